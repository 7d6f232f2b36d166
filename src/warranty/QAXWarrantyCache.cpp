// The per-device warranty cache: one XML property list per serial number (named by the
// serial number's digest) under the home directory, the legacy single-file cache of earlier
// releases, and the one-time move from the one to the other. Files are replaced atomically
// (written aside, flushed, renamed, directory flushed), so a reader sees the old file or the
// new one. A cache file is parsed once per change: what was parsed is kept by path with the
// file's identity, size and times, and used while a stat() finds them unchanged, so the file
// stays the truth. Any thread (the parsed files are behind a mutex).
#include <sys/stat.h>

#include <ctime>
#include <filesystem>
#include <mutex>
#include <system_error>
#include <unordered_map>

#include "core/AtomicFile.h"
#include "core/Clock.h"
#include "core/FileChangeMonitor.h"
#include "core/Hash.h"
#include "core/Log.h"
#include "core/PlistCodec.h"
#include "platform/Platform.h"
#include "platform/PreferenceStore.h"
#include "warranty/QAXWarranty.h"

namespace qax {
namespace {

namespace fs = std::filesystem;

constexpr const char* kLegacyWarrantyFile =
    "Library/Application Support/com.velmora.Kestova/Warranty.plist";
constexpr const char* kWarrantyFileFormat =
    "Library/Application Support/com.velmora.Kestova/%@_Warranty.plist";
constexpr const char* kSerialNumberPlaceholder = "%@";

// Legacy preference keys; their per-serial forms are the serial number's digest, "_", and
// the same name.
constexpr const char* kLegacyCacheKeys[] = {
    "CachedWarrantyLastUpdatedDate",
    "CachedWarrantyLocale",
    "CachedWarrantyVersion",
};

std::string pathForSerialNumber(const Platform& platform,
                                const std::optional<std::string>& serialNumber) {
    if (!serialNumber) {
        return QAXWarranty::_legacyWarrantyPath(platform);
    }
    // The placeholder is the file name's; the home directory may hold a '%' of its own.
    std::string path = QAXWarranty::_warrantyPathForSerialNumberFormat(platform);
    const auto at = path.rfind(kSerialNumberPlaceholder);
    return path.replace(at, std::char_traits<char>::length(kSerialNumberPlaceholder),
                        sha256Hash(*serialNumber));
}

// Parsed cache files by path, looked at again only once their directory has seen a change
// (FileChangeMonitor), then compared by identity. Few devices are ever cached, so the table
// stays small; past the bound it starts again.
class ParsedFiles {
  public:
    // The file's root dictionary; none for a missing, unreadable or malformed file or any
    // other root.
    std::shared_ptr<const Value> read(const std::string& path) {
        FileChangeMonitor& monitor = FileChangeMonitor::shared();
        {
            // Nothing has changed in the file's directory since it was parsed.
            std::lock_guard lock(mutex_);
            if (auto it = files_.find(path);
                it != files_.end() && monitor.holds(path, it->second.stamp)) {
                return it->second.value;
            }
        }
        const std::uint64_t stamp = monitor.stamp(path);
        struct stat st {};
        if (::stat(path.c_str(), &st) != 0) {
            forget(path);
            return nullptr;
        }
        const Identity identity = identityOf(st);
        {
            std::lock_guard lock(mutex_);
            if (auto it = files_.find(path);
                it != files_.end() && it->second.settled && it->second.identity == identity) {
                it->second.stamp = stamp;
                return it->second.value;
            }
        }
        // Read after the stat: a file replaced in between is newer than the identity kept
        // with it, so the next stat sees the change and reads it again.
        const long long readNs = fileSystemTimeNs();
        std::shared_ptr<const Value> value;
        if (auto bytes = readWholeFile(path, kMaxPlistBytes)) {
            if (auto parsed = parsePlist(*bytes); parsed && parsed->isDictionary()) {
                value = std::make_shared<const Value>(std::move(*parsed));
            }
        }
        std::lock_guard lock(mutex_);
        if (files_.size() >= kMaxFiles) {
            files_.clear();
        }
        // File times advance in clock ticks: a file changed within a tick of this read could
        // change again without its times moving, so it is parsed again until it is older.
        const bool settled = readNs - identity.modifiedNs > kTimeGranularityNs &&
                             readNs - identity.changedNs > kTimeGranularityNs;
        // Notices tell apart changes that file times cannot: with a stamp, an unsettled file is
        // not read again while nothing changes.
        files_.insert_or_assign(path, Parsed{identity, settled, stamp, value});
        return value;
    }

    // Called after this process has written or removed the file.
    void forget(const std::string& path) {
        std::lock_guard lock(mutex_);
        files_.erase(path);
    }

  private:
    struct Identity {
        dev_t device = 0;
        ino_t inode = 0;
        off_t size = 0;
        long long modifiedNs = 0;
        long long changedNs = 0;
        bool operator==(const Identity&) const = default;
    };
    struct Parsed {
        Identity identity;
        bool settled = false;
        std::uint64_t stamp = 0;             // the directory's, taken before the file was looked at
        std::shared_ptr<const Value> value;  // shared with the records built from it
    };
    static constexpr std::size_t kMaxFiles = 64;
    // Coarser than any file system's timestamp tick.
    static constexpr long long kTimeGranularityNs = 50'000'000;

    static long long toNs(const timespec& t) { return t.tv_sec * 1'000'000'000LL + t.tv_nsec; }
    static Identity identityOf(const struct stat& st) {
        return {st.st_dev, st.st_ino, st.st_size, toNs(st.st_mtim), toNs(st.st_ctim)};
    }

    std::mutex mutex_;
    std::unordered_map<std::string, Parsed> files_;
};

ParsedFiles& parsedFiles() {
    static ParsedFiles files;
    return files;
}

std::shared_ptr<const Value> readDictionary(const std::string& path) {
    return parsedFiles().read(path);
}

}  // namespace

std::string QAXWarranty::_legacyWarrantyPath(const Platform& platform) {
    return (fs::path(platform.homeDirectory) / kLegacyWarrantyFile).string();
}

std::string QAXWarranty::_warrantyPathForSerialNumberFormat(const Platform& platform) {
    return (fs::path(platform.homeDirectory) / kWarrantyFileFormat).string();
}

bool QAXWarranty::cacheWarranty(const std::optional<std::string>& serialNumber) const {
    const std::string path = pathForSerialNumber(*platform(), serialNumber);
    qaxLog().info("%s -> %@", "-[QAXWarranty cacheWarranty:]", path);
    std::error_code ignored;
    fs::create_directories(fs::path(path).parent_path(), ignored);
    auto xml = toXmlPlist(dictionaryRepresentation());
    std::string error = "the summary has no property-list form";
    const bool written = xml && writeFileAtomically(path, *xml, &error);
    parsedFiles().forget(path);
    if (!written) {
        qaxLog().error("Unable to write the warranty cache %@: %@", path, error);
        return false;
    }
    return true;
}

bool QAXWarranty::cache() const {
    return cacheWarranty(std::nullopt);
}

std::shared_ptr<QAXWarranty> QAXWarranty::cachedWarrantyForSerialNumber(
    std::shared_ptr<Platform> platform, const std::optional<std::string>& serialNumber) {
    const std::string path = pathForSerialNumber(*platform, serialNumber);
    qaxLog().info("%s : warrantyPath : %@", "+[QAXWarranty cachedWarrantyForSerialNumber:]", path);
    return warrantyWithSharedDictionary(std::move(platform), readDictionary(path));
}

std::shared_ptr<QAXWarranty> QAXWarranty::migrateLegacyCachedWarrantyIfNeededForSerialNumber(
    std::shared_ptr<Platform> platform, const std::string& serialNumber) {
    const std::string legacyPath = _legacyWarrantyPath(*platform);
    auto warranty = warrantyWithSharedDictionary(platform, readDictionary(legacyPath));
    if (!warranty) {
        return nullptr;
    }
    qaxLog().info("Migrating legacy warranty..");
    warranty->cacheWarranty(serialNumber);

    PreferenceStore& preferences = *platform->preferences;
    const std::string hash = sha256Hash(serialNumber);
    for (const char* legacyKey : kLegacyCacheKeys) {
        if (auto value = preferences.objectForKey(legacyKey)) {
            preferences.setObject(hash + "_" + legacyKey, *value);
            preferences.removeObject(legacyKey);
        }
    }
    std::error_code ignored;
    fs::remove(legacyPath, ignored);
    parsedFiles().forget(legacyPath);
    return warranty;
}

}  // namespace qax
