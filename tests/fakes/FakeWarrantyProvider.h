// A warranty provider of the test's making: cache facts per serial number set by the test,
// downloads answered at once or held until released (from any thread), and a log of the calls
// that act. Thread-safe.
#pragma once

#include <algorithm>
#include <atomic>
#include <deque>
#include <map>
#include <mutex>

#include "agent/QAXAgentWarrantyProvider.h"
#include "devices/QAXDeviceInfo.h"

namespace qax::test {

class FakeWarrantyProvider : public QAXAgentWarrantyProvider {
  public:
    using InfoList = std::vector<std::shared_ptr<QAXDeviceInfo>>;
    using Download = std::function<void(bool, std::shared_ptr<QAXWarranty>)>;
    struct Cache {
        std::shared_ptr<QAXWarranty> warranty;
        std::optional<std::string> version, locale;
        std::optional<Date> lastUpdated;
    };

    InfoList refreshFollowupWithDeviceInfos(const InfoList& infos) override {
        std::lock_guard lock(mutex_);
        calls_.push_back("refresh " + std::to_string(infos.size()));
        refreshed_.push_back(infos);
        return {};
    }
    InfoList refreshFollowupWithDeviceInfo(const std::shared_ptr<QAXDeviceInfo>& info) override {
        record("refreshOne " + info->device()->serialNumber().value_or(""));
        return {};
    }
    void dismissFollowUpForSerialNumber(const std::string& s) override { record("dismiss " + s); }
    void dismissNotificationForSerialNumber(const std::string& s) override {
        record("dismissNotification " + s);
    }
    void downloadWarrantyForSerialNumber(const std::string& s, Download completion) override {
        std::unique_lock lock(mutex_);
        calls_.push_back("download " + s);
        if (hold_) {
            held_.emplace_back(s, std::move(completion));
            return;
        }
        auto result = downloads_[s];
        lock.unlock();
        completion(result != nullptr, result);
    }
    std::shared_ptr<QAXWarranty> cachedWarrantyForSerialNumber(const std::string& s) override {
        return cache(s).warranty;
    }
    std::optional<Date> lastUpdatedDateForSerialNumber(const std::string& s) override {
        return cache(s).lastUpdated;
    }
    std::optional<std::string> cachedWarrantyVersionForSerialNumber(const std::string& s) override {
        return cache(s).version;
    }
    std::optional<std::string> cachedWarrantyLocaleForSerialNumber(const std::string& s) override {
        return cache(s).locale;
    }
    std::shared_ptr<QAXWarranty> migrateLegacyCachedWarrantyIfNeededForSerialNumber(
        const std::string& s) override {
        record("migrateWarranty " + s);
        return legacyWarranty;
    }
    void migrateLegacyFollowUpIfNeededWithDeviceInfo(
        const std::shared_ptr<QAXDeviceInfo>& info) override {
        record("migrateFollowUp " + info->device()->serialNumber().value_or("") +
               (info->warranty() ? " with warranty" : ""));
    }
    double cachedWarrantyValidityDuration() override { return 86400; }
    bool isSignedInToSkyvault() override { return signedIn; }
    std::int32_t migrationVersion() override { return storedMigrationVersion; }
    void setMigrationVersion(std::int32_t v) override {
        record("setMigrationVersion " + std::to_string(v));
        storedMigrationVersion = v;
    }

    void setCache(const std::string& s, Cache c) {
        std::lock_guard lock(mutex_);
        caches_[s] = std::move(c);
    }
    // What downloads of a serial number give (none: they fail).
    void setDownloadResult(const std::string& s, std::shared_ptr<QAXWarranty> w) {
        std::lock_guard lock(mutex_);
        downloads_[s] = std::move(w);
    }
    void holdDownloads(bool hold) {
        std::lock_guard lock(mutex_);
        hold_ = hold;
    }
    // Completes up to `count` held downloads in the order they were asked for.
    std::size_t releaseDownloads(std::size_t count = SIZE_MAX) {
        std::vector<std::pair<Download, std::shared_ptr<QAXWarranty>>> due;
        {
            std::lock_guard lock(mutex_);
            while (!held_.empty() && due.size() < count) {
                due.emplace_back(std::move(held_.front().second), downloads_[held_.front().first]);
                held_.pop_front();
            }
        }
        for (auto& [completion, result] : due) {
            completion(result != nullptr, result);
        }
        return due.size();
    }
    std::size_t heldDownloads() {
        std::lock_guard lock(mutex_);
        return held_.size();
    }
    // "download S", "refresh N", "refreshOne S", "dismiss S", ... in call order.
    std::vector<std::string> calls() {
        std::lock_guard lock(mutex_);
        return calls_;
    }
    std::vector<InfoList> refreshedLists() {
        std::lock_guard lock(mutex_);
        return refreshed_;
    }

    std::atomic<bool> signedIn{true};
    std::atomic<std::int32_t> storedMigrationVersion{0};
    std::shared_ptr<QAXWarranty> legacyWarranty;  // set before use

  private:
    void record(std::string call) {
        std::lock_guard lock(mutex_);
        calls_.push_back(std::move(call));
    }
    Cache cache(const std::string& s) {
        std::lock_guard lock(mutex_);
        return caches_[s];
    }

    std::mutex mutex_;
    std::map<std::string, Cache> caches_;
    std::map<std::string, std::shared_ptr<QAXWarranty>> downloads_;
    bool hold_ = false;
    std::deque<std::pair<std::string, Download>> held_;
    std::vector<std::string> calls_;
    std::vector<InfoList> refreshed_;
};

}  // namespace qax::test
