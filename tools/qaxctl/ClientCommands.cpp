// qaxctl as a client of the agent: asks it over IPC for the default device and the paired
// devices (tables for people, --json for scripts), and posts system notifications on the
// host's notification socket. The agent's socket is found the way the agent itself finds it,
// from HOME, QAX_PLATFORM_ROOT and QAX_RUNTIME_DIR.
#include <algorithm>
#include <cstdio>
#include <string>
#include <vector>

#include "Command.h"
#include "agent/QAXAgentRemoteInterface.h"
#include "core/JsonCodec.h"
#include "devices/QAXDevice.h"
#include "platform/host/HostIpcClient.h"
#include "platform/host/HostNotificationSocket.h"
#include "platform/host/HostPlatform.h"
#include "platform/host/HostServiceListenerFactory.h"

namespace qaxctl {
namespace {

using qax::QAXDevice;
using qax::Value;

constexpr double kReplyTimeoutSeconds = 120;
constexpr int kExitUsage = 64;
constexpr int kExitUnavailable = 69;
constexpr int kExitFailure = 70;

std::string agentSocketPath() {
    const auto env = qax::HostEnvironment::fromProcessEnvironment();
    return qax::HostServiceListenerFactory::clientSocketPath(env.runtimeDirectory,
                                                             qax::kQAXAgentServiceName);
}

// Calls `op` and hands its reply to `onReply`; returns the exit status.
int callAgent(const std::string& op,
              const std::function<int(const std::optional<Value>&)>& onReply) {
    qax::HostIpcClient client;
    std::string error;
    if (!client.connect(agentSocketPath(), &error)) {
        std::fprintf(stderr, "qaxctl: %s (is qaxagent running?)\n", error.c_str());
        return kExitUnavailable;
    }
    auto reply = client.call(op, {}, kReplyTimeoutSeconds, &error);
    if (!reply) {
        std::fprintf(
            stderr, "qaxctl: %s: %s\n", op.c_str(),
            error == "closed" ? "the agent closed the connection (not entitled?)" : error.c_str());
        return kExitUnavailable;
    }
    if (reply->error) {
        std::fprintf(stderr, "qaxctl: %s: %s\n", op.c_str(), reply->error->c_str());
        return kExitFailure;
    }
    return onReply(reply->value);
}

Value deviceJson(const QAXDevice& d) {
    Value::Dictionary out;
    out["name"] = d.name() ? Value(*d.name()) : Value();
    out["serialNumber"] = d.serialNumber() ? Value(*d.serialNumber()) : Value();
    out["activationDate"] = d.activationDate() ? Value(d.activationDate()->iso8601()) : Value();
    out["deviceType"] = Value(static_cast<unsigned long long>(d.deviceType()));
    out["deviceTypeString"] = Value(d.deviceTypeString());
    return Value(std::move(out));
}

void printTable(const std::vector<std::shared_ptr<QAXDevice>>& devices) {
    std::vector<std::vector<std::string>> rows = {{"NAME", "SERIAL NUMBER", "ACTIVATED", "TYPE"}};
    for (const auto& d : devices) {
        rows.push_back({d->name().value_or("-"), d->serialNumber().value_or("-"),
                        d->activationDate() ? d->activationDate()->description() : "-",
                        d->deviceTypeString()});
    }
    std::vector<std::size_t> widths(4, 0);
    for (const auto& row : rows) {
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

int badReply(const char* op) {
    std::fprintf(stderr, "qaxctl: %s: the agent's reply is not what was expected\n", op);
    return kExitFailure;
}

int defaultDevice(std::vector<std::string> args) {
    const bool json = takeFlag(args, "--json");
    if (!args.empty()) {
        std::fputs("usage: qaxctl default-device [--json]\n", stderr);
        return kExitUsage;
    }
    return callAgent("defaultDevice:", [json](const std::optional<Value>& reply) {
        auto device = reply ? QAXDevice::decode(*reply) : nullptr;
        if (!device) {
            return badReply("defaultDevice:");
        }
        if (json) {
            std::printf("%s\n", qax::toJsonString(deviceJson(*device), 2).c_str());
        } else {
            printTable({device});
        }
        return 0;
    });
}

int pairedDevices(std::vector<std::string> args) {
    const bool json = takeFlag(args, "--json");
    if (!args.empty()) {
        std::fputs("usage: qaxctl paired-devices [--json]\n", stderr);
        return kExitUsage;
    }
    return callAgent("pairedDevices:", [json](const std::optional<Value>& reply) {
        const Value::Array* list = reply ? reply->asArray() : nullptr;
        if (!list) {
            return badReply("pairedDevices:");
        }
        std::vector<std::shared_ptr<QAXDevice>> devices;
        for (const auto& archived : *list) {
            auto device = QAXDevice::decode(archived);
            if (!device) {
                return badReply("pairedDevices:");
            }
            devices.push_back(std::move(device));
        }
        // The agent answers in no particular order; people and scripts like a stable one.
        std::sort(devices.begin(), devices.end(), [](const auto& a, const auto& b) {
            return a->serialNumber().value_or("") < b->serialNumber().value_or("");
        });
        if (json) {
            Value::Array out;
            for (const auto& d : devices) {
                out.push_back(deviceJson(*d));
            }
            std::printf("%s\n", qax::toJsonString(Value(std::move(out)), 2).c_str());
        } else if (devices.empty()) {
            std::printf("No paired devices.\n");
        } else {
            printTable(devices);
        }
        return 0;
    });
}

int notify(std::vector<std::string> args) {
    if (args.size() != 1) {
        std::fputs("usage: qaxctl notify NAME\n", stderr);
        return kExitUsage;
    }
    const auto env = qax::HostEnvironment::fromProcessEnvironment();
    if (!qax::HostNotificationSocket::post(env.runtimeDirectory, args[0])) {
        std::fprintf(stderr, "qaxctl: nobody receives notifications at %s\n",
                     qax::HostNotificationSocket::socketPath(env.runtimeDirectory).c_str());
        return kExitUnavailable;
    }
    return 0;
}

QAXCTL_COMMAND("default-device", "default-device [--json]",
               "ask the agent for the device it runs on", defaultDevice);
QAXCTL_COMMAND("paired-devices", "paired-devices [--json]", "ask the agent for the paired watches",
               pairedDevices);
QAXCTL_COMMAND("notify", "notify NAME", "post a system notification (a pairing event, say)",
               notify);

}  // namespace
}  // namespace qaxctl
