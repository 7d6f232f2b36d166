// Follow-up items as they are stored in state/followups/<client>.plist: one dictionary per
// item, a missing text being a missing key, notification options as their names, and the
// date of the item's last post beside it. The agent's follow-up service and qaxctl read the
// store through this one codec. Stateless; any thread.
#pragma once

#include <optional>

#include "core/Value.h"
#include "platform/FollowUpCenter.h"

namespace qax {

struct StoredFollowUpItem {
    FollowUpItem item;
    std::optional<Date> postedDate;
};

class FollowUpItemCodec {
  public:
    static Value encode(const FollowUpItem& item, std::optional<Date> postedDate);
    // Takes what the dictionary has: a missing or mistyped key leaves the field empty.
    static StoredFollowUpItem decode(const Value::Dictionary& stored);
    // The stored item's unique identifier, if it has one.
    static std::optional<std::string> uniqueIdentifier(const Value& stored);
    static bool hasNotification(const Value& stored);
    // Withdraws the stored item's notification, keeping the item.
    static void removeNotification(Value& stored);
};

}  // namespace qax
