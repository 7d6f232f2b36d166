// The persisted registry of the host's background activities, state/activities.plist:
// identifier -> {Preregistered, Delay, GracePeriod, RequiresNetwork, ScheduledAt, DueDate,
// LastFired, LastResult, Deferrals}. A registration is pending while it has a DueDate; the
// rest is the activity's history. The scheduler is its only writer; qaxctl reads it.
// Stateless; any thread.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>

#include "core/Date.h"

namespace qax {

struct ActivityRecord {
    bool preregistered = false;
    std::int64_t delay = 0;
    std::int64_t gracePeriod = 0;
    bool requiresNetwork = false;
    std::optional<Date> scheduledAt;
    // Present while a registration is pending: it fires once the clock reaches it.
    std::optional<Date> dueDate;
    std::optional<Date> lastFired;
    std::optional<std::int64_t> lastResult;
    // Deferred results since the registration was made.
    std::int64_t deferrals = 0;

    bool pending() const { return dueDate.has_value(); }
};

class HostActivityRegistry {
  public:
    using Records = std::map<std::string, ActivityRecord>;

    // The latest date the file stores (property-list dates count 32-bit seconds from 2001).
    static constexpr Date kLatestDate = Date(kSecondsFrom1970To2001 + 2147483647.0);

    static std::string path(const std::string& platformRoot);
    // A missing file is an empty registry; an unreadable one too, logged (and left alone).
    static Records load(const std::string& platformRoot);
    static bool save(const std::string& platformRoot, const Records& records, std::string* error);
};

}  // namespace qax
