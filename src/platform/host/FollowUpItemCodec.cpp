#include "platform/host/FollowUpItemCodec.h"

#include <utility>

namespace qax {
namespace {

constexpr const char* kUniqueIdentifier = "uniqueIdentifier";
constexpr const char* kGroupIdentifier = "groupIdentifier";
constexpr const char* kTargetBundleIdentifier = "targetBundleIdentifier";
constexpr const char* kExtensionIdentifier = "extensionIdentifier";
constexpr const char* kDisplayStyle = "displayStyle";
constexpr const char* kTitle = "title";
constexpr const char* kInformativeFooterText = "informativeFooterText";
constexpr const char* kExpirationDate = "expirationDate";
constexpr const char* kUserInfo = "userInfo";
constexpr const char* kActions = "actions";
constexpr const char* kNotification = "notification";
constexpr const char* kPostedDate = "postedDate";
constexpr const char* kIdentifier = "identifier";
constexpr const char* kLabel = "label";
constexpr const char* kUrl = "url";
constexpr const char* kInformativeText = "informativeText";
constexpr const char* kActivateAction = "activateAction";
constexpr const char* kClearAction = "clearAction";
constexpr const char* kFrequency = "frequency";
constexpr const char* kOptions = "options";

constexpr std::pair<FollowUpNotification::Option, const char*> kOptionNames[] = {
    {FollowUpNotification::LockScreenOption, "LockScreen"},
    {FollowUpNotification::NotificationCenterOption, "NotificationCenter"},
    {FollowUpNotification::ExtensionActionsOption, "ExtensionActions"},
    {FollowUpNotification::ExtensionForNotificationOption, "ExtensionForNotification"},
};

void putText(Value::Dictionary& d, const char* key, const std::optional<std::string>& text) {
    if (text) {
        d[key] = *text;
    }
}

std::optional<std::string> text(const Value::Dictionary& d, const char* key) {
    auto it = d.find(key);
    if (it == d.end() || !it->second.isString()) {
        return std::nullopt;
    }
    return *it->second.asString();
}

const Value::Dictionary* dictionary(const Value::Dictionary& d, const char* key) {
    auto it = d.find(key);
    return it == d.end() ? nullptr : it->second.asDictionary();
}

Value encodeAction(const FollowUpAction& action) {
    Value::Dictionary d;
    putText(d, kIdentifier, action.identifier);
    putText(d, kLabel, action.label);
    putText(d, kUrl, action.url);
    return Value(std::move(d));
}

FollowUpAction decodeAction(const Value::Dictionary& d) {
    return FollowUpAction{text(d, kLabel), text(d, kUrl), text(d, kIdentifier)};
}

Value encodeNotification(const FollowUpNotification& n) {
    Value::Dictionary d;
    putText(d, kTitle, n.title);
    putText(d, kInformativeText, n.informativeText);
    if (n.activateAction) {
        d[kActivateAction] = encodeAction(*n.activateAction);
    }
    if (n.clearAction) {
        d[kClearAction] = encodeAction(*n.clearAction);
    }
    d[kFrequency] = n.frequency;
    Value::Array options;
    for (const auto& [bit, name] : kOptionNames) {
        if (n.options & bit) {
            options.emplace_back(name);
        }
    }
    d[kOptions] = std::move(options);
    return Value(std::move(d));
}

FollowUpNotification decodeNotification(const Value::Dictionary& d) {
    FollowUpNotification n;
    n.title = text(d, kTitle);
    n.informativeText = text(d, kInformativeText);
    if (const auto* a = dictionary(d, kActivateAction)) {
        n.activateAction = decodeAction(*a);
    }
    if (const auto* a = dictionary(d, kClearAction)) {
        n.clearAction = decodeAction(*a);
    }
    if (auto it = d.find(kFrequency); it != d.end()) {
        n.frequency = it->second.asDouble().value_or(0);
    }
    if (auto it = d.find(kOptions); it != d.end() && it->second.isArray()) {
        for (const auto& option : *it->second.asArray()) {
            for (const auto& [bit, name] : kOptionNames) {
                if (option.asString() && *option.asString() == name) {
                    n.options |= bit;
                }
            }
        }
    }
    return n;
}

}  // namespace

Value FollowUpItemCodec::encode(const FollowUpItem& item, std::optional<Date> postedDate) {
    Value::Dictionary d;
    putText(d, kUniqueIdentifier, item.uniqueIdentifier);
    putText(d, kGroupIdentifier, item.groupIdentifier);
    putText(d, kTargetBundleIdentifier, item.targetBundleIdentifier);
    putText(d, kExtensionIdentifier, item.extensionIdentifier);
    d[kDisplayStyle] = static_cast<std::int64_t>(item.displayStyle);
    putText(d, kTitle, item.title);
    putText(d, kInformativeFooterText, item.informativeFooterText);
    if (item.expirationDate) {
        d[kExpirationDate] = *item.expirationDate;
    }
    d[kUserInfo] = item.userInfo;
    Value::Array actions;
    for (const auto& action : item.actions) {
        actions.push_back(encodeAction(action));
    }
    d[kActions] = std::move(actions);
    if (item.notification) {
        d[kNotification] = encodeNotification(*item.notification);
    }
    if (postedDate) {
        d[kPostedDate] = *postedDate;
    }
    return Value(std::move(d));
}

StoredFollowUpItem FollowUpItemCodec::decode(const Value::Dictionary& d) {
    StoredFollowUpItem stored;
    FollowUpItem& item = stored.item;
    item.uniqueIdentifier = text(d, kUniqueIdentifier);
    item.groupIdentifier = text(d, kGroupIdentifier);
    item.targetBundleIdentifier = text(d, kTargetBundleIdentifier);
    item.extensionIdentifier = text(d, kExtensionIdentifier);
    if (auto it = d.find(kDisplayStyle); it != d.end()) {
        item.displayStyle = static_cast<std::uint64_t>(it->second.asInteger().value_or(0));
    }
    item.title = text(d, kTitle);
    item.informativeFooterText = text(d, kInformativeFooterText);
    if (auto it = d.find(kExpirationDate); it != d.end()) {
        item.expirationDate = it->second.asDate();
    }
    if (const auto* userInfo = dictionary(d, kUserInfo)) {
        item.userInfo = *userInfo;
    }
    if (auto it = d.find(kActions); it != d.end() && it->second.isArray()) {
        for (const auto& action : *it->second.asArray()) {
            if (const auto* a = action.asDictionary()) {
                item.actions.push_back(decodeAction(*a));
            }
        }
    }
    if (const auto* n = dictionary(d, kNotification)) {
        item.notification = decodeNotification(*n);
    }
    if (auto it = d.find(kPostedDate); it != d.end()) {
        stored.postedDate = it->second.asDate();
    }
    return stored;
}

std::optional<std::string> FollowUpItemCodec::uniqueIdentifier(const Value& stored) {
    const Value* id = stored.find(kUniqueIdentifier);
    return id && id->isString() ? std::optional<std::string>(*id->asString()) : std::nullopt;
}

bool FollowUpItemCodec::hasNotification(const Value& stored) {
    const Value* n = stored.find(kNotification);
    return n && n->isDictionary();
}

void FollowUpItemCodec::removeNotification(Value& stored) {
    if (auto* d = stored.asDictionary()) {
        d->erase(kNotification);
    }
}

}  // namespace qax
