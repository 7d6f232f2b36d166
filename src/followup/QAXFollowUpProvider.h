// Where the follow-up rules store their items: the platform's follow-up service for the
// agent's client identifier, or a store of a test's making. Implementations are thread-safe.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "platform/FollowUpCenter.h"

namespace qax {

class QAXFollowUpProvider {
  public:
    virtual ~QAXFollowUpProvider() = default;
    // True when the item was stored; an item whose unique identifier is pending replaces it.
    virtual bool postFollowUpItem(const FollowUpItem& item, std::optional<std::string>* error) = 0;
    virtual bool clearPendingFollowUpItemsWithUniqueIdentifiers(
        const std::vector<std::string>& uniqueIdentifiers, std::optional<std::string>* error) = 0;
    // The pending items; on failure `error` is set and whatever is returned is used as the list.
    virtual std::vector<FollowUpItem> pendingFollowUpItems(std::optional<std::string>* error) = 0;
};

}  // namespace qax
