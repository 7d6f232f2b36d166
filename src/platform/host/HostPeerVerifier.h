// Who is at the other end of an accepted Unix socket, checked so that a process id cannot be
// used to impersonate another program: the pid and uid come from the kernel (SO_PEERCRED), a
// pidfd pins the process, the executable is matched by device and inode against the
// application registry, the process's effective uid must still be the peer's, the executable
// must not change while it is examined, and the pidfd must show the process alive afterwards
// (so the pid was not reused by another process meanwhile). Any failure refuses. Stateless;
// any thread (it reads /proc and the registry, so keep it off latency-critical threads).
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>

#include "core/Value.h"
#include "platform/ApplicationRegistry.h"

namespace qax {

struct VerifiedPeer {
    pid_t pid = 0;
    uid_t uid = 0;
    // The entitlements the registry grants the peer's executable (empty when it is not
    // registered).
    Value::Dictionary entitlements;
};

class HostPeerVerifier {
  public:
    // The pid and uid the kernel recorded for the peer; none when they cannot be read.
    static std::optional<std::pair<pid_t, uid_t>> peerCredentials(int socketFd);
    // Everything above; none (with `error`) when any step fails.
    static std::optional<VerifiedPeer> verify(int socketFd, ApplicationRegistry& registry,
                                              std::string* error);
};

}  // namespace qax
