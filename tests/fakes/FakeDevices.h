// Test doubles of the device services: a paired-device registry holding a list the test sets,
// and feature flags the test turns on. Thread-safe.
#pragma once

#include <algorithm>
#include <iterator>
#include <mutex>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "platform/FeatureFlags.h"
#include "platform/PairedDeviceRegistry.h"

namespace qax::test {

class FakePairedDeviceRegistry : public PairedDeviceRegistry {
  public:
    std::vector<PairedDevice> allDevicesMatching(
        const std::function<bool(const PairedDevice&)>& predicate) override {
        std::lock_guard lock(mutex_);
        std::vector<PairedDevice> out;
        std::copy_if(devices_.begin(), devices_.end(), std::back_inserter(out),
                     [&](const PairedDevice& d) { return !predicate || predicate(d); });
        return out;
    }
    void setDevices(std::vector<PairedDevice> devices) {
        std::lock_guard lock(mutex_);
        devices_ = std::move(devices);
    }
    // A paired, unarchived watch.
    static PairedDevice watch(std::string name, std::string serialNumber, Date pairedDate) {
        PairedDevice d;
        d.name = std::move(name);
        d.localizedModel = "Watch";
        d.serialNumber = std::move(serialNumber);
        d.pairedDate = pairedDate;
        d.isPaired = true;
        return d;
    }

  private:
    std::mutex mutex_;
    std::vector<PairedDevice> devices_;
};

class FakeFeatureFlags : public FeatureFlags {
  public:
    bool isFeatureEnabled(std::string_view domain, std::string_view flag) override {
        std::lock_guard lock(mutex_);
        return enabled_.count(std::make_pair(std::string(domain), std::string(flag))) > 0;
    }
    void set(const std::string& domain, const std::string& flag, bool enabled) {
        std::lock_guard lock(mutex_);
        if (enabled) {
            enabled_.insert({domain, flag});
        } else {
            enabled_.erase({domain, flag});
        }
    }

  private:
    std::mutex mutex_;
    std::set<std::pair<std::string, std::string>, std::less<>> enabled_;
};

}  // namespace qax::test
