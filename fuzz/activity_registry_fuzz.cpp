// The activity registry file as it may be found on disk: loaded, saved and loaded again the
// way the host scheduler keeps it across restarts. Whatever was loaded must survive the round
// trip: pending registrations whole, finished ones with their history.
#include <cmath>
#include <cstddef>
#include <cstdint>
#include <string>

#include "FuzzPlatform.h"
#include "platform/host/HostActivityRegistry.h"

namespace {

// Dates go through the file with microsecond resolution.
bool sameDate(const std::optional<qax::Date>& a, const std::optional<qax::Date>& b) {
    if (a.has_value() != b.has_value()) {
        return false;
    }
    return !a || std::fabs(a->secondsSince1970() - b->secondsSince1970()) < 1e-3;
}

bool survived(const qax::ActivityRecord& before, const qax::ActivityRecord& after) {
    bool same = before.preregistered == after.preregistered &&
                before.deferrals == after.deferrals &&
                sameDate(before.lastFired, after.lastFired) &&
                before.lastResult == after.lastResult && before.pending() == after.pending();
    if (same && before.pending()) {
        same = before.delay == after.delay && before.gracePeriod == after.gracePeriod &&
               before.requiresNetwork == after.requiresNetwork &&
               sameDate(before.dueDate, after.dueDate) &&
               sameDate(before.scheduledAt, after.scheduledAt);
    }
    return same;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    qaxfuzz::quietLog();
    static const std::string root = qaxfuzz::scratchDirectory() + "/registry-root";
    qaxfuzz::putFile(qax::HostActivityRegistry::path(root), data, size);

    const auto loaded = qax::HostActivityRegistry::load(root);
    std::string error;
    if (!qax::HostActivityRegistry::save(root, loaded, &error)) {
        __builtin_trap();  // what was loaded must be storable again
    }
    const auto reloaded = qax::HostActivityRegistry::load(root);
    if (reloaded.size() != loaded.size()) {
        __builtin_trap();
    }
    for (const auto& [identifier, record] : loaded) {
        auto it = reloaded.find(identifier);
        if (it == reloaded.end() || !survived(record, it->second)) {
            __builtin_trap();
        }
    }
    return 0;
}
