#include "devices/QAXDevice.h"

#include "core/Log.h"

namespace qax {
namespace {

constexpr const char* kClassKey = "$class";
constexpr const char* kClassName = "QAXDevice";
constexpr const char* kNameKey = "name";
constexpr const char* kSerialNumberKey = "serialNumber";
constexpr const char* kActivationDateKey = "activationDate";
constexpr const char* kDeviceTypeKey = "deviceType";

// A key that is present must hold a string; false when it holds anything else.
bool decodeString(const Value& archive, const char* key, std::optional<std::string>& out) {
    const Value* v = archive.find(key);
    if (!v) {
        return true;
    }
    if (!v->isString()) {
        return false;
    }
    out = *v->asString();
    return true;
}

}  // namespace

std::shared_ptr<QAXDevice> QAXDevice::deviceWithName(std::optional<std::string> name,
                                                     std::optional<std::string> serialNumber,
                                                     std::optional<Date> activationDate,
                                                     QAXDeviceType deviceType) {
    return std::make_shared<QAXDevice>(std::move(name), std::move(serialNumber), activationDate,
                                       deviceType);
}

QAXDevice::QAXDevice(std::optional<std::string> name, std::optional<std::string> serialNumber,
                     std::optional<Date> activationDate, QAXDeviceType deviceType)
    : name_(std::move(name)),
      serialNumber_(std::move(serialNumber)),
      activationDate_(activationDate),
      deviceType_(deviceType) {}

std::string QAXDevice::deviceTypeString() const {
    switch (deviceType_) {
        case QAXDeviceTypeWatch:
            return "Watch";
        case QAXDeviceTypeOther:
            return "Other";
        default:
            return "Default";
    }
}

std::string QAXDevice::describe(bool markPrivate) const {
    auto mark = [markPrivate](const std::optional<std::string>& text) {
        return markPrivate ? privateText(text) : text;
    };
    return formatLogMessage("%@ (%@) (%@) - %@",
                            {toLogArg(mark(name_)), toLogArg(mark(serialNumber_)),
                             toLogArg(activationDate_), toLogArg(deviceTypeString())},
                            true);
}

Value QAXDevice::encode() const {
    Value::Dictionary archive{{kClassKey, Value(kClassName)}};
    if (name_) {
        archive[kNameKey] = *name_;
    }
    if (serialNumber_) {
        archive[kSerialNumberKey] = *serialNumber_;
    }
    if (activationDate_) {
        archive[kActivationDateKey] = *activationDate_;
    }
    archive[kDeviceTypeKey] = static_cast<std::int64_t>(deviceType_);
    return Value(std::move(archive));
}

std::shared_ptr<QAXDevice> QAXDevice::decode(const Value& archive) {
    const Value* cls = archive.find(kClassKey);
    if (!cls || !cls->isString() || *cls->asString() != kClassName) {
        return nullptr;
    }
    std::optional<std::string> name;
    std::optional<std::string> serialNumber;
    if (!decodeString(archive, kNameKey, name) ||
        !decodeString(archive, kSerialNumberKey, serialNumber)) {
        return nullptr;
    }
    std::optional<Date> activationDate;
    if (const Value* v = archive.find(kActivationDateKey)) {
        activationDate = v->asDate();
        if (!activationDate) {
            return nullptr;
        }
    }
    std::int64_t type = 0;
    if (const Value* v = archive.find(kDeviceTypeKey)) {
        if (!v->isInteger()) {
            return nullptr;
        }
        type = *v->asInteger();
    }
    return deviceWithName(std::move(name), std::move(serialNumber), activationDate,
                          static_cast<QAXDeviceType>(type));
}

std::string QAXDevice::describeDevices(
    const std::map<std::string, std::shared_ptr<QAXDevice>>& devices) {
    Value::Dictionary described;
    for (const auto& [serial, device] : devices) {
        described[privateText(serial)] = device ? Value(device->logDescription()) : Value("(null)");
    }
    return Value(std::move(described)).description();
}

}  // namespace qax
