// The scheduled activity that keeps posted follow-ups current while their offers last: each run
// rebuilds the shown items from cached warranties (day count, badge, notification, removal at
// the end) and schedules the next run for the next moment one of them changes, for as long as
// any is shown. No state of its own; a run starts on the platform's queue and ends on its
// agent's policy queue.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "core/Date.h"
#include "followup/QAXFollowUp.h"
#include "scheduling/QAXSchedulerActivityDelegate.h"

namespace qax {

struct Platform;

class QAXFollowUpRefresh : public QAXSchedulerActivityDelegate,
                           public std::enable_shared_from_this<QAXFollowUpRefresh> {
  public:
    explicit QAXFollowUpRefresh(std::shared_ptr<Platform> platform);

    std::string identifier() const override { return kQAXFollowUpRefreshActivityIdentifier; }
    bool requiresNetwork() const override { return false; }
    void performActivityForScheduler(const std::shared_ptr<QAXScheduler>& scheduler,
                                     Completion completion) override;

    // The next moment a shown offer's day count changes (or a pending offer's start), brought
    // forward to the earliest end of eligibility; none when nothing calls for one.
    static std::optional<Date> nextFollowUpRefreshDateWithDevicesInfo(
        const Platform& platform, const QAXDeviceInfoList& deviceInfos, bool isInitialCall);

  private:
    const std::shared_ptr<Platform> platform_;
};

}  // namespace qax
