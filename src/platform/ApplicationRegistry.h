// The applications known to the platform: installed state and display names by bundle
// identifier, and the entitlements granted to an executable. Thread-safe; every call reads
// the platform's registry afresh.
#pragma once

#include <optional>
#include <string>

#include "core/Value.h"

namespace qax {

struct ApplicationRecord {
    // None for an executable that is registered outside any application bundle.
    std::optional<std::string> bundleIdentifier;
    std::string executablePath;
    std::optional<std::string> localizedName;
    std::optional<std::string> vendorName;
    bool installed = false;
    Value::Dictionary entitlements;
};

class ApplicationRegistry {
  public:
    virtual ~ApplicationRegistry() = default;
    // The application with that bundle identifier, installed or not; none when unknown.
    virtual std::optional<ApplicationRecord> applicationForBundleIdentifier(
        const std::string& bundleIdentifier) = 0;
    // The application whose executable is the file at `path` (the same file, not merely the
    // same name); none when no registered application has it.
    virtual std::optional<ApplicationRecord> applicationForExecutablePath(
        const std::string& path) = 0;
    // The entitlements of the executable at `path`; empty when it has none or is unknown.
    virtual Value::Dictionary entitlementsForExecutablePath(const std::string& path) = 0;
};

}  // namespace qax
