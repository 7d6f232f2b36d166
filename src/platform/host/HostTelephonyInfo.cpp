#include "platform/host/HostTelephonyInfo.h"

#include <filesystem>

namespace qax {
namespace {

std::optional<std::string> code(const Value& carrier, const char* key) {
    const Value* v = carrier.find(key);
    return v && v->isString() ? std::optional<std::string>(*v->asString()) : std::nullopt;
}

}  // namespace

HostTelephonyInfo::HostTelephonyInfo(const std::string& platformRoot)
    : file_((std::filesystem::path(platformRoot) / "carriers.plist").string(), Value::Kind::Array) {
}

std::vector<SubscriberCarrier> HostTelephonyInfo::subscriberCarriers() {
    std::vector<SubscriberCarrier> carriers;
    auto root = file_.read();
    if (!root) {
        return carriers;
    }
    for (const auto& entry : *root->asArray()) {
        if (entry.isDictionary()) {
            carriers.push_back(
                {code(entry, "mobileCountryCode"), code(entry, "mobileNetworkCode")});
        }
    }
    return carriers;
}

}  // namespace qax
