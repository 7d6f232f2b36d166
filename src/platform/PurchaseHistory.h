// Purchases of a store account. Thread-safe; completions run on the HTTP session's thread.
#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <vector>

namespace qax {

struct PurchaseRecord {
    std::optional<std::string> bundleIdentifier;
    std::optional<std::string> title;
    std::optional<std::string> developerName;
    std::optional<std::string> productURL;
};

class PurchaseHistory {
  public:
    virtual ~PurchaseHistory() = default;
    virtual void purchasesForAccount(
        std::int64_t storeAccountId, const std::vector<std::string>& bundleIdentifiers,
        std::function<void(std::vector<PurchaseRecord> records, std::optional<std::string> error)>
            completion) = 0;
};

}  // namespace qax
