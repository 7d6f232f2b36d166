// Test doubles of the services behind the support-application row: the application registry,
// the store look-up and the purchase history. They answer on the caller's thread, except that
// purchase answers can be held back and released late. Set their answers before use.
#pragma once

#include <atomic>
#include <mutex>
#include <vector>

#include "platform/ApplicationRegistry.h"
#include "platform/PurchaseHistory.h"
#include "platform/StoreLookup.h"

namespace qax::test {

class FakeApplicationRegistry : public ApplicationRegistry {
  public:
    std::optional<ApplicationRecord> applicationForBundleIdentifier(
        const std::string& id) override {
        for (const auto& r : records) {
            if (r.bundleIdentifier == id) {
                return r;
            }
        }
        return std::nullopt;
    }
    std::optional<ApplicationRecord> applicationForExecutablePath(const std::string&) override {
        return std::nullopt;
    }
    Value::Dictionary entitlementsForExecutablePath(const std::string&) override { return {}; }

    std::vector<ApplicationRecord> records;  // set before use
};

class FakeStoreLookup : public StoreLookup {
  public:
    using Completion = std::function<void(std::vector<StoreItem>, std::optional<std::string>)>;
    void lookUpBundleIdentifier(const std::string&, Completion completion) override {
        ++lookups;
        completion(items, error);
    }
    // Set before use.
    std::vector<StoreItem> items;
    std::optional<std::string> error;
    std::atomic<int> lookups{0};
};

class FakePurchaseHistory : public PurchaseHistory {
  public:
    using Completion = std::function<void(std::vector<PurchaseRecord>, std::optional<std::string>)>;
    void purchasesForAccount(std::int64_t account, const std::vector<std::string>& bundleIDs,
                             Completion completion) override {
        std::unique_lock lock(mutex_);
        queries.emplace_back(account, bundleIDs);
        if (hold) {
            held_.push_back(std::move(completion));
            return;
        }
        lock.unlock();
        completion(records, std::nullopt);
    }
    void releaseHeld() {
        std::vector<Completion> held;
        {
            std::lock_guard lock(mutex_);
            held.swap(held_);
        }
        for (auto& completion : held) {
            completion(records, std::nullopt);
        }
    }
    // Set before use; `queries` read after.
    std::vector<PurchaseRecord> records;
    bool hold = false;
    std::vector<std::pair<std::int64_t, std::vector<std::string>>> queries;

  private:
    std::mutex mutex_;
    std::vector<Completion> held_;
};

}  // namespace qax::test
