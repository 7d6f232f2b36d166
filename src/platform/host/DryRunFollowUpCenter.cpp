#include "platform/host/DryRunFollowUpCenter.h"

#include <algorithm>
#include <utility>

namespace qax {
namespace {

bool fail(std::string* error, const std::string& why) {
    if (error) {
        *error = why;
    }
    return false;
}

}  // namespace

DryRunFollowUpCenter::DryRunFollowUpCenter(std::shared_ptr<FollowUpCenter> base)
    : base_(std::move(base)) {}

DryRunFollowUpCenter::Client& DryRunFollowUpCenter::clientLocked(
    const std::string& clientIdentifier) {
    auto [it, inserted] = clients_.try_emplace(clientIdentifier);
    if (inserted && base_) {
        std::string error;
        it->second.items = base_->pendingFollowUpItems(clientIdentifier, &error);
        if (!error.empty()) {
            it->second.listError = error;
        }
    }
    return it->second;
}

bool DryRunFollowUpCenter::postFollowUpItem(const std::string& clientIdentifier,
                                            const FollowUpItem& item, std::string* error) {
    if (!item.uniqueIdentifier) {
        return fail(error, "a follow-up item needs a unique identifier");
    }
    std::lock_guard lock(mutex_);
    auto& items = clientLocked(clientIdentifier).items;
    auto same = [&](const FollowUpItem& i) { return i.uniqueIdentifier == item.uniqueIdentifier; };
    auto it = std::find_if(items.begin(), items.end(), same);
    const bool hadNotification = it != items.end() && it->notification;
    if (it == items.end()) {
        items.push_back(item);
    } else {
        *it = item;
        items.erase(std::remove_if(std::next(it), items.end(), same), items.end());
    }
    changes_.push_back(Change{Change::Kind::Post, clientIdentifier, *item.uniqueIdentifier, item,
                              item.notification && !hadNotification});
    return true;
}

bool DryRunFollowUpCenter::clearPendingFollowUpItemsWithUniqueIdentifiers(
    const std::string& clientIdentifier, const std::vector<std::string>& uniqueIdentifiers,
    std::string*) {
    std::lock_guard lock(mutex_);
    auto& items = clientLocked(clientIdentifier).items;
    std::erase_if(items, [&](const FollowUpItem& i) {
        return i.uniqueIdentifier && std::find(uniqueIdentifiers.begin(), uniqueIdentifiers.end(),
                                               *i.uniqueIdentifier) != uniqueIdentifiers.end();
    });
    for (const auto& id : uniqueIdentifiers) {
        changes_.push_back(Change{Change::Kind::Clear, clientIdentifier, id, std::nullopt, false});
    }
    return true;
}

std::vector<FollowUpItem> DryRunFollowUpCenter::pendingFollowUpItems(
    const std::string& clientIdentifier, std::string* error) {
    std::lock_guard lock(mutex_);
    const Client& client = clientLocked(clientIdentifier);
    if (client.listError && error) {
        *error = *client.listError;
    }
    return client.items;
}

bool DryRunFollowUpCenter::clearNotificationForItem(const std::string& clientIdentifier,
                                                    const FollowUpItem& item, std::string* error) {
    if (!item.uniqueIdentifier) {
        return fail(error, "a follow-up item needs a unique identifier");
    }
    std::lock_guard lock(mutex_);
    bool found = false;
    for (auto& i : clientLocked(clientIdentifier).items) {
        if (i.uniqueIdentifier == item.uniqueIdentifier) {
            i.notification.reset();
            found = true;
        }
    }
    if (!found) {
        return fail(error, "no pending follow-up item '" + *item.uniqueIdentifier + "'");
    }
    changes_.push_back(Change{Change::Kind::ClearNotification, clientIdentifier,
                              *item.uniqueIdentifier, std::nullopt, false});
    return true;
}

std::vector<DryRunFollowUpCenter::Change> DryRunFollowUpCenter::changes() const {
    std::lock_guard lock(mutex_);
    return changes_;
}

}  // namespace qax
