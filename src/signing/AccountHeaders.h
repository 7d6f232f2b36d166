// Turns a mutable HTTP request into a coverage request the service accepts: the account
// token, identity, user-agent and store-front headers, the JSON body, the offer-service
// headers and the device attestation headers. Stateless free functions on any thread, but
// signing and attestation block the calling thread (credential renewal, silent store
// authentication, certificate issuance): call them only on threads meant for blocking.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "signing/QAXKVAManager.h"

namespace qax {

struct Platform;
class HttpRequest;
struct Account;
class AccountStore;

// The bundle identifier the agent names itself with.
inline constexpr const char* kAgentBundleIdentifier = "com.velmora.qaxagent";

// Adds the account-token header, the identity headers, "altDSID", "User-Agent" and
// "storefrontLocale". False means the request must not be sent; no header is set then.
bool qax_signWithAccountHeaders(HttpRequest& request, const Platform& platform,
                                bool forceReprovisioning, bool avoidUI,
                                const std::optional<std::string>& bundleID);
bool qax_signWithAccountHeaders(HttpRequest& request, const Platform& platform,
                                bool forceReprovisioning, bool avoidUI);

// Sets "X-Velmora-KF-Token" from the KF account of `cloudAccount`, renewing the token
// (and waiting for the renewal) when there is none or when `forceReprovisioning` is set.
bool _addKFHeadersForAccount(HttpRequest& request, const Account& cloudAccount, AccountStore& store,
                             bool forceReprovisioning, bool avoidUI);

// Method POST, "Content-Type" and the compact JSON body {serialNumber, locale,
// requestTimestamp (ms), requestTimezone (whole hours)}, read from the clock now.
void qax_setCoverageRequestBodyWithSerialNumber(HttpRequest& request, const Platform& platform,
                                                const std::string& serialNumber);

// The offer-service header set. Sets no method, body or account token.
void qax_addOASHeadersWithOfferID(HttpRequest& request, const Platform& platform,
                                  const std::string& offerID, const std::string& serialNumber);

// All header fields as a printed dictionary, for logs.
std::string headerDescription(const HttpRequest& request);
// The body as text; none when there is no body or it is not valid UTF-8.
std::optional<std::string> bodyDescription(const HttpRequest& request);

// "<bundle/OS version/product type>".
std::string _userAgentWithBundleID(const Platform& platform, const std::string& bundleID);
std::string _userAgent(const Platform& platform);

// Attests the device and adds "X-Velmora-Kva-S" (signature over `body`) and "X-Velmora-Kva"
// (the certificate chain) when it can; failures only leave the headers out. `wait` bounds
// the wait for the issuance (the default waits in real time).
void addKVAAuthenticationHeadersWithBody(HttpRequest& request, const Platform& platform,
                                         std::string_view body, QAXKVAManager::TimedWait wait = {});
// The same over the body {"serialNumber": serialNumber}, which is not set on the request.
void addKVAAuthenticationHeadersWithSerialNumber(HttpRequest& request, const Platform& platform,
                                                 const std::string& serialNumber,
                                                 QAXKVAManager::TimedWait wait = {});

}  // namespace qax
