#include "agent/QAXAgentRemoteInterface.h"

#include <cmath>
#include <functional>
#include <string_view>
#include <vector>

#include "agent/QAXAgentProtocol.h"

namespace qax {
namespace {

constexpr const char* kUnknownOperation = "unknown operation";
constexpr const char* kNotAnAgent = "the exported object does not serve this interface";

// Serial numbers are short; a longer one is a client's mistake or an attack, and would only
// travel into file names, preference keys and requests.
constexpr std::size_t kMaxSerialNumberLength = 256;
constexpr std::size_t kMaxStringLength = 4096;

enum class Arg { SerialNumber, String, Unsigned, Double, Bool };

const char* argName(Arg a) {
    switch (a) {
        case Arg::SerialNumber:
            return "serial number of 1 to 256 characters";
        case Arg::String:
            return "string of at most 4096 characters";
        case Arg::Unsigned:
            return "unsigned integer";
        case Arg::Double:
            return "finite number";
        case Arg::Bool:
            return "boolean";
    }
    return "?";
}

bool argMatches(Arg a, const Value& v) {
    switch (a) {
        case Arg::SerialNumber: {
            const std::string* s = v.asString();
            return s && !s->empty() && s->size() <= kMaxSerialNumberLength &&
                   s->find('\0') == std::string::npos;
        }
        case Arg::String:
            return v.isString() && v.asString()->size() <= kMaxStringLength;
        case Arg::Unsigned:
            return v.isInteger() && *v.asInteger() >= 0;
        case Arg::Double:
            return v.isNumber() && std::isfinite(*v.asDouble());
        case Arg::Bool:
            return v.isBool();
    }
    return false;
}

using Call = std::function<void(QAXAgentProtocol&, const Value::Array&, RemoteReplyHandler)>;

struct Operation {
    std::string_view name;
    std::vector<Arg> args;
    Call call;
};

const std::string& stringArg(const Value::Array& args, std::size_t i) {
    return *args[i].asString();
}

QAXWarrantyPolicy policyArg(const Value::Array& args, std::size_t i) {
    return static_cast<QAXWarrantyPolicy>(*args[i].asInteger());
}

RemoteReply replyOf(const std::shared_ptr<QAXDevice>& device) {
    return device ? RemoteReply::of(device->encode()) : RemoteReply::none();
}

RemoteReply replyOf(const std::shared_ptr<QAXDeviceInfo>& info) {
    return info ? RemoteReply::of(info->encode()) : RemoteReply::none();
}

QAXBoolReply boolReply(RemoteReplyHandler reply) {
    return [reply = std::move(reply)](bool value) { reply(RemoteReply::of(Value(value))); };
}

QAXDeviceInfoReply deviceInfoReply(RemoteReplyHandler reply) {
    return
        [reply = std::move(reply)](std::shared_ptr<QAXDeviceInfo> info) { reply(replyOf(info)); };
}

const std::vector<Operation>& operations() {
    static const std::vector<Operation> table = {
        {"scheduleOutreachWithReply:",
         {},
         [](QAXAgentProtocol& agent, const Value::Array&, RemoteReplyHandler reply) {
             agent.scheduleOutreach(boolReply(std::move(reply)));
         }},
        {"scheduleOutreachAfter:withReply:",
         {Arg::Double},
         [](QAXAgentProtocol& agent, const Value::Array& args, RemoteReplyHandler reply) {
             agent.scheduleOutreachAfter(*args[0].asDouble(), boolReply(std::move(reply)));
         }},
        {"velmoraAccountAddedWithReply:",
         {},
         [](QAXAgentProtocol& agent, const Value::Array&, RemoteReplyHandler reply) {
             agent.velmoraAccountAdded(boolReply(std::move(reply)));
         }},
        {"checkIsAvailableInStore:withReply:",
         {Arg::String},
         [](QAXAgentProtocol& agent, const Value::Array& args, RemoteReplyHandler reply) {
             agent.checkIsAvailableInStore(
                 stringArg(args, 0), [reply](std::optional<Value::Dictionary> answer) {
                     reply(answer ? RemoteReply::of(Value(std::move(*answer)))
                                  : RemoteReply::none());
                 });
         }},
        {"appSupportAvailability:withReply:",
         {Arg::String},
         [](QAXAgentProtocol& agent, const Value::Array& args, RemoteReplyHandler reply) {
             agent.appSupportAvailability(stringArg(args, 0), [reply](Value::Dictionary answer) {
                 reply(RemoteReply::of(Value(std::move(answer))));
             });
         }},
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
                         archived.push_back(d->encode());
                     }
                 }
                 reply(RemoteReply::of(Value(std::move(archived))));
             });
         }},
        {"getDefaultDeviceInfoUsingPolicy:withReply:",
         {Arg::Unsigned},
         [](QAXAgentProtocol& agent, const Value::Array& args, RemoteReplyHandler reply) {
             agent.getDefaultDeviceInfoUsingPolicy(policyArg(args, 0),
                                                   deviceInfoReply(std::move(reply)));
         }},
        {"getDeviceInfoForSerialNumber:usingPolicy:withReply:",
         {Arg::SerialNumber, Arg::Unsigned},
         [](QAXAgentProtocol& agent, const Value::Array& args, RemoteReplyHandler reply) {
             agent.getDeviceInfoForSerialNumber(stringArg(args, 0), policyArg(args, 1),
                                                deviceInfoReply(std::move(reply)));
         }},
        {"getAllDeviceInfosUsingPolicy:updateFollowUps:withReply:",
         {Arg::Unsigned, Arg::Bool},
         [](QAXAgentProtocol& agent, const Value::Array& args, RemoteReplyHandler reply) {
             agent.getAllDeviceInfosUsingPolicy(
                 policyArg(args, 0), *args[1].asBool(),
                 [reply](std::vector<std::shared_ptr<QAXDeviceInfo>> infos) {
                     Value::Array archived;
                     for (const auto& info : infos) {
                         if (info) {
                             archived.push_back(info->encode());
                         }
                     }
                     reply(RemoteReply::of(Value(std::move(archived))));
                 });
         }},
        {"dismissFollowUpForSerialNumber:completion:",
         {Arg::SerialNumber},
         [](QAXAgentProtocol& agent, const Value::Array& args, RemoteReplyHandler reply) {
             agent.dismissFollowUpForSerialNumber(stringArg(args, 0), boolReply(std::move(reply)));
         }},
        {"dismissNotificationForSerialNumber:completion:",
         {Arg::SerialNumber},
         [](QAXAgentProtocol& agent, const Value::Array& args, RemoteReplyHandler reply) {
             agent.dismissNotificationForSerialNumber(stringArg(args, 0),
                                                      boolReply(std::move(reply)));
         }},
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
    auto* agent = dynamic_cast<QAXAgentProtocol*>(object.get());
    if (!agent) {
        reply(RemoteReply::failure(kNotAnAgent));
        return;
    }
    found->call(*agent, args, std::move(reply));
}

}  // namespace qax
