#include "platform/host/HostAttestationService.h"

#include <openssl/asn1.h>
#include <openssl/evp.h>

#include <asio/post.hpp>
#include <filesystem>
#include <thread>

#include "core/JsonCodec.h"
#include "core/Value.h"
#include "platform/host/HostIdentityAccountManager.h"

namespace qax {
namespace {

constexpr const char* kSupportedKey = "Supported";
constexpr const char* kFirstIssuanceErrorCodeKey = "FirstIssuanceErrorCode";

// The attestation extensions live under a private arc of the UUID-based OID tree.
constexpr const char* kExtensionArc = "2.25.327152082327832833974847356669451588356";

// Certificates may begin a little before the clock says, so that a verifier whose clock
// lags behind does not reject a fresh leaf.
constexpr double kBackdateSeconds = 300;

class HostAttestationKey : public AttestationKey {
  public:
    explicit HostAttestationKey(std::shared_ptr<EVP_PKEY> key) : key_(std::move(key)) {}

    std::optional<Bytes> createSignature(SignatureAlgorithm algorithm,
                                         std::span<const std::uint8_t> data,
                                         std::string* error) override {
        if (algorithm != SignatureAlgorithm::ECDSASignatureMessageX962SHA256) {
            if (error) {
                *error = "unsupported signature algorithm";
            }
            return std::nullopt;
        }
        std::unique_ptr<EVP_MD_CTX, decltype(&EVP_MD_CTX_free)> ctx(EVP_MD_CTX_new(),
                                                                    EVP_MD_CTX_free);
        std::size_t length = 0;
        if (!ctx ||
            EVP_DigestSignInit(ctx.get(), nullptr, EVP_sha256(), nullptr, key_.get()) != 1 ||
            EVP_DigestSign(ctx.get(), nullptr, &length, data.data(), data.size()) != 1) {
            if (error) {
                *error = "cannot prepare an ECDSA signature";
            }
            return std::nullopt;
        }
        Bytes signature(length);
        if (EVP_DigestSign(ctx.get(), signature.data(), &length, data.data(), data.size()) != 1) {
            if (error) {
                *error = "ECDSA signing failed";
            }
            return std::nullopt;
        }
        signature.resize(length);
        return signature;
    }

  private:
    std::shared_ptr<EVP_PKEY> key_;
};

class HostAttestationCertificate : public AttestationCertificate {
  public:
    explicit HostAttestationCertificate(Bytes der) : der_(std::move(der)) {}
    Bytes certificateData() const override { return der_; }

  private:
    Bytes der_;
};

// The DER of a UTF8String holding `text`.
Bytes utf8StringDER(const std::string& text) {
    std::unique_ptr<ASN1_UTF8STRING, decltype(&ASN1_UTF8STRING_free)> s(ASN1_UTF8STRING_new(),
                                                                        ASN1_UTF8STRING_free);
    if (!s || ASN1_STRING_set(s.get(), text.data(), static_cast<int>(text.size())) != 1) {
        return {};
    }
    int n = i2d_ASN1_UTF8STRING(s.get(), nullptr);
    if (n <= 0) {
        return {};
    }
    Bytes out(static_cast<std::size_t>(n));
    unsigned char* p = out.data();
    i2d_ASN1_UTF8STRING(s.get(), &p);
    return out;
}

std::string accessibilityName(KeyAccessibility accessibility) {
    switch (accessibility) {
        case KeyAccessibility::AfterFirstUnlockThisDeviceOnly:
            return "AfterFirstUnlockThisDeviceOnly";
    }
    return "Unknown";
}

Value property(DeviceProperties& properties, std::string_view name) {
    auto value = properties.copyDeviceProperty(name);
    return value ? *value : Value(std::string());
}

// The facts one extension vouches for, as compact JSON.
std::string extensionContent(AttestationOID oid, const AttestationOptions& options,
                             DeviceProperties& device) {
    Value::Dictionary content;
    switch (oid) {
        case AttestationOID::UVXTDeviceIdentifiers:
            content["level"] = Value(options.svxtAttestation ? "SVXT" : "UVXT");
            content["UDID"] = Value(HostIdentityAccountManager::deviceIdentifier(device));
            break;
        case AttestationOID::DeviceIdentifiers:
            content["SerialNumber"] = property(device, "SerialNumber");
            content["UDID"] = Value(HostIdentityAccountManager::deviceIdentifier(device));
            break;
        case AttestationOID::HardwareProperties:
            content["ProductType"] = property(device, "ProductType");
            break;
        case AttestationOID::AccessControls:
            content["accessGroup"] = Value(options.keyStoreAccessGroup);
            if (options.accessControls) {
                content["accessibility"] =
                    Value(accessibilityName(options.accessControls->accessibility));
                content["privateKeyUsageOnly"] = Value(options.accessControls->privateKeyUsageOnly);
            }
            break;
        case AttestationOID::DeviceOSInformation:
            content["ProductVersion"] = property(device, "ProductVersion");
            content["InternalBuild"] = Value(device.isInternalBuild());
            break;
    }
    return toJsonString(Value(std::move(content)));
}

}  // namespace

struct HostAttestationService::Core {
    Core(const std::string& platformRoot, std::shared_ptr<DeviceProperties> device,
         std::shared_ptr<Clock> clock)
        : authority(platformRoot),
          config((std::filesystem::path(platformRoot) / "attestation.plist").string()),
          device(std::move(device)),
          clock(std::move(clock)) {}

    bool supported() {
        auto root = config.read();
        const Value* v = root ? root->find(kSupportedKey) : nullptr;
        return !v || v->truthy();
    }

    std::optional<long> firstIssuanceErrorCode() {
        auto root = config.read();
        const Value* v = root ? root->find(kFirstIssuanceErrorCodeKey) : nullptr;
        auto code = v ? v->asInteger() : std::nullopt;
        return code ? std::optional<long>(static_cast<long>(*code)) : std::nullopt;
    }

    void issue(
        const AttestationOptions& options,
        const std::function<void(std::shared_ptr<AttestationKey>, std::optional<CertificateChain>,
                                 std::optional<AttestationError>)>& completion) {
        auto failWith = [&](long code, std::string reason) {
            completion(nullptr, std::nullopt, AttestationError{code, std::move(reason)});
        };
        if (!supported()) {
            return failWith(kErrorUnsupported, "attestation is not supported on this device");
        }
        if (options.keyStoreLabel.empty() || options.validity <= 0) {
            return failWith(kErrorInvalidParameter,
                            "a key-store label and a validity are required");
        }
        if (!options.svxtAttestation) {
            if (auto code = firstIssuanceErrorCode()) {
                return failWith(*code, "the user-level certificate is not available");
            }
        }
        std::string error;
        auto key = authority.keyForLabel(options.keyStoreLabel, &error);
        if (!key) {
            return failWith(kErrorInternal, error);
        }
        std::vector<HostAttestationAuthority::Extension> extensions;
        for (AttestationOID oid : options.oidsToInclude) {
            extensions.push_back(
                {extensionOID(oid), utf8StringDER(extensionContent(oid, options, *device))});
        }
        const Date notBefore = clock->now().byAdding(-kBackdateSeconds);
        auto leaf = authority.issueLeaf(
            key.get(), options.keyStoreLabel, notBefore,
            kBackdateSeconds + static_cast<double>(options.validity) * 60, extensions, &error);
        if (!leaf) {
            return failWith(kErrorInternal, error);
        }
        CertificateChain chain{std::make_shared<HostAttestationCertificate>(std::move(*leaf))};
        if (options.includeCACertificate) {
            auto intermediate = authority.intermediateCertificateDER(&error);
            if (!intermediate) {
                return failWith(kErrorInternal, error);
            }
            chain.push_back(std::make_shared<HostAttestationCertificate>(std::move(*intermediate)));
        }
        completion(std::make_shared<HostAttestationKey>(std::move(key)), std::move(chain),
                   std::nullopt);
    }

    HostAttestationAuthority authority;
    CachedPlistFile config;
    std::shared_ptr<DeviceProperties> device;
    std::shared_ptr<Clock> clock;
};

HostAttestationService::HostAttestationService(const std::string& platformRoot,
                                               std::shared_ptr<DeviceProperties> deviceProperties,
                                               std::shared_ptr<Clock> clock)
    : core_(std::make_shared<Core>(platformRoot, std::move(deviceProperties), std::move(clock))),
      thread_(std::make_shared<HostIoThread>()) {}

HostAttestationService::~HostAttestationService() {
    if (thread_->runningInThisThread()) {
        // A thread cannot join itself: let another stop it once this handler has returned.
        std::thread([thread = thread_] { thread->stop(); }).detach();
    } else {
        thread_->stop();
    }
}

bool HostAttestationService::isAttestationSupported() {
    return core_->supported();
}

std::shared_ptr<const AccessControl> HostAttestationService::createPrivateKeyAccessControl(
    KeyAccessibility accessibility, std::string*) {
    auto control = std::make_shared<AccessControl>();
    control->accessibility = accessibility;
    control->privateKeyUsageOnly = true;
    return control;
}

void HostAttestationService::issueClientCertificate(
    const AttestationOptions& options,
    std::function<void(std::shared_ptr<AttestationKey>, std::optional<CertificateChain>,
                       std::optional<AttestationError>)>
        completion) {
    thread_->start();
    asio::post(thread_->context(), [core = core_, options, completion = std::move(completion)] {
        core->issue(options, completion);
    });
}

bool HostAttestationService::isMissingUVXTError(const AttestationError& error) {
    return error.code == kErrorMissingUserCertificate ||
           error.code == kErrorMissingUserCertificateInStore;
}

std::optional<std::string> HostAttestationService::rootCertificatePEM(std::string* error) {
    return core_->authority.rootCertificatePEM(error);
}

std::string HostAttestationService::extensionOID(AttestationOID oid) {
    const char* leaf = "";
    switch (oid) {
        case AttestationOID::UVXTDeviceIdentifiers:
            leaf = ".1";
            break;
        case AttestationOID::DeviceIdentifiers:
            leaf = ".2";
            break;
        case AttestationOID::HardwareProperties:
            leaf = ".3";
            break;
        case AttestationOID::AccessControls:
            leaf = ".4";
            break;
        case AttestationOID::DeviceOSInformation:
            leaf = ".5";
            break;
    }
    return std::string(kExtensionArc) + leaf;
}

}  // namespace qax
