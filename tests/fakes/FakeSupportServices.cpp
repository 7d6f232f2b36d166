#include "fakes/FakeSupportServices.h"

namespace qax::test {

std::optional<ApplicationRecord> FakeApplicationRegistry::applicationForBundleIdentifier(
    const std::string& bundleIdentifier) {
    std::lock_guard lock(mutex_);
    for (const auto& r : records_) {
        if (r.bundleIdentifier == bundleIdentifier) {
            return r;
        }
    }
    return std::nullopt;
}

std::optional<ApplicationRecord> FakeApplicationRegistry::applicationForExecutablePath(
    const std::string& path) {
    std::lock_guard lock(mutex_);
    for (const auto& r : records_) {
        if (r.executablePath == path) {
            return r;
        }
    }
    return std::nullopt;
}

Value::Dictionary FakeApplicationRegistry::entitlementsForExecutablePath(const std::string& path) {
    auto record = applicationForExecutablePath(path);
    return record ? record->entitlements : Value::Dictionary{};
}

void FakeApplicationRegistry::add(ApplicationRecord record) {
    std::lock_guard lock(mutex_);
    records_.push_back(std::move(record));
}

void FakeStoreLookup::lookUpBundleIdentifier(
    const std::string& bundleIdentifier,
    std::function<void(std::vector<StoreItem>, std::optional<std::string>)> completion) {
    std::lock_guard lock(mutex_);
    lookups_.push_back(bundleIdentifier);
    threads_.run([items = items_, error = error_, completion = std::move(completion)] {
        completion(items, error);
    });
}

void FakeStoreLookup::answer(std::vector<StoreItem> items, std::optional<std::string> error) {
    std::lock_guard lock(mutex_);
    items_ = std::move(items);
    error_ = std::move(error);
}

std::vector<std::string> FakeStoreLookup::lookups() {
    std::lock_guard lock(mutex_);
    return lookups_;
}

void FakePurchaseHistory::purchasesForAccount(std::int64_t storeAccountId,
                                              const std::vector<std::string>& bundleIdentifiers,
                                              Completion completion) {
    std::lock_guard lock(mutex_);
    queries_.push_back({storeAccountId, bundleIdentifiers});
    if (hold_) {
        held_.push_back(std::move(completion));
        return;
    }
    threads_.run([records = records_, completion = std::move(completion)] {
        completion(records, std::nullopt);
    });
}

void FakePurchaseHistory::answer(std::vector<PurchaseRecord> records) {
    std::lock_guard lock(mutex_);
    records_ = std::move(records);
}

void FakePurchaseHistory::hold(bool held) {
    std::lock_guard lock(mutex_);
    hold_ = held;
}

void FakePurchaseHistory::releaseHeld() {
    std::lock_guard lock(mutex_);
    for (auto& completion : held_) {
        threads_.run([records = records_, completion = std::move(completion)] {
            completion(records, std::nullopt);
        });
    }
    held_.clear();
}

std::vector<FakePurchaseHistory::Query> FakePurchaseHistory::queries() {
    std::lock_guard lock(mutex_);
    return queries_;
}

}  // namespace qax::test
