// The preference domain as a property-list file (com.velmora.qaxagent.plist under
// $HOME/Library/Preferences). Registered defaults live in memory only. Every write is a
// read-modify-write of the file under an advisory lock, replaced atomically; reads reload
// the file when its identity or modification time changed, so edits by another process
// (qaxctl) are seen on the next read (within a FileSnapshotScope, the file is looked at once).
// Writes made at the same time from several threads share one write of the file; each
// returns once its change is on disk. Thread-safe (one mutex; the file is written outside it).
#pragma once

#include <sys/types.h>

#include <condition_variable>
#include <cstdint>
#include <mutex>
#include <string>
#include <vector>

#include "platform/PreferenceStore.h"

namespace qax {

class FilePreferenceStore : public PreferenceStore {
  public:
    explicit FilePreferenceStore(std::string path);

    void registerDefaults(const Value::Dictionary& defaults) override;
    std::optional<Value> objectForKey(std::string_view key) override;
    bool setObject(std::string_view key, const Value& value) override;
    bool removeObject(std::string_view key) override;
    std::vector<std::string> allKeys() override;

    // The stored values only (no defaults), as on disk now.
    Value::Dictionary storedValues();
    const std::string& path() const { return path_; }

    static std::string domainPath(const std::string& homeDirectory);

  private:
    struct FileIdentity {
        dev_t dev = 0;
        ino_t ino = 0;
        off_t size = -1;
        long long mtimeNs = -1;
        bool exists = false;
        bool operator==(const FileIdentity&) const = default;
    };

    FileIdentity currentIdentity() const;
    // Reloads the file into stored_ when it changed since it was last read. Caller holds mutex_.
    void refreshLocked();
    // Reads and parses the file; a corrupt file is logged and reads as empty.
    Value::Dictionary loadLocked(const FileIdentity& identity);
    // A change waiting to be written; `done` and `ok` are set under mutex_ once it is.
    struct Change {
        std::string_view key;
        const Value* value;  // none: remove the key
        bool done = false;
        bool ok = false;
    };
    bool modify(std::string_view key, const Value* value);
    // One read-modify-write of the file with every change of `batch`. Caller holds no lock.
    bool writeBatch(const std::vector<Change*>& batch);

    const std::string path_;
    std::mutex mutex_;
    std::condition_variable written_;
    std::vector<Change*> pending_;
    bool writing_ = false;  // a thread is writing a batch
    Value::Dictionary defaults_;
    Value::Dictionary stored_;
    FileIdentity loaded_;
    bool loadedOnce_ = false;
    // The FileSnapshotScope in which the file was last looked at.
    std::uint64_t checkedInScope_ = 0;
    // The directory's stamp taken before the file was last looked at (FileChangeMonitor).
    std::uint64_t stamp_ = 0;
};

}  // namespace qax
