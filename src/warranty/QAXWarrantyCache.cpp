// The per-device warranty cache: one XML property list per serial number (named by the
// serial number's digest) under the home directory, the legacy single-file cache of earlier
// releases, and the one-time move from the one to the other. Files are replaced atomically
// (written aside, flushed, renamed, directory flushed), so a reader sees the old file or the
// new one. No lock of its own; any thread.
#include <filesystem>
#include <system_error>

#include "core/AtomicFile.h"
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

// The file's root dictionary; none for a missing, unreadable or malformed file or any other
// root.
std::optional<Value> readDictionary(const std::string& path) {
    auto bytes = readWholeFile(path, kMaxPlistBytes);
    if (!bytes) {
        return std::nullopt;
    }
    auto value = parsePlist(*bytes);
    if (!value || !value->isDictionary()) {
        return std::nullopt;
    }
    return value;
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
    if (!xml || !writeFileAtomically(path, *xml, &error)) {
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
    return warrantyWithDictionary(std::move(platform), readDictionary(path));
}

std::shared_ptr<QAXWarranty> QAXWarranty::migrateLegacyCachedWarrantyIfNeededForSerialNumber(
    std::shared_ptr<Platform> platform, const std::string& serialNumber) {
    const std::string legacyPath = _legacyWarrantyPath(*platform);
    auto warranty = warrantyWithDictionary(platform, readDictionary(legacyPath));
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
    return warranty;
}

}  // namespace qax
