// The user's locale: the platform root's locale.plist {PreferredLocale: "fr_FR"} when it names
// one (so a running agent can follow a language change), else the environment (LC_ALL, then
// LC_MESSAGES, then LANG): "fr_FR.UTF-8" gives "fr_FR"; "C", "POSIX" or nothing gives "en_US".
// The file is looked at on every call and parsed once per change; a missing file costs a stat.
// The text-size category comes from QAX_CONTENT_SIZE_CATEGORY (default "Large"). Thread-safe.
#pragma once

#include <memory>
#include <string>

#include "platform/LocaleInfo.h"
#include "platform/host/CachedPlistFile.h"

namespace qax {

class HostLocaleInfo : public LocaleInfo {
  public:
    // From the environment only.
    HostLocaleInfo() = default;
    // The platform root's locale.plist first.
    explicit HostLocaleInfo(const std::string& platformRoot);

    std::string preferredLocaleIdentifier() override;
    std::optional<std::string> preferredContentSizeCategory() override;

    // The identifier for given values of the three variables (null: unset).
    static std::string identifierFromEnvironment(const char* lcAll, const char* lcMessages,
                                                 const char* lang);
    // ROOT/locale.plist, and the key that names the locale there.
    static std::string overridePath(const std::string& platformRoot);
    static constexpr const char* kPreferredLocaleKey = "PreferredLocale";

  private:
    std::unique_ptr<CachedPlistFile> override_;
};

}  // namespace qax
