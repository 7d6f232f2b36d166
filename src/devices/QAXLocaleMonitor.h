// Refreshes warranties and follow-ups when the user's language changes while a follow-up is
// shown, so that its text follows the new language, then lets the process exit once idle.
// Each language notification schedules its own check 5 s later (not coalesced). The
// notification handler and the check run on the main queue; the refresh reply on the agent's
// policy queue.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>

#include "agent/QAXAgentProtocol.h"

namespace qax {

struct Platform;

class QAXLocaleMonitor : public std::enable_shared_from_this<QAXLocaleMonitor> {
  public:
    // How many of the agent's follow-up items the follow-up service lists as pending (the
    // follow-up layer answers; this layer may not name it).
    using PendingFollowUpCount = std::function<std::uint64_t()>;

    QAXLocaleMonitor(std::shared_ptr<Platform> platform, std::shared_ptr<QAXAgentProtocol> agent,
                     PendingFollowUpCount pendingFollowUpCount);
    ~QAXLocaleMonitor();

    // Registers for the language-changed notification on the main queue.
    void start();
    void localeDidChange();

    std::shared_ptr<QAXAgentProtocol> agent() const;
    void setAgent(std::shared_ptr<QAXAgentProtocol> agent);

  private:
    const std::shared_ptr<Platform> platform_;
    const PendingFollowUpCount pendingFollowUpCount_;
    std::int32_t languageNotifyToken_ = 0;
    mutable std::mutex mutex_;
    std::shared_ptr<QAXAgentProtocol> agent_;
};

}  // namespace qax
