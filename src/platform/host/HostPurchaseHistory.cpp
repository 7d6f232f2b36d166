#include "platform/host/HostPurchaseHistory.h"

namespace qax {
namespace {

constexpr const char* kLabel = "purchase history";

std::optional<PurchaseRecord> recordFrom(const Value& value) {
    PurchaseRecord record;
    if (!value.isDictionary() ||
        !HostStoreEndpoint::optionalString(value, "bundleId", record.bundleIdentifier) ||
        !HostStoreEndpoint::optionalString(value, "title", record.title) ||
        !HostStoreEndpoint::optionalString(value, "developerName", record.developerName) ||
        !HostStoreEndpoint::optionalString(value, "productURL", record.productURL)) {
        return std::nullopt;
    }
    return record;
}

}  // namespace

HostPurchaseHistory::HostPurchaseHistory(const std::string& platformRoot,
                                         std::shared_ptr<HttpClient> http,
                                         std::shared_ptr<Dispatcher> dispatcher)
    : endpoint_(platformRoot, "PurchasesURL", "purchases", kLabel, std::move(http),
                std::move(dispatcher)) {}

void HostPurchaseHistory::purchasesForAccount(
    std::int64_t storeAccountId, const std::vector<std::string>& bundleIdentifiers,
    std::function<void(std::vector<PurchaseRecord>, std::optional<std::string>)> completion) {
    std::string ids;
    for (const auto& id : bundleIdentifiers) {
        ids += (ids.empty() ? "" : ",") + id;
    }
    endpoint_.get({{"accountId", std::to_string(storeAccountId)}, {"bundleIds", ids}},
                  [completion = std::move(completion)](std::optional<Value::Array> purchases,
                                                       std::optional<std::string> error) {
                      std::vector<PurchaseRecord> records;
                      for (std::size_t i = 0; purchases && i < purchases->size(); ++i) {
                          auto record = recordFrom((*purchases)[i]);
                          if (!record) {
                              return completion({}, std::string(kLabel) + ": purchase " +
                                                        std::to_string(i) +
                                                        " is not a purchase record");
                          }
                          records.push_back(std::move(*record));
                      }
                      completion(std::move(records), std::move(error));
                  });
}

}  // namespace qax
