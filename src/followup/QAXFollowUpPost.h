// The scheduled activity that posts follow-ups when their time has come: a run fetches fresh
// device infos for all devices, posts the due ones, schedules its own next run for the next
// offer that begins later, and starts the refresh chain when something was posted. A run starts
// on the platform's queue, its deferral check runs on the main queue and the rest on the run's
// agent's policy queue; the two fields below are atomic for that reason, and whichever of the
// deferral check and the end of the run comes first reports the run's result.
#pragma once

#include <atomic>
#include <memory>
#include <mutex>
#include <optional>

#include "core/Date.h"
#include "core/RepeatingTimer.h"
#include "followup/QAXFollowUp.h"
#include "scheduling/QAXSchedulerActivityDelegate.h"

namespace qax {

struct Platform;

class QAXFollowUpPost : public QAXSchedulerActivityDelegate,
                        public std::enable_shared_from_this<QAXFollowUpPost> {
  public:
    // The deferral check's interval: it never fires within a run in practice.
    static constexpr double kDeferralCheckInterval = 2000000000;

    explicit QAXFollowUpPost(std::shared_ptr<Platform> platform);

    std::string identifier() const override { return kQAXFollowUpPostActivityIdentifier; }
    bool requiresNetwork() const override { return true; }
    void performActivityForScheduler(const std::shared_ptr<QAXScheduler>& scheduler,
                                     Completion completion) override;

    // The earliest future beginning of an offer among displayed, never-posted devices, brought
    // forward to the earliest end of eligibility among them (which may lie in the past); none
    // when no such device remains.
    static std::optional<Date> nextFollowUpPostDateWithDevicesInfo(
        const Platform& platform, const QAXDeviceInfoList& deviceInfos);

    std::shared_ptr<RepeatingTimer> followUpPostTimer() const;
    void setFollowUpPostTimer(std::shared_ptr<RepeatingTimer> timer);
    bool followUpPostInProgress() const { return followUpPostInProgress_; }
    void setFollowUpPostInProgress(bool inProgress) { followUpPostInProgress_ = inProgress; }

    // Tests shorten the deferral check.
    void setDeferralCheckInterval(double seconds) { deferralCheckInterval_ = seconds; }

  private:
    struct Run;

    void handleDeviceInfos(const std::shared_ptr<Run>& run,
                           const std::optional<QAXDeviceInfoList>& deviceInfos);
    void endRun(const std::shared_ptr<Run>& run, std::int64_t result);

    const std::shared_ptr<Platform> platform_;
    double deferralCheckInterval_ = kDeferralCheckInterval;
    mutable std::mutex timerMutex_;
    std::shared_ptr<RepeatingTimer> followUpPostTimer_;
    std::atomic<bool> followUpPostInProgress_{false};
};

}  // namespace qax
