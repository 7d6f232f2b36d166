// Device facts from device.plist under the platform root (SerialNumber, ProductType,
// ProductVersion, InternalBuild). Without that file the facts are the machine's own: the
// serial number and product name from its DMI data, the system version from os-release
// VERSION_ID, not an internal build. Where the file leaves out ProductType or ProductVersion
// the machine's stand in; its serial number never does. The machine's facts are read once.
// Thread-safe.
#pragma once

#include <mutex>
#include <optional>
#include <string>

#include "platform/DeviceProperties.h"
#include "platform/host/CachedPlistFile.h"

namespace qax {

class HostDeviceProperties : public DeviceProperties {
  public:
    explicit HostDeviceProperties(const std::string& platformRoot,
                                  std::string osReleasePath = "/etc/os-release",
                                  std::string dmiDirectory = "/sys/class/dmi/id");

    std::optional<Value> copyDeviceProperty(std::string_view name) override;
    bool isInternalBuild() override;

  private:
    struct MachineFacts {
        std::optional<std::string> productType;
        std::optional<std::string> systemVersion;
    };

    const MachineFacts& machine();
    MachineFacts readMachineFacts() const;
    // Read only when asked for: a machine without one logs it once.
    const std::optional<std::string>& machineSerialNumber();
    std::optional<std::string> readSerialNumber() const;

    CachedPlistFile file_;
    const std::string osReleasePath_;
    const std::string dmiDirectory_;
    std::once_flag machineOnce_;
    MachineFacts machine_;
    std::once_flag serialOnce_;
    std::optional<std::string> serialNumber_;
};

}  // namespace qax
