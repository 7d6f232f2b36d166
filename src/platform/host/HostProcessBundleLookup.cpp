#include "platform/host/HostProcessBundleLookup.h"

#include <unistd.h>

#include <string>

namespace qax {

int HostProcessBundleLookup::executablePathForProcess(pid_t pid, char* buffer, std::size_t size) {
    if (pid <= 0 || !buffer || size == 0) {
        return 0;
    }
    const std::string link = "/proc/" + std::to_string(pid) + "/exe";
    const ssize_t n = ::readlink(link.c_str(), buffer, size);
    // A path that fills the buffer may have been cut short.
    if (n <= 0 || static_cast<std::size_t>(n) >= size) {
        return 0;
    }
    return static_cast<int>(n);
}

std::optional<std::string> HostProcessBundleLookup::bundleIdentifierForExecutablePath(
    const std::string& path) {
    if (!applications_) {
        return std::nullopt;
    }
    auto record = applications_->applicationForExecutablePath(path);
    if (!record) {
        return std::nullopt;
    }
    return record->bundleIdentifier;
}

}  // namespace qax
