#include "platform/host/HostPlatform.h"

#include <pwd.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>

#include "platform/host/FilePreferenceStore.h"
#include "platform/host/HostDeviceProperties.h"
#include "platform/host/HostLocaleInfo.h"
#include "platform/host/SystemClock.h"

namespace qax {

HostEnvironment HostEnvironment::fromProcessEnvironment() {
    HostEnvironment env;
    const char* home = std::getenv("HOME");
    if (home && *home) {
        env.homeDirectory = home;
    } else if (const passwd* pw = getpwuid(getuid())) {
        env.homeDirectory = pw->pw_dir;
    } else {
        env.homeDirectory = "/";
    }
    const char* root = std::getenv("QAX_PLATFORM_ROOT");
    env.platformRoot = root && *root
                           ? std::string(root)
                           : (std::filesystem::path(env.homeDirectory) / ".qaxplatform").string();
    const char* run = std::getenv("QAX_RUNTIME_DIR");
    env.runtimeDirectory =
        run && *run ? std::string(run) : (std::filesystem::path(env.platformRoot) / "run").string();
    return env;
}

std::shared_ptr<Platform> makeHostPlatform(const HostEnvironment& environment,
                                           std::shared_ptr<Dispatcher> dispatcher) {
    auto p = std::make_shared<Platform>();
    p->homeDirectory = environment.homeDirectory;
    p->platformRoot = environment.platformRoot;
    p->runtimeDirectory = environment.runtimeDirectory;
    p->dispatcher = std::move(dispatcher);
    p->clock = std::make_shared<SystemClock>();
    p->log = std::make_shared<StderrLogSink>();
    p->preferences = std::make_shared<FilePreferenceStore>(
        FilePreferenceStore::domainPath(environment.homeDirectory));
    p->deviceProperties = std::make_shared<HostDeviceProperties>(environment.platformRoot);
    p->locale = std::make_shared<HostLocaleInfo>();

    // Further host bindings are installed here, one line each.
    return p;
}

}  // namespace qax
