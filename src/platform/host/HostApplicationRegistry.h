// The application registry from apps/*.plist under the platform root, one file per
// application: {BundleIdentifier, ExecutablePath, LocalizedName, VendorName, Installed,
// Entitlements}. An executable is matched by file identity (device and inode of the file the
// path leads to), so a copy or a different file at the same name does not match, and
// "/proc/PID/exe" finds the running process's executable. Thread-safe; each file is re-read
// when it changes, the directory is listed on every call.
#pragma once

#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/ApplicationRegistry.h"
#include "platform/host/CachedPlistFile.h"

namespace qax {

class HostApplicationRegistry : public ApplicationRegistry {
  public:
    explicit HostApplicationRegistry(const std::string& platformRoot);

    std::optional<ApplicationRecord> applicationForBundleIdentifier(
        const std::string& bundleIdentifier) override;
    std::optional<ApplicationRecord> applicationForExecutablePath(const std::string& path) override;
    Value::Dictionary entitlementsForExecutablePath(const std::string& path) override;

    // The record a registry file holds; none when it is not a dictionary.
    static std::optional<ApplicationRecord> recordFromValue(const Value& value);

  private:
    // Every readable record, in file-name order.
    std::vector<ApplicationRecord> allRecords();

    std::string directory_;
    std::mutex mutex_;
    std::map<std::string, std::shared_ptr<CachedPlistFile>> files_;
};

}  // namespace qax
