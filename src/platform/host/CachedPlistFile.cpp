#include "platform/host/CachedPlistFile.h"

#include <sys/stat.h>

#include <cerrno>

#include "core/AtomicFile.h"
#include "core/FileChangeMonitor.h"
#include "core/FileSnapshotScope.h"
#include "core/Log.h"
#include "core/PlistCodec.h"

namespace qax {

std::shared_ptr<const Value> CachedPlistFile::read(bool* present) {
    const std::uint64_t scope = FileSnapshotScope::current();
    FileChangeMonitor& monitor = FileChangeMonitor::shared();
    {
        std::lock_guard lock(mutex_);
        // Looked at already during this piece of work, or nothing has changed since.
        if (loaded_ && ((scope != 0 && scope == checkedInScope_) || monitor.holds(path_, stamp_))) {
            checkedInScope_ = scope;
            if (present) {
                *present = present_;
            }
            return value_;
        }
    }
    const std::uint64_t stamp = monitor.stamp(path_);
    struct stat st {};
    const bool exists = ::stat(path_.c_str(), &st) == 0;
    const bool there = exists || (errno != ENOENT && errno != ENOTDIR);
    if (present) {
        *present = there;
    }
    const long long mtimeNs =
        exists ? static_cast<long long>(st.st_mtim.tv_sec) * 1'000'000'000LL + st.st_mtim.tv_nsec
               : -1;
    std::lock_guard lock(mutex_);
    checkedInScope_ = scope;
    present_ = there;
    stamp_ = stamp;
    if (loaded_ && (exists ? (st.st_dev == dev_ && st.st_ino == ino_ && st.st_size == size_ &&
                              mtimeNs == mtimeNs_)
                           : size_ == -1)) {
        return value_;
    }
    loaded_ = true;
    dev_ = exists ? st.st_dev : 0;
    ino_ = exists ? st.st_ino : 0;
    size_ = exists ? st.st_size : -1;
    mtimeNs_ = mtimeNs;
    value_.reset();
    if (!exists) {
        return value_;
    }
    auto bytes = readWholeFile(path_, kMaxPlistBytes);
    std::string error;
    if (bytes) {
        if (auto parsed = parsePlist(*bytes, &error)) {
            value_ = std::make_shared<const Value>(std::move(*parsed));
        }
    }
    if (!value_) {
        qaxLog().error("Ignoring unreadable platform file '%@': %@", path_,
                       bytes ? error : std::string("cannot be read"));
    }
    return value_;
}

}  // namespace qax
