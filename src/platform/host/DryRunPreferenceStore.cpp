#include "platform/host/DryRunPreferenceStore.h"

#include <algorithm>
#include <utility>

namespace qax {

DryRunPreferenceStore::DryRunPreferenceStore(std::shared_ptr<PreferenceStore> base)
    : base_(std::move(base)) {}

void DryRunPreferenceStore::registerDefaults(const Value::Dictionary& defaults) {
    std::lock_guard lock(mutex_);
    for (const auto& [key, value] : defaults) {
        defaults_.insert_or_assign(key, value);
    }
}

std::optional<Value> DryRunPreferenceStore::objectForKey(std::string_view key) {
    std::lock_guard lock(mutex_);
    std::optional<Value> value;
    if (auto changed = changes_.find(key); changed != changes_.end()) {
        value = changed->second;
    } else if (base_) {
        value = base_->objectForKey(key);
    }
    if (!value) {
        if (auto it = defaults_.find(key); it != defaults_.end()) {
            value = it->second;
        }
    }
    return value;
}

bool DryRunPreferenceStore::setObject(std::string_view key, const Value& value) {
    std::lock_guard lock(mutex_);
    changes_.insert_or_assign(std::string(key), value);
    return true;
}

bool DryRunPreferenceStore::removeObject(std::string_view key) {
    std::lock_guard lock(mutex_);
    changes_.insert_or_assign(std::string(key), std::nullopt);
    return true;
}

std::vector<std::string> DryRunPreferenceStore::allKeys() {
    std::lock_guard lock(mutex_);
    std::vector<std::string> keys = base_ ? base_->allKeys() : std::vector<std::string>{};
    std::erase_if(keys, [this](const std::string& key) { return changes_.contains(key); });
    for (const auto& [key, value] : changes_) {
        if (value) {
            keys.push_back(key);
        }
    }
    std::sort(keys.begin(), keys.end());
    return keys;
}

std::map<std::string, std::optional<Value>> DryRunPreferenceStore::changes() const {
    std::lock_guard lock(mutex_);
    return {changes_.begin(), changes_.end()};
}

}  // namespace qax
