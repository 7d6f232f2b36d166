// Paired watches from paired-devices.plist under the platform root: an array of {name,
// localizedModel, serialNumber, pairedDate, isPaired, isArchived, isAltAccount}. Entries that
// are not dictionaries are skipped; keys of the wrong kind read as absent. Thread-safe; the
// file is re-read when it changes.
#pragma once

#include <string>

#include "platform/PairedDeviceRegistry.h"
#include "platform/host/CachedPlistFile.h"

namespace qax {

class HostPairedDeviceRegistry : public PairedDeviceRegistry {
  public:
    explicit HostPairedDeviceRegistry(const std::string& platformRoot);
    std::vector<PairedDevice> allDevicesMatching(
        const std::function<bool(const PairedDevice&)>& predicate) override;

  private:
    CachedPlistFile file_;
};

}  // namespace qax
