// Device attestation on the host: keys and certificates from the local attestation
// authority, leaves carrying the device's identifiers, hardware and OS facts as extensions.
// attestation.plist {Supported, FirstIssuanceErrorCode} can declare the device unsupported
// or make every first (user-level) attempt fail with the given code. Thread-safe; issuance
// runs on the service's own thread, where its completions are called. Issuances not yet
// started when the service is destroyed are dropped.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "core/Clock.h"
#include "platform/AttestationService.h"
#include "platform/DeviceProperties.h"
#include "platform/host/CachedPlistFile.h"
#include "platform/host/HostAttestationAuthority.h"
#include "platform/host/HostIoThread.h"

namespace qax {

class HostAttestationService : public AttestationService {
  public:
    HostAttestationService(const std::string& platformRoot,
                           std::shared_ptr<DeviceProperties> deviceProperties,
                           std::shared_ptr<Clock> clock);
    ~HostAttestationService() override;

    bool isAttestationSupported() override;
    std::shared_ptr<const AccessControl> createPrivateKeyAccessControl(
        KeyAccessibility accessibility, std::string* error) override;
    void issueClientCertificate(
        const AttestationOptions& options,
        std::function<void(std::shared_ptr<AttestationKey>, std::optional<CertificateChain>,
                           std::optional<AttestationError>)>
            completion) override;
    bool isMissingUVXTError(const AttestationError& error) override;

    // The local root certificate in PEM, created on first use.
    std::optional<std::string> rootCertificatePEM(std::string* error);

    // Dotted identifier of the extension that carries `oid` in a leaf.
    static std::string extensionOID(AttestationOID oid);

  private:
    struct Core;
    std::shared_ptr<Core> core_;
    // Shared so that the service may be destroyed on its own thread (by the last holder of
    // a late completion) without joining itself.
    std::shared_ptr<HostIoThread> thread_;
};

}  // namespace qax
