#include "signing/AccountHeaders.h"

#include <openssl/rand.h>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <cstdio>
#include <mutex>

#include "core/IcuLibrary.h"
#include "core/JsonCodec.h"
#include "core/Log.h"
#include "core/Value.h"
#include "platform/AccountStore.h"
#include "platform/DeviceProperties.h"
#include "platform/HttpClient.h"
#include "platform/IdentityAccountManager.h"
#include "platform/LocaleInfo.h"
#include "platform/Platform.h"
#include "platform/PreferenceStore.h"

namespace qax {
namespace {

constexpr const char* kKFService = "com.velmora.kf.supportapp.auth";
constexpr const char* kKFTokenHeader = "X-Velmora-KF-Token";
constexpr const char* kAltDSIDHeader = "altDSID";
constexpr const char* kUserAgentHeader = "User-Agent";
constexpr const char* kStorefrontHeader = "storefrontLocale";
constexpr const char* kStorefrontPreference = "storefrontLocale";

constexpr const char* kAddKVAName =
    "-[HttpRequest(AccountHeaders) addKVAAuthenticationHeadersWithBody:]";

// Holds the caller's thread until a completion, running on another thread, hands over its
// result. The completion may also run before the wait begins, or on the caller's own
// thread before the operation returns.
template <typename T>
class BlockingResult {
  public:
    void set(T value) {
        {
            std::lock_guard lock(mutex_);
            value_ = std::move(value);
        }
        ready_.notify_all();
    }
    T wait() {
        std::unique_lock lock(mutex_);
        ready_.wait(lock, [this] { return value_.has_value(); });
        return std::move(*value_);
    }

  private:
    std::mutex mutex_;
    std::condition_variable ready_;
    std::optional<T> value_;
};

std::optional<std::string> storefrontOverride(const Platform& platform) {
    if (!platform.preferences) {
        return std::nullopt;
    }
    auto value = platform.preferences->objectForKey(kStorefrontPreference);
    if (!value) {
        return std::nullopt;
    }
    if (const std::string* s = value->asString()) {
        return *s;
    }
    return value->description();
}

std::optional<Value> deviceProperty(const Platform& platform, std::string_view name) {
    return platform.deviceProperties ? platform.deviceProperties->copyDeviceProperty(name)
                                     : std::nullopt;
}

// A random (version 4) UUID in its canonical upper-case form.
std::string randomUUIDString() {
    std::uint8_t b[16] = {};
    if (RAND_bytes(b, sizeof b) != 1) {
        // The generator failing is no reason to reuse an identifier; fall back to the clock.
        auto t =
            static_cast<std::uint64_t>(std::chrono::steady_clock::now().time_since_epoch().count());
        for (int i = 0; i < 8; ++i) {
            b[i] ^= static_cast<std::uint8_t>(t >> (8 * i));
        }
    }
    b[6] = static_cast<std::uint8_t>((b[6] & 0x0F) | 0x40);
    b[8] = static_cast<std::uint8_t>((b[8] & 0x3F) | 0x80);
    char out[37];
    std::snprintf(out, sizeof out,
                  "%02X%02X%02X%02X-%02X%02X-%02X%02X-%02X%02X-%02X%02X%02X%02X%02X%02X", b[0],
                  b[1], b[2], b[3], b[4], b[5], b[6], b[7], b[8], b[9], b[10], b[11], b[12], b[13],
                  b[14], b[15]);
    return out;
}

bool isValidUTF8(const std::string& text) {
    if (std::all_of(text.begin(), text.end(), [](char c) { return (c & 0x80) == 0; })) {
        return true;
    }
    const IcuLibrary* icu = IcuLibrary::get();
    if (!icu) {
        return false;
    }
    UErrorCode status = U_ZERO_ERROR;
    int32_t length = 0;
    icu->strFromUTF8(nullptr, 0, &length, text.data(), static_cast<int32_t>(text.size()), &status);
    return status == U_BUFFER_OVERFLOW_ERROR || status == U_STRING_NOT_TERMINATED_WARNING ||
           U_SUCCESS(status);
}

}  // namespace

bool qax_signWithAccountHeaders(HttpRequest& request, const Platform& platform,
                                bool forceReprovisioning, bool avoidUI,
                                const std::optional<std::string>& bundleID) {
    AccountStore* store = platform.accounts.get();
    auto primary = store ? store->primaryCloudAccount() : nullptr;
    if (!primary) {
        qaxLog().info("No primary Skyvault account, can't sign this request");
        return false;
    }
    if (!_addKFHeadersForAccount(request, *primary, *store, forceReprovisioning, avoidUI)) {
        qaxLog().info("Failed to add KF headers, can't sign this request");
        return false;
    }

    if (platform.identity) {
        platform.identity->addClientInfoHeader(request);
        platform.identity->addDeviceUDIDHeader(request);
        for (auto& [name, value] : platform.identity->identityHeadersForRequest(request)) {
            request.setValue(name, value);
        }
    }
    request.setValue(kAltDSIDHeader, primary->altDSID);
    request.setValue(kUserAgentHeader,
                     bundleID ? _userAgentWithBundleID(platform, *bundleID) : _userAgent(platform));

    std::optional<std::string> storefront = storefrontOverride(platform);
    if (!storefront) {
        if (auto ostara = store->ostaraAccountForCloudAccount(*primary)) {
            storefront = ostara->storefront;
        } else {
            qaxLog().info("Couldn't find an OstaraAccount");
            using Result = std::pair<std::shared_ptr<const Account>, std::optional<std::string>>;
            auto result = std::make_shared<BlockingResult<Result>>();
            store->authenticateSilently(
                *primary, "Retrying with silent authentication to get the ostara store account.",
                [result](std::shared_ptr<const Account> account, std::optional<std::string> error) {
                    result->set(Result(std::move(account), std::move(error)));
                });
            auto [account, error] = result->wait();
            if (account) {
                storefront = account->storefront;
            } else {
                qaxLog().error("Couldn't find an OstaraAccount with error: %@", error);
            }
        }
    }
    request.setValue(kStorefrontHeader, storefront);
    qaxLog().info("storeLocale %@", storefront);
    return true;
}

bool qax_signWithAccountHeaders(HttpRequest& request, const Platform& platform,
                                bool forceReprovisioning, bool avoidUI) {
    return qax_signWithAccountHeaders(request, platform, forceReprovisioning, avoidUI,
                                      std::nullopt);
}

bool _addKFHeadersForAccount(HttpRequest& request, const Account& cloudAccount, AccountStore& store,
                             bool forceReprovisioning, bool avoidUI) {
    auto kfAccount = store.kfAccountForCloudAccount(cloudAccount);
    if (!kfAccount) {
        qaxLog().info("Keyforge signing failed because no KF account was provided.");
        return false;
    }
    if (!kfAccount->altDSID) {
        qaxLog().error("Keyforge signing failed because no there's no altDSID on the account.");
        return false;
    }
    auto token = store.credentialTokenForAccount(*kfAccount, kKFService);
    if (!token || forceReprovisioning) {
        qaxLog().info("Reprovision KF tokens");
        CredentialRenewalOptions options;
        options.avoidUserInterface = avoidUI;
        options.services = {kKFService};
        using Result = std::pair<long, std::optional<std::string>>;
        auto result = std::make_shared<BlockingResult<Result>>();
        store.renewCredentialsForAccount(*kfAccount, options,
                                         [result](long code, std::optional<std::string> error) {
                                             result->set(Result(code, std::move(error)));
                                         });
        auto [code, error] = result->wait();
        if (code != 0) {
            // A forced renewal that fails keeps the token read before it.
            qaxLog().error(
                "No way to sign request with KF token because renewal of KF credential failed: "
                "%ld, %@",
                code, error);
        } else {
            token = store.credentialTokenForAccount(*kfAccount, kKFService);
        }
        if (!token) {
            qaxLog().info(
                "Error: still no KF token even after calling renewCredentialsForAccount.");
            return false;
        }
    }
    request.setValue(kKFTokenHeader, token);
    return true;
}

void qax_setCoverageRequestBodyWithSerialNumber(HttpRequest& request, const Platform& platform,
                                                const std::string& serialNumber) {
    request.setMethod("POST");
    request.setValue("Content-Type", std::string("application/json"));
    const Date now = platform.clock->now();
    // Milliseconds with the fraction dropped; whole hours truncated toward zero (+5:45 is 5).
    const auto timestamp = static_cast<std::uint64_t>(now.secondsSince1970() * 1000.0);
    const std::int32_t timezone = platform.clock->secondsFromGMT(now) / 3600;
    Value::Dictionary body{
        {"serialNumber", Value(serialNumber)},
        {"locale",
         Value(platform.locale ? platform.locale->preferredLocaleIdentifier() : std::string())},
        {"requestTimestamp", Value(static_cast<unsigned long long>(timestamp))},
        {"requestTimezone", Value(timezone)},
    };
    request.setBody(toJsonString(Value(std::move(body))));
}

void qax_addOASHeadersWithOfferID(HttpRequest& request, const Platform& platform,
                                  const std::string& offerID, const std::string& serialNumber) {
    request.setValue("X-Velmora-SN", serialNumber);
    request.setValue("X-Velmora-Txn-ID", randomUUIDString());
    request.setValue("X-Velmora-Content-Size", platform.locale
                                                   ? platform.locale->preferredContentSizeCategory()
                                                   : std::nullopt);
    request.setValue("X-Velmora-DM", std::string("No"));
    request.setValue(kUserAgentHeader, _userAgent(platform));
    request.setValue("Offer-ID", offerID);

    std::optional<std::string> storefront = storefrontOverride(platform);
    if (!storefront) {
        auto primary = platform.accounts ? platform.accounts->primaryCloudAccount() : nullptr;
        if (primary) {
            if (auto ostara = platform.accounts->ostaraAccountForCloudAccount(*primary)) {
                storefront = ostara->storefront;
            }
        } else {
            qaxLog().error("Primary Skyvault Account is nil!");
        }
    }
    request.setValue(kStorefrontHeader, storefront);
    qaxLog().info("storeLocale %@", storefront);
}

std::string headerDescription(const HttpRequest& request) {
    Value::Dictionary fields;
    for (const auto& [name, value] : request.headers()) {
        fields[name] = Value(value);
    }
    return Value(std::move(fields)).description();
}

std::optional<std::string> bodyDescription(const HttpRequest& request) {
    const auto& body = request.body();
    if (!body || !isValidUTF8(*body)) {
        return std::nullopt;
    }
    return *body;
}

std::string _userAgentWithBundleID(const Platform& platform, const std::string& bundleID) {
    return formatLogMessage(
        "<%@/%@/%@>",
        {toLogArg(bundleID), toLogArg(deviceProperty(platform, "ProductVersion")),
         toLogArg(deviceProperty(platform, "ProductType"))},
        true);
}

std::string _userAgent(const Platform& platform) {
    return _userAgentWithBundleID(platform, kAgentBundleIdentifier);
}

void addKVAAuthenticationHeadersWithBody(HttpRequest& request, const Platform& platform,
                                         std::string_view body, QAXKVAManager::TimedWait wait) {
    qaxLog().info("%s: Initiating device authentication", kAddKVAName);
    auto manager = QAXKVAManager::create(platform.attestation, std::move(wait));
    const bool generated = manager->generateKVACertficate(
        [](std::optional<CertificateChain>, std::shared_ptr<AttestationKey>,
           std::optional<AttestationError> error) {
            if (error) {
                qaxLog().error(
                    "Device authentication failed while generating certificate with error: %@",
                    *error);
            }
        });
    qaxLog().info("KVA certificate generation success: %@", generated ? 1 : 0);
    if (!generated) {
        return;
    }
    std::optional<std::string> error;
    if (!manager->addKVAAuthenticationHeadersToRequest(request, body, &error)) {
        qaxLog().error("Device authentication failed with error: %@", error);
    } else {
        qaxLog().info("Device authentication successful");
    }
}

void addKVAAuthenticationHeadersWithSerialNumber(HttpRequest& request, const Platform& platform,
                                                 const std::string& serialNumber,
                                                 QAXKVAManager::TimedWait wait) {
    const std::string body =
        toJsonString(Value(Value::Dictionary{{"serialNumber", Value(serialNumber)}}));
    addKVAAuthenticationHeadersWithBody(request, platform, body, std::move(wait));
}

}  // namespace qax
