// Whether the host has network connectivity for activities that require it: a non-loopback
// interface is up and carries a default route (IPv4 or IPv6). QAX_NETWORK=up or =down in the
// environment overrides the check, for demos and tests on machines without a default route.
// Stateless; any thread.
#pragma once

#include <optional>
#include <string_view>

namespace qax {

class HostNetworkState {
  public:
    static bool available();
    // The override of QAX_NETWORK: none unless it is "up" or "down".
    static std::optional<bool> overrideFromEnvironment(const char* value);
    // From the kernel's route tables (/proc/net/route, /proc/net/ipv6_route) and the
    // interfaces' flags.
    static bool hasDefaultRoute();
};

}  // namespace qax
