#include "platform/host/HostActivityTriggerRecord.h"

#include <filesystem>

#include "core/AtomicFile.h"
#include "core/PlistCodec.h"
#include "platform/host/CheckedPlistFile.h"

namespace qax {
namespace {

constexpr const char* kBootID = "BootID";
constexpr const char* kProductVersions = "ProductVersions";

}  // namespace

std::string HostActivityTriggerRecord::path(const std::string& platformRoot) {
    return (std::filesystem::path(platformRoot) / "state" / "triggers.plist").string();
}

HostActivityTriggerRecord::Records HostActivityTriggerRecord::load(
    const std::string& platformRoot) {
    Records records;
    CheckedPlistFile file(path(platformRoot), Value::Kind::Dictionary);
    auto root = file.read();
    if (!root) {
        return records;
    }
    for (const auto& [identifier, entry] : *root->asDictionary()) {
        TriggerRecord& r = records[identifier];
        if (const Value* boot = entry.find(kBootID); boot && boot->isString()) {
            r.bootId = *boot->asString();
        }
        if (const Value* versions = entry.find(kProductVersions); versions && versions->isArray()) {
            for (const auto& v : *versions->asArray()) {
                if (v.isString()) {
                    r.productVersions.push_back(*v.asString());
                }
            }
        }
    }
    return records;
}

bool HostActivityTriggerRecord::save(const std::string& platformRoot, const Records& records,
                                     std::string* error) {
    Value::Dictionary root;
    for (const auto& [identifier, r] : records) {
        Value::Dictionary entry;
        if (r.bootId) {
            entry[kBootID] = *r.bootId;
        }
        Value::Array versions(r.productVersions.begin(), r.productVersions.end());
        entry[kProductVersions] = std::move(versions);
        root[identifier] = std::move(entry);
    }
    auto xml = toXmlPlist(Value(std::move(root)));
    return xml && writeFileAtomically(path(platformRoot), *xml, error);
}

}  // namespace qax
