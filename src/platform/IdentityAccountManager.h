// The platform's identity headers: the client-information and device-identifier fields
// and any further pairs the identity service wants on a request. Thread-safe; every
// operation answers at once.
#pragma once

#include <map>
#include <string>

namespace qax {

class HttpRequest;

class IdentityAccountManager {
  public:
    virtual ~IdentityAccountManager() = default;

    // Sets the client-information header on `request`.
    virtual void addClientInfoHeader(HttpRequest& request) = 0;
    // Sets the device-identifier header on `request`.
    virtual void addDeviceUDIDHeader(HttpRequest& request) = 0;
    // Further header fields for `request`, name to value.
    virtual std::map<std::string, std::string> identityHeadersForRequest(
        const HttpRequest& request) = 0;
};

}  // namespace qax
