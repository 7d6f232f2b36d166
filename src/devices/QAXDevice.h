// One device the user owns: this device, a paired watch, or a device known only by the serial
// number a client asked about. Its archive is what crosses IPC. A record is immutable after
// construction, so any thread may read it; records compare by identity only.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>

#include "core/Date.h"
#include "core/Value.h"

namespace qax {

// Any value other than Watch and Other reads as "Default".
enum QAXDeviceType : std::uint64_t {
    QAXDeviceTypeDefault = 0,
    QAXDeviceTypeWatch = 1,
    QAXDeviceTypeOther = 2,
};

class QAXDevice {
  public:
    static std::shared_ptr<QAXDevice> deviceWithName(std::optional<std::string> name,
                                                     std::optional<std::string> serialNumber,
                                                     std::optional<Date> activationDate,
                                                     QAXDeviceType deviceType);

    QAXDevice(std::optional<std::string> name, std::optional<std::string> serialNumber,
              std::optional<Date> activationDate, QAXDeviceType deviceType);
    QAXDevice(const QAXDevice&) = delete;
    QAXDevice& operator=(const QAXDevice&) = delete;

    const std::optional<std::string>& name() const { return name_; }
    const std::optional<std::string>& serialNumber() const { return serialNumber_; }
    const std::optional<Date>& activationDate() const { return activationDate_; }
    QAXDeviceType deviceType() const { return deviceType_; }

    // "Default", "Watch" or "Other".
    std::string deviceTypeString() const;
    // "<name> (<serial number>) (<activation date>) - <type>"; the log's form has the name
    // and serial number private.
    std::string description() const { return describe(false); }
    std::string logDescription() const { return describe(true); }

    // {"$class": "QAXDevice", "name", "serialNumber", "activationDate", "deviceType"}; keys
    // whose value is none are left out.
    Value encode() const;
    // None unless the archive names this class and every key present holds its kind (strings,
    // a date, a signed 64-bit integer). Missing keys read as none and type 0.
    static std::shared_ptr<QAXDevice> decode(const Value& archive);
    static constexpr bool supportsSecureCoding() { return true; }

    // A map of devices by serial number in the bracketed form of logs.
    static std::string describeDevices(
        const std::map<std::string, std::shared_ptr<QAXDevice>>& devices);

  private:
    // Names are the user's (or, on internal builds, carry a serial number): private in logs.
    std::string describe(bool markPrivate) const;

    const std::optional<std::string> name_;
    const std::optional<std::string> serialNumber_;
    const std::optional<Date> activationDate_;
    const QAXDeviceType deviceType_;
};

}  // namespace qax
