#include "platform/host/HostPeerVerifier.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <fstream>
#include <sstream>

namespace qax {
namespace {

// Closes a descriptor on every exit path.
struct FdGuard {
    int fd;
    ~FdGuard() {
        if (fd >= 0) {
            ::close(fd);
        }
    }
};

int openPidfd(pid_t pid) {
    return static_cast<int>(::syscall(SYS_pidfd_open, pid, 0));
}

// The effective uid from /proc/PID/status ("Uid: real effective saved fs").
std::optional<uid_t> effectiveUid(pid_t pid) {
    std::ifstream in("/proc/" + std::to_string(pid) + "/status");
    std::string line;
    while (std::getline(in, line)) {
        if (line.rfind("Uid:", 0) == 0) {
            std::istringstream fields(line.substr(4));
            unsigned long real = 0, effective = 0;
            if (fields >> real >> effective) {
                return static_cast<uid_t>(effective);
            }
            return std::nullopt;
        }
    }
    return std::nullopt;
}

}  // namespace

std::optional<std::pair<pid_t, uid_t>> HostPeerVerifier::peerCredentials(int socketFd) {
    ucred cred{};
    socklen_t len = sizeof(cred);
    if (::getsockopt(socketFd, SOL_SOCKET, SO_PEERCRED, &cred, &len) != 0 || len != sizeof(cred) ||
        cred.pid <= 0) {
        return std::nullopt;
    }
    return std::make_pair(cred.pid, cred.uid);
}

std::optional<VerifiedPeer> HostPeerVerifier::verify(int socketFd, ApplicationRegistry& registry,
                                                     std::string* error) {
    auto fail = [&](std::string text) -> std::optional<VerifiedPeer> {
        if (error) {
            *error = std::move(text);
        }
        return std::nullopt;
    };
    auto cred = peerCredentials(socketFd);
    if (!cred) {
        return fail(std::string("no peer credentials: ") + std::strerror(errno));
    }
    const auto [pid, uid] = *cred;

    // From here on the pidfd names this very process, whatever happens to the pid.
    FdGuard pidfd{openPidfd(pid)};
    if (pidfd.fd < 0) {
        return fail("pidfd_open(" + std::to_string(pid) + "): " + std::strerror(errno));
    }

    const std::string exe = "/proc/" + std::to_string(pid) + "/exe";
    struct stat before {};
    if (::stat(exe.c_str(), &before) != 0) {
        return fail("stat " + exe + ": " + std::strerror(errno));
    }
    Value::Dictionary entitlements = registry.entitlementsForExecutablePath(exe);

    auto euid = effectiveUid(pid);
    if (!euid) {
        return fail("cannot read the uid of process " + std::to_string(pid));
    }
    if (*euid != uid) {
        return fail("process " + std::to_string(pid) + " runs as uid " + std::to_string(*euid) +
                    ", not as the peer's uid " + std::to_string(uid));
    }

    // The process must not have replaced its executable while it was being looked up.
    struct stat after {};
    if (::stat(exe.c_str(), &after) != 0 || after.st_dev != before.st_dev ||
        after.st_ino != before.st_ino) {
        return fail("executable of process " + std::to_string(pid) + " changed");
    }

    // A pidfd turns readable once its process has exited; then the pid we examined may have
    // been another process's.
    pollfd p{pidfd.fd, POLLIN, 0};
    const int ready = ::poll(&p, 1, 0);
    if (ready != 0) {
        return fail("process " + std::to_string(pid) + " exited during the check");
    }
    return VerifiedPeer{pid, uid, std::move(entitlements)};
}

}  // namespace qax
