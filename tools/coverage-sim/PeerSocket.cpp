#include "PeerSocket.h"

#include <dirent.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>

#include <chrono>
#include <cstdlib>

namespace coveragesim {
namespace {

int portOf(const sockaddr_storage& address) {
    if (address.ss_family == AF_INET) {
        return ntohs(reinterpret_cast<const sockaddr_in&>(address).sin_port);
    }
    if (address.ss_family == AF_INET6) {
        return ntohs(reinterpret_cast<const sockaddr_in6&>(address).sin6_port);
    }
    return -1;
}

}  // namespace

int findAcceptedSocket(int localPort, int peerPort) {
    DIR* fds = opendir("/proc/self/fd");
    if (!fds) {
        return -1;
    }
    int found = -1;
    while (dirent* entry = readdir(fds)) {
        char* end = nullptr;
        const long fd = std::strtol(entry->d_name, &end, 10);
        if (*end != '\0' || end == entry->d_name || fd == dirfd(fds)) {
            continue;
        }
        sockaddr_storage local{}, peer{};
        socklen_t localSize = sizeof local, peerSize = sizeof peer;
        if (getsockname(static_cast<int>(fd), reinterpret_cast<sockaddr*>(&local), &localSize) !=
                0 ||
            getpeername(static_cast<int>(fd), reinterpret_cast<sockaddr*>(&peer), &peerSize) != 0) {
            continue;
        }
        if (portOf(local) == localPort && portOf(peer) == peerPort) {
            found = static_cast<int>(fd);
            break;
        }
    }
    closedir(fds);
    return found;
}

bool resetConnection(int fd) {
    // Connecting a TCP socket to AF_UNSPEC dissolves the connection; from the established
    // state the kernel answers with a reset, which is what a crashing server looks like.
    sockaddr noPeer{};
    noPeer.sa_family = AF_UNSPEC;
    return ::connect(fd, &noPeer, sizeof noPeer) == 0;
}

void waitForPeerToLeave(int fd, const std::atomic<bool>& stopping, double maxSeconds) {
    const auto deadline = std::chrono::steady_clock::now() +
                          std::chrono::duration_cast<std::chrono::steady_clock::duration>(
                              std::chrono::duration<double>(maxSeconds));
    while (!stopping && std::chrono::steady_clock::now() < deadline) {
        pollfd p{fd, POLLRDHUP, 0};
        const int ready = ::poll(&p, 1, 100);
        if (ready > 0 && (p.revents & (POLLRDHUP | POLLHUP | POLLERR | POLLNVAL))) {
            return;
        }
    }
}

}  // namespace coveragesim
