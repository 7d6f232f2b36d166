// qaxctl activities: the agent's background activities as the host platform sees them, read
// straight from the files (no agent needed): each activity of the launch configuration with
// its trigger, its pending registration in the activity registry, the agent's persisted
// target date from the preference domain, and the last fire and its result.
#include <cstdio>
#include <set>
#include <string>
#include <vector>

#include "Command.h"
#include "core/JsonCodec.h"
#include "platform/host/FilePreferenceStore.h"
#include "platform/host/HostActivityLaunchConfiguration.h"
#include "platform/host/HostActivityRegistry.h"
#include "platform/host/HostPlatform.h"

namespace qaxctl {
namespace {

using qax::ActivityRecord;
using qax::Date;
using qax::LaunchActivity;
using qax::Value;

constexpr const char* kUsage = "usage: qaxctl activities [--json]\n";
// The agent's scheduler keeps an activity's target date under identifier + this suffix.
constexpr const char* kTargetDateSuffix = ".TargetDate";

const char* resultName(std::int64_t result) {
    switch (result) {
        case 1:
            return "finished";
        case 2:
            return "deferred";
        default:
            return "unknown";
    }
}

// "in 2d 03:04:05" or "2d 03:04:05 ago" relative to now.
std::string relative(Date date, Date now) {
    const double seconds = date.timeIntervalSince(now);
    long long s = static_cast<long long>(seconds < 0 ? -seconds : seconds);
    char text[64];
    std::snprintf(text, sizeof text, "%lldd %02lld:%02lld:%02lld", s / 86400, s / 3600 % 24,
                  s / 60 % 60, s % 60);
    return seconds < 0 ? std::string(text) + " ago" : "in " + std::string(text);
}

Value describe(const std::string& identifier, const LaunchActivity* launch,
               const ActivityRecord* record, std::optional<Date> target, Date now) {
    Value::Dictionary d{{"identifier", identifier}};
    if (launch) {
        d["trigger"] = qax::HostActivityLaunchConfiguration::triggerName(launch->trigger);
        d["interval"] = launch->interval;
        d["requiresNetwork"] = launch->requiresNetwork;
    }
    if (record && record->pending()) {
        Value::Dictionary r{{"dueDate", record->dueDate->iso8601()},
                            {"due", record->dueDate->timeIntervalSince(now) <= 0},
                            {"delay", record->delay},
                            {"gracePeriod", record->gracePeriod},
                            {"requiresNetwork", record->requiresNetwork},
                            {"preregistered", record->preregistered},
                            {"deferrals", record->deferrals}};
        if (record->scheduledAt) {
            r["scheduledAt"] = record->scheduledAt->iso8601();
        }
        d["registration"] = std::move(r);
    }
    if (target) {
        d["targetDate"] = target->iso8601();
    }
    if (record && record->lastFired) {
        d["lastFired"] = record->lastFired->iso8601();
    }
    if (record && record->lastResult) {
        d["lastResult"] = *record->lastResult;
    }
    return Value(std::move(d));
}

void printText(const std::string& identifier, const LaunchActivity* launch,
               const ActivityRecord* record, std::optional<Date> target, Date now) {
    std::printf("%s\n", identifier.c_str());
    if (launch) {
        std::string trigger = qax::HostActivityLaunchConfiguration::triggerName(launch->trigger);
        if (launch->trigger == LaunchActivity::Trigger::Interval) {
            trigger +=
                launch->interval > 0
                    ? " (every " + std::to_string(static_cast<long long>(launch->interval)) + " s)"
                    : " (only when scheduled)";
        }
        std::printf("  trigger       %s%s\n", trigger.c_str(),
                    launch->requiresNetwork ? ", needs the network" : "");
    } else {
        std::printf("  trigger       (not in the launch configuration)\n");
    }
    if (record && record->pending()) {
        std::printf("  registration  due %s (%s), delay %lld s, grace %lld s%s%s, deferrals %lld\n",
                    record->dueDate->description().c_str(), relative(*record->dueDate, now).c_str(),
                    static_cast<long long>(record->delay),
                    static_cast<long long>(record->gracePeriod),
                    record->requiresNetwork ? ", needs the network" : "",
                    record->preregistered ? ", from the launch configuration" : "",
                    static_cast<long long>(record->deferrals));
    } else {
        std::printf("  registration  none\n");
    }
    std::printf(
        "  target date   %s\n",
        target ? (target->description() + " (" + relative(*target, now) + ")").c_str() : "none");
    if (record && record->lastFired) {
        std::printf("  last fired    %s (%s)", record->lastFired->description().c_str(),
                    relative(*record->lastFired, now).c_str());
        if (record->lastResult) {
            std::printf(", result %lld (%s)", static_cast<long long>(*record->lastResult),
                        resultName(*record->lastResult));
        }
        std::printf("\n");
    } else {
        std::printf("  last fired    never\n");
    }
}

int run(const std::vector<std::string>& argsIn) {
    std::vector<std::string> args = argsIn;
    const bool json = takeFlag(args, "--json");
    if (!args.empty()) {
        std::fputs(kUsage, stderr);
        return 64;
    }
    const auto env = qax::HostEnvironment::fromProcessEnvironment();
    const Date now = qax::makeHostClock(env)->now();
    const auto launch = qax::HostActivityLaunchConfiguration::load(env.shareDirectory);
    const auto records = qax::HostActivityRegistry::load(env.platformRoot);
    qax::FilePreferenceStore preferences(qax::FilePreferenceStore::domainPath(env.homeDirectory));

    std::set<std::string> identifiers;
    for (const auto& [identifier, activity] : launch) {
        identifiers.insert(identifier);
    }
    for (const auto& [identifier, record] : records) {
        identifiers.insert(identifier);
    }
    Value::Array list;
    bool first = true;
    for (const auto& identifier : identifiers) {
        auto l = launch.find(identifier);
        auto r = records.find(identifier);
        const LaunchActivity* activity = l == launch.end() ? nullptr : &l->second;
        const ActivityRecord* record = r == records.end() ? nullptr : &r->second;
        const auto target = preferences.dateForKey(identifier + kTargetDateSuffix);
        if (json) {
            list.push_back(describe(identifier, activity, record, target, now));
        } else {
            if (!first) {
                std::printf("\n");
            }
            first = false;
            printText(identifier, activity, record, target, now);
        }
    }
    if (json) {
        std::printf("%s\n", qax::toJsonString(Value(std::move(list)), 2).c_str());
    } else if (identifiers.empty()) {
        std::printf("no activities (launch configuration: %s)\n",
                    qax::HostActivityLaunchConfiguration::path(env.shareDirectory).c_str());
    }
    return 0;
}

QAXCTL_COMMAND("activities", "activities [--json]",
               "show the background activities: triggers, registrations, target dates, last runs",
               run);

}  // namespace
}  // namespace qaxctl
