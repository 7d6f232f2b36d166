#include "platform/host/HostUnixSocketPath.h"

#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>

namespace qax {

std::size_t HostUnixSocketPath::maxLength() {
    return sizeof(sockaddr_un::sun_path) - 1;
}

bool HostUnixSocketPath::prepareDirectory(const std::string& directory, std::string* error) {
    std::filesystem::path dir(directory);
    std::error_code ec;
    if (std::filesystem::is_directory(dir, ec)) {
        return true;
    }
    // Parents are ordinary directories; only the socket directory itself is private.
    if (dir.has_parent_path()) {
        std::filesystem::create_directories(dir.parent_path(), ec);
    }
    if (::mkdir(dir.c_str(), 0700) != 0 && errno != EEXIST) {
        if (error) {
            *error = "cannot create " + directory + ": " + std::strerror(errno);
        }
        return false;
    }
    return true;
}

SocketPathState HostUnixSocketPath::probe(const std::string& path, int socketType) {
    if (path.empty() || path.size() > maxLength()) {
        return SocketPathState::Invalid;
    }
    struct stat st {};
    if (::lstat(path.c_str(), &st) != 0) {
        return SocketPathState::Free;
    }
    if (!S_ISSOCK(st.st_mode)) {
        return SocketPathState::Invalid;
    }
    const int fd = ::socket(AF_UNIX, socketType | SOCK_CLOEXEC, 0);
    if (fd < 0) {
        return SocketPathState::Invalid;
    }
    sockaddr_un addr{};
    addr.sun_family = AF_UNIX;
    std::memcpy(addr.sun_path, path.c_str(), path.size());
    const int rc = ::connect(fd, reinterpret_cast<const sockaddr*>(&addr), sizeof(addr));
    const int err = errno;
    ::close(fd);
    if (rc == 0) {
        return SocketPathState::InUse;
    }
    return err == ECONNREFUSED ? SocketPathState::Stale : SocketPathState::InUse;
}

bool HostUnixSocketPath::claim(const std::string& path, int socketType, std::string* error) {
    auto fail = [&](std::string text) {
        if (error) {
            *error = std::move(text);
        }
        return false;
    };
    if (path.size() > maxLength()) {
        return fail("socket path too long: " + path);
    }
    if (!prepareDirectory(std::filesystem::path(path).parent_path().string(), error)) {
        return false;
    }
    switch (probe(path, socketType)) {
        case SocketPathState::Free:
            return true;
        case SocketPathState::Stale:
            if (::unlink(path.c_str()) != 0 && errno != ENOENT) {
                return fail("cannot remove stale socket " + path + ": " + std::strerror(errno));
            }
            return true;
        case SocketPathState::InUse:
            return fail("another process serves " + path);
        case SocketPathState::Invalid:
            break;
    }
    return fail("cannot use " + path + " as a socket path");
}

}  // namespace qax
