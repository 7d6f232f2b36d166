// The platform's follow-up service: items shown as a settings row (with badge and
// notification) per client identifier. Thread-safe.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "core/Value.h"

namespace qax {

struct FollowUpAction {
    std::optional<std::string> label;
    std::optional<std::string> url;
    std::optional<std::string> identifier;
};

struct FollowUpNotification {
    // Option bits of a notification.
    enum Option : std::uint64_t {
        LockScreenOption = 1 << 0,
        NotificationCenterOption = 1 << 1,
        ExtensionActionsOption = 1 << 2,
        ExtensionForNotificationOption = 1 << 3,
    };
    std::optional<std::string> title;
    std::optional<std::string> informativeText;
    std::optional<FollowUpAction> activateAction;
    std::optional<FollowUpAction> clearAction;
    double frequency = 0;
    std::uint64_t options = 0;
};

struct FollowUpItem {
    std::optional<std::string> uniqueIdentifier;
    std::optional<std::string> groupIdentifier;
    std::optional<std::string> targetBundleIdentifier;
    std::optional<std::string> extensionIdentifier;
    std::uint64_t displayStyle = 0;
    std::optional<std::string> title;
    std::optional<std::string> informativeFooterText;
    std::optional<Date> expirationDate;
    Value::Dictionary userInfo;
    std::vector<FollowUpAction> actions;
    std::optional<FollowUpNotification> notification;
};

// Keys of an item's userInfo that the follow-up service itself reads.
inline constexpr const char* kFollowUpRelativeIsCeilingKey = "RelativeIsCeiling";
inline constexpr const char* kFollowUpRelativeSingleDayKey = "RelativeSingleDay";
inline constexpr const char* kFollowUpRelativePluralDaysFormatKey = "RelativePluralDaysFormat";
// The follow-up service's own target identifier for the settings application.
inline constexpr const char* kFollowUpSettingsTargetBundleIdentifier = "com.velmora.Preferences";

// Opened per call for a client identifier (the agent's is "com.velmora.Kestova").
class FollowUpCenter {
  public:
    virtual ~FollowUpCenter() = default;
    // Stores an item; an item with the same unique identifier is replaced. False with
    // `error` set when the item could not be stored.
    virtual bool postFollowUpItem(const std::string& clientIdentifier, const FollowUpItem& item,
                                  std::string* error) = 0;
    // Removes the pending items with these unique identifiers.
    virtual bool clearPendingFollowUpItemsWithUniqueIdentifiers(
        const std::string& clientIdentifier, const std::vector<std::string>& uniqueIdentifiers,
        std::string* error) = 0;
    // The items this client has pending; on failure `error` is set and the list may be empty.
    virtual std::vector<FollowUpItem> pendingFollowUpItems(const std::string& clientIdentifier,
                                                           std::string* error) = 0;
    // Withdraws the notification of a pending item, leaving the item itself.
    virtual bool clearNotificationForItem(const std::string& clientIdentifier,
                                          const FollowUpItem& item, std::string* error) = 0;
};

}  // namespace qax
