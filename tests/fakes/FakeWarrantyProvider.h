// A warranty provider of the test's making: cache facts per serial number that the test sets,
// downloads that answer at once or are held until the test releases them (from any thread),
// and a log of the calls that change something. Thread-safe.
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <map>
#include <mutex>
#include <string>
#include <vector>

#include "agent/QAXAgentWarrantyProvider.h"

namespace qax::test {

class FakeWarrantyProvider : public QAXAgentWarrantyProvider {
  public:
    using DownloadCompletion = std::function<void(bool, std::shared_ptr<QAXWarranty>)>;

    struct Cache {
        std::shared_ptr<QAXWarranty> warranty;
        std::optional<std::string> version;
        std::optional<std::string> locale;
        std::optional<Date> lastUpdated;
    };

    std::vector<std::shared_ptr<QAXDeviceInfo>> refreshFollowupWithDeviceInfos(
        const std::vector<std::shared_ptr<QAXDeviceInfo>>& deviceInfos) override;
    std::vector<std::shared_ptr<QAXDeviceInfo>> refreshFollowupWithDeviceInfo(
        const std::shared_ptr<QAXDeviceInfo>& deviceInfo) override;
    void dismissFollowUpForSerialNumber(const std::string& serialNumber) override;
    void dismissNotificationForSerialNumber(const std::string& serialNumber) override;
    void downloadWarrantyForSerialNumber(const std::string& serialNumber,
                                         DownloadCompletion completion) override;
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
    bool isSignedInToSkyvault() override;
    std::int32_t migrationVersion() override;
    void setMigrationVersion(std::int32_t version) override;

    void setCache(const std::string& serialNumber, Cache cache);
    // What downloads of `serialNumber` answer (none: the download fails).
    void setDownloadResult(const std::string& serialNumber, std::shared_ptr<QAXWarranty> warranty);
    // While held, download completions wait for releaseDownloads().
    void holdDownloads(bool hold);
    // Completes up to `count` held downloads, in the order they were asked for; returns how
    // many.
    std::size_t releaseDownloads(std::size_t count = SIZE_MAX);
    std::size_t heldDownloads();

    // "download SERIAL", "refresh N", "refreshOne SERIAL", "dismiss SERIAL",
    // "dismissNotification SERIAL", "migrateWarranty SERIAL", "migrateFollowUp SERIAL",
    // "setMigrationVersion N", in call order.
    std::vector<std::string> calls();
    std::vector<std::vector<std::shared_ptr<QAXDeviceInfo>>> refreshedLists();

    std::atomic<double> validity{86400};
    std::atomic<bool> signedIn{true};
    std::atomic<std::int32_t> storedMigrationVersion{0};
    // What the legacy-cache migration finds; set before use.
    std::shared_ptr<QAXWarranty> legacyWarranty;

  private:
    void record(std::string call);

    std::mutex mutex_;
    std::map<std::string, Cache> caches_;
    std::map<std::string, std::shared_ptr<QAXWarranty>> downloads_;
    bool hold_ = false;
    std::vector<std::pair<std::string, DownloadCompletion>> held_;
    std::vector<std::string> calls_;
    std::vector<std::vector<std::shared_ptr<QAXDeviceInfo>>> refreshed_;
};

}  // namespace qax::test
