// The purchase history on the host: GET PurchasesURL?accountId=N&bundleIds=A,B of the
// platform root's store.plist (coverage-sim serves it), answering {"purchases":
// [{"bundleId", "title", "developerName", "productURL"}]}. Thread-safe; completions run
// once, on the HTTP session's thread (on the dispatcher's background queue when no request
// could be made).
#pragma once

#include <memory>

#include "platform/PurchaseHistory.h"
#include "platform/host/HostStoreEndpoint.h"

namespace qax {

class HostPurchaseHistory : public PurchaseHistory {
  public:
    HostPurchaseHistory(const std::string& platformRoot, std::shared_ptr<HttpClient> http,
                        std::shared_ptr<Dispatcher> dispatcher);

    void purchasesForAccount(
        std::int64_t storeAccountId, const std::vector<std::string>& bundleIdentifiers,
        std::function<void(std::vector<PurchaseRecord> records, std::optional<std::string> error)>
            completion) override;

  private:
    HostStoreEndpoint endpoint_;
};

}  // namespace qax
