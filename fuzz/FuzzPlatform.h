// A minimal in-memory platform for fuzz targets: preferences, a fixed clock and locale.
#pragma once

#include <map>
#include <memory>
#include <mutex>

#include "core/Clock.h"
#include "core/VirtualTimeTaskRunner.h"
#include "platform/LocaleInfo.h"
#include "platform/Platform.h"
#include "platform/PreferenceStore.h"
#include "platform/QAXSettings.h"

namespace qaxfuzz {

class MemoryPreferences : public qax::PreferenceStore {
  public:
    void registerDefaults(const qax::Value::Dictionary& d) override {
        for (const auto& [k, v] : d) {
            defaults_.insert_or_assign(k, v);
        }
    }
    std::optional<qax::Value> objectForKey(std::string_view key) override {
        if (auto it = stored_.find(key); it != stored_.end()) {
            return it->second;
        }
        if (auto it = defaults_.find(key); it != defaults_.end()) {
            return it->second;
        }
        return std::nullopt;
    }
    bool setObject(std::string_view key, const qax::Value& v) override {
        stored_.insert_or_assign(std::string(key), v);
        return true;
    }
    bool removeObject(std::string_view key) override {
        if (auto it = stored_.find(key); it != stored_.end()) {
            stored_.erase(it);
        }
        return true;
    }
    std::vector<std::string> allKeys() override { return {}; }

  private:
    qax::Value::Dictionary defaults_, stored_;
};

class FixedLocale : public qax::LocaleInfo {
  public:
    std::string preferredLocaleIdentifier() override { return "de_DE"; }
    std::optional<std::string> preferredContentSizeCategory() override { return "Large"; }
};

inline std::shared_ptr<qax::Platform> makePlatform() {
    auto p = std::make_shared<qax::Platform>();
    auto clock = std::make_shared<qax::ManualClock>();
    p->clock = clock;
    p->dispatcher = std::make_shared<qax::VirtualTimeDispatcher>(
        std::make_shared<qax::VirtualTimeTaskRunner>(clock));
    p->log = std::make_shared<qax::CapturingLogSink>();
    p->preferences = std::make_shared<MemoryPreferences>();
    p->locale = std::make_shared<FixedLocale>();
    qax::qax_registerDefaults(*p->preferences);
    return p;
}

}  // namespace qaxfuzz
