// The follow-up service on files: state/followups/<clientIdentifier>.plist holds a client's
// pending items as a binary property-list array in posting order (binary keeps the
// milliseconds of dates). Posting replaces the item with the same unique identifier in place;
// a posted item whose notification is new is delivered as a line of state/notifications.jsonl.
// Every change is a read-modify-write under an advisory lock, replaced atomically, so the
// agent and qaxctl (or any two processes) lose nothing. Thread-safe.
#pragma once

#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "core/Clock.h"
#include "platform/FollowUpCenter.h"
#include "platform/host/CheckedPlistFile.h"
#include "platform/host/FollowUpItemCodec.h"

namespace qax {

class HostFollowUpCenter : public FollowUpCenter {
  public:
    HostFollowUpCenter(std::string platformRoot, std::shared_ptr<Clock> clock);

    bool postFollowUpItem(const std::string& clientIdentifier, const FollowUpItem& item,
                          std::string* error) override;
    bool clearPendingFollowUpItemsWithUniqueIdentifiers(
        const std::string& clientIdentifier, const std::vector<std::string>& uniqueIdentifiers,
        std::string* error) override;
    std::vector<FollowUpItem> pendingFollowUpItems(const std::string& clientIdentifier,
                                                   std::string* error) override;
    bool clearNotificationForItem(const std::string& clientIdentifier, const FollowUpItem& item,
                                  std::string* error) override;

    // The client's items with the dates of their last post, as stored now.
    std::vector<StoredFollowUpItem> storedItems(const std::string& clientIdentifier,
                                                std::string* error = nullptr);
    // The clients that have a store file.
    std::vector<std::string> clientIdentifiers();

    static std::string storeDirectory(const std::string& platformRoot);
    static std::string notificationsPath(const std::string& platformRoot);

  private:
    using Change = std::function<bool(Value::Array& items, std::string* error)>;
    // Reads the client's array, applies `change` and writes the result back, all under the
    // store's lock. A store that cannot be read counts as empty and is replaced.
    bool modify(const std::string& clientIdentifier, const Change& change, std::string* error);
    // None (and `error`) for an identifier that cannot name a file.
    CheckedPlistFile* storeFile(const std::string& clientIdentifier, std::string* error);
    void deliverNotification(const FollowUpItem& item);

    const std::string platformRoot_;
    const std::shared_ptr<Clock> clock_;
    std::mutex mutex_;
    std::map<std::string, std::unique_ptr<CheckedPlistFile>> files_;
};

}  // namespace qax
