#include "platform/host/HostActivityRegistry.h"

#include <filesystem>

#include "core/AtomicFile.h"
#include "core/PlistCodec.h"
#include "platform/host/CheckedPlistFile.h"

namespace qax {
namespace {

constexpr const char* kPreregistered = "Preregistered";
constexpr const char* kDelay = "Delay";
constexpr const char* kGracePeriod = "GracePeriod";
constexpr const char* kRequiresNetwork = "RequiresNetwork";
constexpr const char* kScheduledAt = "ScheduledAt";
constexpr const char* kDueDate = "DueDate";
constexpr const char* kLastFired = "LastFired";
constexpr const char* kLastResult = "LastResult";
constexpr const char* kDeferrals = "Deferrals";

std::optional<Date> dateAt(const Value& entry, const char* key) {
    const Value* v = entry.find(key);
    return v ? v->asDate() : std::nullopt;
}

std::int64_t integerAt(const Value& entry, const char* key) {
    const Value* v = entry.find(key);
    return v ? v->asInteger().value_or(0) : 0;
}

ActivityRecord decode(const Value& entry) {
    ActivityRecord r;
    if (const Value* v = entry.find(kPreregistered)) {
        r.preregistered = v->truthy();
    }
    r.delay = integerAt(entry, kDelay);
    r.gracePeriod = integerAt(entry, kGracePeriod);
    if (const Value* v = entry.find(kRequiresNetwork)) {
        r.requiresNetwork = v->truthy();
    }
    r.scheduledAt = dateAt(entry, kScheduledAt);
    r.dueDate = dateAt(entry, kDueDate);
    r.lastFired = dateAt(entry, kLastFired);
    if (const Value* v = entry.find(kLastResult)) {
        r.lastResult = v->asInteger();
    }
    r.deferrals = integerAt(entry, kDeferrals);
    return r;
}

Value encode(const ActivityRecord& r) {
    Value::Dictionary d{{kPreregistered, r.preregistered}, {kDeferrals, r.deferrals}};
    if (r.pending()) {
        d[kDelay] = r.delay;
        d[kGracePeriod] = r.gracePeriod;
        d[kRequiresNetwork] = r.requiresNetwork;
        d[kDueDate] = *r.dueDate;
        if (r.scheduledAt) {
            d[kScheduledAt] = *r.scheduledAt;
        }
    }
    if (r.lastFired) {
        d[kLastFired] = *r.lastFired;
    }
    if (r.lastResult) {
        d[kLastResult] = *r.lastResult;
    }
    return Value(std::move(d));
}

}  // namespace

std::string HostActivityRegistry::path(const std::string& platformRoot) {
    return (std::filesystem::path(platformRoot) / "state" / "activities.plist").string();
}

HostActivityRegistry::Records HostActivityRegistry::load(const std::string& platformRoot) {
    Records records;
    CheckedPlistFile file(path(platformRoot), Value::Kind::Dictionary);
    if (auto root = file.read()) {
        for (const auto& [identifier, entry] : *root->asDictionary()) {
            if (entry.isDictionary()) {
                records[identifier] = decode(entry);
            }
        }
    }
    return records;
}

bool HostActivityRegistry::save(const std::string& platformRoot, const Records& records,
                                std::string* error) {
    Value::Dictionary root;
    for (const auto& [identifier, record] : records) {
        root[identifier] = encode(record);
    }
    auto bytes = toBinaryPlist(Value(std::move(root)));
    if (!bytes) {
        if (error) {
            *error = "a date of the registry is out of range";
        }
        return false;
    }
    return writeFileAtomically(path(platformRoot), *bytes, error);
}

}  // namespace qax
