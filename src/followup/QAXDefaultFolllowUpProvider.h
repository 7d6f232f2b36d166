// The follow-up rules' store on the platform's follow-up service: every operation opens the
// service anew for the agent's client identifier and forwards the call, returning the
// service's result and error unchanged. Keeps nothing between calls; any thread.
#pragma once

#include <memory>

#include "followup/QAXFollowUpProvider.h"

namespace qax {

class QAXDefaultFolllowUpProvider : public QAXFollowUpProvider {
  public:
    explicit QAXDefaultFolllowUpProvider(std::shared_ptr<FollowUpCenter> center);

    bool postFollowUpItem(const FollowUpItem& item, std::optional<std::string>* error) override;
    bool clearPendingFollowUpItemsWithUniqueIdentifiers(
        const std::vector<std::string>& uniqueIdentifiers,
        std::optional<std::string>* error) override;
    std::vector<FollowUpItem> pendingFollowUpItems(std::optional<std::string>* error) override;

  private:
    const std::shared_ptr<FollowUpCenter> center_;
};

}  // namespace qax
