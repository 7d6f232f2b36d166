#include "platform/host/HostPairedDeviceRegistry.h"

#include <filesystem>

namespace qax {
namespace {

std::optional<std::string> stringAt(const Value& entry, std::string_view key) {
    const Value* v = entry.find(key);
    if (v && v->isString()) {
        return *v->asString();
    }
    return std::nullopt;
}

bool boolAt(const Value& entry, std::string_view key) {
    const Value* v = entry.find(key);
    return v && v->truthy();
}

}  // namespace

HostPairedDeviceRegistry::HostPairedDeviceRegistry(const std::string& platformRoot)
    : file_((std::filesystem::path(platformRoot) / "paired-devices.plist").string()) {}

std::vector<PairedDevice> HostPairedDeviceRegistry::allDevicesMatching(
    const std::function<bool(const PairedDevice&)>& predicate) {
    std::vector<PairedDevice> result;
    auto root = file_.read();
    const Value::Array* entries = root ? root->asArray() : nullptr;
    if (!entries) {
        return result;
    }
    for (const Value& entry : *entries) {
        if (!entry.isDictionary()) {
            continue;
        }
        PairedDevice device;
        device.name = stringAt(entry, "name");
        device.localizedModel = stringAt(entry, "localizedModel");
        device.serialNumber = stringAt(entry, "serialNumber");
        if (const Value* date = entry.find("pairedDate")) {
            device.pairedDate = date->asDate();
        }
        device.isPaired = boolAt(entry, "isPaired");
        device.isArchived = boolAt(entry, "isArchived");
        device.isAltAccount = boolAt(entry, "isAltAccount");
        if (!predicate || predicate(device)) {
            result.push_back(std::move(device));
        }
    }
    return result;
}

}  // namespace qax
