// The simulated device's attestation authority: a local root and intermediate CA under
// state/attestation/, one P-256 key per key-store label under state/keys/ (mode 0600), and
// leaf certificates that the intermediate issues for those keys. Files are created on first
// use under an advisory lock, so processes sharing a platform root agree on one CA and one
// key per label. Thread-safe.
#pragma once

#include <openssl/types.h>

#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "core/Date.h"

namespace qax {

class HostAttestationAuthority {
  public:
    // A non-critical extension of a leaf: dotted object identifier and the DER of its value.
    struct Extension {
        std::string oid;
        std::vector<std::uint8_t> der;
    };

    explicit HostAttestationAuthority(std::string platformRoot);
    ~HostAttestationAuthority();
    HostAttestationAuthority(const HostAttestationAuthority&) = delete;
    HostAttestationAuthority& operator=(const HostAttestationAuthority&) = delete;

    // The key of `label`, created on first use; none with `error` set on failure.
    std::shared_ptr<EVP_PKEY> keyForLabel(const std::string& label, std::string* error);

    // A leaf certificate (DER) for `key`, valid from `notBefore` for `validitySeconds`,
    // issued by the intermediate.
    std::optional<std::vector<std::uint8_t>> issueLeaf(EVP_PKEY* key, const std::string& commonName,
                                                       Date notBefore, double validitySeconds,
                                                       const std::vector<Extension>& extensions,
                                                       std::string* error);

    std::optional<std::vector<std::uint8_t>> intermediateCertificateDER(std::string* error);
    std::optional<std::string> rootCertificatePEM(std::string* error);

    std::string rootCertificatePath() const;
    std::string keyPathForLabel(const std::string& label) const;

  private:
    struct CA;
    bool loadOrCreateCA(std::string* error);

    const std::string root_;
    std::mutex mutex_;
    std::unique_ptr<CA> ca_;
};

}  // namespace qax
