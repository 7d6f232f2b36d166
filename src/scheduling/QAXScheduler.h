// Runs one of the agent's activities as a deferrable one-shot background activity of the
// platform that must not start before a target date and survives exits and reboots: the target
// date is persisted in the preference domain under identifier + ".TargetDate", the platform is
// asked to wake the agent after the remaining delay, and on waking the scheduler either runs
// its delegate or tells the platform to defer. Several schedulers may exist for one identifier;
// they share only the platform activity and the preference key. Any thread; results are handed
// back to the platform on the main queue.
#pragma once

#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "core/Date.h"
#include "platform/BackgroundActivityScheduler.h"
#include "scheduling/QAXSchedulerActivityDelegate.h"

namespace qax {

struct Platform;

class QAXScheduler : public std::enable_shared_from_this<QAXScheduler> {
  public:
    static std::shared_ptr<QAXScheduler> newSchedulerWithActivityDelegate(
        std::shared_ptr<Platform> platform,
        std::shared_ptr<QAXSchedulerActivityDelegate> activityDelegate);
    // Removes every persisted target date (every key ending in ".TargetDate").
    static void clearScheduledActivities(const Platform& platform);
    // The preference key of an identifier's target date.
    static std::string targetDateKey(const std::string& identifier);

    QAXScheduler(std::shared_ptr<Platform> platform,
                 std::shared_ptr<QAXSchedulerActivityDelegate> activityDelegate);

    const std::string& identifier() const { return identifier_; }
    std::shared_ptr<QAXSchedulerActivityDelegate> activityDelegate() const;
    void setActivityDelegate(std::shared_ptr<QAXSchedulerActivityDelegate> delegate);

    // Attaches the handler to the pre-registered platform activity of this identifier.
    void monitorForScheduledActivity();
    // Target = now + delay.
    void scheduleActivityWithDelay(double delay);
    // Delay = seconds from now to `date` (0 without a date, which also leaves no target).
    void scheduleActivityForDate(std::optional<Date> date);
    void _scheduleActivityWithDelay(double delay, std::optional<Date> date);
    // The persisted target date, or none.
    std::optional<Date> scheduledActivityDate() const;
    // The handler run when the platform activity fires.
    void performScheduledOutreachWithBlock(std::function<void(ActivityResult)> completion);
    // Whether the platform asks the running activity of this identifier to stop and defer.
    bool shouldDefer() const;

  private:
    const std::shared_ptr<Platform> platform_;
    const std::string identifier_;
    mutable std::mutex mutex_;
    std::shared_ptr<QAXSchedulerActivityDelegate> activityDelegate_;
    std::shared_ptr<BackgroundActivity> activity_;
};

}  // namespace qax
