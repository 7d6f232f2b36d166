// qaxctl attestation-ca: prints the root certificate of this device's local attestation
// authority (PEM), which a coverage service needs to trust the device's attestation chains.
// The authority is created on first use.
#include <cstdio>
#include <memory>
#include <string>
#include <vector>

#include "Command.h"
#include "platform/host/HostAttestationService.h"
#include "platform/host/HostPlatform.h"

namespace qaxctl {
namespace {

int run(const std::vector<std::string>& args) {
    if (!args.empty()) {
        std::fputs("usage: qaxctl attestation-ca\n", stderr);
        return 64;
    }
    auto platform = qax::makeHostPlatform(qax::HostEnvironment::fromProcessEnvironment(), nullptr);
    auto service = std::dynamic_pointer_cast<qax::HostAttestationService>(platform->attestation);
    if (!service) {
        std::fputs("qaxctl attestation-ca: this platform has no local attestation authority\n",
                   stderr);
        return 1;
    }
    std::string error;
    auto pem = service->rootCertificatePEM(&error);
    if (!pem) {
        std::fprintf(stderr, "qaxctl attestation-ca: %s\n", error.c_str());
        return 1;
    }
    std::fputs(pem->c_str(), stdout);
    return 0;
}

QAXCTL_COMMAND("attestation-ca", "attestation-ca",
               "print the local attestation root certificate (PEM)", run);

}  // namespace
}  // namespace qaxctl
