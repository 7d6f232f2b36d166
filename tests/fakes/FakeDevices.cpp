#include "fakes/FakeDevices.h"

namespace qax::test {

std::vector<PairedDevice> FakePairedDeviceRegistry::allDevicesMatching(
    const std::function<bool(const PairedDevice&)>& predicate) {
    std::lock_guard lock(mutex_);
    std::vector<PairedDevice> out;
    for (const auto& d : devices_) {
        if (!predicate || predicate(d)) {
            out.push_back(d);
        }
    }
    return out;
}

void FakePairedDeviceRegistry::setDevices(std::vector<PairedDevice> devices) {
    std::lock_guard lock(mutex_);
    devices_ = std::move(devices);
}

PairedDevice FakePairedDeviceRegistry::watch(std::string name, std::string serialNumber,
                                             Date pairedDate) {
    PairedDevice d;
    d.name = std::move(name);
    d.localizedModel = "Watch";
    d.serialNumber = std::move(serialNumber);
    d.pairedDate = pairedDate;
    d.isPaired = true;
    return d;
}

bool FakeFeatureFlags::isFeatureEnabled(std::string_view domain, std::string_view flag) {
    std::lock_guard lock(mutex_);
    return enabled_.count(std::make_pair(std::string(domain), std::string(flag))) > 0;
}

void FakeFeatureFlags::set(const std::string& domain, const std::string& flag, bool enabled) {
    std::lock_guard lock(mutex_);
    if (enabled) {
        enabled_.insert({domain, flag});
    } else {
        enabled_.erase({domain, flag});
    }
}

}  // namespace qax::test
