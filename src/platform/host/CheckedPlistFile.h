// A property-list file of the platform root whose root must be of one kind (dictionary or
// array). Read afresh on every call, so the file on disk is always the truth. A missing file
// reads as none without a word; one that is empty, unreadable, truncated, nested too deep or
// has another root kind reads as none and is logged once per version of the file (identity,
// size, modification time), so a bad file does not flood the log. Never writes.
// Thread-safe (one mutex around the last reported version).
#pragma once

#include <sys/types.h>

#include <mutex>
#include <optional>
#include <string>

#include "core/Value.h"

namespace qax {

class CheckedPlistFile {
  public:
    CheckedPlistFile(std::string path, Value::Kind rootKind)
        : path_(std::move(path)), rootKind_(rootKind) {}

    std::optional<Value> read();
    const std::string& path() const { return path_; }

  private:
    struct Version {
        dev_t dev = 0;
        ino_t ino = 0;
        off_t size = -1;
        long long mtimeNs = -1;
        bool operator==(const Version&) const = default;
    };
    void reportOnce(const Version& version, const std::string& reason);

    const std::string path_;
    const Value::Kind rootKind_;
    std::mutex mutex_;
    std::optional<Version> reported_;
};

}  // namespace qax
