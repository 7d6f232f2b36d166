// Whether a file may have changed since it was last looked at, known without looking at it.
// The kernel reports every change made in a watched directory (inotify); a reader takes a
// stamp of the file's directory before it looks at the file, and as long as that stamp
// holds, nothing in the directory has changed since. Files that are read on every request
// and change rarely (platform files, the preference domain, warranty caches) then cost no
// stat() each: one non-blocking read of pending notices per piece of work (FileSnapshotScope)
// or per call outside any scope.
//
// A stamp of 0 means "unknown" and never holds: the directory cannot be watched (no inotify,
// out of watches), or the file is a symbolic link, whose target may change elsewhere.
// A directory that is removed or moved away stops being watched, and the next stamp of a
// path in it watches whatever is there then. Not seen: a change of what a symbolic link
// among the directory's own ancestors points to. Process-wide and thread-safe.
#pragma once

#include <cstdint>
#include <mutex>
#include <string>
#include <string_view>
#include <unordered_map>

namespace qax {

class FileChangeMonitor {
  public:
    static FileChangeMonitor& shared();

    // The stamp of `path`'s directory as it stands now; take it before looking at the file.
    std::uint64_t stamp(const std::string& path);
    // Whether nothing has changed in `path`'s directory since `stamp` was taken.
    bool holds(const std::string& path, std::uint64_t stamp);

    FileChangeMonitor();
    ~FileChangeMonitor();
    FileChangeMonitor(const FileChangeMonitor&) = delete;
    FileChangeMonitor& operator=(const FileChangeMonitor&) = delete;

  private:
    struct Watch {
        int descriptor = -1;
        std::uint64_t generation = 0;
    };
    // Applies the notices that have arrived (under the lock).
    void drainLocked();
    // The watch of `directory`, added if need be; none when it cannot be watched.
    Watch* watchLocked(std::string_view directory);

    int fd_ = -1;
    std::mutex mutex_;
    std::uint64_t lastGeneration_ = 0;
    std::unordered_map<std::string, Watch> watches_;
    std::unordered_map<int, std::string> directories_;
};

}  // namespace qax
