// The general outreach: the first outreach after set-up and on a client's request. Each run hands
// the work to a new QAXOutreachActivityUtilities. No state of its own; runs start on the platform's
// queue.
#pragma once

#include <memory>

#include "scheduling/QAXOutreachActivityUtilities.h"
#include "scheduling/QAXSchedulerActivityDelegate.h"

namespace qax {

struct Platform;

class QAXOutreachActivity : public QAXSchedulerActivityDelegate {
  public:
    explicit QAXOutreachActivity(std::shared_ptr<Platform> platform);

    std::string identifier() const override;
    bool requiresNetwork() const override { return true; }
    void performActivityForScheduler(const std::shared_ptr<QAXScheduler>& scheduler,
                                     Completion completion) override;

  private:
    const std::shared_ptr<Platform> platform_;
};

}  // namespace qax
