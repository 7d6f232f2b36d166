#include "devices/QAXDevicesManager.h"

#include <mutex>

#include "core/Log.h"
#include "platform/DeviceProperties.h"
#include "platform/FeatureFlags.h"
#include "platform/Platform.h"
#include "platform/PreferenceStore.h"
#include "platform/QAXUtilities.h"
#include "warranty/QAXServerVersionUtilities.h"

namespace qax {
namespace {

constexpr const char* kDefaultDeviceName = "Default Device";
constexpr const char* kSerialNumberProperty = "SerialNumber";
constexpr const char* kSerialNumberOverrideKey = "SerialNumber";
constexpr const char* kDefaultDeviceActivationDateKey = "DefaultDeviceActivationDate";
constexpr const char* kPairedWatchesSerialNumbersKey = "PairedWatchesSerialNumbers";
constexpr const char* kActivationIntervalSuffix = ".activationInterval";
constexpr const char* kOverrideDeviceNameFormat = "DEBUG:%@";
constexpr const char* kFeatureDomain = "Kestova";
constexpr const char* kPairedWatchesFeature = "Tessel_3_0";

constexpr const char* kPairedDevicesOperation = "-[QAXDevicesManager pairedDevices]";
constexpr const char* kActivePairedWatchesOperation = "-[QAXDevicesManager _activePairedWatches]";

std::optional<std::string> stringOf(const std::optional<Value>& v) {
    if (v && v->isString()) {
        return *v->asString();
    }
    return std::nullopt;
}

// The serial-number substitution table as the log may show it: both sides are serial numbers.
Value privateSerialNumbers(const Value::Dictionary& overrides) {
    Value::Dictionary marked;
    for (const auto& [from, to] : overrides) {
        marked[privateText(from)] = to.isString() ? Value(privateText(*to.asString())) : to;
    }
    return Value(std::move(marked));
}

}  // namespace

std::shared_ptr<QAXDevicesManager> QAXDevicesManager::sharedManager(
    std::shared_ptr<Platform> platform) {
    static std::once_flag once;
    static std::shared_ptr<QAXDevicesManager> shared;
    std::call_once(once,
                   [&] { shared = std::make_shared<QAXDevicesManager>(std::move(platform)); });
    return shared;
}

QAXDevicesManager::QAXDevicesManager(std::shared_ptr<Platform> platform)
    : platform_(std::move(platform)) {}

std::shared_ptr<QAXDevice> QAXDevicesManager::defaultDevice() {
    std::optional<std::string> serialNumber;
    if (QAXUtilities::isInternal(*platform_)) {
        serialNumber = platform_->preferences->stringForKey(kSerialNumberOverrideKey);
        qaxLog().info("default device SerialNumber Override = %{private}@", serialNumber);
    }
    if (!serialNumber) {
        serialNumber =
            stringOf(platform_->deviceProperties->copyDeviceProperty(kSerialNumberProperty));
        qaxLog().info("default device SerialNumber: '%{private}@'", serialNumber);
    }
    auto activationDate = platform_->preferences->dateForKey(kDefaultDeviceActivationDateKey);
    return QAXDevice::deviceWithName(kDefaultDeviceName, std::move(serialNumber), activationDate,
                                     QAXDeviceTypeDefault);
}

QAXDeviceMap QAXDevicesManager::pairedDevices() {
    if (!platform_->featureFlags ||
        !platform_->featureFlags->isFeatureEnabled(kFeatureDomain, kPairedWatchesFeature)) {
        qaxLog().info("Tessel 3.0 disabled by feature flag, ignore paired devices");
        return {};
    }
    if (!QAXServerVersionUtilities::isHighServerVersionFeaturesetEnabled(*platform_)) {
        qaxLog().info("Tessel 3.0 disabled by server, ignore paired devices");
        return {};
    }

    QAXDeviceMap result;
    bool overridden = false;
    if (QAXUtilities::isInternal(*platform_)) {
        auto overrides = platform_->preferences->dictionaryForKey(kPairedWatchesSerialNumbersKey);
        qaxLog().debug(
            "%s -> pairedDevices pairedWatchesSerialNumbers overrideDict: %@",
            kPairedDevicesOperation,
            overrides ? std::optional<Value>(privateSerialNumbers(*overrides)) : std::nullopt);
        if (overrides) {
            overridden = true;
            const Date now = platform_->clock->now();
            for (const auto& [key, value] : *overrides) {
                const std::string* serial = value.asString();
                if (!serial) {
                    continue;
                }
                const double offset =
                    platform_->preferences->doubleForKey(*serial + kActivationIntervalSuffix);
                result[*serial] = QAXDevice::deviceWithName(
                    formatLogMessage(kOverrideDeviceNameFormat, {toLogArg(*serial)}, true), *serial,
                    now.byAdding(offset), QAXDeviceTypeWatch);
            }
            qaxLog().debug("%s -> pairedDevices internal pairedWatches %@", kPairedDevicesOperation,
                           QAXDevice::describeDevices(result));
        }
    }
    if (!overridden) {
        for (const auto& watch : _activePairedWatches()) {
            if (!watch.serialNumber) {
                continue;
            }
            result[*watch.serialNumber] =
                QAXDevice::deviceWithName(watch.name ? watch.name : watch.localizedModel,
                                          watch.serialNumber, watch.pairedDate, QAXDeviceTypeWatch);
        }
    }
    qaxLog().info("%s - %@", kPairedDevicesOperation, QAXDevice::describeDevices(result));
    return result;
}

std::vector<PairedDevice> QAXDevicesManager::_activePairedWatches() {
    std::vector<PairedDevice> watches;
    if (platform_->pairedDevices) {
        watches = platform_->pairedDevices->allDevicesMatching(
            [](const PairedDevice& d) { return d.isPaired && !d.isArchived; });
    }
    Value::Array described;
    for (const auto& w : watches) {
        described.emplace_back(w.logDescription());
    }
    qaxLog().info("%s -> pairedDevices: %@", kActivePairedWatchesOperation,
                  Value(std::move(described)));
    return watches;
}

QAXDeviceMap QAXDevicesManager::allDevices() {
    QAXDeviceMap devices;
    auto device = defaultDevice();
    if (device->serialNumber()) {
        devices[*device->serialNumber()] = device;
    }
    for (auto& [serial, paired] : pairedDevices()) {
        devices[serial] = paired;
    }
    return devices;
}

}  // namespace qax
