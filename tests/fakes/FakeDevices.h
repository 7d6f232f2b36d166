// Test doubles of the device services: a paired-device registry holding a list the test sets,
// and feature flags the test turns on. Thread-safe.
#pragma once

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
        const std::function<bool(const PairedDevice&)>& predicate) override;

    void setDevices(std::vector<PairedDevice> devices);
    // A paired, unarchived watch.
    static PairedDevice watch(std::string name, std::string serialNumber, Date pairedDate);

  private:
    std::mutex mutex_;
    std::vector<PairedDevice> devices_;
};

class FakeFeatureFlags : public FeatureFlags {
  public:
    bool isFeatureEnabled(std::string_view domain, std::string_view flag) override;
    void set(const std::string& domain, const std::string& flag, bool enabled);

  private:
    std::mutex mutex_;
    std::set<std::pair<std::string, std::string>, std::less<>> enabled_;
};

}  // namespace qax::test
