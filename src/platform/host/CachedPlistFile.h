// A property-list file of the platform root (device.plist, features.plist, ...), parsed
// once per change: the file is re-read only when its identity or modification time
// changes, and the file on disk stays the truth. A missing or malformed file reads as
// none. Within a FileSnapshotScope the file is looked at once, and not at all while its
// directory has seen no change (FileChangeMonitor). Readers share the parsed
// content (it is never changed in place), so a read copies nothing. Thread-safe.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "core/Value.h"

namespace qax {

class CachedPlistFile {
  public:
    explicit CachedPlistFile(std::string path) : path_(std::move(path)) {}

    // `present`, when given, says whether the file is there, or cannot be looked at for
    // another reason than its absence (an unreadable file is not a missing one).
    std::shared_ptr<const Value> read(bool* present = nullptr);
    const std::string& path() const { return path_; }

  private:
    std::string path_;
    std::mutex mutex_;
    bool loaded_ = false;
    dev_t dev_ = 0;
    ino_t ino_ = 0;
    off_t size_ = -1;
    long long mtimeNs_ = -1;
    bool present_ = false;
    // The directory's stamp taken before the file was last looked at.
    std::uint64_t stamp_ = 0;
    std::shared_ptr<const Value> value_;
    // The FileSnapshotScope in which the file was last looked at.
    std::uint64_t checkedInScope_ = 0;
};

}  // namespace qax
