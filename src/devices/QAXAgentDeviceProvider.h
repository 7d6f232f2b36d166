// Where an agent gets its devices from: this device, the paired watches, and both together.
// The agent holds one; tests give it their own. Implementations may be called from any thread.
#pragma once

#include <map>
#include <memory>
#include <string>

#include "devices/QAXDevice.h"

namespace qax {

// Devices by serial number.
using QAXDeviceMap = std::map<std::string, std::shared_ptr<QAXDevice>>;

class QAXAgentDeviceProvider {
  public:
    virtual ~QAXAgentDeviceProvider() = default;
    // The device the agent runs on.
    virtual std::shared_ptr<QAXDevice> defaultDevice() = 0;
    // The paired watches; empty when the paired-watch feature is off.
    virtual QAXDeviceMap pairedDevices() = 0;
    // The default device and the paired devices.
    virtual QAXDeviceMap allDevices() = 0;
};

}  // namespace qax
