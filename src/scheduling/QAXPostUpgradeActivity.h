// Runs when the platform fires the upgrade activity (the first start, then once per new system
// version): the first run ever resets every pending target, records this device's activation
// date and schedules the first outreach; later runs force a conversion outreach once per newer
// system version while no general outreach is pending. Runs on the platform's queue and
// finishes before it returns.
#pragma once

#include <memory>

#include "scheduling/QAXSchedulerActivityDelegate.h"

namespace qax {

struct Platform;

class QAXPostUpgradeActivity : public QAXSchedulerActivityDelegate {
  public:
    explicit QAXPostUpgradeActivity(std::shared_ptr<Platform> platform);

    std::string identifier() const override { return kQAXPostUpgradeActivityIdentifier; }
    bool requiresNetwork() const override { return false; }
    void performActivityForScheduler(const std::shared_ptr<QAXScheduler>& scheduler,
                                     Completion completion) override;

    // Whether the system version is newer than the one seen last while no general outreach is
    // pending.
    bool shouldTriggerWarrantyDownload();

  private:
    const std::shared_ptr<Platform> platform_;
};

}  // namespace qax
