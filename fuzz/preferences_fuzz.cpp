// The preference domain file as it may be found on disk (hand-edited, truncated, from another
// release): read through the file-backed store and the agent's typed reads, then one write.
// A write keeps every key the file had, and what was written reads back.
#include <cstddef>
#include <cstdint>
#include <set>
#include <string>

#include "FuzzPlatform.h"
#include "platform/host/FilePreferenceStore.h"
#include "warranty/QAXServerVersionUtilities.h"

namespace {

std::set<std::string> keysOf(qax::FilePreferenceStore& store) {
    auto keys = store.allKeys();
    return {keys.begin(), keys.end()};
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    static auto platform = qaxfuzz::makePlatform();
    static const std::string path =
        qax::FilePreferenceStore::domainPath(qaxfuzz::scratchDirectory() + "/prefs-home");
    qaxfuzz::putFile(path, data, size);

    auto store = std::make_shared<qax::FilePreferenceStore>(path);
    qax::qax_registerDefaults(*store);
    platform->preferences = store;

    int reads = 0;
    for (const auto& key : keysOf(*store)) {
        if (++reads > 16) {
            break;
        }
        (void)store->boolForKey(key);
        (void)store->integerForKey(key);
        (void)store->doubleForKey(key);
        (void)store->stringForKey(key);
        (void)store->dateForKey(key);
        (void)store->arrayForKey(key);
        (void)store->dictionaryForKey(key);
    }
    (void)qax::settings::cachedWarrantyValidityDuration(*store);
    (void)qax::settings::migrationVersion(*store);
    (void)qax::QAXServerVersionUtilities::_getValidServerVersionCache(*platform);

    // The reads may drop a stale server version cache; the write starts from what is left.
    constexpr const char* kProbe = "QAXFuzzProbe";
    std::set<std::string> expected = keysOf(*store);
    if (store->setObject(kProbe, qax::Value(static_cast<long long>(size)))) {
        expected.insert(kProbe);
    }
    if (keysOf(*store) != expected) {
        __builtin_trap();  // a write lost or invented a key
    }
    qax::FilePreferenceStore reread(path);
    if (keysOf(reread) != expected) {
        __builtin_trap();  // what was written does not read back
    }
    return 0;
}
