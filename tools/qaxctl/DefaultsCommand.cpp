// qaxctl defaults: the engineers' way to read and set the agent's preference domain (the
// keys the agent never writes, such as "SerialNumber" or "ServerVersionOverride"). It
// edits the same domain file through the same store as the agent, which sees a change on
// its next read.
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#include "Command.h"
#include "core/Date.h"
#include "core/JsonCodec.h"
#include "platform/QAXSettings.h"
#include "platform/host/FilePreferenceStore.h"
#include "platform/host/HostPlatform.h"

namespace qaxctl {
namespace {

using qax::Value;

constexpr const char* kUsage =
    "usage: qaxctl defaults read [KEY] [--json]\n"
    "       qaxctl defaults write KEY [-string|-int|-real|-bool|-date|-json] VALUE\n"
    "       qaxctl defaults delete KEY\n";

int usage() {
    std::fputs(kUsage, stderr);
    return 64;
}

std::optional<Value> parseTyped(const std::string& type, const std::string& text,
                                std::string& error) {
    if (type == "-string") {
        return Value(text);
    }
    if (type == "-int") {
        char* end = nullptr;
        errno = 0;
        long long v = std::strtoll(text.c_str(), &end, 10);
        if (text.empty() || *end != '\0' || errno == ERANGE) {
            error = "'" + text + "' is not an integer";
            return std::nullopt;
        }
        return Value(v);
    }
    if (type == "-real") {
        char* end = nullptr;
        double v = std::strtod(text.c_str(), &end);
        if (text.empty() || *end != '\0') {
            error = "'" + text + "' is not a number";
            return std::nullopt;
        }
        return Value(v);
    }
    if (type == "-bool") {
        if (text == "true" || text == "yes" || text == "YES" || text == "1") {
            return Value(true);
        }
        if (text == "false" || text == "no" || text == "NO" || text == "0") {
            return Value(false);
        }
        error = "'" + text + "' is not a boolean (true, false, yes, no, 1, 0)";
        return std::nullopt;
    }
    if (type == "-date") {
        if (auto d = qax::Date::parseIso8601(text)) {
            return Value(*d);
        }
        error = "'" + text + "' is not an ISO 8601 date (for example 2026-11-22T10:00:00Z)";
        return std::nullopt;
    }
    if (type == "-json") {
        std::string why;
        auto v = qax::parseJson(text, &why);
        if (!v) {
            error = "invalid JSON: " + why;
            return std::nullopt;
        }
        return v;
    }
    error = "unknown type flag '" + type + "'";
    return std::nullopt;
}

void printValue(const Value& v, bool json) {
    if (json) {
        std::printf("%s\n", qax::toJsonString(v, 2).c_str());
    } else {
        std::printf("%s\n", v.description().c_str());
    }
}

int run(const std::vector<std::string>& argsIn) {
    std::vector<std::string> args = argsIn;
    const bool json = takeFlag(args, "--json");
    if (args.empty()) {
        return usage();
    }
    const auto env = qax::HostEnvironment::fromProcessEnvironment();
    qax::FilePreferenceStore store(qax::FilePreferenceStore::domainPath(env.homeDirectory));
    qax::qax_registerDefaults(store);
    const std::string action = args[0];

    if (action == "read") {
        if (args.size() == 1) {
            printValue(Value(store.storedValues()), json);
            return 0;
        }
        if (args.size() != 2) {
            return usage();
        }
        auto v = store.objectForKey(args[1]);
        if (!v) {
            std::fprintf(stderr, "qaxctl: no value for '%s'\n", args[1].c_str());
            return 1;
        }
        printValue(*v, json);
        return 0;
    }
    if (action == "write") {
        std::string key, type = "-string", text;
        if (args.size() == 3) {
            key = args[1];
            text = args[2];
        } else if (args.size() == 4) {
            key = args[1];
            type = args[2];
            text = args[3];
        } else {
            return usage();
        }
        std::string error;
        auto v = parseTyped(type, text, error);
        if (!v) {
            std::fprintf(stderr, "qaxctl: %s\n", error.c_str());
            return 1;
        }
        if (!store.setObject(key, *v)) {
            std::fprintf(stderr,
                         "qaxctl: could not store '%s' (a null has no place in the domain, or "
                         "the domain file could not be written)\n",
                         key.c_str());
            return 1;
        }
        return 0;
    }
    if (action == "delete") {
        if (args.size() != 2) {
            return usage();
        }
        return store.removeObject(args[1]) ? 0 : 1;
    }
    return usage();
}

QAXCTL_COMMAND("defaults", "defaults read|write|delete ...",
               "read and set the agent's preference domain", run);

}  // namespace
}  // namespace qaxctl
