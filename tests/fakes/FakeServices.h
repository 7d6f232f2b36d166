// In-memory test doubles of the simple platform services.
#pragma once

#include <atomic>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "platform/DeviceProperties.h"
#include "platform/LocaleInfo.h"
#include "platform/PreferenceStore.h"
#include "platform/ProcessLifecycle.h"

namespace qax::test {

class InMemoryPreferenceStore : public PreferenceStore {
  public:
    void registerDefaults(const Value::Dictionary& defaults) override {
        std::lock_guard lock(mutex_);
        for (const auto& [k, v] : defaults) {
            defaults_.insert_or_assign(k, v);
        }
    }
    std::optional<Value> objectForKey(std::string_view key) override {
        std::lock_guard lock(mutex_);
        auto it = stored_.find(key);
        if (it == stored_.end() && (it = defaults_.find(key)) == defaults_.end()) {
            return std::nullopt;
        }
        return it->second;
    }
    bool setObject(std::string_view key, const Value& value) override {
        std::lock_guard lock(mutex_);
        stored_.insert_or_assign(std::string(key), value);
        return true;
    }
    bool removeObject(std::string_view key) override {
        std::lock_guard lock(mutex_);
        if (auto it = stored_.find(key); it != stored_.end()) {
            stored_.erase(it);
        }
        return true;
    }
    std::vector<std::string> allKeys() override {
        std::lock_guard lock(mutex_);
        std::vector<std::string> keys;
        for (const auto& [k, v] : stored_) {
            keys.push_back(k);
        }
        return keys;
    }

    // Whether a value is stored (registered defaults do not count).
    bool hasStoredValue(std::string_view key) {
        std::lock_guard lock(mutex_);
        return stored_.find(key) != stored_.end();
    }

  private:
    std::mutex mutex_;
    Value::Dictionary defaults_;
    Value::Dictionary stored_;
};

class FakeDeviceProperties : public DeviceProperties {
  public:
    std::optional<Value> copyDeviceProperty(std::string_view name) override {
        std::lock_guard lock(mutex_);
        auto it = properties_.find(name);
        return it == properties_.end() ? std::nullopt : std::optional<Value>(it->second);
    }
    bool isInternalBuild() override { return internal; }

    void set(const std::string& name, std::optional<Value> value) {
        std::lock_guard lock(mutex_);
        if (value) {
            properties_.insert_or_assign(name, *value);
        } else {
            properties_.erase(name);
        }
    }

    bool internal = false;

  private:
    std::mutex mutex_;
    std::map<std::string, Value, std::less<>> properties_{
        {"SerialNumber", Value("C02TESTSERIAL")},
        {"ProductType", Value("Model9,1")},
        {"ProductVersion", Value("4.2")},
    };
};

class FakeLocaleInfo : public LocaleInfo {
  public:
    std::string preferredLocaleIdentifier() override { return identifier; }
    std::optional<std::string> preferredContentSizeCategory() override { return contentSize; }

    std::string identifier = "en_US";
    std::optional<std::string> contentSize = "Large";
};

// Counts clean-exit requests and the transactions that are open.
class FakeProcessLifecycle : public ProcessLifecycle {
  public:
    void requestCleanExit() override { ++cleanExitRequests; }
    std::shared_ptr<void> beginTransaction(std::string_view) override {
        auto counter = openTransactions;
        ++*counter;
        return std::shared_ptr<void>(new int(0), [counter](void* token) {
            delete static_cast<int*>(token);
            --*counter;
        });
    }
    int transactionsOpen() const { return *openTransactions; }

    std::atomic<int> cleanExitRequests{0};

  private:
    std::shared_ptr<std::atomic<int>> openTransactions = std::make_shared<std::atomic<int>>(0);
};

}  // namespace qax::test
