// Which devices the user has right now: the default device and the paired watches, merged by
// serial number. It keeps nothing between calls: every call asks the platform (device
// properties, paired-device registry, feature flags, server versions) and the preferences
// again. No mutable state, so any thread may call it at once; one shared instance serves every
// agent of the process.
#pragma once

#include <memory>
#include <vector>

#include "devices/QAXAgentDeviceProvider.h"
#include "platform/PairedDeviceRegistry.h"

namespace qax {

struct Platform;

class QAXDevicesManager : public QAXAgentDeviceProvider {
  public:
    // The process's shared manager, made on first use from the context given then; later
    // calls return it whatever they pass.
    static std::shared_ptr<QAXDevicesManager> sharedManager(std::shared_ptr<Platform> platform);

    explicit QAXDevicesManager(std::shared_ptr<Platform> platform);

    std::shared_ptr<QAXDevice> defaultDevice() override;
    QAXDeviceMap pairedDevices() override;
    QAXDeviceMap allDevices() override;

    // The registry's watches that are paired and not archived.
    std::vector<PairedDevice> _activePairedWatches();

  private:
    std::shared_ptr<Platform> platform_;
};

}  // namespace qax
