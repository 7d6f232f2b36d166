// qaxctl defer: asks running background activities to defer (state/defer present) or lets
// them run on; without an argument it tells which is in force.
#include <cstdio>
#include <filesystem>
#include <string>
#include <vector>

#include "Command.h"
#include "core/AtomicFile.h"
#include "platform/host/HostBackgroundActivityScheduler.h"
#include "platform/host/HostPlatform.h"

namespace qaxctl {
namespace {

constexpr const char* kUsage = "usage: qaxctl defer [on|off]\n";

int run(const std::vector<std::string>& args) {
    const auto env = qax::HostEnvironment::fromProcessEnvironment();
    const std::string path = qax::HostBackgroundActivityScheduler::deferPath(env.platformRoot);
    std::error_code ec;
    if (args.empty()) {
        std::printf("%s\n", std::filesystem::exists(path, ec) ? "on" : "off");
        return 0;
    }
    if (args.size() != 1) {
        std::fputs(kUsage, stderr);
        return 64;
    }
    if (args[0] == "on") {
        std::string error;
        if (!qax::writeFileAtomically(path, "", &error)) {
            std::fprintf(stderr, "qaxctl: cannot create %s: %s\n", path.c_str(), error.c_str());
            return 1;
        }
        return 0;
    }
    if (args[0] == "off") {
        std::filesystem::remove(path, ec);
        if (ec) {
            std::fprintf(stderr, "qaxctl: cannot remove %s: %s\n", path.c_str(),
                         ec.message().c_str());
            return 1;
        }
        return 0;
    }
    std::fputs(kUsage, stderr);
    return 64;
}

QAXCTL_COMMAND("defer", "defer [on|off]",
               "ask running background activities to defer (state/defer), or stop asking", run);

}  // namespace
}  // namespace qaxctl
