// What the settings application shows for one pending follow-up item at a given moment: its
// row (title, footer, the remaining-days text the follow-up service renders from the item's
// user info, the badge), its notification and where it leads. qaxctl prints it; it reads the
// same stored items the agent posts. Immutable value type; any thread.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "core/Value.h"
#include "platform/FollowUpCenter.h"

namespace qax {

struct FollowUpRowPresentation {
    struct Notification {
        std::optional<std::string> title;
        std::optional<std::string> text;
        std::optional<std::string> activateLabel;
        std::optional<std::string> clearLabel;
    };

    std::optional<std::string> uniqueIdentifier;
    std::optional<std::string> title;
    std::optional<std::string> footer;
    // Whole days left to the expiration date (rounded up when the item asks for the ceiling);
    // none without an expiration date or once it has passed.
    std::optional<std::int64_t> remainingDays;
    // "1 day left"-style text from RelativeSingleDay or RelativePluralDaysFormat.
    std::optional<std::string> dayText;
    bool badge = false;
    std::optional<Notification> notification;
    std::optional<std::string> target;
    std::optional<Date> expiration;
    bool expired = false;
    std::optional<Date> postedDate;

    static FollowUpRowPresentation present(const FollowUpItem& item, std::optional<Date> postedDate,
                                           Date now);
    // Dates as ISO 8601 strings, missing fields left out.
    Value toValue() const;
};

}  // namespace qax
