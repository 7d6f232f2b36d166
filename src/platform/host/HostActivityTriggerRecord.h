// What the platform remembers of its launch triggers, state/triggers.plist: per activity
// identifier the boot id it last fired for and every system version it fired for, so that a
// "boot" activity fires once per boot and an "upgrade" activity once per new version.
// Stateless; any thread.
#pragma once

#include <map>
#include <optional>
#include <string>
#include <vector>

namespace qax {

struct TriggerRecord {
    std::optional<std::string> bootId;
    std::vector<std::string> productVersions;
};

class HostActivityTriggerRecord {
  public:
    using Records = std::map<std::string, TriggerRecord>;

    static std::string path(const std::string& platformRoot);
    // A missing or unreadable file (logged) remembers nothing.
    static Records load(const std::string& platformRoot);
    static bool save(const std::string& platformRoot, const Records& records, std::string* error);
};

}  // namespace qax
