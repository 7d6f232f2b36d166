// The user's locale from the environment (LC_ALL, then LC_MESSAGES, then LANG):
// "fr_FR.UTF-8" gives "fr_FR"; "C", "POSIX" or nothing gives "en_US". The text-size
// category comes from QAX_CONTENT_SIZE_CATEGORY (default "Large"). Thread-safe.
#pragma once

#include "platform/LocaleInfo.h"

namespace qax {

class HostLocaleInfo : public LocaleInfo {
  public:
    std::string preferredLocaleIdentifier() override;
    std::optional<std::string> preferredContentSizeCategory() override;

    // The identifier for given values of the three variables (null: unset).
    static std::string identifierFromEnvironment(const char* lcAll, const char* lcMessages,
                                                 const char* lang);
};

}  // namespace qax
