// The watches paired with this device, including archived ones and those paired under an
// alternate account, with the properties the agent reads. Thread-safe; every call reads the
// registry afresh.
#pragma once

#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "core/Date.h"

namespace qax {

// Posted by the registry when a watch is paired or unpaired.
inline constexpr const char* kPairedDeviceDidPairNotification =
    "com.velmora.pairlink.devicedidpair";
inline constexpr const char* kPairedDeviceDidUnpairNotification =
    "com.velmora.pairlink.devicedidunpair";

struct PairedDevice {
    std::optional<std::string> name;
    std::optional<std::string> localizedModel;
    std::optional<std::string> serialNumber;
    std::optional<Date> pairedDate;
    bool isPaired = false;
    bool isArchived = false;
    bool isAltAccount = false;

    // "<name> (<model>) <serial> paired <date>" and the flags that are set; the log's form
    // has the name (of the user's choosing) and the serial number private.
    std::string description() const { return describe(false); }
    std::string logDescription() const { return describe(true); }
    std::string describe(bool markPrivate) const;
};

class PairedDeviceRegistry {
  public:
    virtual ~PairedDeviceRegistry() = default;
    // Every registered device (archived and alternate-account ones included) for which
    // `predicate` is true, in registry order.
    virtual std::vector<PairedDevice> allDevicesMatching(
        const std::function<bool(const PairedDevice&)>& predicate) = 0;
};

}  // namespace qax
