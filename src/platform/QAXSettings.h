// The agent's registered defaults and the typed reads of its settings. The preference
// domain is the platform's; this file only names what the agent registers and how it
// converts what it reads. Stateless; any thread.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "core/Value.h"

namespace qax {

class PreferenceStore;

namespace settings {

// The registered defaults.
inline constexpr const char* kCachedWarrantyValidityDuration = "CachedWarrantyValidityDuration";
inline constexpr const char* kHighServerVersion = "HighServerVersion";
inline constexpr const char* kLowServerVersion = "LowServerVersion";
inline constexpr const char* kOneDayInterval = "OneDayInterval";
inline constexpr const char* kPostUpgradeOutreachDelay = "PostUpgradeOutreachDelay";
inline constexpr const char* kServerVersionURL = "ServerVersionURL";
inline constexpr const char* kWarrantyURL = "WarrantyURL";
inline constexpr const char* kWearablesWarrantyURL = "WearablesWarrantyURL";

inline constexpr const char* kDefaultServerVersionURL =
    "https://assets.velmora.example/library/VELMORA/asset/qaxV2.plist";
inline constexpr const char* kDefaultWarrantyURL =
    "https://coverage.velmora.example/api/v3/coverage/summary";
inline constexpr const char* kDefaultWearablesWarrantyURL =
    "https://coverage.velmora.example/api/v2/coverage/summary";

// The eight values above, each number a 32-bit integer.
Value::Dictionary registeredDefaults();

// "CachedWarrantyValidityDuration" read as an object and converted to a double
// (absent and unregistered: 0).
double cachedWarrantyValidityDuration(PreferenceStore& store);
// "QAXMigrationVersion" read as an object and converted to a 32-bit integer (absent: 0).
std::int32_t migrationVersion(PreferenceStore& store);

}  // namespace settings

// Registers the agent's defaults in its preference domain. Defaults stay in memory only.
void qax_registerDefaults(PreferenceStore& store);

}  // namespace qax
