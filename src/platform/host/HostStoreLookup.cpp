#include "platform/host/HostStoreLookup.h"

namespace qax {
namespace {

constexpr const char* kLabel = "store look-up";

// None when an item is not a dictionary or a field has the wrong kind.
std::optional<StoreItem> itemFrom(const Value& value) {
    if (!value.isDictionary()) {
        return std::nullopt;
    }
    StoreItem item;
    if (!HostStoreEndpoint::optionalString(value, "bundleId", item.bundleIdentifier) ||
        !HostStoreEndpoint::optionalString(value, "displayName", item.displayName) ||
        !HostStoreEndpoint::optionalString(value, "artistName", item.artistName) ||
        !HostStoreEndpoint::optionalString(value, "productPageURL", item.productPageURL)) {
        return std::nullopt;
    }
    if (const Value* artwork = value.find("artworkURLs"); artwork && !artwork->isNull()) {
        if (!artwork->isArray()) {
            return std::nullopt;
        }
        for (const auto& url : *artwork->asArray()) {
            if (!url.asString()) {
                return std::nullopt;
            }
            item.artworkURLs.push_back(*url.asString());
        }
    }
    return item;
}

}  // namespace

HostStoreLookup::HostStoreLookup(const std::string& platformRoot, std::shared_ptr<HttpClient> http,
                                 std::shared_ptr<Dispatcher> dispatcher)
    : endpoint_(platformRoot, "LookupURL", "results", kLabel, std::move(http),
                std::move(dispatcher)) {}

void HostStoreLookup::lookUpBundleIdentifier(
    const std::string& bundleIdentifier,
    std::function<void(std::vector<StoreItem>, std::optional<std::string>)> completion) {
    endpoint_.get({{"bundleId", bundleIdentifier}},
                  [completion = std::move(completion)](std::optional<Value::Array> results,
                                                       std::optional<std::string> error) {
                      std::vector<StoreItem> items;
                      for (std::size_t i = 0; results && i < results->size(); ++i) {
                          auto item = itemFrom((*results)[i]);
                          if (!item) {
                              return completion({}, std::string(kLabel) + ": result " +
                                                        std::to_string(i) + " is not a store item");
                          }
                          items.push_back(std::move(*item));
                      }
                      completion(std::move(items), std::move(error));
                  });
}

}  // namespace qax
