#include "platform/host/HostIdentityAccountManager.h"

#include <filesystem>

#include "core/Hash.h"
#include "platform/HttpClient.h"

namespace qax {
namespace {

constexpr const char* kClientInfoHeader = "X-Velmora-Client-Info";
constexpr const char* kDeviceUDIDHeader = "X-Velmora-Device-UDID";
constexpr const char* kIdentityHeadersKey = "IdentityHeaders";

std::string propertyText(DeviceProperties& properties, std::string_view name) {
    auto value = properties.copyDeviceProperty(name);
    if (!value) {
        return std::string();
    }
    const std::string* s = value->asString();
    return s ? *s : value->description();
}

}  // namespace

HostIdentityAccountManager::HostIdentityAccountManager(
    const std::string& platformRoot, std::shared_ptr<DeviceProperties> deviceProperties)
    : file_((std::filesystem::path(platformRoot) / "accounts.plist").string()),
      deviceProperties_(std::move(deviceProperties)) {}

std::string HostIdentityAccountManager::deviceIdentifier(DeviceProperties& deviceProperties) {
    // Domain-separated so the identifier is never the bare digest of a serial number, which
    // the agent stores elsewhere.
    return sha256Hash("qax-device-udid\n" + propertyText(deviceProperties, "SerialNumber") + "\n" +
                      propertyText(deviceProperties, "ProductType"));
}

std::string HostIdentityAccountManager::clientInfo(DeviceProperties& deviceProperties) {
    return "ProductType=" + propertyText(deviceProperties, "ProductType") +
           "; ProductVersion=" + propertyText(deviceProperties, "ProductVersion");
}

void HostIdentityAccountManager::addClientInfoHeader(HttpRequest& request) {
    request.setValue(kClientInfoHeader, clientInfo(*deviceProperties_));
}

void HostIdentityAccountManager::addDeviceUDIDHeader(HttpRequest& request) {
    request.setValue(kDeviceUDIDHeader, deviceIdentifier(*deviceProperties_));
}

std::map<std::string, std::string> HostIdentityAccountManager::identityHeadersForRequest(
    const HttpRequest&) {
    std::map<std::string, std::string> headers;
    auto root = file_.read();
    const Value* pairs = root ? root->find(kIdentityHeadersKey) : nullptr;
    if (!pairs || !pairs->isDictionary()) {
        return headers;
    }
    for (const auto& [name, value] : *pairs->asDictionary()) {
        // Header values are text; other kinds would have no agreed wire form.
        if (const std::string* s = value.asString(); s && !name.empty()) {
            headers[name] = *s;
        }
    }
    return headers;
}

}  // namespace qax
