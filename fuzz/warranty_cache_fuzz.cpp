// Warranty cache files as they may be found on disk: the input is the legacy single-file cache.
// It is read as a warranty record, moved to the per-device cache the way start-up migrates it,
// and read back from there. A record that was moved must read back, and the legacy file
// must be gone.
#include <sys/stat.h>
#include <unistd.h>

#include <cstddef>
#include <cstdint>
#include <string>

#include "FuzzPlatform.h"
#include "core/Hash.h"
#include "warranty/QAXWarranty.h"

namespace {

constexpr const char* kSerialNumber = "FUZZ-SN-1";

void exercise(const qax::QAXWarranty& warranty) {
    (void)warranty.daysEligible();
    (void)warranty.hvLocalizedOfferDesc();
    (void)warranty.hvLocalizedNotificationOfferDesc();
    (void)warranty.hvLocalizedOfferDetailsEligibility();
    (void)warranty.encode();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    static auto platform = [] {
        auto p = qaxfuzz::makePlatform();
        p->homeDirectory = qaxfuzz::scratchDirectory() + "/cache-home";
        return p;
    }();
    const std::string legacy = qax::QAXWarranty::_legacyWarrantyPath(*platform);
    static const std::string perDevice = [] {
        std::string path = qax::QAXWarranty::_warrantyPathForSerialNumberFormat(*platform);
        return path.replace(path.rfind("%@"), 2, qax::sha256Hash(kSerialNumber));
    }();
    ::unlink(perDevice.c_str());
    qaxfuzz::putFile(legacy, data, size);

    auto cached = qax::QAXWarranty::cachedWarrantyForSerialNumber(platform, std::nullopt);
    if (cached) {
        exercise(*cached);
    }
    auto migrated = qax::QAXWarranty::migrateLegacyCachedWarrantyIfNeededForSerialNumber(
        platform, kSerialNumber);
    if (bool(migrated) != bool(cached)) {
        __builtin_trap();  // the same file read twice gave different answers
    }
    if (!migrated) {
        return 0;
    }
    struct stat st {};
    if (::stat(legacy.c_str(), &st) == 0) {
        __builtin_trap();  // a migrated legacy cache stays behind
    }
    auto reread = qax::QAXWarranty::cachedWarrantyForSerialNumber(platform, kSerialNumber);
    if (!reread) {
        __builtin_trap();  // the per-device cache written from it does not read back
    }
    exercise(*reread);
    return 0;
}
