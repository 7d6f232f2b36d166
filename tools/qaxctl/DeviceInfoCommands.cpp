// qaxctl device-info and device-infos: devices with their warranties as the agent answers
// them under a freshness policy, shown the way a person reads them (device, coverage, the
// plan offer with its day count and dates) or as JSON for scripts. The records are decoded
// with the agent's own preference domain, clock and locale, so derived texts match its own.
#include <algorithm>
#include <cstdio>
#include <string>
#include <vector>

#include "AgentClient.h"
#include "Command.h"
#include "core/JsonCodec.h"
#include "devices/QAXDeviceInfo.h"
#include "warranty/QAXWarranty.h"

namespace qaxctl {
namespace {

using qax::Date;
using qax::QAXDeviceInfo;
using qax::QAXWarranty;
using qax::Value;

constexpr const char* kDeviceInfoUsage =
    "device-info [SERIAL] [--policy default|cached|force|N] [--timeout SECONDS] [--json]";
constexpr const char* kDeviceInfosUsage =
    "device-infos [--policy default|cached|force|N] [--update-followups] [--timeout SECONDS] "
    "[--json]";

Value dateValue(const std::optional<Date>& date) {
    return date ? Value(*date) : Value();
}

Value textValue(const std::optional<Value>& v) {
    return v ? *v : Value();
}

Value textValue(const std::optional<std::string>& s) {
    return s ? Value(*s) : Value();
}

Value warrantyJson(const QAXWarranty& w) {
    return Value(Value::Dictionary{
        {"covered", Value(w.covered())},
        {"coverageEndDate", dateValue(w.coverageEndDate())},
        {"coverageLocalizedLabel", textValue(w.coverageLocalizedLabel())},
        {"coverageLocalizedDesc", textValue(w.coverageLocalizedDesc())},
        {"hvOfferEligible", Value(w.hvOfferEligible())},
        {"hvOfferDisplay", Value(w.hvOfferDisplay())},
        {"hvOfferIdentifier", textValue(w.hvOfferIdentifier())},
        {"hvLocalizedOfferLabel", textValue(w.hvLocalizedOfferLabel())},
        {"hvLocalizedOfferDesc", textValue(w.hvLocalizedOfferDesc())},
        {"hvLocalizedOfferDetailsEligibility", textValue(w.hvLocalizedOfferDetailsEligibility())},
        {"daysEligible", Value(static_cast<long long>(w.daysEligible()))},
        {"hvOfferEligibleUntil", dateValue(w.hvOfferEligibleUntil())},
        {"hvOfferDisplayDate", dateValue(w.hvOfferDisplayDate())},
        {"hvOfferFollowupDisplayDate", dateValue(w.hvOfferFollowupDisplayDate())},
        {"hvOfferConversionDate", dateValue(w.hvOfferConversionDate())},
        {"summary", w.dictionaryRepresentation()},
    });
}

Value deviceInfoJson(const QAXDeviceInfo& info) {
    return Value(Value::Dictionary{
        {"device", info.device() ? deviceJson(*info.device()) : Value()},
        {"warranty", info.warranty() ? warrantyJson(*info.warranty()) : Value()},
    });
}

// A summary string as it stands; other kinds of value as their description.
std::string text(const std::optional<Value>& v) {
    if (!v) {
        return "";
    }
    return v->asString() ? *v->asString() : v->description();
}

std::string dateText(const std::optional<Date>& d) {
    return d ? d->description() : "-";
}

void printDeviceInfo(const QAXDeviceInfo& info) {
    std::vector<std::vector<std::string>> rows;
    auto row = [&rows](std::string label, std::string value) {
        rows.push_back({std::move(label), std::move(value)});
    };
    if (const auto& d = info.device()) {
        row("Device:", d->name().value_or("-") + " (" + d->serialNumber().value_or("-") + ")");
        row("Type:", d->deviceTypeString());
        row("Activated:", dateText(d->activationDate()));
    } else {
        row("Device:", "-");
    }
    const auto& w = info.warranty();
    if (!w) {
        row("Warranty:", "no warranty");
        printColumns(rows);
        return;
    }
    std::string coverage = w->covered() ? "covered" : "not covered";
    if (auto label = text(w->coverageLocalizedLabel()); !label.empty()) {
        coverage += " (" + label + ")";
    }
    if (w->coverageEndDate()) {
        coverage += ", ends " + w->coverageEndDate()->description();
    }
    row("Coverage:", coverage);
    if (auto desc = text(w->coverageLocalizedDesc()); !desc.empty()) {
        row("", desc);
    }
    if (!w->hvOfferEligible() && !w->hvOfferDisplay()) {
        row("Offer:", "none");
        printColumns(rows);
        return;
    }
    std::string offer = text(w->hvLocalizedOfferLabel());
    if (auto id = text(w->hvOfferIdentifier()); !id.empty()) {
        offer += (offer.empty() ? "" : " ") + ("[" + id + "]");
    }
    offer += w->hvOfferDisplay() ? ", displayed" : ", not displayed";
    row("Offer:", offer);
    if (auto desc = w->hvLocalizedOfferDesc()) {
        row("", *desc);
    }
    row("Eligible until:", dateText(w->hvOfferEligibleUntil()) + " (" +
                               std::to_string(w->daysEligible()) +
                               (w->daysEligible() == 1 ? " day left)" : " days left)"));
    row("Display date:", dateText(w->hvOfferDisplayDate()));
    row("Follow-up date:", dateText(w->hvOfferFollowupDisplayDate()));
    printColumns(rows);
}

struct Options {
    Value policy = Value(0);
    double timeout = kDefaultReplyTimeoutSeconds;
    bool json = false;
};

// Takes the options every device-info verb has; false on a bad value.
bool takeOptions(std::vector<std::string>& args, Options& options) {
    options.json = takeFlag(args, "--json");
    std::string policy;
    if (std::find(args.begin(), args.end(), "--policy") != args.end()) {
        auto parsed = takeOption(args, "--policy", policy) ? parsePolicy(policy) : std::nullopt;
        if (!parsed) {
            return false;
        }
        options.policy = *parsed;
    }
    return takeTimeout(args, options.timeout);
}

int deviceInfo(std::vector<std::string> args) {
    Options options;
    if (!takeOptions(args, options) || args.size() > 1 ||
        (args.size() == 1 && args[0].rfind("--", 0) == 0)) {
        return usageError(kDeviceInfoUsage);
    }
    const bool bySerial = args.size() == 1;
    const std::string op = bySerial ? "getDeviceInfoForSerialNumber:usingPolicy:withReply:"
                                    : "getDefaultDeviceInfoUsingPolicy:withReply:";
    Value::Array request =
        bySerial ? Value::Array{Value(args[0]), options.policy} : Value::Array{options.policy};
    return callAgent(op, request, options.timeout, [&](const std::optional<Value>& reply) {
        auto info = reply ? QAXDeviceInfo::decode(recordPlatform(), *reply) : nullptr;
        if (!info) {
            return badReply(op);
        }
        if (options.json) {
            std::printf("%s\n", qax::toJsonString(deviceInfoJson(*info), 2).c_str());
        } else {
            printDeviceInfo(*info);
        }
        return 0;
    });
}

int deviceInfos(std::vector<std::string> args) {
    Options options;
    const bool updateFollowUps = takeFlag(args, "--update-followups");
    if (!takeOptions(args, options) || !args.empty()) {
        return usageError(kDeviceInfosUsage);
    }
    const std::string op = "getAllDeviceInfosUsingPolicy:updateFollowUps:withReply:";
    return callAgent(
        op, {options.policy, Value(updateFollowUps)}, options.timeout,
        [&](const std::optional<Value>& reply) {
            const Value::Array* list = reply ? reply->asArray() : nullptr;
            if (!list) {
                return badReply(op);
            }
            auto platform = recordPlatform();
            std::vector<std::shared_ptr<QAXDeviceInfo>> infos;
            for (const auto& archived : *list) {
                auto info = QAXDeviceInfo::decode(platform, archived);
                if (!info) {
                    return badReply(op);
                }
                infos.push_back(std::move(info));
            }
            // The agent answers in the order its downloads finish; print in a stable one.
            auto serial = [](const QAXDeviceInfo& i) {
                return i.device() ? i.device()->serialNumber().value_or("") : std::string();
            };
            std::stable_sort(infos.begin(), infos.end(),
                             [&](const auto& a, const auto& b) { return serial(*a) < serial(*b); });
            if (options.json) {
                Value::Array out;
                for (const auto& info : infos) {
                    out.push_back(deviceInfoJson(*info));
                }
                std::printf("%s\n", qax::toJsonString(Value(std::move(out)), 2).c_str());
                return 0;
            }
            if (infos.empty()) {
                std::printf("No devices.\n");
            }
            for (std::size_t i = 0; i < infos.size(); ++i) {
                std::printf("%s", i ? "\n" : "");
                printDeviceInfo(*infos[i]);
            }
            return 0;
        });
}

QAXCTL_COMMAND("device-info", "device-info [SERIAL] [--policy P] [--json]",
               "a device's warranty from the agent (the default device without SERIAL)",
               deviceInfo);
QAXCTL_COMMAND("device-infos", "device-infos [--policy P] [--update-followups] [--json]",
               "every device's warranty from the agent, optionally refreshing the follow-ups",
               deviceInfos);

}  // namespace
}  // namespace qaxctl
