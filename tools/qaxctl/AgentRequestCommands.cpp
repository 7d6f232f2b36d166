// qaxctl's verbs for the agent's other requests: dismissing a follow-up or its notification,
// scheduling outreach, announcing a new account, the support application's availability and
// store listing, and the web URL override. Text for people, --json for scripts (the reply as
// JSON: true/false, an object, a string or null).
#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <functional>
#include <string>
#include <vector>

#include "AgentClient.h"
#include "Command.h"
#include "core/JsonCodec.h"

namespace qaxctl {
namespace {

using qax::Value;

// What every verb here shares: its usage, how many words it takes, and --json/--timeout.
struct Invocation {
    std::vector<std::string> words;
    bool json = false;
    double timeout = kDefaultReplyTimeoutSeconds;
};

std::optional<Invocation> parse(std::vector<std::string> args, std::size_t words) {
    Invocation in;
    in.json = takeFlag(args, "--json");
    if (!takeTimeout(args, in.timeout) || args.size() != words) {
        return std::nullopt;
    }
    for (const auto& a : args) {
        if (a.rfind("--", 0) == 0) {
            return std::nullopt;
        }
    }
    in.words = std::move(args);
    return in;
}

// A reply that must be a boolean, printed as JSON or as the sentence for its value.
std::function<int(const std::optional<Value>&)> boolReply(std::string op, bool json,
                                                          std::string yes, std::string no) {
    return [op, json, yes, no](const std::optional<Value>& reply) {
        if (!reply || !reply->isBool()) {
            return badReply(op);
        }
        const bool answer = reply->truthy();
        std::printf("%s\n", json ? (answer ? "true" : "false") : (answer ? yes : no).c_str());
        return 0;
    };
}

const char* availabilityMeaning(std::int64_t type) {
    switch (type) {
        case 0:
            return "not available";
        case 1:
            return "installed (or forced available)";
        case 2:
            return "purchased, can be downloaded again";
        case 3:
            return "available in the Marketa";
    }
    return "unknown";
}

// The availability dictionary, known keys first in the order a person reads them.
void printAvailability(const Value::Dictionary& answer) {
    static const char* const order[] = {
        "AppBundleID",        "AppTitleKey", "AppVendorName", "AppAvailabilityType",
        "AppAvailablityText", "AppLinkURL",  "AppIconURL"};
    std::vector<std::vector<std::string>> rows;
    auto add = [&](const std::string& key, const Value& v) {
        std::string text = v.asString() ? *v.asString() : v.description();
        if (key == "AppAvailabilityType" && v.asInteger()) {
            text += std::string(" (") + availabilityMeaning(*v.asInteger()) + ")";
        }
        rows.push_back({key + ":", text});
    };
    for (const char* key : order) {
        if (auto it = answer.find(key); it != answer.end()) {
            add(key, it->second);
        }
    }
    for (const auto& [key, v] : answer) {
        if (std::find(std::begin(order), std::end(order), key) == std::end(order)) {
            add(key, v);
        }
    }
    printColumns(rows);
}

int dismiss(std::vector<std::string> args, const char* verb, const char* op, const char* what) {
    const std::string usage = std::string(verb) + " SERIAL [--timeout SECONDS] [--json]";
    auto in = parse(std::move(args), 1);
    if (!in) {
        return usageError(usage);
    }
    const std::string& serial = in->words[0];
    return callAgent(
        op, {Value(serial)}, in->timeout,
        boolReply(op, in->json, std::string(what) + " of " + serial + " dismissed",
                  "the agent did not dismiss the " + std::string(what) + " of " + serial));
}

int dismissFollowUp(std::vector<std::string> args) {
    return dismiss(std::move(args), "dismiss-followup",
                   "dismissFollowUpForSerialNumber:completion:", "follow-up");
}

int dismissNotification(std::vector<std::string> args) {
    return dismiss(std::move(args), "dismiss-notification",
                   "dismissNotificationForSerialNumber:completion:", "notification");
}

constexpr const char* kScheduleUsage =
    "schedule-outreach [--after SECONDS] [--timeout SECONDS] "
    "[--json]";

int scheduleOutreach(std::vector<std::string> args) {
    std::optional<double> after;
    if (std::find(args.begin(), args.end(), "--after") != args.end()) {
        std::string text;
        after = takeOption(args, "--after", text) ? parseDuration(text) : std::nullopt;
        if (!after) {
            return usageError(kScheduleUsage);
        }
    }
    auto in = parse(std::move(args), 0);
    if (!in) {
        return usageError(kScheduleUsage);
    }
    const std::string op =
        after ? "scheduleOutreachAfter:withReply:" : "scheduleOutreachWithReply:";
    const std::string when =
        after ? " in " + std::to_string(static_cast<long long>(*after)) + " s" : " now";
    return callAgent(op, after ? Value::Array{Value(*after)} : Value::Array{}, in->timeout,
                     boolReply(op, in->json, "outreach scheduled" + when,
                               "the agent did not schedule outreach"));
}

int accountAdded(std::vector<std::string> args) {
    auto in = parse(std::move(args), 0);
    if (!in) {
        return usageError("account-added [--timeout SECONDS] [--json]");
    }
    const std::string op = "velmoraAccountAddedWithReply:";
    return callAgent(
        op, {}, in->timeout,
        boolReply(op, in->json, "account added: outreach scheduled or warranties downloaded",
                  "account added: skipped (the post-upgrade activity has not "
                  "completed)"));
}

int supportAvailability(std::vector<std::string> args) {
    auto in = parse(std::move(args), 1);
    if (!in) {
        return usageError("support-availability BUNDLE_ID [--timeout SECONDS] [--json]");
    }
    const std::string op = "appSupportAvailability:withReply:";
    return callAgent(op, {Value(in->words[0])}, in->timeout,
                     [&](const std::optional<Value>& reply) {
                         const Value::Dictionary* answer = reply ? reply->asDictionary() : nullptr;
                         if (!answer) {
                             return badReply(op);
                         }
                         if (in->json) {
                             std::printf("%s\n", qax::toJsonString(*reply, 2).c_str());
                         } else {
                             printAvailability(*answer);
                         }
                         return 0;
                     });
}

int storeCheck(std::vector<std::string> args) {
    auto in = parse(std::move(args), 1);
    if (!in) {
        return usageError("store-check BUNDLE_ID [--timeout SECONDS] [--json]");
    }
    const std::string op = "checkIsAvailableInStore:withReply:";
    return callAgent(
        op, {Value(in->words[0])}, in->timeout, [&](const std::optional<Value>& reply) {
            if (reply && !reply->isDictionary()) {
                return badReply(op);
            }
            if (in->json) {
                std::printf("%s\n", reply ? qax::toJsonString(*reply, 2).c_str() : "null");
            } else if (!reply) {
                std::printf(
                    "%s: not found in the Marketa (the look-up failed or "
                    "found nothing)\n",
                    in->words[0].c_str());
            } else {
                printAvailability(*reply->asDictionary());
            }
            return 0;
        });
}

int webURLOverride(std::vector<std::string> args) {
    auto in = parse(std::move(args), 0);
    if (!in) {
        return usageError("web-url-override [--timeout SECONDS] [--json]");
    }
    const std::string op = "readWebURLOverride:";
    return callAgent(op, {}, in->timeout, [&](const std::optional<Value>& reply) {
        if (reply && !reply->isString()) {
            return badReply(op);
        }
        if (in->json) {
            std::printf("%s\n", reply ? qax::toJsonString(*reply).c_str() : "null");
        } else {
            std::printf("%s\n", reply ? reply->asString()->c_str() : "no web URL override");
        }
        return 0;
    });
}

QAXCTL_COMMAND("dismiss-followup", "dismiss-followup SERIAL [--json]",
               "dismiss the follow-up of a device, as the user would", dismissFollowUp);
QAXCTL_COMMAND("dismiss-notification", "dismiss-notification SERIAL [--json]",
               "dismiss the notification of a device's follow-up", dismissNotification);
QAXCTL_COMMAND("schedule-outreach", "schedule-outreach [--after SECONDS] [--json]",
               "ask the agent to schedule the outreach activity", scheduleOutreach);
QAXCTL_COMMAND("account-added", "account-added [--json]",
               "tell the agent a user account was added (may wait for downloads)", accountAdded);
QAXCTL_COMMAND("support-availability", "support-availability BUNDLE_ID [--json]",
               "whether the support application is installed, purchased or in the store",
               supportAvailability);
QAXCTL_COMMAND("store-check", "store-check BUNDLE_ID [--json]",
               "the support application's store listing, as the agent sees it", storeCheck);
QAXCTL_COMMAND("web-url-override", "web-url-override [--json]",
               "the web flow URL override (internal builds)", webURLOverride);

}  // namespace
}  // namespace qaxctl
