#include "agent/QAXAgentRemoteInterface.h"

#include <functional>
#include <string_view>
#include <vector>

#include "agent/QAXAgentProtocol.h"

namespace qax {
namespace {

constexpr const char* kUnknownOperation = "unknown operation";
constexpr const char* kUnsupportedOperation = "unsupported operation";
constexpr const char* kNotAnAgent = "the exported object does not serve this interface";

enum class Arg { String, Unsigned, Double, Bool };

const char* argName(Arg a) {
    switch (a) {
        case Arg::String:
            return "string";
        case Arg::Unsigned:
            return "unsigned integer";
        case Arg::Double:
            return "number";
        case Arg::Bool:
            return "boolean";
    }
    return "?";
}

bool argMatches(Arg a, const Value& v) {
    switch (a) {
        case Arg::String:
            return v.isString();
        case Arg::Unsigned:
            return v.isInteger() && *v.asInteger() >= 0;
        case Arg::Double:
            return v.isNumber();
        case Arg::Bool:
            return v.isBool();
    }
    return false;
}

using Call = std::function<void(QAXAgentProtocol&, const Value::Array&, RemoteReplyHandler)>;

struct Operation {
    std::string_view name;
    std::vector<Arg> args;
    // Empty while the operation has not joined the agent.
    Call call;
};

Value encodeDevice(const std::shared_ptr<QAXDevice>& device) {
    return device ? device->encode() : Value();
}

RemoteReply replyOf(const std::shared_ptr<QAXDevice>& device) {
    return device ? RemoteReply::of(device->encode()) : RemoteReply::none();
}

const std::vector<Operation>& operations() {
    static const std::vector<Operation> table = {
        {"scheduleOutreachWithReply:", {}, {}},
        {"scheduleOutreachAfter:withReply:", {Arg::Double}, {}},
        {"velmoraAccountAddedWithReply:", {}, {}},
        {"checkIsAvailableInStore:withReply:", {Arg::String}, {}},
        {"appSupportAvailability:withReply:", {Arg::String}, {}},
        {"readWebURLOverride:",
         {},
         [](QAXAgentProtocol& agent, const Value::Array&, RemoteReplyHandler reply) {
             agent.readWebURLOverride([reply](std::optional<Value> url) {
                 reply(url ? RemoteReply::of(std::move(*url)) : RemoteReply::none());
             });
         }},
        {"defaultDevice:",
         {},
         [](QAXAgentProtocol& agent, const Value::Array&, RemoteReplyHandler reply) {
             agent.defaultDevice(
                 [reply](std::shared_ptr<QAXDevice> device) { reply(replyOf(device)); });
         }},
        {"pairedDevices:",
         {},
         [](QAXAgentProtocol& agent, const Value::Array&, RemoteReplyHandler reply) {
             agent.pairedDevices([reply](std::vector<std::shared_ptr<QAXDevice>> devices) {
                 Value::Array archived;
                 for (const auto& d : devices) {
                     if (d) {
                         archived.push_back(encodeDevice(d));
                     }
                 }
                 reply(RemoteReply::of(Value(std::move(archived))));
             });
         }},
        {"getDefaultDeviceInfoUsingPolicy:withReply:", {Arg::Unsigned}, {}},
        {"getDeviceInfoForSerialNumber:usingPolicy:withReply:", {Arg::String, Arg::Unsigned}, {}},
        {"getAllDeviceInfosUsingPolicy:updateFollowUps:withReply:", {Arg::Unsigned, Arg::Bool}, {}},
        // The dismissals need the warranty provider, which connection agents do not have yet.
        {"dismissFollowUpForSerialNumber:completion:", {Arg::String}, {}},
        {"dismissNotificationForSerialNumber:completion:", {Arg::String}, {}},
    };
    return table;
}

std::string expectedArguments(const Operation& op) {
    std::string text = "'" + std::string(op.name) + "' takes " + std::to_string(op.args.size()) +
                       (op.args.size() == 1 ? " argument" : " arguments");
    for (std::size_t i = 0; i < op.args.size(); ++i) {
        text += (i == 0 ? " (" : ", ");
        text += argName(op.args[i]);
    }
    if (!op.args.empty()) {
        text += ")";
    }
    return text;
}

}  // namespace

void QAXAgentRemoteInterface::invoke(const std::shared_ptr<ExportedObject>& object,
                                     const std::string& op, const Value::Array& args,
                                     RemoteReplyHandler reply) const {
    const Operation* found = nullptr;
    for (const auto& candidate : operations()) {
        if (candidate.name == op) {
            found = &candidate;
            break;
        }
    }
    if (!found) {
        reply(RemoteReply::failure(std::string(kUnknownOperation) + " '" + op + "'"));
        return;
    }
    bool argsMatch = args.size() == found->args.size();
    for (std::size_t i = 0; argsMatch && i < args.size(); ++i) {
        argsMatch = argMatches(found->args[i], args[i]);
    }
    if (!argsMatch) {
        reply(RemoteReply::failure("wrong arguments: " + expectedArguments(*found)));
        return;
    }
    if (!found->call) {
        reply(RemoteReply::failure(kUnsupportedOperation));
        return;
    }
    auto* agent = dynamic_cast<QAXAgentProtocol*>(object.get());
    if (!agent) {
        reply(RemoteReply::failure(kNotAnAgent));
        return;
    }
    found->call(*agent, args, std::move(reply));
}

}  // namespace qax
