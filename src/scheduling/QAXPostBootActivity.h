// Runs when the platform fires the boot activity: re-schedules the general outreach, the
// conversion outreach and the follow-up refresh from their persisted target dates, so that
// work pending before a restart is asked of the platform again. Runs on the platform's queue
// and finishes before it returns.
#pragma once

#include <memory>

#include "scheduling/QAXSchedulerActivityDelegate.h"

namespace qax {

struct Platform;

class QAXPostBootActivity : public QAXSchedulerActivityDelegate {
  public:
    explicit QAXPostBootActivity(std::shared_ptr<Platform> platform);

    std::string identifier() const override { return kQAXPostBootActivityIdentifier; }
    bool requiresNetwork() const override { return false; }
    void performActivityForScheduler(const std::shared_ptr<QAXScheduler>& scheduler,
                                     Completion completion) override;

  private:
    const std::shared_ptr<Platform> platform_;
};

}  // namespace qax
