// The user's language and text-size preferences. Thread-safe.
#pragma once

#include <optional>
#include <string>

namespace qax {

class LocaleInfo {
  public:
    virtual ~LocaleInfo() = default;
    // Language and region, for example "en_US" or "fr_FR".
    virtual std::string preferredLocaleIdentifier() = 0;
    // The user's preferred text-size category name; none when the platform has none.
    virtual std::optional<std::string> preferredContentSizeCategory() = 0;
};

}  // namespace qax
