// Test doubles of the services behind the support-application row: the application registry,
// the store look-up and the purchase history. Store and purchase answers come on threads of
// their own, as the platform's do; a purchase answer can be held back and released late.
// Thread-safe.
#pragma once

#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "fakes/FakeAccounts.h"
#include "platform/ApplicationRegistry.h"
#include "platform/PurchaseHistory.h"
#include "platform/StoreLookup.h"

namespace qax::test {

class FakeApplicationRegistry : public ApplicationRegistry {
  public:
    std::optional<ApplicationRecord> applicationForBundleIdentifier(
        const std::string& bundleIdentifier) override;
    std::optional<ApplicationRecord> applicationForExecutablePath(const std::string& path) override;
    Value::Dictionary entitlementsForExecutablePath(const std::string& path) override;

    void add(ApplicationRecord record);

  private:
    std::mutex mutex_;
    std::vector<ApplicationRecord> records_;
};

class FakeStoreLookup : public StoreLookup {
  public:
    void lookUpBundleIdentifier(
        const std::string& bundleIdentifier,
        std::function<void(std::vector<StoreItem>, std::optional<std::string>)> completion)
        override;
    void answer(std::vector<StoreItem> items, std::optional<std::string> error = std::nullopt);
    std::vector<std::string> lookups();
    void drain() { threads_.drain(); }

  private:
    std::mutex mutex_;
    std::vector<StoreItem> items_;
    std::optional<std::string> error_;
    std::vector<std::string> lookups_;
    TaskThreads threads_;
};

class FakePurchaseHistory : public PurchaseHistory {
  public:
    struct Query {
        std::int64_t accountId;
        std::vector<std::string> bundleIdentifiers;
    };
    void purchasesForAccount(
        std::int64_t storeAccountId, const std::vector<std::string>& bundleIdentifiers,
        std::function<void(std::vector<PurchaseRecord>, std::optional<std::string>)> completion)
        override;
    void answer(std::vector<PurchaseRecord> records);
    // Keeps the next completions until releaseHeld().
    void hold(bool held);
    void releaseHeld();
    std::vector<Query> queries();
    void drain() { threads_.drain(); }

  private:
    using Completion = std::function<void(std::vector<PurchaseRecord>, std::optional<std::string>)>;
    std::mutex mutex_;
    std::vector<PurchaseRecord> records_;
    bool hold_ = false;
    std::vector<Completion> held_;
    std::vector<Query> queries_;
    TaskThreads threads_;
};

}  // namespace qax::test
