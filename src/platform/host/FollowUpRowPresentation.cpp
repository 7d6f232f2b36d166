#include "platform/host/FollowUpRowPresentation.h"

#include <cmath>

namespace qax {
namespace {

constexpr double kSecondsPerDay = 86400;
// Display style bit: the row carries a badge.
constexpr std::uint64_t kBadgeStyle = 1;
constexpr std::string_view kNumberPlaceholder = "%@";

std::optional<std::string> userInfoText(const FollowUpItem& item, const char* key) {
    auto it = item.userInfo.find(key);
    return it != item.userInfo.end() && it->second.isString()
               ? std::optional<std::string>(*it->second.asString())
               : std::nullopt;
}

std::optional<std::string> renderDays(const FollowUpItem& item, std::int64_t days) {
    if (days == 1) {
        return userInfoText(item, kFollowUpRelativeSingleDayKey);
    }
    auto format = userInfoText(item, kFollowUpRelativePluralDaysFormatKey);
    if (!format) {
        return std::nullopt;
    }
    const std::string number = std::to_string(days);
    for (auto at = format->find(kNumberPlaceholder); at != std::string::npos;
         at = format->find(kNumberPlaceholder, at + number.size())) {
        format->replace(at, kNumberPlaceholder.size(), number);
    }
    return format;
}

void put(Value::Dictionary& d, const char* key, const std::optional<std::string>& text) {
    if (text) {
        d[key] = *text;
    }
}

}  // namespace

FollowUpRowPresentation FollowUpRowPresentation::present(const FollowUpItem& item,
                                                         std::optional<Date> postedDate, Date now) {
    FollowUpRowPresentation p;
    p.uniqueIdentifier = item.uniqueIdentifier;
    p.title = item.title;
    p.footer = item.informativeFooterText;
    p.badge = (item.displayStyle & kBadgeStyle) != 0;
    p.target = item.targetBundleIdentifier;
    p.expiration = item.expirationDate;
    p.postedDate = postedDate;
    if (item.expirationDate) {
        const double remaining = item.expirationDate->timeIntervalSince(now);
        p.expired = remaining <= 0;
        if (!p.expired) {
            auto ceiling = item.userInfo.find(kFollowUpRelativeIsCeilingKey);
            const bool roundUp = ceiling != item.userInfo.end() && ceiling->second.truthy();
            const double days = remaining / kSecondsPerDay;
            p.remainingDays =
                static_cast<std::int64_t>(roundUp ? std::ceil(days) : std::floor(days));
            p.dayText = renderDays(item, *p.remainingDays);
        }
    }
    if (item.notification) {
        const auto& n = *item.notification;
        p.notification = Notification{n.title, n.informativeText,
                                      n.activateAction ? n.activateAction->label : std::nullopt,
                                      n.clearAction ? n.clearAction->label : std::nullopt};
    }
    return p;
}

Value FollowUpRowPresentation::toValue() const {
    Value::Dictionary d;
    put(d, "uniqueIdentifier", uniqueIdentifier);
    put(d, "title", title);
    put(d, "footer", footer);
    if (remainingDays) {
        d["remainingDays"] = *remainingDays;
    }
    put(d, "dayText", dayText);
    d["badge"] = badge;
    if (notification) {
        Value::Dictionary n;
        put(n, "title", notification->title);
        put(n, "text", notification->text);
        put(n, "activateLabel", notification->activateLabel);
        put(n, "clearLabel", notification->clearLabel);
        d["notification"] = std::move(n);
    }
    put(d, "target", target);
    if (expiration) {
        d["expiration"] = expiration->iso8601();
    }
    d["expired"] = expired;
    if (postedDate) {
        d["postedDate"] = postedDate->iso8601();
    }
    return Value(std::move(d));
}

}  // namespace qax
