#include "platform/host/CheckedPlistFile.h"

#include <sys/stat.h>

#include "core/AtomicFile.h"
#include "core/Log.h"
#include "core/PlistCodec.h"

namespace qax {

std::optional<Value> CheckedPlistFile::read() {
    struct stat st {};
    if (::stat(path_.c_str(), &st) != 0) {
        return std::nullopt;
    }
    const Version version{
        st.st_dev, st.st_ino, st.st_size,
        static_cast<long long>(st.st_mtim.tv_sec) * 1'000'000'000LL + st.st_mtim.tv_nsec};
    auto bytes = readWholeFile(path_, kMaxPlistBytes);
    if (!bytes) {
        reportOnce(version, "it cannot be read");
        return std::nullopt;
    }
    if (bytes->empty()) {
        reportOnce(version, "it is empty");
        return std::nullopt;
    }
    std::string error;
    auto root = parsePlist(*bytes, &error);
    if (!root) {
        reportOnce(version, error);
        return std::nullopt;
    }
    if (root->kind() != rootKind_) {
        reportOnce(version, std::string("its root is ") + Value::kindName(root->kind()) + ", not " +
                                Value::kindName(rootKind_));
        return std::nullopt;
    }
    return root;
}

void CheckedPlistFile::reportOnce(const Version& version, const std::string& reason) {
    {
        std::lock_guard lock(mutex_);
        if (reported_ == version) {
            return;
        }
        reported_ = version;
    }
    qaxLog().error("Ignoring platform file '%@' (%@); it reads as empty until it is rewritten",
                   path_, reason);
}

}  // namespace qax
