// An in-memory follow-up service: a store of items per client identifier that replaces an item
// posted under a pending unique identifier and can be told to fail any operation. Thread-safe.
#pragma once

#include <algorithm>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/FollowUpCenter.h"

namespace qax::test {

class InMemoryFollowUpCenter : public FollowUpCenter {
  public:
    bool postFollowUpItem(const std::string& client, const FollowUpItem& item,
                          std::string* error) override {
        std::lock_guard lock(mutex_);
        if (failed(postError_, error)) {
            return false;
        }
        auto& list = items_[client];
        auto same = std::find_if(list.begin(), list.end(), [&](const FollowUpItem& pending) {
            return pending.uniqueIdentifier == item.uniqueIdentifier;
        });
        same != list.end() ? void(*same = item) : list.push_back(item);
        return true;
    }
    bool clearPendingFollowUpItemsWithUniqueIdentifiers(const std::string& client,
                                                        const std::vector<std::string>& ids,
                                                        std::string* error) override {
        std::lock_guard lock(mutex_);
        if (failed(clearError_, error)) {
            return false;
        }
        ++clears_;
        std::erase_if(items_[client], [&](const FollowUpItem& pending) {
            return pending.uniqueIdentifier &&
                   std::find(ids.begin(), ids.end(), *pending.uniqueIdentifier) != ids.end();
        });
        return true;
    }
    // On a listing failure the list is empty.
    std::vector<FollowUpItem> pendingFollowUpItems(const std::string& client,
                                                   std::string* error) override {
        std::lock_guard lock(mutex_);
        return failed(listError_, error) ? std::vector<FollowUpItem>{} : items_[client];
    }
    bool clearNotificationForItem(const std::string& client, const FollowUpItem& item,
                                  std::string* error) override {
        std::lock_guard lock(mutex_);
        if (failed(clearNotificationError_, error)) {
            return false;
        }
        for (auto& pending : items_[client]) {
            if (pending.uniqueIdentifier == item.uniqueIdentifier) {
                pending.notification.reset();
            }
        }
        return true;
    }

    // The client's items in posting order, read without touching the failure switches.
    std::vector<FollowUpItem> items(const std::string& client) {
        std::lock_guard lock(mutex_);
        return items_[client];
    }
    std::optional<FollowUpItem> item(const std::string& client, const std::string& uniqueId) {
        for (auto& pending : items(client)) {
            if (pending.uniqueIdentifier == uniqueId) {
                return pending;
            }
        }
        return std::nullopt;
    }
    void setItems(const std::string& client, std::vector<FollowUpItem> items) {
        std::lock_guard lock(mutex_);
        items_[client] = std::move(items);
    }
    int clearCount() {
        std::lock_guard lock(mutex_);
        return clears_;
    }

    // While set, the operation fails with this error text and changes nothing.
    void failPost(std::optional<std::string> e) { set(postError_, std::move(e)); }
    void failClear(std::optional<std::string> e) { set(clearError_, std::move(e)); }
    void failList(std::optional<std::string> e) { set(listError_, std::move(e)); }
    void failClearNotification(std::optional<std::string> e) {
        set(clearNotificationError_, std::move(e));
    }

  private:
    static bool failed(const std::optional<std::string>& configured, std::string* error) {
        if (configured && error) {
            *error = *configured;
        }
        return configured.has_value();
    }
    void set(std::optional<std::string>& slot, std::optional<std::string> error) {
        std::lock_guard lock(mutex_);
        slot = std::move(error);
    }

    std::mutex mutex_;
    std::map<std::string, std::vector<FollowUpItem>> items_;
    std::optional<std::string> postError_, clearError_, listError_, clearNotificationError_;
    int clears_ = 0;
};

}  // namespace qax::test
