#include "platform/host/HostSocketActivation.h"

#include <sys/socket.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>

#include "core/Log.h"

namespace qax {

std::optional<int> HostSocketActivation::takeListeningSocket() {
    if (!std::getenv("LISTEN_FDS")) {
        // Started by hand: leave the environment alone (clearing it races other threads).
        return std::nullopt;
    }
    const int count = sd_listen_fds(1);
    if (count < 0) {
        qaxLog().error("Cannot read the sockets passed to the agent: %s", std::strerror(-count));
        return std::nullopt;
    }
    std::optional<int> listening;
    for (int fd = SD_LISTEN_FDS_START; fd < SD_LISTEN_FDS_START + count; ++fd) {
        if (!listening && sd_is_socket_unix(fd, SOCK_STREAM, 1, nullptr, 0) > 0) {
            listening = fd;
            continue;
        }
        qaxLog().error("Ignoring passed descriptor %d: not a listening Unix stream socket", fd);
        ::close(fd);
    }
    if (listening) {
        qaxLog().info(
            "Started on demand: serving the listening socket passed by the service "
            "manager");
    }
    return listening;
}

void HostSocketActivation::notifyReady() {
    sd_notify(0, "READY=1\nSTATUS=Serving clients");
}

void HostSocketActivation::notifyStopping() {
    sd_notify(0, "STOPPING=1");
}

}  // namespace qax
