// The platform's device attestation: a key held by the device and a certificate chain,
// issued by the attestation authority, that vouches for the key and the device. Thread-safe;
// issuance completes on the service's own thread, never on the caller's.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <vector>

namespace qax {

using Bytes = std::vector<std::uint8_t>;

enum class SignatureAlgorithm {
    // ECDSA over the SHA-256 digest of the message, signature as DER ECDSA-Sig-Value.
    ECDSASignatureMessageX962SHA256,
};

// A private key held by the attestation key store. Released when the last handle goes.
class AttestationKey {
  public:
    virtual ~AttestationKey() = default;
    // The signature of `data`; none with `error` set when the key cannot sign.
    virtual std::optional<Bytes> createSignature(SignatureAlgorithm algorithm,
                                                 std::span<const std::uint8_t> data,
                                                 std::string* error) = 0;
};

class AttestationCertificate {
  public:
    virtual ~AttestationCertificate() = default;
    // The DER encoding; empty when the certificate has none.
    virtual Bytes certificateData() const = 0;
};

using CertificateChain = std::vector<std::shared_ptr<AttestationCertificate>>;

// When a key may be used.
enum class KeyAccessibility {
    // After the first unlock since boot, on this device only.
    AfterFirstUnlockThisDeviceOnly,
};

struct AccessControl {
    KeyAccessibility accessibility = KeyAccessibility::AfterFirstUnlockThisDeviceOnly;
    // Only private-key operations (signing) are allowed.
    bool privateKeyUsageOnly = true;
};

// The properties a leaf certificate can vouch for, each as its own extension.
enum class AttestationOID {
    UVXTDeviceIdentifiers,
    DeviceIdentifiers,
    HardwareProperties,
    AccessControls,
    DeviceOSInformation,
};

struct AttestationOptions {
    std::string keyStoreLabel;
    std::string keyStoreAccessGroup;
    // The chain ends with the issuing CA's certificate.
    bool includeCACertificate = false;
    double networkTimeoutInterval = 60;
    // Attest with the system-level certificate rather than the user-level one.
    bool svxtAttestation = false;
    // Validity of the leaf certificate, in minutes.
    std::int64_t validity = 0;
    std::shared_ptr<const AccessControl> accessControls;
    std::vector<AttestationOID> oidsToInclude;
};

struct AttestationError {
    long code = 0;
    std::string reason;
    std::string description() const {
        return "AttestationError(code " + std::to_string(code) + "): " + reason;
    }
};

class AttestationService {
  public:
    // Codes of this service's error domain.
    static constexpr long kErrorInvalidParameter = -1;
    static constexpr long kErrorInternal = -2;
    static constexpr long kErrorMissingUserCertificateInStore = -4;
    static constexpr long kErrorUnsupported = -5;
    static constexpr long kErrorMissingUserCertificate = -11;

    virtual ~AttestationService() = default;

    virtual bool isAttestationSupported() = 0;
    // An access-control object for keys that sign only; none with `error` set on failure.
    virtual std::shared_ptr<const AccessControl> createPrivateKeyAccessControl(
        KeyAccessibility accessibility, std::string* error) = 0;
    // Issues (or reissues) the key of `options.keyStoreLabel` and a certificate chain for it,
    // leaf first. `completion` runs exactly once, on the service's thread.
    virtual void issueClientCertificate(
        const AttestationOptions& options,
        std::function<void(std::shared_ptr<AttestationKey> key,
                           std::optional<CertificateChain> certificates,
                           std::optional<AttestationError> error)>
            completion) = 0;
    // Whether `error` says that the user-level certificate is missing.
    virtual bool isMissingUVXTError(const AttestationError& error) = 0;
};

}  // namespace qax
