// The warranty provider every real agent uses: each operation is forwarded to the class that
// owns the data (the cache, a fresh downloader, a fresh follow-up rules object, the
// preference domain, the account store). No mutable state, so any thread may call it at once;
// the workers it makes live only for their call.
#pragma once

#include <memory>
#include <string>

#include "agent/QAXAgentWarrantyProvider.h"

namespace qax {

struct Platform;

class QAXAgentDefaultWarrantyProvider : public QAXAgentWarrantyProvider {
  public:
    static std::shared_ptr<QAXAgentDefaultWarrantyProvider> initWithCallingProcessBundleID(
        std::shared_ptr<Platform> platform, std::string callingProcessBundleID);
    QAXAgentDefaultWarrantyProvider(std::shared_ptr<Platform> platform,
                                    std::string callingProcessBundleID);

    const std::string& callingProcessBundleID() const { return callingProcessBundleID_; }

    std::vector<std::shared_ptr<QAXDeviceInfo>> refreshFollowupWithDeviceInfos(
        const std::vector<std::shared_ptr<QAXDeviceInfo>>& deviceInfos) override;
    // Never allows a forced post.
    std::vector<std::shared_ptr<QAXDeviceInfo>> refreshFollowupWithDeviceInfo(
        const std::shared_ptr<QAXDeviceInfo>& deviceInfo) override;
    void dismissFollowUpForSerialNumber(const std::string& serialNumber) override;
    void dismissNotificationForSerialNumber(const std::string& serialNumber) override;
    void downloadWarrantyForSerialNumber(
        const std::string& serialNumber,
        std::function<void(bool success, std::shared_ptr<QAXWarranty> warranty)> completion)
        override;
    std::shared_ptr<QAXWarranty> cachedWarrantyForSerialNumber(
        const std::string& serialNumber) override;
    std::optional<Date> lastUpdatedDateForSerialNumber(const std::string& serialNumber) override;
    std::optional<std::string> cachedWarrantyVersionForSerialNumber(
        const std::string& serialNumber) override;
    std::optional<std::string> cachedWarrantyLocaleForSerialNumber(
        const std::string& serialNumber) override;
    std::shared_ptr<QAXWarranty> migrateLegacyCachedWarrantyIfNeededForSerialNumber(
        const std::string& serialNumber) override;
    void migrateLegacyFollowUpIfNeededWithDeviceInfo(
        const std::shared_ptr<QAXDeviceInfo>& deviceInfo) override;
    double cachedWarrantyValidityDuration() override;
    // Asked afresh at every call: signing out takes effect without a restart.
    bool isSignedInToSkyvault() override;
    std::int32_t migrationVersion() override;
    void setMigrationVersion(std::int32_t version) override;

  private:
    const std::shared_ptr<Platform> platform_;
    const std::string callingProcessBundleID_;
};

}  // namespace qax
