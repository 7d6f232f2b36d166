// The store look-up on the host: GET LookupURL?bundleId=ID of the platform root's
// store.plist (coverage-sim serves it), answering {"results": [{"bundleId", "displayName",
// "artistName", "artworkURLs": [string], "productPageURL"}]}. Thread-safe; completions run
// once, on the HTTP session's thread (on the dispatcher's background queue when no request
// could be made).
#pragma once

#include <memory>

#include "platform/StoreLookup.h"
#include "platform/host/HostStoreEndpoint.h"

namespace qax {

class HostStoreLookup : public StoreLookup {
  public:
    HostStoreLookup(const std::string& platformRoot, std::shared_ptr<HttpClient> http,
                    std::shared_ptr<Dispatcher> dispatcher);

    void lookUpBundleIdentifier(
        const std::string& bundleIdentifier,
        std::function<void(std::vector<StoreItem> items, std::optional<std::string> error)>
            completion) override;

  private:
    HostStoreEndpoint endpoint_;
};

}  // namespace qax
