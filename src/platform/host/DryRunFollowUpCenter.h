// The follow-up service of a dry run: each client's items are read once from the real service
// and kept in memory from then on; posts, clears and notification clears change that copy and
// are recorded, never written, and no notification is delivered. Thread-safe (one mutex).
#pragma once

#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/FollowUpCenter.h"

namespace qax {

class DryRunFollowUpCenter : public FollowUpCenter {
  public:
    struct Change {
        enum class Kind { Post, Clear, ClearNotification };
        Kind kind = Kind::Post;
        std::string clientIdentifier;
        std::string uniqueIdentifier;
        // Post: the item as posted, and whether its notification is new (the service would
        // deliver it).
        std::optional<FollowUpItem> item;
        bool deliversNotification = false;
    };

    explicit DryRunFollowUpCenter(std::shared_ptr<FollowUpCenter> base);

    bool postFollowUpItem(const std::string& clientIdentifier, const FollowUpItem& item,
                          std::string* error) override;
    bool clearPendingFollowUpItemsWithUniqueIdentifiers(
        const std::string& clientIdentifier, const std::vector<std::string>& uniqueIdentifiers,
        std::string* error) override;
    std::vector<FollowUpItem> pendingFollowUpItems(const std::string& clientIdentifier,
                                                   std::string* error) override;
    bool clearNotificationForItem(const std::string& clientIdentifier, const FollowUpItem& item,
                                  std::string* error) override;

    std::vector<Change> changes() const;

  private:
    struct Client {
        std::vector<FollowUpItem> items;
        // Why the real store could not be listed; reported by every listing, as the real
        // service would.
        std::optional<std::string> listError;
    };
    Client& clientLocked(const std::string& clientIdentifier);

    const std::shared_ptr<FollowUpCenter> base_;
    mutable std::mutex mutex_;
    std::map<std::string, Client> clients_;
    std::vector<Change> changes_;
};

}  // namespace qax
