#include "core/FileChangeMonitor.h"

#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "core/FileSnapshotScope.h"

namespace qax {
namespace {

// Everything that can change what a path in the directory reads as. (Closing a file opened
// for writing is not among them: a lock file is opened so, and written is already seen.)
constexpr std::uint32_t kWatchedEvents = IN_MODIFY | IN_ATTRIB | IN_MOVED_FROM | IN_MOVED_TO |
                                         IN_CREATE | IN_DELETE | IN_DELETE_SELF | IN_MOVE_SELF |
                                         IN_ONLYDIR;

std::string_view directoryOf(std::string_view path) {
    const auto slash = path.rfind('/');
    if (slash == std::string_view::npos) {
        return ".";
    }
    return slash == 0 ? std::string_view("/") : path.substr(0, slash);
}

}  // namespace

FileChangeMonitor& FileChangeMonitor::shared() {
    static FileChangeMonitor monitor;
    return monitor;
}

FileChangeMonitor::FileChangeMonitor() : fd_(inotify_init1(IN_NONBLOCK | IN_CLOEXEC)) {}

FileChangeMonitor::~FileChangeMonitor() {
    if (fd_ >= 0) {
        ::close(fd_);
    }
}

void FileChangeMonitor::drainLocked() {
    alignas(inotify_event) char buffer[4096];
    for (;;) {
        const ssize_t n = ::read(fd_, buffer, sizeof buffer);
        if (n <= 0) {
            // Nothing pending (EAGAIN), or the descriptor is unusable: then every stamp taken
            // so far is void.
            if (n < 0 && errno != EAGAIN && errno != EINTR) {
                watches_.clear();
                directories_.clear();
            }
            if (n < 0 && errno == EINTR) {
                continue;
            }
            return;
        }
        for (ssize_t at = 0; at < n;) {
            const auto* event = reinterpret_cast<const inotify_event*>(buffer + at);
            at += static_cast<ssize_t>(sizeof(inotify_event) + event->len);
            if (event->mask & IN_Q_OVERFLOW) {
                // Notices were lost: nothing is known any more.
                for (auto& [directory, watch] : watches_) {
                    watch.generation = ++lastGeneration_;
                }
                continue;
            }
            auto it = directories_.find(event->wd);
            if (it == directories_.end()) {
                continue;
            }
            if (event->mask & (IN_IGNORED | IN_DELETE_SELF | IN_MOVE_SELF | IN_UNMOUNT)) {
                // The directory went: its watch ends, and the path is watched afresh (with a
                // new generation) when next asked about.
                inotify_rm_watch(fd_, event->wd);
                watches_.erase(it->second);
                directories_.erase(it);
                continue;
            }
            watches_[it->second].generation = ++lastGeneration_;
        }
    }
}

FileChangeMonitor::Watch* FileChangeMonitor::watchLocked(std::string_view directory) {
    auto it = watches_.find(std::string(directory));
    if (it != watches_.end()) {
        return &it->second;
    }
    const std::string path(directory);
    const int wd = inotify_add_watch(fd_, path.c_str(), kWatchedEvents);
    if (wd < 0) {
        return nullptr;
    }
    // A directory watched under two names (links) shares one descriptor: the first name keeps
    // it, the other is looked at every time.
    if (auto other = directories_.find(wd); other != directories_.end() && other->second != path) {
        return nullptr;
    }
    directories_[wd] = path;
    Watch& watch = watches_[path];
    watch.descriptor = wd;
    watch.generation = ++lastGeneration_;
    return &watch;
}

std::uint64_t FileChangeMonitor::stamp(const std::string& path) {
    if (fd_ < 0) {
        return 0;
    }
    struct stat st {};
    if (::lstat(path.c_str(), &st) == 0 && S_ISLNK(st.st_mode)) {
        return 0;
    }
    std::lock_guard lock(mutex_);
    drainLocked();
    Watch* watch = watchLocked(directoryOf(path));
    return watch ? watch->generation : 0;
}

bool FileChangeMonitor::holds(const std::string& path, std::uint64_t stamp) {
    if (stamp == 0 || fd_ < 0) {
        return false;
    }
    // Within one piece of work the notices are read once, at its first question: the work
    // sees the files as they stood then.
    thread_local std::uint64_t drainedInScope = 0;
    const std::uint64_t scope = FileSnapshotScope::current();
    std::lock_guard lock(mutex_);
    if (scope == 0 || scope != drainedInScope) {
        drainLocked();
        drainedInScope = scope;
    }
    auto it = watches_.find(std::string(directoryOf(path)));
    return it != watches_.end() && it->second.generation == stamp;
}

}  // namespace qax
