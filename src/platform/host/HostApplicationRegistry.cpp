#include "platform/host/HostApplicationRegistry.h"

#include <sys/stat.h>

#include <algorithm>
#include <filesystem>

namespace qax {
namespace {

constexpr const char* kBundleIdentifierKey = "BundleIdentifier";
constexpr const char* kExecutablePathKey = "ExecutablePath";
constexpr const char* kLocalizedNameKey = "LocalizedName";
constexpr const char* kVendorNameKey = "VendorName";
constexpr const char* kInstalledKey = "Installed";
constexpr const char* kEntitlementsKey = "Entitlements";

std::optional<std::string> stringAt(const Value& v, std::string_view key) {
    const Value* s = v.find(key);
    if (s && s->isString()) {
        return *s->asString();
    }
    return std::nullopt;
}

bool sameFile(const struct stat& a, const struct stat& b) {
    return a.st_dev == b.st_dev && a.st_ino == b.st_ino;
}

}  // namespace

HostApplicationRegistry::HostApplicationRegistry(const std::string& platformRoot)
    : directory_((std::filesystem::path(platformRoot) / "apps").string()) {}

std::optional<ApplicationRecord> HostApplicationRegistry::recordFromValue(const Value& value) {
    if (!value.isDictionary()) {
        return std::nullopt;
    }
    ApplicationRecord record;
    record.bundleIdentifier = stringAt(value, kBundleIdentifierKey);
    record.executablePath = stringAt(value, kExecutablePathKey).value_or("");
    record.localizedName = stringAt(value, kLocalizedNameKey);
    record.vendorName = stringAt(value, kVendorNameKey);
    const Value* installed = value.find(kInstalledKey);
    record.installed = installed && installed->truthy();
    if (const Value* e = value.find(kEntitlementsKey); e && e->isDictionary()) {
        record.entitlements = *e->asDictionary();
    }
    return record;
}

std::vector<ApplicationRecord> HostApplicationRegistry::allRecords() {
    std::vector<std::string> paths;
    std::error_code ec;
    for (const auto& entry : std::filesystem::directory_iterator(directory_, ec)) {
        if (entry.path().extension() == ".plist") {
            paths.push_back(entry.path().string());
        }
    }
    std::sort(paths.begin(), paths.end());

    std::vector<std::shared_ptr<CachedPlistFile>> files;
    {
        std::lock_guard lock(mutex_);
        std::map<std::string, std::shared_ptr<CachedPlistFile>> current;
        for (const auto& path : paths) {
            auto it = files_.find(path);
            current[path] =
                it != files_.end() ? it->second : std::make_shared<CachedPlistFile>(path);
        }
        files_ = std::move(current);
        for (const auto& path : paths) {
            files.push_back(files_[path]);
        }
    }

    std::vector<ApplicationRecord> records;
    for (const auto& file : files) {
        if (auto value = file->read()) {
            if (auto record = recordFromValue(*value)) {
                records.push_back(std::move(*record));
            }
        }
    }
    return records;
}

std::optional<ApplicationRecord> HostApplicationRegistry::applicationForBundleIdentifier(
    const std::string& bundleIdentifier) {
    for (auto& record : allRecords()) {
        if (record.bundleIdentifier == bundleIdentifier) {
            return std::move(record);
        }
    }
    return std::nullopt;
}

std::optional<ApplicationRecord> HostApplicationRegistry::applicationForExecutablePath(
    const std::string& path) {
    struct stat target {};
    if (path.empty() || ::stat(path.c_str(), &target) != 0) {
        return std::nullopt;
    }
    for (auto& record : allRecords()) {
        struct stat registered {};
        if (!record.executablePath.empty() &&
            ::stat(record.executablePath.c_str(), &registered) == 0 &&
            sameFile(target, registered)) {
            return std::move(record);
        }
    }
    return std::nullopt;
}

Value::Dictionary HostApplicationRegistry::entitlementsForExecutablePath(const std::string& path) {
    auto record = applicationForExecutablePath(path);
    return record ? std::move(record->entitlements) : Value::Dictionary{};
}

}  // namespace qax
