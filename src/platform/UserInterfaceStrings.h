// The localized texts of the companion user-interface resource bundle ("KestovaUI"), which the
// settings application also uses: button labels of notifications and of the support row.
// Thread-safe; every look-up follows the user's current language.
#pragma once

#include <string>
#include <string_view>

namespace qax {

class UserInterfaceStrings {
  public:
    virtual ~UserInterfaceStrings() = default;
    // The text under `key` in string table `table` (for example "Localizable") for the user's
    // preferred language, falling back to English; `defaultValue` when no table has the key.
    virtual std::string localizedString(std::string_view key, std::string_view defaultValue,
                                        std::string_view table) = 0;
};

}  // namespace qax
