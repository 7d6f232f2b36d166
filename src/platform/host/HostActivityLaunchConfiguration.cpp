#include "platform/host/HostActivityLaunchConfiguration.h"

#include <cmath>
#include <filesystem>

#include "core/Log.h"
#include "platform/host/CheckedPlistFile.h"

namespace qax {
namespace {

constexpr std::pair<LaunchActivity::Trigger, const char*> kTriggerNames[] = {
    {LaunchActivity::Trigger::Boot, "boot"},
    {LaunchActivity::Trigger::Upgrade, "upgrade"},
    {LaunchActivity::Trigger::Interval, "interval"},
};

}  // namespace

std::string HostActivityLaunchConfiguration::path(const std::string& shareDirectory) {
    return (std::filesystem::path(shareDirectory) / "activities.plist").string();
}

const char* HostActivityLaunchConfiguration::triggerName(LaunchActivity::Trigger trigger) {
    for (const auto& [t, name] : kTriggerNames) {
        if (t == trigger) {
            return name;
        }
    }
    return "";
}

std::map<std::string, LaunchActivity> HostActivityLaunchConfiguration::load(
    const std::string& shareDirectory) {
    std::map<std::string, LaunchActivity> activities;
    CheckedPlistFile file(path(shareDirectory), Value::Kind::Dictionary);
    auto root = file.read();
    if (!root) {
        return activities;
    }
    for (const auto& [identifier, entry] : *root->asDictionary()) {
        const Value* trigger = entry.find("Trigger");
        const std::string* name = trigger ? trigger->asString() : nullptr;
        LaunchActivity activity;
        bool known = false;
        for (const auto& [t, triggerName] : kTriggerNames) {
            if (name && *name == triggerName) {
                activity.trigger = t;
                known = true;
            }
        }
        if (!known) {
            qaxLog().error(
                "Launch configuration '%@': activity '%@' has no known trigger; left out",
                file.path(), identifier);
            continue;
        }
        if (const Value* interval = entry.find("Interval")) {
            const double seconds = interval->asDouble().value_or(0);
            activity.interval = std::isfinite(seconds) && seconds > 0 ? seconds : 0;
        }
        if (const Value* network = entry.find("RequiresNetwork")) {
            activity.requiresNetwork = network->truthy();
        }
        activities[identifier] = activity;
    }
    return activities;
}

}  // namespace qax
