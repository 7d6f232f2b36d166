#include "platform/host/JsonLinesFile.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>

#include "core/JsonCodec.h"

namespace qax {

bool JsonLinesFile::append(const std::string& path, const Value& record, std::string* error) {
    std::string line = toJsonString(record);
    line += '\n';
    std::error_code ec;
    std::filesystem::create_directories(std::filesystem::path(path).parent_path(), ec);
    const int fd = ::open(path.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0600);
    if (fd < 0) {
        if (error) {
            *error = "cannot open " + path + ": " + std::strerror(errno);
        }
        return false;
    }
    ssize_t n;
    while ((n = ::write(fd, line.data(), line.size())) < 0 && errno == EINTR) {
    }
    const bool ok = n == static_cast<ssize_t>(line.size());
    if (!ok && error) {
        *error = "cannot append to " + path +
                 (n < 0 ? std::string(": ") + std::strerror(errno) : std::string(": short write"));
    }
    ::close(fd);
    return ok;
}

}  // namespace qax
