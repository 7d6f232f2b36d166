#include "platform/host/HostFileLock.h"

#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>

namespace qax {

HostFileLock::HostFileLock(const std::string& lockPath) {
    std::error_code ec;
    std::filesystem::create_directories(std::filesystem::path(lockPath).parent_path(), ec);
    fd_ = ::open(lockPath.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
    if (fd_ < 0) {
        return;
    }
    int rc;
    while ((rc = ::flock(fd_, LOCK_EX)) != 0 && errno == EINTR) {
    }
    locked_ = rc == 0;
}

HostFileLock::~HostFileLock() {
    if (fd_ >= 0) {
        if (locked_) {
            ::flock(fd_, LOCK_UN);
        }
        ::close(fd_);
    }
}

}  // namespace qax
