#include "platform/host/HostFollowUpCenter.h"

#include <algorithm>
#include <filesystem>

#include "core/AtomicFile.h"
#include "core/Log.h"
#include "core/PlistCodec.h"
#include "platform/host/HostFileLock.h"
#include "platform/host/JsonLinesFile.h"

namespace qax {
namespace {

namespace fs = std::filesystem;

constexpr const char* kStoreExtension = ".plist";

bool fail(std::string* error, std::string message) {
    if (error) {
        *error = std::move(message);
    }
    return false;
}

}  // namespace

HostFollowUpCenter::HostFollowUpCenter(std::string platformRoot, std::shared_ptr<Clock> clock)
    : platformRoot_(std::move(platformRoot)), clock_(std::move(clock)) {}

std::string HostFollowUpCenter::storeDirectory(const std::string& platformRoot) {
    return (fs::path(platformRoot) / "state" / "followups").string();
}

std::string HostFollowUpCenter::notificationsPath(const std::string& platformRoot) {
    return (fs::path(platformRoot) / "state" / "notifications.jsonl").string();
}

CheckedPlistFile* HostFollowUpCenter::storeFile(const std::string& clientIdentifier,
                                                std::string* error) {
    if (clientIdentifier.empty() || clientIdentifier.front() == '.' ||
        clientIdentifier.find('/') != std::string::npos) {
        fail(error, "'" + clientIdentifier + "' is not a client identifier");
        return nullptr;
    }
    auto& file = files_[clientIdentifier];
    if (!file) {
        file = std::make_unique<CheckedPlistFile>(
            (fs::path(storeDirectory(platformRoot_)) / (clientIdentifier + kStoreExtension))
                .string(),
            Value::Kind::Array);
    }
    return file.get();
}

bool HostFollowUpCenter::modify(const std::string& clientIdentifier, const Change& change,
                                std::string* error) {
    std::lock_guard lock(mutex_);
    CheckedPlistFile* file = storeFile(clientIdentifier, error);
    if (!file) {
        return false;
    }
    HostFileLock fileLock(file->path() + ".lock");
    auto stored = file->read();
    Value::Array items = stored ? std::move(*stored->asArray()) : Value::Array{};
    if (!change(items, error)) {
        return false;
    }
    auto bytes = toBinaryPlist(Value(std::move(items)));
    if (!bytes) {
        return fail(error, "the item has no property-list form (a null value in its user info?)");
    }
    std::string why;
    if (!writeFileAtomically(file->path(), *bytes, &why)) {
        qaxLog().error("Cannot write the follow-up store '%@': %@", file->path(), why);
        return fail(error, "cannot write the follow-up store: " + why);
    }
    return true;
}

bool HostFollowUpCenter::postFollowUpItem(const std::string& clientIdentifier,
                                          const FollowUpItem& item, std::string* error) {
    if (!item.uniqueIdentifier) {
        return fail(error, "a follow-up item needs a unique identifier");
    }
    const std::string& id = *item.uniqueIdentifier;
    bool deliver = false;
    const bool ok = modify(
        clientIdentifier,
        [&](Value::Array& items, std::string*) {
            Value posted = FollowUpItemCodec::encode(item, clock_->now());
            auto same = [&](const Value& v) {
                return FollowUpItemCodec::uniqueIdentifier(v) == id;
            };
            auto it = std::find_if(items.begin(), items.end(), same);
            const bool hadNotification =
                it != items.end() && FollowUpItemCodec::hasNotification(*it);
            deliver = item.notification && !hadNotification;
            if (it == items.end()) {
                items.push_back(std::move(posted));
            } else {
                *it = std::move(posted);
                // One item per identifier: drop copies a hand-edited file may hold.
                items.erase(std::remove_if(std::next(it), items.end(), same), items.end());
            }
            return true;
        },
        error);
    if (ok && deliver) {
        deliverNotification(item);
    }
    return ok;
}

bool HostFollowUpCenter::clearPendingFollowUpItemsWithUniqueIdentifiers(
    const std::string& clientIdentifier, const std::vector<std::string>& uniqueIdentifiers,
    std::string* error) {
    return modify(
        clientIdentifier,
        [&](Value::Array& items, std::string*) {
            std::erase_if(items, [&](const Value& v) {
                auto id = FollowUpItemCodec::uniqueIdentifier(v);
                return id && std::find(uniqueIdentifiers.begin(), uniqueIdentifiers.end(), *id) !=
                                 uniqueIdentifiers.end();
            });
            return true;
        },
        error);
}

std::vector<FollowUpItem> HostFollowUpCenter::pendingFollowUpItems(
    const std::string& clientIdentifier, std::string* error) {
    std::vector<FollowUpItem> items;
    for (auto& stored : storedItems(clientIdentifier, error)) {
        items.push_back(std::move(stored.item));
    }
    return items;
}

bool HostFollowUpCenter::clearNotificationForItem(const std::string& clientIdentifier,
                                                  const FollowUpItem& item, std::string* error) {
    if (!item.uniqueIdentifier) {
        return fail(error, "a follow-up item needs a unique identifier");
    }
    return modify(
        clientIdentifier,
        [&](Value::Array& items, std::string* why) {
            bool found = false;
            for (auto& stored : items) {
                if (FollowUpItemCodec::uniqueIdentifier(stored) == item.uniqueIdentifier) {
                    FollowUpItemCodec::removeNotification(stored);
                    found = true;
                }
            }
            return found || fail(why, "no pending follow-up item '" + *item.uniqueIdentifier + "'");
        },
        error);
}

std::vector<StoredFollowUpItem> HostFollowUpCenter::storedItems(const std::string& clientIdentifier,
                                                                std::string* error) {
    CheckedPlistFile* file;
    {
        std::lock_guard lock(mutex_);
        file = storeFile(clientIdentifier, error);
    }
    std::vector<StoredFollowUpItem> items;
    auto stored = file ? file->read() : std::nullopt;
    if (!stored) {
        return items;
    }
    for (const auto& entry : *stored->asArray()) {
        if (const auto* d = entry.asDictionary()) {
            items.push_back(FollowUpItemCodec::decode(*d));
        }
    }
    return items;
}

std::vector<std::string> HostFollowUpCenter::clientIdentifiers() {
    std::vector<std::string> clients;
    std::error_code ec;
    for (const auto& entry : fs::directory_iterator(storeDirectory(platformRoot_), ec)) {
        const auto name = entry.path().filename().string();
        if (entry.path().extension() == kStoreExtension && name.front() != '.') {
            clients.push_back(entry.path().stem().string());
        }
    }
    std::sort(clients.begin(), clients.end());
    return clients;
}

void HostFollowUpCenter::deliverNotification(const FollowUpItem& item) {
    const FollowUpNotification& n = *item.notification;
    Value::Dictionary line{{"time", clock_->now().iso8601()},
                           {"uniqueIdentifier", *item.uniqueIdentifier}};
    if (n.title) {
        line["title"] = *n.title;
    }
    if (n.informativeText) {
        line["informativeText"] = *n.informativeText;
    }
    std::string error;
    if (!JsonLinesFile::append(notificationsPath(platformRoot_), Value(std::move(line)), &error)) {
        qaxLog().error("Cannot record the delivered notification of '%@': %@",
                       *item.uniqueIdentifier, error);
    }
    qaxLog().info("Delivered follow-up notification '%@' of item '%@'", n.title,
                  *item.uniqueIdentifier);
}

}  // namespace qax
