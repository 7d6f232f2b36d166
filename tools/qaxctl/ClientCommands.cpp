// qaxctl as a client of the agent: asks it over IPC for the default device and the paired
// devices (tables for people, --json for scripts), and posts system notifications on the
// host's notification socket. The agent's socket is found the way the agent itself finds it,
// from HOME, QAX_PLATFORM_ROOT and QAX_RUNTIME_DIR.
#include <algorithm>
#include <cstdio>
#include <string>
#include <vector>

#include "AgentClient.h"
#include "Command.h"
#include "core/JsonCodec.h"
#include "devices/QAXDevice.h"
#include "platform/host/HostNotificationSocket.h"

namespace qaxctl {
namespace {

using qax::QAXDevice;
using qax::Value;

int defaultDevice(std::vector<std::string> args) {
    const bool json = takeFlag(args, "--json");
    if (!args.empty()) {
        return usageError("default-device [--json]");
    }
    return callAgent("defaultDevice:", {}, kDefaultReplyTimeoutSeconds,
                     [json](const std::optional<Value>& reply) {
                         auto device = reply ? QAXDevice::decode(*reply) : nullptr;
                         if (!device) {
                             return badReply("defaultDevice:");
                         }
                         if (json) {
                             std::printf("%s\n", qax::toJsonString(deviceJson(*device), 2).c_str());
                         } else {
                             printDeviceTable({device});
                         }
                         return 0;
                     });
}

int pairedDevices(std::vector<std::string> args) {
    const bool json = takeFlag(args, "--json");
    if (!args.empty()) {
        return usageError("paired-devices [--json]");
    }
    return callAgent(
        "pairedDevices:", {}, kDefaultReplyTimeoutSeconds,
        [json](const std::optional<Value>& reply) {
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
                printDeviceTable(devices);
            }
            return 0;
        });
}

int notify(std::vector<std::string> args) {
    if (args.size() != 1) {
        return usageError("notify NAME");
    }
    const std::string runtimeDirectory = agentRuntimeDirectory();
    if (!qax::HostNotificationSocket::post(runtimeDirectory, args[0])) {
        std::fprintf(stderr, "qaxctl: nobody receives notifications at %s\n",
                     qax::HostNotificationSocket::socketPath(runtimeDirectory).c_str());
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
