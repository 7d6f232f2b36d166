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

using QAXDeviceInfoList = std::vector<std::shared_ptr<QAXDeviceInfo>>;

// The agent's identity at the follow-up service.
inline constexpr const char* kQAXFollowUpClientIdentifier = "com.velmora.Kestova";

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

    // Item construction.
    void _setupFollowUpItem(FollowUpItem& item, const QAXDeviceInfo& deviceInfo);
    FollowUpNotification _setupFollowUpNotificationWithDeviceInfo(const QAXDeviceInfo& deviceInfo);

    // Posting.
    bool postFollowUpWithDevicesInfo(const QAXDeviceInfoList& deviceInfos);
    bool _postFollowUpWithDevicesInfo(const QAXDeviceInfoList& deviceInfos, bool repostAllowed);
    void postFollowUpWithDeviceInfo(const std::shared_ptr<QAXDeviceInfo>& deviceInfo);
    bool _checkConversionEligibilityForDevice(const std::shared_ptr<QAXDeviceInfo>& deviceInfo);
    // The date from which a device's follow-up is due (display date, or end of eligibility
    // minus the offer duration, moved to a later activation date); none without a warranty.
    std::optional<Date> postDateForDeviceInfo(const QAXDeviceInfo& deviceInfo);

    // Refresh: the device infos whose items were updated or reposted.
    QAXDeviceInfoList refreshFollowupWithDeviceInfos(const QAXDeviceInfoList& deviceInfos,
                                                     bool clearUntrackedDeviceFollowups,
                                                     bool allowForcePost);
    QAXDeviceInfoList refreshFollowupWithDeviceInfos(const QAXDeviceInfoList& deviceInfos);
    QAXDeviceInfoList refreshFollowupWithDeviceInfo(
        const std::shared_ptr<QAXDeviceInfo>& deviceInfo, bool allowForcePost);

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
