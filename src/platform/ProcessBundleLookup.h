// From a running process to the application bundle it belongs to. Thread-safe.
#pragma once

#include <sys/types.h>
#include <cstddef>
#include <optional>
#include <string>

namespace qax {

class ProcessBundleLookup {
  public:
    virtual ~ProcessBundleLookup() = default;
    // Writes the path of the process's executable (not NUL-terminated) into `buffer` and
    // returns the number of bytes written; 0 or less on failure.
    virtual int executablePathForProcess(pid_t pid, char* buffer, std::size_t size) = 0;
    // The bundle identifier of the application whose executable is at `path`; none when the
    // executable is not inside a bundle.
    virtual std::optional<std::string> bundleIdentifierForExecutablePath(
        const std::string& path) = 0;
};

}  // namespace qax
