#include "AgentClient.h"

#include <algorithm>
#include <cerrno>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>

#include "Command.h"
#include "agent/QAXAgentRemoteInterface.h"
#include "platform/QAXSettings.h"
#include "platform/host/HostIpcClient.h"
#include "platform/host/HostPlatform.h"
#include "platform/host/HostServiceListenerFactory.h"

namespace qaxctl {
namespace {

using qax::Value;

// poll() takes milliseconds in an int; "no limit" is eleven days.
constexpr double kNoLimitSeconds = 1e6;

// The agent closing on a client it refuses shows as the end of the stream, or as a failed
// write when the request was still being sent.
bool closedByAgent(const std::string& error) {
    return error == "closed" || error == std::string("send: ") + std::strerror(EPIPE) ||
           error == std::string("send: ") + std::strerror(ECONNRESET);
}

}  // namespace

std::string agentSocketPath() {
    const auto env = qax::HostEnvironment::fromProcessEnvironment();
    return qax::HostServiceListenerFactory::clientSocketPath(env.runtimeDirectory,
                                                             qax::kQAXAgentServiceName);
}

std::string agentRuntimeDirectory() {
    return std::filesystem::path(agentSocketPath()).parent_path().string();
}

int callAgent(const std::string& op, const Value::Array& args, double timeoutSeconds,
              const std::function<int(const std::optional<Value>&)>& onReply) {
    qax::HostIpcClient client;
    std::string error;
    if (!client.connect(agentSocketPath(), &error)) {
        std::fprintf(stderr, "qaxctl: %s (is qaxagent running?)\n", error.c_str());
        return kExitUnavailable;
    }
    auto reply =
        client.call(op, args, timeoutSeconds > 0 ? timeoutSeconds : kNoLimitSeconds, &error);
    if (!reply) {
        std::fprintf(stderr, "qaxctl: %s: %s\n", op.c_str(),
                     closedByAgent(error)   ? "the agent closed the connection (not entitled?)"
                     : error == "timed out" ? "no reply in time (--timeout SECONDS)"
                                            : error.c_str());
        return kExitUnavailable;
    }
    if (reply->error) {
        std::fprintf(stderr, "qaxctl: %s: the agent answered an error: %s\n", op.c_str(),
                     reply->error->c_str());
        return kExitFailure;
    }
    return onReply(reply->value);
}

int badReply(const std::string& op) {
    std::fprintf(stderr, "qaxctl: %s: the agent's reply is not what was expected\n", op.c_str());
    return kExitFailure;
}

int usageError(const std::string& usage) {
    std::fprintf(stderr, "usage: qaxctl %s\n", usage.c_str());
    return kExitUsage;
}

bool takeTimeout(std::vector<std::string>& args, double& seconds) {
    std::string text;
    if (std::find(args.begin(), args.end(), "--timeout") == args.end()) {
        return true;
    }
    if (!takeOption(args, "--timeout", text)) {
        return false;
    }
    auto parsed = parseDuration(text);
    if (!parsed) {
        return false;
    }
    seconds = *parsed;
    return true;
}

std::optional<Value> parsePolicy(const std::string& text) {
    static const std::pair<const char*, long long> names[] = {
        {"default", 0}, {"cached", 1}, {"force", 2}};
    for (const auto& [name, value] : names) {
        if (text == name) {
            return Value(value);
        }
    }
    if (text.empty() || text.find_first_not_of("0123456789") != std::string::npos) {
        return std::nullopt;
    }
    errno = 0;
    const unsigned long long n = std::strtoull(text.c_str(), nullptr, 10);
    if (errno == ERANGE || n > static_cast<unsigned long long>(INT64_MAX)) {
        return std::nullopt;
    }
    return Value(static_cast<long long>(n));
}

std::optional<double> parseDuration(const std::string& text) {
    if (text.empty()) {
        return std::nullopt;
    }
    char* end = nullptr;
    const double n = std::strtod(text.c_str(), &end);
    const std::string unit = end;
    const double scale = unit.empty() || unit == "s" ? 1
                         : unit == "m"               ? 60
                         : unit == "h"               ? 3600
                         : unit == "d"               ? 86400
                                                     : -1;
    if (end == text.c_str() || scale < 0 || !std::isfinite(n) || n < 0) {
        return std::nullopt;
    }
    return n * scale;
}

std::shared_ptr<qax::Platform> recordPlatform() {
    auto platform = qax::makeHostPlatform(qax::HostEnvironment::fromProcessEnvironment(), nullptr);
    qax::qax_registerDefaults(*platform->preferences);
    return platform;
}

Value deviceJson(const qax::QAXDevice& d) {
    Value::Dictionary out;
    out["name"] = d.name() ? Value(*d.name()) : Value();
    out["serialNumber"] = d.serialNumber() ? Value(*d.serialNumber()) : Value();
    out["activationDate"] = d.activationDate() ? Value(d.activationDate()->iso8601()) : Value();
    out["deviceType"] = Value(static_cast<unsigned long long>(d.deviceType()));
    out["deviceTypeString"] = Value(d.deviceTypeString());
    return Value(std::move(out));
}

void printColumns(const std::vector<std::vector<std::string>>& rows) {
    std::vector<std::size_t> widths;
    for (const auto& row : rows) {
        widths.resize(std::max(widths.size(), row.size()), 0);
        for (std::size_t i = 0; i < row.size(); ++i) {
            widths[i] = std::max(widths[i], row[i].size());
        }
    }
    for (const auto& row : rows) {
        std::string line;
        for (std::size_t i = 0; i < row.size(); ++i) {
            line += row[i];
            if (i + 1 < row.size()) {
                line += std::string(widths[i] - row[i].size() + 2, ' ');
            }
        }
        std::printf("%s\n", line.c_str());
    }
}

void printDeviceTable(const std::vector<std::shared_ptr<qax::QAXDevice>>& devices) {
    std::vector<std::vector<std::string>> rows = {{"NAME", "SERIAL NUMBER", "ACTIVATED", "TYPE"}};
    for (const auto& d : devices) {
        rows.push_back({d->name().value_or("-"), d->serialNumber().value_or("-"),
                        d->activationDate() ? d->activationDate()->description() : "-",
                        d->deviceTypeString()});
    }
    printColumns(rows);
}

}  // namespace qaxctl
