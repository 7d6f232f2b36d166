// qaxctl: the client of the agent's IPC service and the engineers' tool for the host
// platform (preferences, notifications, request previews).
#include <algorithm>
#include <cstdio>
#include <string>
#include <vector>

#include "Command.h"

namespace qaxctl {

std::vector<Command>& commandRegistry() {
    static std::vector<Command> commands;
    return commands;
}

bool takeFlag(std::vector<std::string>& args, const std::string& flag) {
    auto it = std::find(args.begin(), args.end(), flag);
    if (it == args.end()) {
        return false;
    }
    args.erase(it);
    return true;
}

bool takeOption(std::vector<std::string>& args, const std::string& option, std::string& value) {
    auto it = std::find(args.begin(), args.end(), option);
    if (it == args.end() || it + 1 == args.end()) {
        return false;
    }
    value = *(it + 1);
    args.erase(it, it + 2);
    return true;
}

}  // namespace qaxctl

namespace {

void printUsage(std::FILE* out) {
    std::fprintf(out, "usage: qaxctl COMMAND [ARGS...]\n\ncommands:\n");
    auto commands = qaxctl::commandRegistry();
    std::sort(commands.begin(), commands.end(),
              [](const auto& a, const auto& b) { return a.usage < b.usage; });
    for (const auto& c : commands) {
        std::fprintf(out, "  %-48s %s\n", c.usage.c_str(), c.summary.c_str());
    }
}

}  // namespace

int main(int argc, char** argv) {
    if (argc < 2 || std::string(argv[1]) == "help" || std::string(argv[1]) == "--help" ||
        std::string(argv[1]) == "-h") {
        printUsage(argc < 2 ? stderr : stdout);
        return argc < 2 ? 64 : 0;
    }
    const std::string verb = argv[1];
    for (const auto& c : qaxctl::commandRegistry()) {
        if (c.name == verb) {
            return c.run(std::vector<std::string>(argv + 2, argv + argc));
        }
    }
    std::fprintf(stderr, "qaxctl: unknown command '%s'\n\n", verb.c_str());
    printUsage(stderr);
    return 64;
}
