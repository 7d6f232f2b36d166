// The launch configuration of the agent's pre-registered activities, activities.plist in the
// share directory: identifier -> {Trigger: "boot" | "upgrade" | "interval", Interval: seconds,
// RequiresNetwork: bool}. An entry with an unknown trigger is left out with a log line.
// Stateless; any thread.
#pragma once

#include <map>
#include <string>

namespace qax {

struct LaunchActivity {
    enum class Trigger { Boot, Upgrade, Interval };
    Trigger trigger = Trigger::Interval;
    // Seconds between fires of an interval activity; 0 fires it only when scheduled.
    double interval = 0;
    bool requiresNetwork = false;
};

class HostActivityLaunchConfiguration {
  public:
    static std::string path(const std::string& shareDirectory);
    // A missing or unreadable file gives no activity (logged when unreadable).
    static std::map<std::string, LaunchActivity> load(const std::string& shareDirectory);
    static const char* triggerName(LaunchActivity::Trigger trigger);
};

}  // namespace qax
