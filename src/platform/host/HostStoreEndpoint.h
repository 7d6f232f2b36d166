// One store endpoint of the platform root's store.plist ({LookupURL, PurchasesURL}): a GET
// with query parameters, whose JSON answer must be an object holding an array under a
// given key. The file is read on each request (and parsed once per change), so a
// coverage-sim started later is found. Thread-safe. A completion runs exactly once: on the
// HTTP session's thread, or, when no request can be made (no file, no URL, a URL that is
// not http(s)), on the dispatcher's background queue (inline without a dispatcher).
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "core/TaskRunner.h"
#include "core/Value.h"
#include "platform/HttpClient.h"
#include "platform/host/CachedPlistFile.h"

namespace qax {

class HostStoreEndpoint {
  public:
    using Completion =
        std::function<void(std::optional<Value::Array> items, std::optional<std::string> error)>;

    // `urlKey` names the URL in store.plist, `arrayKey` the array in the answer; `label`
    // starts every error text ("store look-up").
    HostStoreEndpoint(const std::string& platformRoot, std::string urlKey, std::string arrayKey,
                      std::string label, std::shared_ptr<HttpClient> http,
                      std::shared_ptr<Dispatcher> dispatcher);

    void get(const std::vector<std::pair<std::string, std::string>>& query, Completion completion);

    // Reads `key` of an answer's item: false when it is there but not a string.
    static bool optionalString(const Value& item, const char* key, std::optional<std::string>& out);

  private:
    void failWithoutRequest(std::string error, Completion completion);

    CachedPlistFile file_;
    std::string urlKey_;
    std::string arrayKey_;
    std::string label_;
    std::shared_ptr<HttpClient> http_;
    std::shared_ptr<Dispatcher> dispatcher_;
};

}  // namespace qax
