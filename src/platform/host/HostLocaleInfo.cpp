#include "platform/host/HostLocaleInfo.h"

#include <cstdlib>
#include <string>

namespace qax {

std::string HostLocaleInfo::identifierFromEnvironment(const char* lcAll, const char* lcMessages,
                                                      const char* lang) {
    const char* chosen = nullptr;
    for (const char* v : {lcAll, lcMessages, lang}) {
        if (v && *v) {
            chosen = v;
            break;
        }
    }
    std::string id = chosen ? chosen : "";
    if (auto cut = id.find_first_of(".@"); cut != std::string::npos) {
        id.resize(cut);
    }
    if (id.empty() || id == "C" || id == "POSIX") {
        return "en_US";
    }
    return id;
}

std::string HostLocaleInfo::preferredLocaleIdentifier() {
    return identifierFromEnvironment(std::getenv("LC_ALL"), std::getenv("LC_MESSAGES"),
                                     std::getenv("LANG"));
}

std::optional<std::string> HostLocaleInfo::preferredContentSizeCategory() {
    const char* v = std::getenv("QAX_CONTENT_SIZE_CATEGORY");
    return std::string(v && *v ? v : "Large");
}

}  // namespace qax
