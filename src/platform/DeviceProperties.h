// Facts about the device the agent runs on. Thread-safe.
#pragma once

#include <optional>
#include <string_view>

#include "core/Value.h"

namespace qax {

class DeviceProperties {
  public:
    virtual ~DeviceProperties() = default;
    // "SerialNumber", "ProductType", "ProductVersion", ...: none when the device has no
    // such property.
    virtual std::optional<Value> copyDeviceProperty(std::string_view name) = 0;
    // Whether the installed system is an internal build.
    virtual bool isInternalBuild() = 0;
};

}  // namespace qax
