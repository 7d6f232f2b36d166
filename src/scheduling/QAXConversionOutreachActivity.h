// The conversion outreach: after the coverage service moved an offer's conversion date earlier, or
// on a newer system version. Each run hands the work to a new QAXOutreachActivityUtilities. No
// state of its own; runs start on the platform's queue.
#pragma once

#include <memory>

#include "scheduling/QAXOutreachActivityUtilities.h"
#include "scheduling/QAXSchedulerActivityDelegate.h"

namespace qax {

struct Platform;

class QAXConversionOutreachActivity : public QAXSchedulerActivityDelegate {
  public:
    explicit QAXConversionOutreachActivity(std::shared_ptr<Platform> platform);

    std::string identifier() const override;
    bool requiresNetwork() const override { return true; }
    void performActivityForScheduler(const std::shared_ptr<QAXScheduler>& scheduler,
                                     Completion completion) override;

  private:
    const std::shared_ptr<Platform> platform_;
};

}  // namespace qax
