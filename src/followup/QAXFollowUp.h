// The rules that decide, device by device, whether the offer of the paid coverage plan is
// shown: building follow-up items from warranties, posting due ones, keeping posted ones
// current, clearing, dismissal and the legacy migration. Each caller makes a new object per
// call; it keeps nothing between calls. All persistent state is in the follow-up provider's
// items and the preference domain. Every public operation runs under one process-wide lock, so
// the read-modify-write of the preference arrays never loses an entry to a concurrent call.
#pragma once

#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "core/Date.h"
#include "devices/QAXDeviceInfo.h"
#include "followup/QAXFollowUpProvider.h"
#include "platform/FollowUpCenter.h"

namespace qax {

struct Platform;
class QAXWarranty;

using QAXDeviceInfoList = std::vector<std::shared_ptr<QAXDeviceInfo>>;

// The agent's identity at the follow-up service.
inline constexpr const char* kQAXFollowUpClientIdentifier = "com.velmora.Kestova";

// An item's row badge or notification: whether the offer asks for it, the moment it turns on
// (the end of eligibility minus the offer's distance for it) and whether it is on now (from
// that moment until the end of eligibility).
struct QAXFollowUpCue {
    bool enabled = false;
    std::optional<Date> date;
    bool on = false;
};

// The row of the post rule that decides one device.
enum class QAXFollowUpPostDecision {
    NoWarranty,
    NotDisplayed,
    NoLongerEligible,
    Dismissed,  // and no new offer period since the dismissal
    Due,
    FuturePostDate,
};

// The row of the refresh rule that decides one device.
enum class QAXFollowUpRefreshDecision {
    NoWarranty,
    NotDisplayed,
    NoLongerEligible,  // these three clear the device's item
    Update,
    Repost,
    LeaveUnposted,
};

// What the preference domain remembers of one device's follow-up.
struct QAXFollowUpHistory {
    bool posted = false;     // counted as displayed
    bool dismissed = false;  // turned down by the user at least once
    std::optional<Date> dismissedDate;
};

class QAXFollowUp {
  public:
    // On the default provider (the platform's follow-up service).
    explicit QAXFollowUp(std::shared_ptr<Platform> platform);
    QAXFollowUp(std::shared_ptr<Platform> platform, std::shared_ptr<QAXFollowUpProvider> provider);

    std::shared_ptr<QAXFollowUpProvider> followUpProvider() const;
    void setFollowUpProvider(std::shared_ptr<QAXFollowUpProvider> provider);

    // "com.velmora.Kestova." + sha256Hash(serial number); the bare client identifier for none.
    static std::string uniqueIdentfierForSerialNumber(
        const std::optional<std::string>& serialNumber);

    // The serial number a pending item belongs to ("FollowupSerialNumber" of its user info).
    static std::optional<std::string> serialNumberForItem(const FollowUpItem& item);

    // Item construction.
    void _setupFollowUpItem(FollowUpItem& item, const QAXDeviceInfo& deviceInfo);
    QAXFollowUpCue _rowBadgeForWarranty(const QAXWarranty& warranty) const;
    QAXFollowUpCue _notificationForWarranty(const QAXWarranty& warranty) const;
    FollowUpNotification _setupFollowUpNotificationWithDeviceInfo(const QAXDeviceInfo& deviceInfo);

    // Posting.
    bool postFollowUpWithDevicesInfo(const QAXDeviceInfoList& deviceInfos);
    bool _postFollowUpWithDevicesInfo(const QAXDeviceInfoList& deviceInfos, bool repostAllowed);
    void postFollowUpWithDeviceInfo(const std::shared_ptr<QAXDeviceInfo>& deviceInfo);
    bool _checkConversionEligibilityForDevice(const std::shared_ptr<QAXDeviceInfo>& deviceInfo);
    // The post rule's row for one device; `dismissed` tells whether its hash is among the
    // dismissed ones. Checks conversion eligibility (which may forget the posted hash) when the
    // row needs it, and hands out the post date when the rule got that far.
    QAXFollowUpPostDecision _postDecisionForDeviceInfo(
        const std::shared_ptr<QAXDeviceInfo>& deviceInfo, bool dismissed, bool repostAllowed,
        std::optional<Date>* postDate);
    // The date from which a device's follow-up is due (display date, or end of eligibility
    // minus the offer duration, moved to a later activation date); none without a warranty.
    std::optional<Date> postDateForDeviceInfo(const QAXDeviceInfo& deviceInfo);
    // The offer's own post date, before a later activation date moves it.
    static std::optional<Date> _offerPostDateForWarranty(const QAXWarranty& warranty);
    QAXFollowUpHistory historyForSerialNumber(const std::string& serialNumber);

    // Refresh: the device infos whose items were updated or reposted.
    QAXDeviceInfoList refreshFollowupWithDeviceInfos(const QAXDeviceInfoList& deviceInfos,
                                                     bool clearUntrackedDeviceFollowups,
                                                     bool allowForcePost);
    QAXDeviceInfoList refreshFollowupWithDeviceInfos(const QAXDeviceInfoList& deviceInfos);
    QAXDeviceInfoList refreshFollowupWithDeviceInfo(
        const std::shared_ptr<QAXDeviceInfo>& deviceInfo, bool allowForcePost);
    // The refresh rule's row for one device with a serial number; `posted` tells whether a
    // pending item carries that serial number.
    QAXFollowUpRefreshDecision _refreshDecisionForDeviceInfo(const QAXDeviceInfo& deviceInfo,
                                                             bool posted,
                                                             bool allowForcePost) const;

    // Clearing and dismissal.
    void _clearFollowUpWithDevices(const std::vector<std::shared_ptr<QAXDevice>>& devices);
    void _clearFollowUpForSerialNumber(const std::string& serialNumber);
    void dismissFollowUpForSerialNumber(const std::optional<std::string>& serialNumber);
    void dismissNotificationForSerialNumber(const std::optional<std::string>& serialNumber);

    void migrateLegacyFollowUpIfNeededWithDeviceInfo(
        const std::shared_ptr<QAXDeviceInfo>& deviceInfo);
    std::uint64_t pendingFollowUpCount();

  private:
    const std::shared_ptr<Platform> platform_;
    mutable std::mutex providerMutex_;
    std::shared_ptr<QAXFollowUpProvider> followUpProvider_;
};

}  // namespace qax
