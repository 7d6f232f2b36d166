// An in-memory follow-up service: a store of items per client identifier that replaces an item
// posted under a pending unique identifier and can be told to fail any operation. Thread-safe.
#pragma once

#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/FollowUpCenter.h"

namespace qax::test {

class InMemoryFollowUpCenter : public FollowUpCenter {
  public:
    bool postFollowUpItem(const std::string& clientIdentifier, const FollowUpItem& item,
                          std::string* error) override;
    bool clearPendingFollowUpItemsWithUniqueIdentifiers(
        const std::string& clientIdentifier, const std::vector<std::string>& uniqueIdentifiers,
        std::string* error) override;
    // On a listing failure the list is empty.
    std::vector<FollowUpItem> pendingFollowUpItems(const std::string& clientIdentifier,
                                                   std::string* error) override;
    bool clearNotificationForItem(const std::string& clientIdentifier, const FollowUpItem& item,
                                  std::string* error) override;

    // The client's items in posting order, read without touching the failure switches.
    std::vector<FollowUpItem> items(const std::string& clientIdentifier) const;
    std::optional<FollowUpItem> item(const std::string& clientIdentifier,
                                     const std::string& uniqueIdentifier) const;
    void setItems(const std::string& clientIdentifier, std::vector<FollowUpItem> items);
    int clearCount() const;

    // While set, the operation fails with this error text and changes nothing.
    void failPost(std::optional<std::string> error);
    void failClear(std::optional<std::string> error);
    void failList(std::optional<std::string> error);
    void failClearNotification(std::optional<std::string> error);

  private:
    mutable std::mutex mutex_;
    std::map<std::string, std::vector<FollowUpItem>> items_;
    std::optional<std::string> postError_;
    std::optional<std::string> clearError_;
    std::optional<std::string> listError_;
    std::optional<std::string> clearNotificationError_;
    int clears_ = 0;
};

}  // namespace qax::test
