// Where an agent gets warranties and follow-ups from: the cache, the downloader, the
// follow-up rules, the preference domain and the account store, each reached through one
// operation here so that tests can give the agent a provider of their own. Implementations may
// be called from any thread; the download completion runs on the background queue.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "core/Date.h"
#include "core/Value.h"
#include "devices/QAXDeviceInfo.h"

namespace qax {

class QAXWarranty;

class QAXAgentWarrantyProvider {
  public:
    virtual ~QAXAgentWarrantyProvider() = default;

    // The device infos whose follow-up items were updated or reposted.
    virtual std::vector<std::shared_ptr<QAXDeviceInfo>> refreshFollowupWithDeviceInfos(
        const std::vector<std::shared_ptr<QAXDeviceInfo>>& deviceInfos) = 0;
    virtual std::vector<std::shared_ptr<QAXDeviceInfo>> refreshFollowupWithDeviceInfo(
        const std::shared_ptr<QAXDeviceInfo>& deviceInfo) = 0;
    virtual void dismissFollowUpForSerialNumber(const std::string& serialNumber) = 0;
    virtual void dismissNotificationForSerialNumber(const std::string& serialNumber) = 0;
    virtual void downloadWarrantyForSerialNumber(
        const std::string& serialNumber,
        std::function<void(bool success, std::shared_ptr<QAXWarranty> warranty)> completion) = 0;
    virtual std::shared_ptr<QAXWarranty> cachedWarrantyForSerialNumber(
        const std::string& serialNumber) = 0;
    virtual std::optional<Date> lastUpdatedDateForSerialNumber(const std::string& serialNumber) = 0;
    virtual std::optional<std::string> cachedWarrantyVersionForSerialNumber(
        const std::string& serialNumber) = 0;
    virtual std::optional<std::string> cachedWarrantyLocaleForSerialNumber(
        const std::string& serialNumber) = 0;
    virtual std::shared_ptr<QAXWarranty> migrateLegacyCachedWarrantyIfNeededForSerialNumber(
        const std::string& serialNumber) = 0;
    virtual void migrateLegacyFollowUpIfNeededWithDeviceInfo(
        const std::shared_ptr<QAXDeviceInfo>& deviceInfo) = 0;
    virtual double cachedWarrantyValidityDuration() = 0;
    virtual bool isSignedInToSkyvault() = 0;
    virtual std::int32_t migrationVersion() = 0;
    virtual void setMigrationVersion(std::int32_t version) = 0;
};

}  // namespace qax
