#include "fakes/FakeFollowUpCenter.h"

#include <algorithm>

namespace qax::test {
namespace {

bool fail(const std::optional<std::string>& configured, std::string* error) {
    if (!configured) {
        return false;
    }
    if (error) {
        *error = *configured;
    }
    return true;
}

}  // namespace

bool InMemoryFollowUpCenter::postFollowUpItem(const std::string& clientIdentifier,
                                              const FollowUpItem& item, std::string* error) {
    std::lock_guard lock(mutex_);
    if (fail(postError_, error)) {
        return false;
    }
    auto& list = items_[clientIdentifier];
    auto same = std::find_if(list.begin(), list.end(), [&](const FollowUpItem& pending) {
        return pending.uniqueIdentifier == item.uniqueIdentifier;
    });
    if (same != list.end()) {
        *same = item;
    } else {
        list.push_back(item);
    }
    return true;
}

bool InMemoryFollowUpCenter::clearPendingFollowUpItemsWithUniqueIdentifiers(
    const std::string& clientIdentifier, const std::vector<std::string>& uniqueIdentifiers,
    std::string* error) {
    std::lock_guard lock(mutex_);
    if (fail(clearError_, error)) {
        return false;
    }
    ++clears_;
    auto& list = items_[clientIdentifier];
    std::erase_if(list, [&](const FollowUpItem& pending) {
        return pending.uniqueIdentifier &&
               std::find(uniqueIdentifiers.begin(), uniqueIdentifiers.end(),
                         *pending.uniqueIdentifier) != uniqueIdentifiers.end();
    });
    return true;
}

std::vector<FollowUpItem> InMemoryFollowUpCenter::pendingFollowUpItems(
    const std::string& clientIdentifier, std::string* error) {
    std::lock_guard lock(mutex_);
    if (fail(listError_, error)) {
        return {};
    }
    auto it = items_.find(clientIdentifier);
    return it == items_.end() ? std::vector<FollowUpItem>{} : it->second;
}

bool InMemoryFollowUpCenter::clearNotificationForItem(const std::string& clientIdentifier,
                                                      const FollowUpItem& item,
                                                      std::string* error) {
    std::lock_guard lock(mutex_);
    if (fail(clearNotificationError_, error)) {
        return false;
    }
    for (auto& pending : items_[clientIdentifier]) {
        if (pending.uniqueIdentifier == item.uniqueIdentifier) {
            pending.notification.reset();
        }
    }
    return true;
}

std::vector<FollowUpItem> InMemoryFollowUpCenter::items(const std::string& clientIdentifier) const {
    std::lock_guard lock(mutex_);
    auto it = items_.find(clientIdentifier);
    return it == items_.end() ? std::vector<FollowUpItem>{} : it->second;
}

std::optional<FollowUpItem> InMemoryFollowUpCenter::item(
    const std::string& clientIdentifier, const std::string& uniqueIdentifier) const {
    for (auto& pending : items(clientIdentifier)) {
        if (pending.uniqueIdentifier == uniqueIdentifier) {
            return pending;
        }
    }
    return std::nullopt;
}

void InMemoryFollowUpCenter::setItems(const std::string& clientIdentifier,
                                      std::vector<FollowUpItem> items) {
    std::lock_guard lock(mutex_);
    items_[clientIdentifier] = std::move(items);
}

int InMemoryFollowUpCenter::clearCount() const {
    std::lock_guard lock(mutex_);
    return clears_;
}

void InMemoryFollowUpCenter::failPost(std::optional<std::string> error) {
    std::lock_guard lock(mutex_);
    postError_ = std::move(error);
}

void InMemoryFollowUpCenter::failClear(std::optional<std::string> error) {
    std::lock_guard lock(mutex_);
    clearError_ = std::move(error);
}

void InMemoryFollowUpCenter::failList(std::optional<std::string> error) {
    std::lock_guard lock(mutex_);
    listError_ = std::move(error);
}

void InMemoryFollowUpCenter::failClearNotification(std::optional<std::string> error) {
    std::lock_guard lock(mutex_);
    clearNotificationError_ = std::move(error);
}

}  // namespace qax::test
