// qaxctl locale: shows the locale the agent reads, and changes it the way a user switching
// language would: it writes ROOT/locale.plist {PreferredLocale} (which a running agent reads
// on every use, where the environment would need a restart) and posts the language-changed
// notification. "reset" removes the file, so the environment decides again.
#include <cctype>
#include <cstdio>
#include <filesystem>
#include <string>
#include <vector>

#include "Command.h"
#include "core/AtomicFile.h"
#include "core/PlistCodec.h"
#include "platform/host/HostLocaleInfo.h"
#include "platform/host/HostNotificationSocket.h"
#include "platform/host/HostPlatform.h"

namespace qaxctl {
namespace {

constexpr const char* kUsage = "usage: qaxctl locale [set IDENTIFIER | reset]\n";
constexpr const char* kLanguageChangedNotification = "com.velmora.language.changed";

int usage() {
    std::fputs(kUsage, stderr);
    return 64;
}

// "fr_FR", "pt-BR", "zh_Hant_TW": letters first, then letters, digits, '_' and '-'.
bool isLocaleIdentifier(const std::string& text) {
    if (text.size() < 2 || text.size() > 32 || !std::isalpha(static_cast<unsigned char>(text[0]))) {
        return false;
    }
    for (char c : text) {
        if (!std::isalnum(static_cast<unsigned char>(c)) && c != '_' && c != '-') {
            return false;
        }
    }
    return true;
}

void announce(const qax::HostEnvironment& env) {
    // Nobody listening (no agent running) is fine: the agent reads the file when it next runs.
    qax::HostNotificationSocket::post(env.runtimeDirectory, kLanguageChangedNotification);
}

int run(const std::vector<std::string>& args) {
    const auto env = qax::HostEnvironment::fromProcessEnvironment();
    const std::string path = qax::HostLocaleInfo::overridePath(env.platformRoot);
    if (args.empty()) {
        std::printf("%s\n",
                    qax::HostLocaleInfo(env.platformRoot).preferredLocaleIdentifier().c_str());
        return 0;
    }
    if (args.size() == 2 && args[0] == "set") {
        if (!isLocaleIdentifier(args[1])) {
            std::fprintf(stderr, "qaxctl: '%s' is not a locale identifier (fr_FR, de_DE, ...)\n",
                         args[1].c_str());
            return 64;
        }
        auto plist = qax::toXmlPlist(qax::Value(
            qax::Value::Dictionary{{qax::HostLocaleInfo::kPreferredLocaleKey, args[1]}}));
        std::string error;
        std::error_code ec;
        std::filesystem::create_directories(env.platformRoot, ec);
        if (!plist || !qax::writeFileAtomically(path, *plist, &error)) {
            std::fprintf(stderr, "qaxctl: cannot write %s: %s\n", path.c_str(), error.c_str());
            return 1;
        }
        announce(env);
        return 0;
    }
    if (args.size() == 1 && args[0] == "reset") {
        std::error_code ec;
        std::filesystem::remove(path, ec);
        if (ec) {
            std::fprintf(stderr, "qaxctl: cannot remove %s: %s\n", path.c_str(),
                         ec.message().c_str());
            return 1;
        }
        announce(env);
        return 0;
    }
    return usage();
}

QAXCTL_COMMAND("locale", "locale [set IDENTIFIER | reset]",
               "show or change the user's locale (locale.plist) and tell a running agent", run);

}  // namespace
}  // namespace qaxctl
