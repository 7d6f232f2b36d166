#include "platform/QAXSettings.h"

#include <cstdlib>

#include "platform/PreferenceStore.h"

namespace qax {
namespace settings {

Value::Dictionary registeredDefaults() {
    return {
        {kCachedWarrantyValidityDuration, Value(86400)},
        {kHighServerVersion, Value(3)},
        {kLowServerVersion, Value(2)},
        {kOneDayInterval, Value(86400)},
        {kPostUpgradeOutreachDelay, Value(3600)},
        {kServerVersionURL, Value(kDefaultServerVersionURL)},
        {kWarrantyURL, Value(kDefaultWarrantyURL)},
        {kWearablesWarrantyURL, Value(kDefaultWearablesWarrantyURL)},
    };
}

double cachedWarrantyValidityDuration(PreferenceStore& store) {
    auto v = store.objectForKey(kCachedWarrantyValidityDuration);
    if (!v) {
        return 0;
    }
    if (auto d = v->asDouble()) {
        return *d;
    }
    if (auto* s = v->asString()) {
        return std::strtod(s->c_str(), nullptr);
    }
    return 0;
}

std::int32_t migrationVersion(PreferenceStore& store) {
    auto v = store.objectForKey("QAXMigrationVersion");
    if (!v) {
        return 0;
    }
    if (auto i = v->asInteger()) {
        return static_cast<std::int32_t>(*i);
    }
    if (auto* s = v->asString()) {
        return static_cast<std::int32_t>(std::strtol(s->c_str(), nullptr, 10));
    }
    return 0;
}

}  // namespace settings

void qax_registerDefaults(PreferenceStore& store) {
    store.registerDefaults(settings::registeredDefaults());
}

}  // namespace qax
