// The application store: listings of an application by bundle identifier. Thread-safe;
// completions run on the HTTP session's thread.
#pragma once

#include <functional>
#include <optional>
#include <string>
#include <vector>

namespace qax {

struct StoreItem {
    std::optional<std::string> bundleIdentifier;
    std::optional<std::string> displayName;
    std::optional<std::string> artistName;
    std::vector<std::string> artworkURLs;
    std::optional<std::string> productPageURL;
};

class StoreLookup {
  public:
    virtual ~StoreLookup() = default;
    // Looks one bundle identifier up with the store's compact-listing key profile.
    virtual void lookUpBundleIdentifier(
        const std::string& bundleIdentifier,
        std::function<void(std::vector<StoreItem> items, std::optional<std::string> error)>
            completion) = 0;
};

}  // namespace qax
