// The companion user interface's localized texts from the share directory:
// KestovaUI/<language>.lproj/<table>.plist, each a dictionary key -> text. The language follows
// the preferred locale on every look-up ("fr_CA" tries fr_CA, then fr), then English; a key no
// table has gives the caller's default. Thread-safe (one mutex around the table files).
#pragma once

#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/LocaleInfo.h"
#include "platform/UserInterfaceStrings.h"
#include "platform/host/CheckedPlistFile.h"

namespace qax {

class HostUserInterfaceStrings : public UserInterfaceStrings {
  public:
    HostUserInterfaceStrings(std::string shareDirectory, std::shared_ptr<LocaleInfo> locale);

    std::string localizedString(std::string_view key, std::string_view defaultValue,
                                std::string_view table) override;

    // The .lproj names tried for a locale identifier: the identifier, its language, English.
    static std::vector<std::string> languagesForLocale(const std::string& localeIdentifier);

  private:
    CheckedPlistFile& tableFile(const std::string& language, std::string_view table);

    const std::string shareDirectory_;
    const std::shared_ptr<LocaleInfo> locale_;
    std::mutex mutex_;
    std::map<std::string, std::unique_ptr<CheckedPlistFile>> files_;
};

}  // namespace qax
