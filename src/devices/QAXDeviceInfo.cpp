#include "devices/QAXDeviceInfo.h"

#include "core/Log.h"
#include "warranty/QAXWarranty.h"

namespace qax {
namespace {

constexpr const char* kClassKey = "$class";
constexpr const char* kClassName = "QAXDeviceInfo";
constexpr const char* kDeviceKey = "device";
constexpr const char* kWarrantyKey = "warranty";

}  // namespace

std::shared_ptr<QAXDeviceInfo> QAXDeviceInfo::deviceInfoWithDevice(
    std::shared_ptr<QAXDevice> device, std::shared_ptr<QAXWarranty> warranty) {
    return std::make_shared<QAXDeviceInfo>(std::move(device), std::move(warranty));
}

QAXDeviceInfo::QAXDeviceInfo(std::shared_ptr<QAXDevice> device,
                             std::shared_ptr<QAXWarranty> warranty)
    : device_(std::move(device)), warranty_(std::move(warranty)) {}

bool QAXDeviceInfo::isEqual(const QAXDeviceInfo* other) const {
    if (!other) {
        return false;
    }
    // Devices have no value equality: the same object or nothing.
    if (!other->device_ || other->device_ != device_) {
        return false;
    }
    return other->warranty_ && other->warranty_->isEqual(warranty_.get());
}

std::string QAXDeviceInfo::describe(bool forLog) const {
    std::string offer = "No offer";
    if (warranty_ && warranty_->hvOfferDisplay()) {
        offer = formatLogMessage("Eligible until %@", {toLogArg(warranty_->hvOfferEligibleUntil())},
                                 true);
    }
    std::optional<std::string> device;
    if (device_) {
        device = forLog ? device_->logDescription() : device_->description();
    }
    return formatLogMessage("%@: %@", {toLogArg(device), toLogArg(offer)}, true);
}

Value QAXDeviceInfo::encode() const {
    Value::Dictionary archive{{kClassKey, Value(kClassName)}};
    if (device_) {
        archive[kDeviceKey] = device_->encode();
    }
    if (warranty_) {
        archive[kWarrantyKey] = warranty_->encode();
    }
    return Value(std::move(archive));
}

std::shared_ptr<QAXDeviceInfo> QAXDeviceInfo::decode(std::shared_ptr<Platform> platform,
                                                     const Value& archive) {
    const Value* cls = archive.find(kClassKey);
    if (!cls || !cls->isString() || *cls->asString() != kClassName) {
        return nullptr;
    }
    std::shared_ptr<QAXDevice> device;
    if (const Value* v = archive.find(kDeviceKey)) {
        device = QAXDevice::decode(*v);
        if (!device) {
            return nullptr;
        }
    }
    std::shared_ptr<QAXWarranty> warranty;
    if (const Value* v = archive.find(kWarrantyKey)) {
        warranty = QAXWarranty::decode(std::move(platform), *v);
        if (!warranty) {
            return nullptr;
        }
    }
    return deviceInfoWithDevice(std::move(device), std::move(warranty));
}

}  // namespace qax
