// The preference domain as a property-list file (com.velmora.qaxagent.plist under
// $HOME/Library/Preferences). Registered defaults live in memory only. Every write is a
// read-modify-write of the file under an advisory lock, replaced atomically; reads reload
// the file when its identity or modification time changed, so edits by another process
// (qaxctl) are seen on the next read (within a FileSnapshotScope, the file is looked at once).
// Thread-safe (one mutex).
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <mutex>
#include <string>

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
    bool modify(std::string_view key, const Value* value);

    const std::string path_;
    std::mutex mutex_;
    Value::Dictionary defaults_;
    Value::Dictionary stored_;
    FileIdentity loaded_;
    bool loadedOnce_ = false;
    // The FileSnapshotScope in which the file was last looked at.
    std::uint64_t checkedInScope_ = 0;
};

}  // namespace qax
