// qaxctl's verbs. Each verb lives in its own file and registers itself with
// QAXCTL_COMMAND; main() dispatches on the first argument.
#pragma once

#include <functional>
#include <string>
#include <vector>

namespace qaxctl {

struct Command {
    std::string name;
    std::string usage;    // "defaults read [KEY] [--json]"
    std::string summary;  // one line for the help text
    // Arguments after the verb; returns the process exit status.
    std::function<int(const std::vector<std::string>& args)> run;
};

std::vector<Command>& commandRegistry();

struct CommandRegistration {
    explicit CommandRegistration(Command command) {
        commandRegistry().push_back(std::move(command));
    }
};

// True when `flag` is among `args`; removes it.
bool takeFlag(std::vector<std::string>& args, const std::string& flag);
// The value after `option` ("--bundle-id ID"), removed with it; none when absent.
bool takeOption(std::vector<std::string>& args, const std::string& option, std::string& value);

}  // namespace qaxctl

#define QAXCTL_CONCAT2(a, b) a##b
#define QAXCTL_CONCAT(a, b) QAXCTL_CONCAT2(a, b)
#define QAXCTL_COMMAND(...)                                            \
    static ::qaxctl::CommandRegistration QAXCTL_CONCAT(qaxctlCommand_, \
                                                       __LINE__)(::qaxctl::Command{__VA_ARGS__})
