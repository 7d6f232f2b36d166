// Builds the platform context of a real process (qaxagent, qaxctl) from its environment:
// HOME, QAX_PLATFORM_ROOT (default $HOME/.qaxplatform), QAX_RUNTIME_DIR (default
// $QAX_PLATFORM_ROOT/run), QAX_SHARE_DIR (default: share/qaxagent of the installation the
// program runs from, else the source tree's), QAX_CLOCK ("simulated": the platform clock runs
// at an offset kept in state/clock.plist). Called once at start-up, on the main thread.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "platform/Platform.h"

namespace qax {

struct HostEnvironment {
    std::string homeDirectory;
    std::string platformRoot;
    std::string runtimeDirectory;
    std::string shareDirectory;
    bool simulatedClock = false;

    static HostEnvironment fromProcessEnvironment();
};

// The platform clock of `environment`: the system clock, or under QAX_CLOCK=simulated the
// system time plus the offset of state/clock.plist (a SimulatedClock).
std::shared_ptr<Clock> makeHostClock(const HostEnvironment& environment);

// share/qaxagent of the installation holding `executablePath` (PREFIX/bin/qaxctl,
// PREFIX/lib/qaxagent/qaxagent); none when the program does not run from one.
std::optional<std::string> installedShareDirectory(const std::string& executablePath);

// Takes the listening socket the service manager may have passed (see HostSocketActivation):
// a process started that way exits when idle (HostProcessLifecycle).
std::shared_ptr<Platform> makeHostPlatform(const HostEnvironment& environment,
                                           std::shared_ptr<Dispatcher> dispatcher);

}  // namespace qax
