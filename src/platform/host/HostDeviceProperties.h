// Device facts from device.plist under the platform root (SerialNumber, ProductType,
// ProductVersion, InternalBuild). Where the file does not give ProductVersion or
// ProductType, the host's own facts stand in (/etc/os-release VERSION_ID, the machine
// type); there is no serial number then. Thread-safe.
#pragma once

#include <string>

#include "platform/DeviceProperties.h"
#include "platform/host/CachedPlistFile.h"

namespace qax {

class HostDeviceProperties : public DeviceProperties {
  public:
    explicit HostDeviceProperties(const std::string& platformRoot,
                                  std::string osReleasePath = "/etc/os-release");

    std::optional<Value> copyDeviceProperty(std::string_view name) override;
    bool isInternalBuild() override;

  private:
    std::optional<Value> hostFact(std::string_view name) const;

    CachedPlistFile file_;
    std::string osReleasePath_;
};

}  // namespace qax
