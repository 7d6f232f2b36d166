// Verifies the device-attestation headers of a coverage request the way the coverage
// service does: the compressed certificate list must chain up to the attestation root,
// and the signature must verify over the body with the leaf's key. Stateless; any thread.
#pragma once

#include <optional>
#include <string>

namespace coveragesim {

struct AttestationVerdict {
    bool present = false;  // both headers were sent
    bool valid = false;
    std::string reason;  // why it is not valid
    std::optional<std::string> leafSubject;
};

// `rootPem` is the attestation root certificate; empty when none is configured (then the
// chain is not checked, only the signature against the leaf). The chain is checked as of
// `verifyAt` (seconds since 1970): the service's "now", which follows a device's simulated
// clock, so a certificate issued by a device whose clock was moved ahead still verifies.
AttestationVerdict checkAttestation(const std::optional<std::string>& signatureHeader,
                                    const std::optional<std::string>& certificatesHeader,
                                    const std::string& body, const std::string& rootPem,
                                    double verifyAt);

}  // namespace coveragesim
