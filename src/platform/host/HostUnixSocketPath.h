// Claiming a Unix socket path under the runtime directory: the directory is created with mode
// 0700 when missing, a socket file left behind by a process that is gone is removed, and a
// path some live process still serves is refused. Stateless; any thread.
#pragma once

#include <string>

namespace qax {

enum class SocketPathState { Free, Stale, InUse, Invalid };

class HostUnixSocketPath {
  public:
    // Creates the directory (and missing parents) with mode 0700; false when it cannot.
    static bool prepareDirectory(const std::string& directory, std::string* error);
    // Whether something answers at `path`, for a stream or datagram socket type.
    static SocketPathState probe(const std::string& path, int socketType);
    // Prepares the directory and clears a stale socket file; false (with `error`) when the
    // path is too long, the directory cannot be made or a live process serves the path.
    static bool claim(const std::string& path, int socketType, std::string* error);
    // Longest path a Unix socket address holds.
    static std::size_t maxLength();
};

}  // namespace qax
