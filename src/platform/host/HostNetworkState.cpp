#include "platform/host/HostNetworkState.h"

#include <ifaddrs.h>
#include <net/if.h>
#include <net/route.h>

#include <cstdlib>
#include <fstream>
#include <set>
#include <sstream>
#include <string>

namespace qax {
namespace {

// Names of the interfaces that are up and are not loopback.
std::set<std::string> upInterfaces() {
    std::set<std::string> names;
    ifaddrs* list = nullptr;
    if (getifaddrs(&list) != 0) {
        return names;
    }
    for (ifaddrs* a = list; a; a = a->ifa_next) {
        if (a->ifa_name && (a->ifa_flags & IFF_UP) && !(a->ifa_flags & IFF_LOOPBACK)) {
            names.insert(a->ifa_name);
        }
    }
    freeifaddrs(list);
    return names;
}

// Interfaces of usable default routes in /proc/net/route: destination and mask 0, route up.
void ipv4DefaultRoutes(std::set<std::string>& out) {
    std::ifstream in("/proc/net/route");
    std::string line;
    std::getline(in, line);  // header
    while (std::getline(in, line)) {
        std::istringstream fields(line);
        std::string iface, destination, gateway, flags, refCount, use, metric, mask;
        if (!(fields >> iface >> destination >> gateway >> flags >> refCount >> use >> metric >>
              mask)) {
            continue;
        }
        const unsigned long f = std::strtoul(flags.c_str(), nullptr, 16);
        if (destination == "00000000" && mask == "00000000" && (f & RTF_UP) && !(f & RTF_REJECT)) {
            out.insert(iface);
        }
    }
}

// The same from /proc/net/ipv6_route: destination ::/0, route up and not a reject route.
void ipv6DefaultRoutes(std::set<std::string>& out) {
    std::ifstream in("/proc/net/ipv6_route");
    std::string line;
    while (std::getline(in, line)) {
        std::istringstream fields(line);
        std::string destination, prefix, source, sourcePrefix, nextHop, metric, refCount, use,
            flags, iface;
        if (!(fields >> destination >> prefix >> source >> sourcePrefix >> nextHop >> metric >>
              refCount >> use >> flags >> iface)) {
            continue;
        }
        const unsigned long f = std::strtoul(flags.c_str(), nullptr, 16);
        if (destination == std::string(32, '0') && prefix == "00" && (f & RTF_UP) &&
            !(f & RTF_REJECT)) {
            out.insert(iface);
        }
    }
}

}  // namespace

std::optional<bool> HostNetworkState::overrideFromEnvironment(const char* value) {
    if (!value) {
        return std::nullopt;
    }
    const std::string_view v(value);
    if (v == "up") {
        return true;
    }
    if (v == "down") {
        return false;
    }
    return std::nullopt;
}

bool HostNetworkState::available() {
    if (auto forced = overrideFromEnvironment(std::getenv("QAX_NETWORK"))) {
        return *forced;
    }
    return hasDefaultRoute();
}

bool HostNetworkState::hasDefaultRoute() {
    std::set<std::string> routed;
    ipv4DefaultRoutes(routed);
    ipv6DefaultRoutes(routed);
    if (routed.empty()) {
        return false;
    }
    for (const auto& name : upInterfaces()) {
        if (routed.count(name)) {
            return true;
        }
    }
    return false;
}

}  // namespace qax
