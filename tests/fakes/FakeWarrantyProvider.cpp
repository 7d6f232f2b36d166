#include "fakes/FakeWarrantyProvider.h"

#include <algorithm>

namespace qax::test {

void FakeWarrantyProvider::record(std::string call) {
    std::lock_guard lock(mutex_);
    calls_.push_back(std::move(call));
}

std::vector<std::shared_ptr<QAXDeviceInfo>> FakeWarrantyProvider::refreshFollowupWithDeviceInfos(
    const std::vector<std::shared_ptr<QAXDeviceInfo>>& deviceInfos) {
    std::lock_guard lock(mutex_);
    calls_.push_back("refresh " + std::to_string(deviceInfos.size()));
    refreshed_.push_back(deviceInfos);
    return {};
}

std::vector<std::shared_ptr<QAXDeviceInfo>> FakeWarrantyProvider::refreshFollowupWithDeviceInfo(
    const std::shared_ptr<QAXDeviceInfo>& deviceInfo) {
    record("refreshOne " + deviceInfo->device()->serialNumber().value_or(""));
    return {};
}

void FakeWarrantyProvider::dismissFollowUpForSerialNumber(const std::string& serialNumber) {
    record("dismiss " + serialNumber);
}

void FakeWarrantyProvider::dismissNotificationForSerialNumber(const std::string& serialNumber) {
    record("dismissNotification " + serialNumber);
}

void FakeWarrantyProvider::downloadWarrantyForSerialNumber(const std::string& serialNumber,
                                                           DownloadCompletion completion) {
    std::shared_ptr<QAXWarranty> result;
    {
        std::lock_guard lock(mutex_);
        calls_.push_back("download " + serialNumber);
        if (hold_) {
            held_.emplace_back(serialNumber, std::move(completion));
            return;
        }
        result = downloads_[serialNumber];
    }
    completion(result != nullptr, result);
}

std::shared_ptr<QAXWarranty> FakeWarrantyProvider::cachedWarrantyForSerialNumber(
    const std::string& serialNumber) {
    std::lock_guard lock(mutex_);
    return caches_[serialNumber].warranty;
}

std::optional<Date> FakeWarrantyProvider::lastUpdatedDateForSerialNumber(
    const std::string& serialNumber) {
    std::lock_guard lock(mutex_);
    return caches_[serialNumber].lastUpdated;
}

std::optional<std::string> FakeWarrantyProvider::cachedWarrantyVersionForSerialNumber(
    const std::string& serialNumber) {
    std::lock_guard lock(mutex_);
    return caches_[serialNumber].version;
}

std::optional<std::string> FakeWarrantyProvider::cachedWarrantyLocaleForSerialNumber(
    const std::string& serialNumber) {
    std::lock_guard lock(mutex_);
    return caches_[serialNumber].locale;
}

std::shared_ptr<QAXWarranty>
FakeWarrantyProvider::migrateLegacyCachedWarrantyIfNeededForSerialNumber(
    const std::string& serialNumber) {
    record("migrateWarranty " + serialNumber);
    std::lock_guard lock(mutex_);
    return legacyWarranty;
}

void FakeWarrantyProvider::migrateLegacyFollowUpIfNeededWithDeviceInfo(
    const std::shared_ptr<QAXDeviceInfo>& deviceInfo) {
    record("migrateFollowUp " + deviceInfo->device()->serialNumber().value_or("") +
           (deviceInfo->warranty() ? " with warranty" : ""));
}

double FakeWarrantyProvider::cachedWarrantyValidityDuration() {
    return validity;
}

bool FakeWarrantyProvider::isSignedInToSkyvault() {
    return signedIn;
}

std::int32_t FakeWarrantyProvider::migrationVersion() {
    return storedMigrationVersion;
}

void FakeWarrantyProvider::setMigrationVersion(std::int32_t version) {
    record("setMigrationVersion " + std::to_string(version));
    storedMigrationVersion = version;
}

void FakeWarrantyProvider::setCache(const std::string& serialNumber, Cache cache) {
    std::lock_guard lock(mutex_);
    caches_[serialNumber] = std::move(cache);
}

void FakeWarrantyProvider::setDownloadResult(const std::string& serialNumber,
                                             std::shared_ptr<QAXWarranty> warranty) {
    std::lock_guard lock(mutex_);
    downloads_[serialNumber] = std::move(warranty);
}

void FakeWarrantyProvider::holdDownloads(bool hold) {
    std::lock_guard lock(mutex_);
    hold_ = hold;
}

std::size_t FakeWarrantyProvider::releaseDownloads(std::size_t count) {
    std::vector<std::pair<std::string, DownloadCompletion>> held;
    std::map<std::string, std::shared_ptr<QAXWarranty>> results;
    {
        std::lock_guard lock(mutex_);
        const auto n = static_cast<std::ptrdiff_t>(std::min(count, held_.size()));
        held.assign(std::make_move_iterator(held_.begin()),
                    std::make_move_iterator(held_.begin() + n));
        held_.erase(held_.begin(), held_.begin() + n);
        results = downloads_;
    }
    for (auto& [serial, completion] : held) {
        auto result = results[serial];
        completion(result != nullptr, result);
    }
    return held.size();
}

std::size_t FakeWarrantyProvider::heldDownloads() {
    std::lock_guard lock(mutex_);
    return held_.size();
}

std::vector<std::string> FakeWarrantyProvider::calls() {
    std::lock_guard lock(mutex_);
    return calls_;
}

std::vector<std::vector<std::shared_ptr<QAXDeviceInfo>>> FakeWarrantyProvider::refreshedLists() {
    std::lock_guard lock(mutex_);
    return refreshed_;
}

}  // namespace qax::test
