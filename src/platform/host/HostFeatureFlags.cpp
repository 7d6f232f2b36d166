#include "platform/host/HostFeatureFlags.h"

#include <filesystem>

namespace qax {

HostFeatureFlags::HostFeatureFlags(const std::string& platformRoot)
    : file_((std::filesystem::path(platformRoot) / "features.plist").string()) {}

bool HostFeatureFlags::isFeatureEnabled(std::string_view domain, std::string_view flag) {
    auto root = file_.read();
    const Value* flags = root ? root->find(domain) : nullptr;
    const Value* value = flags ? flags->find(flag) : nullptr;
    return value && value->truthy();
}

}  // namespace qax
