// The platform's deferrable background activities: one pre-registered activity per
// identifier, run when its criteria are met, told to defer when the system is busy.
// Thread-safe; handlers run on the main queue.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

namespace qax {

enum class ActivityResult : std::int64_t { Finished = 1, Deferred = 2 };

enum class QualityOfService { Background, Utility, Default };

struct ActivityCriteria {
    std::int64_t delaySeconds = 0;
    std::int64_t gracePeriodSeconds = 0;
    bool requiresNetwork = false;
    bool priorityUtility = true;
};

// One platform activity, identified by its identifier.
class BackgroundActivity {
  public:
    virtual ~BackgroundActivity() = default;
    virtual const std::string& identifier() const = 0;
    virtual void setPreregistered(bool preregistered) = 0;
    virtual void setRepeats(bool repeats) = 0;
    virtual void setQualityOfService(QualityOfService qos) = 0;
    virtual void setCriteria(const ActivityCriteria& criteria) = 0;
    // Arms the activity; `handler` runs when it fires and must call its completion once.
    virtual void scheduleWithBlock(
        std::function<void(std::function<void(ActivityResult)> completion)> handler) = 0;
    virtual void invalidate() = 0;
    // Whether the platform asks the running activity to stop and defer.
    virtual bool shouldDefer() = 0;
};

class BackgroundActivityScheduler {
  public:
    virtual ~BackgroundActivityScheduler() = default;
    // The activity of this identifier; pre-registered activities come from the launch
    // configuration with their own criteria.
    virtual std::shared_ptr<BackgroundActivity> activityWithIdentifier(
        const std::string& identifier) = 0;
};

}  // namespace qax
