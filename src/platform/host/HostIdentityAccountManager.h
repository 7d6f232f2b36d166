// Identity headers on the host: "X-Velmora-Client-Info" from the device's product type and
// version, "X-Velmora-Device-UDID" (a stable digest of the device properties), and the
// name/value pairs of accounts.plist "IdentityHeaders". Thread-safe.
#pragma once

#include <memory>
#include <string>

#include "platform/DeviceProperties.h"
#include "platform/IdentityAccountManager.h"
#include "platform/host/CachedPlistFile.h"

namespace qax {

class HostIdentityAccountManager : public IdentityAccountManager {
  public:
    HostIdentityAccountManager(const std::string& platformRoot,
                               std::shared_ptr<DeviceProperties> deviceProperties);

    void addClientInfoHeader(HttpRequest& request) override;
    void addDeviceUDIDHeader(HttpRequest& request) override;
    std::map<std::string, std::string> identityHeadersForRequest(
        const HttpRequest& request) override;

    // The device identifier: 64 hexadecimal digits, the same for as long as the device's
    // serial number and product type stay the same.
    static std::string deviceIdentifier(DeviceProperties& deviceProperties);
    static std::string clientInfo(DeviceProperties& deviceProperties);

  private:
    CachedPlistFile file_;
    std::shared_ptr<DeviceProperties> deviceProperties_;
};

}  // namespace qax
