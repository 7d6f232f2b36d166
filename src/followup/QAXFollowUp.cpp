// The follow-up rules. Every public operation takes one process-wide recursive lock for its
// whole run: the preference arrays of posted and dismissed serial-number hashes are read,
// changed and written back whole, and two operations interleaving on different threads would
// otherwise lose an entry. The lock is recursive because operations call each other (a
// refresh runs the post rule, which posts).
#include "followup/QAXFollowUp.h"

#include <algorithm>
#include <utility>

#include "core/Hash.h"
#include "core/Log.h"
#include "followup/QAXDefaultFolllowUpProvider.h"
#include "platform/AnalyticsSink.h"
#include "platform/Platform.h"
#include "platform/PreferenceStore.h"
#include "platform/UserInterfaceStrings.h"
#include "warranty/QAXWarranty.h"

namespace qax {
namespace {

// Identifiers of the items the agent posts.
constexpr const char* kGroupIdentifier = "com.velmora.followup.group.qax";
constexpr const char* kExtensionIdentifier = "com.velmora.Kestova.Extension";
constexpr const char* kWatchTargetBundleIdentifier = "com.velmora.Bridge";
constexpr const char* kItemOpenActionIdentifier = "com.followup.qax_followup_open_action";
constexpr const char* kNotificationOpenActionIdentifier =
    "com.followup.qax_notification_open_action";
constexpr const char* kNotificationClearActionIdentifier =
    "com.followup.qax_notification_clear_action";
constexpr const char* kSerialNumberUserInfoKey = "FollowupSerialNumber";

// Display style bits of the follow-up service.
constexpr std::uint64_t kDisplayStyleRowShown = 2;
constexpr std::uint64_t kDisplayStyleBadge = 1;
constexpr std::uint64_t kDisplayStyleNoBadge = 16;

// Notification button labels, from the companion user interface's string table.
constexpr const char* kDetailsLabelKey = "DETAILS";
constexpr const char* kClearNotificationLabelKey = "CLEAR_NOTIFICATION";
constexpr const char* kLabelTable = "Localizable";

// Preference entries; only digests of serial numbers are stored.
constexpr const char* kPostedHashesKey = "FollowupPostedSerialNumberHashes";
constexpr const char* kDismissedHashesKey = "FollowupDismissedSerialNumberHashes";
constexpr const char* kDismissedDateSuffix = ".dismissed";

constexpr const char* kDisplayCountEvent = "com.velmora.kestova.followupDisplayCount";

// An item's expiration lies just before the end of eligibility, so the row is gone by then.
constexpr double kExpirationLeadSeconds = 0.001;

constexpr const char* kSetupItemOperation = "-[QAXFollowUp _setupFollowUpItem:withDeviceInfo:]";
constexpr const char* kPostRuleOperation =
    "-[QAXFollowUp _postFollowUpWithDevicesInfo:repostAllowed:]";
constexpr const char* kRefreshOperation =
    "-[QAXFollowUp refreshFollowupWithDeviceInfos:clearUntrackedDeviceFollowups:allowForcePost:]";
constexpr const char* kDismissOperation = "-[QAXFollowUp dismissFollowUpForSerialNumber:]";
constexpr const char* kDismissNotificationOperation =
    "-[QAXFollowUp dismissNotificationForSerialNumber:]";

std::recursive_mutex& followUpLock() {
    static std::recursive_mutex lock;
    return lock;
}

std::optional<std::string> stringOf(const std::optional<Value>& value) {
    if (value && value->isString()) {
        return *value->asString();
    }
    return std::nullopt;
}

// A missing date is neither later nor earlier than now.
bool isLaterThanNow(const Platform& platform, const std::optional<Date>& date) {
    return date && date->timeIntervalSince(platform.clock->now()) > 0;
}

bool isEarlierThanNow(const Platform& platform, const std::optional<Date>& date) {
    return date && date->timeIntervalSince(platform.clock->now()) < 0;
}

std::optional<Date> minus(const std::optional<Date>& date, double seconds) {
    return date ? std::optional<Date>(date->byAdding(-seconds)) : std::nullopt;
}

// "success", or the failed call's error.
std::optional<std::string> outcome(bool ok, const std::optional<std::string>& error) {
    return ok ? std::optional<std::string>("success") : error;
}

std::optional<std::string> serialNumberOf(const std::shared_ptr<QAXDeviceInfo>& deviceInfo) {
    if (deviceInfo && deviceInfo->device()) {
        return deviceInfo->device()->serialNumber();
    }
    return std::nullopt;
}

std::shared_ptr<QAXDevice> deviceOf(const std::shared_ptr<QAXDeviceInfo>& deviceInfo) {
    return deviceInfo ? deviceInfo->device() : nullptr;
}

std::shared_ptr<QAXWarranty> warrantyOf(const std::shared_ptr<QAXDeviceInfo>& deviceInfo) {
    return deviceInfo ? deviceInfo->warranty() : nullptr;
}

std::optional<std::string> itemSerialNumber(const FollowUpItem& item) {
    auto it = item.userInfo.find(kSerialNumberUserInfoKey);
    if (it != item.userInfo.end() && it->second.isString()) {
        return *it->second.asString();
    }
    return std::nullopt;
}

std::string describeItem(const FollowUpItem& item) {
    return "<FollowUpItem uniqueIdentifier: " + item.uniqueIdentifier.value_or("(null)") +
           ", title: " + item.title.value_or("(null)") +
           ", displayStyle: " + std::to_string(item.displayStyle) +
           ", notification: " + (item.notification ? "yes" : "no") + ">";
}

Value::Array readArray(PreferenceStore& preferences, const char* key) {
    return preferences.arrayForKey(key).value_or(Value::Array{});
}

bool arrayHolds(const Value::Array& array, const std::string& text) {
    return std::find(array.begin(), array.end(), Value(text)) != array.end();
}

// The label text is a format without arguments: only a doubled percent sign changes.
std::string formatWithoutArguments(const std::string& text) {
    std::string out;
    out.reserve(text.size());
    for (std::size_t i = 0; i < text.size(); ++i) {
        out.push_back(text[i]);
        if (text[i] == '%' && i + 1 < text.size() && text[i + 1] == '%') {
            ++i;
        }
    }
    return out;
}

std::string localizedLabel(const Platform& platform, const char* key) {
    if (!platform.uiStrings) {
        return std::string();
    }
    return formatWithoutArguments(platform.uiStrings->localizedString(key, "", kLabelTable));
}

void sendDisplayCountEvent(const Platform& platform, const QAXDevice& device) {
    if (!platform.analytics) {
        return;
    }
    const std::string deviceType = device.deviceTypeString();
    platform.analytics->sendEventLazily(kDisplayCountEvent, [deviceType] {
        Value payload(Value::Dictionary{{"devicetype", Value(deviceType)}});
        qaxLog().info("Posting for event: %@ with value: %@", kDisplayCountEvent, payload);
        return payload;
    });
}

}  // namespace

QAXFollowUp::QAXFollowUp(std::shared_ptr<Platform> platform)
    : platform_(std::move(platform)),
      followUpProvider_(std::make_shared<QAXDefaultFolllowUpProvider>(platform_->followUps)) {}

QAXFollowUp::QAXFollowUp(std::shared_ptr<Platform> platform,
                         std::shared_ptr<QAXFollowUpProvider> provider)
    : platform_(std::move(platform)), followUpProvider_(std::move(provider)) {}

std::shared_ptr<QAXFollowUpProvider> QAXFollowUp::followUpProvider() const {
    std::lock_guard lock(providerMutex_);
    return followUpProvider_;
}

void QAXFollowUp::setFollowUpProvider(std::shared_ptr<QAXFollowUpProvider> provider) {
    std::lock_guard lock(providerMutex_);
    followUpProvider_ = std::move(provider);
}

std::optional<std::string> QAXFollowUp::serialNumberForItem(const FollowUpItem& item) {
    return itemSerialNumber(item);
}

std::string QAXFollowUp::uniqueIdentfierForSerialNumber(
    const std::optional<std::string>& serialNumber) {
    if (!serialNumber) {
        return kQAXFollowUpClientIdentifier;
    }
    return std::string(kQAXFollowUpClientIdentifier) + "." + sha256Hash(*serialNumber);
}

void QAXFollowUp::_setupFollowUpItem(FollowUpItem& item, const QAXDeviceInfo& deviceInfo) {
    std::lock_guard lock(followUpLock());
    qaxLog().info("%s: %{private}@", kSetupItemOperation, deviceInfo);
    const auto& warranty = deviceInfo.warranty();
    if (!warranty) {
        // Every caller checks for a warranty first; there is nothing to show without one.
        return;
    }

    item.title = stringOf(warranty->hvLocalizedOfferLabel());
    item.informativeFooterText = warranty->hvLocalizedOfferDesc();
    const std::optional<Date> eligibleUntil = warranty->hvOfferEligibleUntil();
    item.expirationDate = minus(eligibleUntil, kExpirationLeadSeconds);

    const bool showRowBadge = _rowBadgeForWarranty(*warranty).on;
    qaxLog().info("%s: shouldShowRowBadge: %d", kSetupItemOperation, showRowBadge);
    // Bits only accumulate: a pending item once badged keeps the badge bit.
    item.displayStyle |= showRowBadge ? kDisplayStyleBadge : kDisplayStyleNoBadge;

    Value::Dictionary userInfo;
    if (const auto& serialNumber =
            deviceInfo.device() ? deviceInfo.device()->serialNumber() : std::nullopt) {
        userInfo.insert_or_assign(kSerialNumberUserInfoKey, Value(*serialNumber));
    }
    userInfo.insert_or_assign(kFollowUpRelativeIsCeilingKey, Value(true));
    if (auto singleDay = warranty->hvLocalizedOfferSingularDesc();
        singleDay && !singleDay->isNull()) {
        userInfo.insert_or_assign(kFollowUpRelativeSingleDayKey, *singleDay);
    } else {
        qaxLog().error("Missing hvLocalizedOfferSingularDesc value");
    }
    if (auto pluralDays = warranty->hvLocalizedOfferPluralDescFormat();
        pluralDays && !pluralDays->isNull()) {
        userInfo.insert_or_assign(kFollowUpRelativePluralDaysFormatKey, *pluralDays);
    } else {
        qaxLog().error("Missing hvLocalizedOfferPluralDescFormat value");
    }
    item.userInfo = std::move(userInfo);

    item.actions = {FollowUpAction{stringOf(warranty->hvLocalizedOfferCTA()), std::nullopt,
                                   kItemOpenActionIdentifier}};

    const QAXFollowUpCue notification = _notificationForWarranty(*warranty);
    if (notification.enabled) {
        qaxLog().info("%s: NotificationDate: %@", kSetupItemOperation, notification.date);
        if (notification.on) {
            item.notification = _setupFollowUpNotificationWithDeviceInfo(deviceInfo);
        }
    }
    qaxLog().info("%s: shouldShowNotification: %d", kSetupItemOperation, notification.on);
}

QAXFollowUpCue QAXFollowUp::_rowBadgeForWarranty(const QAXWarranty& warranty) const {
    QAXFollowUpCue badge;
    badge.enabled = warranty.hvOfferSettingsRowBadge();
    if (badge.enabled) {
        const std::optional<Date> eligibleUntil = warranty.hvOfferEligibleUntil();
        badge.date = minus(eligibleUntil, warranty.hvOfferBadgeDurationBeforeEndDate());
        badge.on =
            isEarlierThanNow(*platform_, badge.date) && isLaterThanNow(*platform_, eligibleUntil);
    }
    return badge;
}

QAXFollowUpCue QAXFollowUp::_notificationForWarranty(const QAXWarranty& warranty) const {
    QAXFollowUpCue notification;
    notification.enabled = warranty.showNotificationToggle();
    if (notification.enabled) {
        const std::optional<Date> eligibleUntil = warranty.hvOfferEligibleUntil();
        notification.date = minus(eligibleUntil, warranty.showNotificationBeforeEndDate());
        notification.on = isEarlierThanNow(*platform_, notification.date) &&
                          isLaterThanNow(*platform_, eligibleUntil);
    }
    return notification;
}

FollowUpNotification QAXFollowUp::_setupFollowUpNotificationWithDeviceInfo(
    const QAXDeviceInfo& deviceInfo) {
    std::lock_guard lock(followUpLock());
    FollowUpNotification notification;
    if (const auto& warranty = deviceInfo.warranty()) {
        notification.title = stringOf(warranty->hvNotificationLocalizedOfferLabel());
        if (!notification.title) {
            notification.title = stringOf(warranty->hvLocalizedOfferLabel());
        }
        if (auto text = warranty->hvLocalizedNotificationOfferDesc()) {
            notification.informativeText = std::move(text);
        }
    }
    notification.activateAction = FollowUpAction{localizedLabel(*platform_, kDetailsLabelKey),
                                                 std::nullopt, kNotificationOpenActionIdentifier};
    notification.clearAction =
        FollowUpAction{localizedLabel(*platform_, kClearNotificationLabelKey), std::nullopt,
                       kNotificationClearActionIdentifier};
    notification.frequency = 0.0;
    notification.options |= FollowUpNotification::LockScreenOption |
                            FollowUpNotification::NotificationCenterOption |
                            FollowUpNotification::ExtensionActionsOption |
                            FollowUpNotification::ExtensionForNotificationOption;
    return notification;
}

bool QAXFollowUp::postFollowUpWithDevicesInfo(const QAXDeviceInfoList& deviceInfos) {
    return _postFollowUpWithDevicesInfo(deviceInfos, false);
}

std::optional<Date> QAXFollowUp::postDateForDeviceInfo(const QAXDeviceInfo& deviceInfo) {
    std::lock_guard lock(followUpLock());
    const auto& warranty = deviceInfo.warranty();
    if (!warranty) {
        return std::nullopt;
    }
    std::optional<Date> postDate = _offerPostDateForWarranty(*warranty);
    // A device activated after its offer opened gets the offer from its activation on.
    const auto& device = deviceInfo.device();
    if (postDate && device && device->activationDate() && *device->activationDate() > *postDate) {
        postDate = device->activationDate();
        qaxLog().info("%s: Using initial postdate as it is later than FollowupDisplay Date",
                      kPostRuleOperation);
    }
    return postDate;
}

std::optional<Date> QAXFollowUp::_offerPostDateForWarranty(const QAXWarranty& warranty) {
    if (auto displayDate = warranty.hvOfferFollowupDisplayDate()) {
        return displayDate;
    }
    return minus(warranty.hvOfferEligibleUntil(), warranty.hvOfferDurationBeforeEndDate());
}

QAXFollowUpHistory QAXFollowUp::historyForSerialNumber(const std::string& serialNumber) {
    std::lock_guard lock(followUpLock());
    PreferenceStore& preferences = *platform_->preferences;
    const std::string hash = sha256Hash(serialNumber);
    QAXFollowUpHistory history;
    history.posted = arrayHolds(readArray(preferences, kPostedHashesKey), hash);
    history.dismissed = arrayHolds(readArray(preferences, kDismissedHashesKey), hash);
    history.dismissedDate = preferences.dateForKey(hash + kDismissedDateSuffix);
    return history;
}

QAXFollowUpPostDecision QAXFollowUp::_postDecisionForDeviceInfo(
    const std::shared_ptr<QAXDeviceInfo>& deviceInfo, bool dismissed, bool repostAllowed,
    std::optional<Date>* postDate) {
    std::lock_guard lock(followUpLock());
    const auto warranty = warrantyOf(deviceInfo);
    if (!warranty) {
        return QAXFollowUpPostDecision::NoWarranty;
    }
    if (!warranty->hvOfferDisplay()) {
        return QAXFollowUpPostDecision::NotDisplayed;
    }
    if (!isLaterThanNow(*platform_, warranty->hvOfferEligibleUntil())) {
        return QAXFollowUpPostDecision::NoLongerEligible;
    }
    if (!repostAllowed && dismissed && !_checkConversionEligibilityForDevice(deviceInfo)) {
        return QAXFollowUpPostDecision::Dismissed;
    }
    const auto date = postDateForDeviceInfo(*deviceInfo);
    if (postDate) {
        *postDate = date;
    }
    return isLaterThanNow(*platform_, date) ? QAXFollowUpPostDecision::FuturePostDate
                                            : QAXFollowUpPostDecision::Due;
}

bool QAXFollowUp::_postFollowUpWithDevicesInfo(const QAXDeviceInfoList& deviceInfos,
                                               bool repostAllowed) {
    std::lock_guard lock(followUpLock());
    const Platform& platform = *platform_;
    const Value::Array dismissed = readArray(*platform.preferences, kDismissedHashesKey);

    QAXDeviceInfoList due;
    for (const auto& deviceInfo : deviceInfos) {
        const auto device = deviceOf(deviceInfo);
        const auto serialNumber = serialNumberOf(deviceInfo);
        std::optional<Date> postDate;
        switch (_postDecisionForDeviceInfo(
            deviceInfo, serialNumber && arrayHolds(dismissed, sha256Hash(*serialNumber)),
            repostAllowed, &postDate)) {
            case QAXFollowUpPostDecision::NoWarranty:
                qaxLog().info(
                    "%s: No warranty downloaded for device. Don't post a followup for "
                    "%{private}@",
                    kPostRuleOperation, device);
                break;
            case QAXFollowUpPostDecision::NotDisplayed:
                qaxLog().info("%s: Device NOT eligible. Don't post a followup for %{private}@",
                              kPostRuleOperation, device);
                break;
            case QAXFollowUpPostDecision::NoLongerEligible:
                qaxLog().info(
                    "%s: Device no longer eligible. Don't post a followup for %{private}@",
                    kPostRuleOperation, device);
                break;
            case QAXFollowUpPostDecision::Dismissed:
                qaxLog().info("%s: Followup already dismissed for %{private}@, leaving unposted",
                              kPostRuleOperation, device);
                break;
            case QAXFollowUpPostDecision::Due:
                qaxLog().info("%s: Device eligible. Post new  followup for %{private}@",
                              kPostRuleOperation, device);
                due.push_back(deviceInfo);
                break;
            case QAXFollowUpPostDecision::FuturePostDate:
                qaxLog().info(
                    "%s: Device eligible with future post date. Cannot post followup for "
                    "%{private}@ on: %@",
                    kPostRuleOperation, device, postDate);
                break;
        }
    }

    for (const auto& deviceInfo : due) {
        postFollowUpWithDeviceInfo(deviceInfo);
    }
    return !due.empty();
}

void QAXFollowUp::postFollowUpWithDeviceInfo(const std::shared_ptr<QAXDeviceInfo>& deviceInfo) {
    std::lock_guard lock(followUpLock());
    const Platform& platform = *platform_;
    const auto warranty = warrantyOf(deviceInfo);
    const auto serialNumber = serialNumberOf(deviceInfo);
    if (!warranty || !warranty->hvOfferDisplay() || !serialNumber) {
        qaxLog().error("Failed to post follow-up:%@%@", warranty ? "" : "<Missing warranty>",
                       serialNumber ? "" : "<Missing serial number>");
        return;
    }
    const auto& device = deviceInfo->device();

    FollowUpItem item;
    item.uniqueIdentifier = uniqueIdentfierForSerialNumber(serialNumber);
    item.groupIdentifier = kGroupIdentifier;
    if (device->deviceType() == QAXDeviceTypeWatch) {
        item.targetBundleIdentifier = kWatchTargetBundleIdentifier;
    } else if (device->deviceType() == QAXDeviceTypeDefault) {
        item.targetBundleIdentifier = kFollowUpSettingsTargetBundleIdentifier;
    }
    item.extensionIdentifier = kExtensionIdentifier;
    item.displayStyle = kDisplayStyleRowShown;
    _setupFollowUpItem(item, *deviceInfo);

    std::optional<std::string> error;
    const bool posted = followUpProvider()->postFollowUpItem(item, &error);
    qaxLog().info("Posted follow-up: serialNumber:%@ -> %@", privateText(*serialNumber),
                  outcome(posted, error));
    if (!posted) {
        return;
    }
    // Only the first post of a device counts as a display.
    const std::string hash = sha256Hash(*serialNumber);
    Value::Array postedHashes = readArray(*platform.preferences, kPostedHashesKey);
    if (!arrayHolds(postedHashes, hash)) {
        postedHashes.emplace_back(hash);
        platform.preferences->setObject(kPostedHashesKey, Value(std::move(postedHashes)));
        sendDisplayCountEvent(platform, *device);
    }
}

bool QAXFollowUp::_checkConversionEligibilityForDevice(
    const std::shared_ptr<QAXDeviceInfo>& deviceInfo) {
    std::lock_guard lock(followUpLock());
    const Platform& platform = *platform_;
    const auto serialNumber = serialNumberOf(deviceInfo);
    const auto warranty = warrantyOf(deviceInfo);
    if (!serialNumber || !warranty) {
        return false;
    }
    const std::string hash = sha256Hash(*serialNumber);
    const auto dismissedDate = platform.preferences->dateForKey(hash + kDismissedDateSuffix);
    const auto displayDate = warranty->hvOfferFollowupDisplayDate();
    if (!dismissedDate || !displayDate) {
        return false;
    }
    if (*dismissedDate < *displayDate) {
        // A new offer period opened after the dismissal: the device may be posted (and
        // counted) again.
        Value::Array postedHashes = readArray(*platform.preferences, kPostedHashesKey);
        if (arrayHolds(postedHashes, hash)) {
            std::erase(postedHashes, Value(hash));
            platform.preferences->setObject(kPostedHashesKey, Value(std::move(postedHashes)));
        }
        return true;
    }
    qaxLog().debug(
        "Device not eligible for conversion. %{private}@, followup dismissed date: %@, fup "
        "display date: %@",
        deviceOf(deviceInfo), dismissedDate, displayDate);
    return false;
}

QAXDeviceInfoList QAXFollowUp::refreshFollowupWithDeviceInfos(const QAXDeviceInfoList& deviceInfos,
                                                              bool clearUntrackedDeviceFollowups,
                                                              bool allowForcePost) {
    std::lock_guard lock(followUpLock());
    const auto provider = followUpProvider();

    std::optional<std::string> listError;
    const std::vector<FollowUpItem> pending = provider->pendingFollowUpItems(&listError);
    if (listError) {
        qaxLog().error("Error loading pending follow-ups: %@", listError);
    }
    std::vector<std::string> postedSerialNumbers;
    for (const auto& item : pending) {
        if (auto serialNumber = itemSerialNumber(item)) {
            postedSerialNumbers.push_back(std::move(*serialNumber));
        }
    }
    auto isPosted = [&](const std::string& serialNumber) {
        return std::find(postedSerialNumbers.begin(), postedSerialNumbers.end(), serialNumber) !=
               postedSerialNumbers.end();
    };

    std::vector<std::shared_ptr<QAXDevice>> toClear;
    QAXDeviceInfoList toUpdate;
    QAXDeviceInfoList toRepost;
    std::vector<std::string> untracked;
    if (clearUntrackedDeviceFollowups) {
        untracked = postedSerialNumbers;
    }

    for (const auto& deviceInfo : deviceInfos) {
        const auto serialNumber = serialNumberOf(deviceInfo);
        if (!serialNumber) {
            qaxLog().error("%{public}s: Serial number is nil", kRefreshOperation);
            continue;
        }
        std::erase(untracked, *serialNumber);
        const auto device = deviceInfo->device();
        switch (
            _refreshDecisionForDeviceInfo(*deviceInfo, isPosted(*serialNumber), allowForcePost)) {
            case QAXFollowUpRefreshDecision::NoWarranty:
                qaxLog().info(
                    "%s: No warranty downloaded for device. Remove the followup for %{private}@",
                    kRefreshOperation, device);
                toClear.push_back(device);
                break;
            case QAXFollowUpRefreshDecision::NotDisplayed:
                qaxLog().info("%s: Device NOT eligible. Remove the followup for %{private}@",
                              kRefreshOperation, device);
                toClear.push_back(device);
                break;
            case QAXFollowUpRefreshDecision::NoLongerEligible:
                qaxLog().info("%s: Device no longer eligible. Remove the followup for %{private}@",
                              kRefreshOperation, device);
                toClear.push_back(device);
                break;
            case QAXFollowUpRefreshDecision::Update:
                qaxLog().info("%s: Device eligible. Update the followup for %{private}@",
                              kRefreshOperation, device);
                toUpdate.push_back(deviceInfo);
                break;
            case QAXFollowUpRefreshDecision::Repost:
                qaxLog().info(
                    "%s: Device eligible for re-post. Re-post the followup for %{private}@",
                    kRefreshOperation, device);
                toRepost.push_back(deviceInfo);
                break;
            case QAXFollowUpRefreshDecision::LeaveUnposted:
                qaxLog().info(
                    "%s: Followup already dismissed/not present for %{private}@, leaving "
                    "unposted",
                    kRefreshOperation, device);
                break;
        }
    }

    // Items of serial numbers no device info mentions belong to devices no longer tracked.
    for (const auto& serialNumber : untracked) {
        auto device = QAXDevice::deviceWithName(serialNumber, serialNumber, std::nullopt,
                                                QAXDeviceTypeDefault);
        qaxLog().info("No longer tracking device %{private}@, clearing", device);
        toClear.push_back(std::move(device));
    }
    if (!toClear.empty()) {
        _clearFollowUpWithDevices(toClear);
    }

    QAXDeviceInfoList result;
    for (const auto& deviceInfo : toUpdate) {
        const auto serialNumber = serialNumberOf(deviceInfo);
        auto match = std::find_if(pending.begin(), pending.end(), [&](const FollowUpItem& item) {
            return itemSerialNumber(item) == serialNumber;
        });
        FollowUpItem item = *match;
        _setupFollowUpItem(item, *deviceInfo);
        std::optional<std::string> error;
        const bool posted = provider->postFollowUpItem(item, &error);
        qaxLog().info("Updated follow-up: %@", outcome(posted, error));
        result.push_back(deviceInfo);
    }

    if (!toRepost.empty()) {
        const bool reposted = _postFollowUpWithDevicesInfo(toRepost, true);
        qaxLog().info("Reposted follow-up: %@", reposted ? "success" : "NO");
        if (reposted) {
            result.insert(result.end(), toRepost.begin(), toRepost.end());
        }
    }
    return result;
}

QAXFollowUpRefreshDecision QAXFollowUp::_refreshDecisionForDeviceInfo(
    const QAXDeviceInfo& deviceInfo, bool posted, bool allowForcePost) const {
    const auto& warranty = deviceInfo.warranty();
    if (!warranty) {
        return QAXFollowUpRefreshDecision::NoWarranty;
    }
    if (!warranty->hvOfferDisplay()) {
        return QAXFollowUpRefreshDecision::NotDisplayed;
    }
    if (!isLaterThanNow(*platform_, warranty->hvOfferEligibleUntil())) {
        return QAXFollowUpRefreshDecision::NoLongerEligible;
    }
    if (posted) {
        return QAXFollowUpRefreshDecision::Update;
    }
    return allowForcePost ? QAXFollowUpRefreshDecision::Repost
                          : QAXFollowUpRefreshDecision::LeaveUnposted;
}

QAXDeviceInfoList QAXFollowUp::refreshFollowupWithDeviceInfos(
    const QAXDeviceInfoList& deviceInfos) {
    return refreshFollowupWithDeviceInfos(deviceInfos, true, false);
}

QAXDeviceInfoList QAXFollowUp::refreshFollowupWithDeviceInfo(
    const std::shared_ptr<QAXDeviceInfo>& deviceInfo, bool allowForcePost) {
    return refreshFollowupWithDeviceInfos({deviceInfo}, false, allowForcePost);
}

void QAXFollowUp::_clearFollowUpWithDevices(
    const std::vector<std::shared_ptr<QAXDevice>>& devices) {
    std::lock_guard lock(followUpLock());
    std::vector<std::string> uniqueIdentifiers;
    for (const auto& device : devices) {
        uniqueIdentifiers.push_back(
            uniqueIdentfierForSerialNumber(device ? device->serialNumber() : std::nullopt));
    }
    std::optional<std::string> error;
    const bool cleared = followUpProvider()->clearPendingFollowUpItemsWithUniqueIdentifiers(
        uniqueIdentifiers, &error);
    qaxLog().info("Cleared follow-up: %@", outcome(cleared, error));
}

void QAXFollowUp::_clearFollowUpForSerialNumber(const std::string& serialNumber) {
    std::lock_guard lock(followUpLock());
    std::optional<std::string> error;
    const bool cleared = followUpProvider()->clearPendingFollowUpItemsWithUniqueIdentifiers(
        {uniqueIdentfierForSerialNumber(serialNumber)}, &error);
    qaxLog().info("Cleared follow-up: %@", outcome(cleared, error));
}

void QAXFollowUp::dismissFollowUpForSerialNumber(const std::optional<std::string>& serialNumber) {
    std::lock_guard lock(followUpLock());
    // Without a serial number the identifier would fall back to the legacy item's: a
    // malformed request must not remove that.
    if (!serialNumber) {
        qaxLog().error("%{public}s: Serial number is nil", kDismissOperation);
        return;
    }
    const Platform& platform = *platform_;
    std::optional<std::string> error;
    const bool cleared = followUpProvider()->clearPendingFollowUpItemsWithUniqueIdentifiers(
        {uniqueIdentfierForSerialNumber(serialNumber)}, &error);
    qaxLog().info("Dismissed follow-up: %@", outcome(cleared, error));
    if (!cleared) {
        return;
    }
    const std::string hash = sha256Hash(*serialNumber);
    Value::Array dismissed = readArray(*platform.preferences, kDismissedHashesKey);
    dismissed.emplace_back(hash);
    platform.preferences->setObject(kDismissedHashesKey, Value(std::move(dismissed)));
    platform.preferences->setObject(hash + kDismissedDateSuffix, Value(platform.clock->now()));
}

void QAXFollowUp::dismissNotificationForSerialNumber(
    const std::optional<std::string>& serialNumber) {
    std::lock_guard lock(followUpLock());
    if (!serialNumber) {
        qaxLog().error("%{public}s: Serial number is nil", kDismissNotificationOperation);
        return;
    }
    if (!platform_->followUps) {
        return;
    }
    // The provider has no notification operation; the service is asked directly.
    FollowUpCenter& center = *platform_->followUps;
    const std::string uniqueIdentifier = uniqueIdentfierForSerialNumber(serialNumber);
    std::string listError;
    for (const auto& item : center.pendingFollowUpItems(kQAXFollowUpClientIdentifier, &listError)) {
        if (item.uniqueIdentifier != uniqueIdentifier) {
            continue;
        }
        std::string error;
        const bool cleared =
            center.clearNotificationForItem(kQAXFollowUpClientIdentifier, item, &error);
        qaxLog().info("Cleared follow-up notification: %@ for item: %@", outcome(cleared, error),
                      describeItem(item));
    }
}

void QAXFollowUp::migrateLegacyFollowUpIfNeededWithDeviceInfo(
    const std::shared_ptr<QAXDeviceInfo>& deviceInfo) {
    std::lock_guard lock(followUpLock());
    const auto provider = followUpProvider();
    std::optional<std::string> listError;
    std::vector<FollowUpItem> pending = provider->pendingFollowUpItems(&listError);
    if (listError) {
        qaxLog().error("Error loading pending follow-ups: %@", listError);
    }
    if (pending.size() != 1 || pending.front().uniqueIdentifier != kQAXFollowUpClientIdentifier) {
        return;
    }

    if (warrantyOf(deviceInfo)) {
        qaxLog().info("Migrating legacy followup..");
        FollowUpItem item = std::move(pending.front());
        item.uniqueIdentifier = uniqueIdentfierForSerialNumber(serialNumberOf(deviceInfo));
        _setupFollowUpItem(item, *deviceInfo);
        std::optional<std::string> error;
        if (!provider->postFollowUpItem(item, &error)) {
            qaxLog().error("Error posting migrated follow-up: %@", error);
        }
    } else {
        qaxLog().info("Clearing legacy followup, no legacy warranty was found..");
    }

    std::optional<std::string> error;
    if (!provider->clearPendingFollowUpItemsWithUniqueIdentifiers({kQAXFollowUpClientIdentifier},
                                                                  &error)) {
        qaxLog().error("Error clearing legacy follow-up: %@", error);
    }
}

std::uint64_t QAXFollowUp::pendingFollowUpCount() {
    std::lock_guard lock(followUpLock());
    std::optional<std::string> error;
    const auto pending = followUpProvider()->pendingFollowUpItems(&error);
    if (error) {
        qaxLog().error("Error loading pending follow-ups: %@", error);
    }
    return pending.size();
}

}  // namespace qax
