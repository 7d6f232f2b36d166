// A device together with its warranty (none when neither the cache nor a download gave one):
// what device-info replies carry and what the follow-up rules consume. Immutable after
// construction; any thread. Two records are equal only when they share one device object and
// hold equal warranties.
#pragma once

#include <memory>
#include <string>

#include "core/Value.h"
#include "devices/QAXDevice.h"

namespace qax {

struct Platform;
class QAXWarranty;

class QAXDeviceInfo {
  public:
    static std::shared_ptr<QAXDeviceInfo> deviceInfoWithDevice(
        std::shared_ptr<QAXDevice> device, std::shared_ptr<QAXWarranty> warranty);

    QAXDeviceInfo(std::shared_ptr<QAXDevice> device, std::shared_ptr<QAXWarranty> warranty);
    QAXDeviceInfo(const QAXDeviceInfo&) = delete;
    QAXDeviceInfo& operator=(const QAXDeviceInfo&) = delete;

    const std::shared_ptr<QAXDevice>& device() const { return device_; }
    const std::shared_ptr<QAXWarranty>& warranty() const { return warranty_; }

    // True only when `other` holds this very device object and a warranty equal to this one's;
    // a record without a device or warranty equals nothing.
    bool isEqual(const QAXDeviceInfo* other) const;
    // "<device description>: Eligible until <date>" while the offer is displayed, else
    // "<device description>: No offer"; the log's form with the device's.
    std::string description() const { return describe(false); }
    std::string logDescription() const { return describe(true); }

    // {"$class": "QAXDeviceInfo", "device", "warranty"}; keys whose value is none are left out.
    Value encode() const;
    // None unless the archive names this class and each key present decodes as its class.
    static std::shared_ptr<QAXDeviceInfo> decode(std::shared_ptr<Platform> platform,
                                                 const Value& archive);
    static constexpr bool supportsSecureCoding() { return true; }

  private:
    std::string describe(bool forLog) const;

    const std::shared_ptr<QAXDevice> device_;
    const std::shared_ptr<QAXWarranty> warranty_;
};

}  // namespace qax
