#include "platform/host/FilePreferenceStore.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>

#include "core/AtomicFile.h"
#include "core/FileChangeMonitor.h"
#include "core/FileSnapshotScope.h"
#include "core/Log.h"
#include "core/PlistCodec.h"

namespace qax {
namespace {

constexpr const char* kDomainFileName = "com.velmora.qaxagent.plist";

// An advisory lock on a side file, so that the agent and qaxctl never interleave a
// read-modify-write of the domain file. The lock file is never replaced, unlike the domain.
class FileLock {
  public:
    FileLock(const std::string& path, int operation) {
        std::error_code ec;
        std::filesystem::create_directories(std::filesystem::path(path).parent_path(), ec);
        fd_ = ::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
        if (fd_ >= 0) {
            while (flock(fd_, operation) != 0 && errno == EINTR) {
            }
        }
    }
    ~FileLock() {
        if (fd_ >= 0) {
            flock(fd_, LOCK_UN);
            ::close(fd_);
        }
    }
    FileLock(const FileLock&) = delete;
    FileLock& operator=(const FileLock&) = delete;

  private:
    int fd_ = -1;
};

}  // namespace

FilePreferenceStore::FilePreferenceStore(std::string path) : path_(std::move(path)) {}

std::string FilePreferenceStore::domainPath(const std::string& homeDirectory) {
    return (std::filesystem::path(homeDirectory) / "Library" / "Preferences" / kDomainFileName)
        .string();
}

FilePreferenceStore::FileIdentity FilePreferenceStore::currentIdentity() const {
    struct stat st {};
    FileIdentity id;
    if (::stat(path_.c_str(), &st) != 0) {
        return id;
    }
    id.exists = true;
    id.dev = st.st_dev;
    id.ino = st.st_ino;
    id.size = st.st_size;
    id.mtimeNs = static_cast<long long>(st.st_mtim.tv_sec) * 1'000'000'000LL + st.st_mtim.tv_nsec;
    return id;
}

Value::Dictionary FilePreferenceStore::loadLocked(const FileIdentity& identity) {
    if (!identity.exists) {
        return {};
    }
    auto bytes = readWholeFile(path_, kMaxPlistBytes);
    std::string error;
    std::optional<Value> root;
    if (!bytes) {
        error = "cannot be read";
    } else if (bytes->empty()) {
        return {};
    } else {
        root = parsePlist(*bytes, &error);
    }
    if (root && root->isDictionary()) {
        return std::move(*root->asDictionary());
    }
    if (root) {
        error = "its root is not a dictionary";
    }
    qaxLog().error("Preference domain file '%@' is unreadable (%@); reading it as empty", path_,
                   error);
    return {};
}

void FilePreferenceStore::refreshLocked() {
    const std::uint64_t scope = FileSnapshotScope::current();
    FileChangeMonitor& monitor = FileChangeMonitor::shared();
    // Looked at already during this piece of work, or nothing has changed since.
    if (loadedOnce_ && ((scope != 0 && scope == checkedInScope_) || monitor.holds(path_, stamp_))) {
        checkedInScope_ = scope;
        return;
    }
    checkedInScope_ = scope;
    stamp_ = monitor.stamp(path_);
    FileIdentity id = currentIdentity();
    if (loadedOnce_ && id == loaded_) {
        return;
    }
    FileLock lock(path_ + ".lock", LOCK_SH);
    id = currentIdentity();
    stored_ = loadLocked(id);
    loaded_ = id;
    loadedOnce_ = true;
}

void FilePreferenceStore::registerDefaults(const Value::Dictionary& defaults) {
    std::lock_guard lock(mutex_);
    for (const auto& [k, v] : defaults) {
        defaults_.insert_or_assign(k, v);
    }
}

std::optional<Value> FilePreferenceStore::objectForKey(std::string_view key) {
    std::lock_guard lock(mutex_);
    refreshLocked();
    if (auto it = stored_.find(key); it != stored_.end()) {
        return it->second;
    }
    if (auto it = defaults_.find(key); it != defaults_.end()) {
        return it->second;
    }
    return std::nullopt;
}

bool FilePreferenceStore::modify(std::string_view key, const Value* value) {
    // Refused on its own, before it can spoil the batch it would join.
    if (value && !toXmlPlist(*value)) {
        qaxLog().error("Cannot store a value under '%@': it has no property-list form", key);
        return false;
    }
    // Changes made while the file is being written go out together in the next write: each
    // write costs two flushes to disk, and downloads finishing together change keys together.
    std::unique_lock lock(mutex_);
    Change change{key, value};
    pending_.push_back(&change);
    while (!change.done) {
        if (writing_) {
            written_.wait(lock);
            continue;
        }
        writing_ = true;
        std::vector<Change*> batch;
        batch.swap(pending_);
        lock.unlock();
        const bool ok = writeBatch(batch);
        lock.lock();
        for (Change* c : batch) {
            c->ok = ok;
            c->done = true;
        }
        writing_ = false;
        written_.notify_all();
    }
    return change.ok;
}

bool FilePreferenceStore::writeBatch(const std::vector<Change*>& batch) {
    Value::Dictionary next;
    FileIdentity written;
    {
        FileLock fileLock(path_ + ".lock", LOCK_EX);
        // Start from the file as it is now, not from what this process read earlier, so that
        // another writer's keys survive.
        written = currentIdentity();
        next = loadLocked(written);
        bool changed = false;
        for (const Change* c : batch) {
            if (c->value) {
                next.insert_or_assign(std::string(c->key), *c->value);
                changed = true;
            } else if (auto it = next.find(c->key); it != next.end()) {
                next.erase(it);
                changed = true;
            }
        }
        if (changed) {
            // Every value was checked alone, so the whole has a property-list form.
            const auto xml = toXmlPlist(Value(next));
            std::string error;
            if (!xml || !writeFileAtomically(path_, *xml, &error, 0600)) {
                qaxLog().error("Cannot write preference domain file '%@': %@", path_, error);
                return false;
            }
            written = currentIdentity();
        }
    }
    // Only once the file lock is let go: a reader holding mutex_ may be waiting for it.
    std::lock_guard lock(mutex_);
    stored_ = std::move(next);
    loaded_ = written;
    loadedOnce_ = true;
    return true;
}

bool FilePreferenceStore::setObject(std::string_view key, const Value& value) {
    return modify(key, &value);
}

bool FilePreferenceStore::removeObject(std::string_view key) {
    return modify(key, nullptr);
}

std::vector<std::string> FilePreferenceStore::allKeys() {
    std::lock_guard lock(mutex_);
    refreshLocked();
    std::vector<std::string> keys;
    keys.reserve(stored_.size());
    for (const auto& [k, v] : stored_) {
        keys.push_back(k);
    }
    return keys;
}

Value::Dictionary FilePreferenceStore::storedValues() {
    std::lock_guard lock(mutex_);
    refreshLocked();
    return stored_;
}

}  // namespace qax
