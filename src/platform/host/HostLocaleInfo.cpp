#include "platform/host/HostLocaleInfo.h"

#include <cstdlib>
#include <filesystem>
#include <string>

namespace qax {
namespace {

// "fr_FR.UTF-8@euro" -> "fr_FR"; empty, "C" and "POSIX" -> none.
std::optional<std::string> localeIdentifier(std::string id) {
    if (auto cut = id.find_first_of(".@"); cut != std::string::npos) {
        id.resize(cut);
    }
    if (id.empty() || id == "C" || id == "POSIX") {
        return std::nullopt;
    }
    return id;
}

}  // namespace

HostLocaleInfo::HostLocaleInfo(const std::string& platformRoot)
    : override_(std::make_unique<CachedPlistFile>(overridePath(platformRoot))) {}

std::string HostLocaleInfo::overridePath(const std::string& platformRoot) {
    return (std::filesystem::path(platformRoot) / "locale.plist").string();
}

std::string HostLocaleInfo::identifierFromEnvironment(const char* lcAll, const char* lcMessages,
                                                      const char* lang) {
    const char* chosen = nullptr;
    for (const char* v : {lcAll, lcMessages, lang}) {
        if (v && *v) {
            chosen = v;
            break;
        }
    }
    return localeIdentifier(chosen ? chosen : "").value_or("en_US");
}

std::string HostLocaleInfo::preferredLocaleIdentifier() {
    if (override_) {
        if (auto root = override_->read()) {
            const Value* named = root->find(kPreferredLocaleKey);
            if (named && named->isString()) {
                if (auto id = localeIdentifier(*named->asString())) {
                    return *id;
                }
            }
        }
    }
    return identifierFromEnvironment(std::getenv("LC_ALL"), std::getenv("LC_MESSAGES"),
                                     std::getenv("LANG"));
}

std::optional<std::string> HostLocaleInfo::preferredContentSizeCategory() {
    const char* v = std::getenv("QAX_CONTENT_SIZE_CATEGORY");
    return std::string(v && *v ? v : "Large");
}

}  // namespace qax
