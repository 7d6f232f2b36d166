// Builds the platform context of a real process (qaxagent, qaxctl) from its environment:
// HOME, QAX_PLATFORM_ROOT (default $HOME/.qaxplatform), QAX_RUNTIME_DIR (default
// $QAX_PLATFORM_ROOT/run), QAX_SHARE_DIR (default: the source tree's share/qaxagent).
// Called once at start-up, on the main thread.
#pragma once

#include <memory>
#include <string>

#include "platform/Platform.h"

namespace qax {

struct HostEnvironment {
    std::string homeDirectory;
    std::string platformRoot;
    std::string runtimeDirectory;
    std::string shareDirectory;

    static HostEnvironment fromProcessEnvironment();
};

std::shared_ptr<Platform> makeHostPlatform(const HostEnvironment& environment,
                                           std::shared_ptr<Dispatcher> dispatcher);

}  // namespace qax
