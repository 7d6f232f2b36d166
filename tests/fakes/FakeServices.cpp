#include "fakes/FakeServices.h"

namespace qax::test {

void InMemoryPreferenceStore::registerDefaults(const Value::Dictionary& defaults) {
    std::lock_guard lock(mutex_);
    for (const auto& [k, v] : defaults) {
        defaults_.insert_or_assign(k, v);
    }
}

std::optional<Value> InMemoryPreferenceStore::objectForKey(std::string_view key) {
    std::lock_guard lock(mutex_);
    if (auto it = stored_.find(key); it != stored_.end()) {
        return it->second;
    }
    if (auto it = defaults_.find(key); it != defaults_.end()) {
        return it->second;
    }
    return std::nullopt;
}

bool InMemoryPreferenceStore::setObject(std::string_view key, const Value& value) {
    std::lock_guard lock(mutex_);
    stored_.insert_or_assign(std::string(key), value);
    return true;
}

bool InMemoryPreferenceStore::removeObject(std::string_view key) {
    std::lock_guard lock(mutex_);
    if (auto it = stored_.find(key); it != stored_.end()) {
        stored_.erase(it);
    }
    return true;
}

std::vector<std::string> InMemoryPreferenceStore::allKeys() {
    std::lock_guard lock(mutex_);
    std::vector<std::string> keys;
    for (const auto& [k, v] : stored_) {
        keys.push_back(k);
    }
    return keys;
}

bool InMemoryPreferenceStore::hasStoredValue(std::string_view key) {
    std::lock_guard lock(mutex_);
    return stored_.find(key) != stored_.end();
}

std::optional<Value> FakeDeviceProperties::copyDeviceProperty(std::string_view name) {
    std::lock_guard lock(mutex_);
    if (auto it = properties_.find(name); it != properties_.end()) {
        return it->second;
    }
    return std::nullopt;
}

void FakeDeviceProperties::set(const std::string& name, std::optional<Value> value) {
    std::lock_guard lock(mutex_);
    if (value) {
        properties_.insert_or_assign(name, *value);
    } else {
        properties_.erase(name);
    }
}

}  // namespace qax::test
