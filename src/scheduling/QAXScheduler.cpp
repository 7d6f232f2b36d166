// The persisted-target scheduler of the agent's activities. The target date in the preference
// domain, not the platform's timer, decides whether a firing runs the delegate: the platform
// may wake the agent early (its delay is whole seconds, and pre-registered activities wake on
// their own criteria), and a firing before the target only asks the platform to defer.
#include "scheduling/QAXScheduler.h"

#include <cmath>
#include <limits>
#include <utility>

#include "core/Log.h"
#include "platform/Platform.h"
#include "platform/PreferenceStore.h"

namespace qax {
namespace {

constexpr const char* kTargetDateSuffix = ".TargetDate";
// The platform hears a delegate's result this long after the delegate reported it.
constexpr double kResultHandBackDelaySeconds = 1.0;

bool endsWith(const std::string& text, std::string_view suffix) {
    return text.size() >= suffix.size() &&
           text.compare(text.size() - suffix.size(), suffix.size(), suffix) == 0;
}

// Whole seconds of a non-negative duration, saturating where 64 bits end.
std::int64_t wholeSeconds(double seconds) {
    constexpr double kLimit = static_cast<double>(std::numeric_limits<std::int64_t>::max());
    if (seconds >= kLimit) {
        return std::numeric_limits<std::int64_t>::max();
    }
    return static_cast<std::int64_t>(seconds);
}

}  // namespace

std::shared_ptr<QAXScheduler> QAXScheduler::newSchedulerWithActivityDelegate(
    std::shared_ptr<Platform> platform,
    std::shared_ptr<QAXSchedulerActivityDelegate> activityDelegate) {
    return std::make_shared<QAXScheduler>(std::move(platform), std::move(activityDelegate));
}

std::string QAXScheduler::targetDateKey(const std::string& identifier) {
    return identifier + kTargetDateSuffix;
}

void QAXScheduler::clearScheduledActivities(const Platform& platform) {
    PreferenceStore& preferences = *platform.preferences;
    for (const std::string& key : preferences.allKeys()) {
        if (endsWith(key, kTargetDateSuffix)) {
            qaxLog().info("Clearing %@", key);
            preferences.removeObject(key);
        }
    }
}

QAXScheduler::QAXScheduler(std::shared_ptr<Platform> platform,
                           std::shared_ptr<QAXSchedulerActivityDelegate> activityDelegate)
    : platform_(std::move(platform)),
      identifier_(activityDelegate ? activityDelegate->identifier() : std::string()),
      activityDelegate_(std::move(activityDelegate)) {
    activity_ = platform_->activities->activityWithIdentifier(identifier_);
}

std::shared_ptr<QAXSchedulerActivityDelegate> QAXScheduler::activityDelegate() const {
    std::lock_guard lock(mutex_);
    return activityDelegate_;
}

void QAXScheduler::setActivityDelegate(std::shared_ptr<QAXSchedulerActivityDelegate> delegate) {
    std::lock_guard lock(mutex_);
    activityDelegate_ = std::move(delegate);
}

void QAXScheduler::monitorForScheduledActivity() {
    qaxLog().info("monitorForScheduledActivity for '%@'", identifier_);
    activity_->setPreregistered(true);
    // The platform keeps the handler, and with it this scheduler, for as long as the
    // activity is registered: start-up's schedulers live as long as the process.
    auto self = shared_from_this();
    activity_->scheduleWithBlock([self](std::function<void(ActivityResult)> completion) {
        self->performScheduledOutreachWithBlock(std::move(completion));
    });
}

void QAXScheduler::scheduleActivityWithDelay(double delay) {
    // A delay that is not a number of seconds schedules for now, like a past date.
    const Date now = platform_->clock->now();
    const Date target = std::isfinite(delay) ? now.byAdding(delay) : now;
    _scheduleActivityWithDelay(delay, target);
}

void QAXScheduler::scheduleActivityForDate(std::optional<Date> date) {
    const double delay = date ? date->timeIntervalSince(platform_->clock->now()) : 0.0;
    _scheduleActivityWithDelay(delay, date);
}

void QAXScheduler::_scheduleActivityWithDelay(double delay, std::optional<Date> date) {
    qaxLog().info("scheduled '%@' with delay: %.02f (%@)", identifier_, delay, date);
    activity_->setPreregistered(false);
    activity_->setRepeats(false);
    activity_->setQualityOfService(QualityOfService::Background);

    // Past dates run at the first opportunity; NaN and infinities have no whole-second form.
    const double clamped = std::isfinite(delay) && delay > 0 ? delay : 0.0;
    auto delegate = activityDelegate();
    ActivityCriteria criteria;
    criteria.gracePeriodSeconds = wholeSeconds(clamped / 10);
    criteria.delaySeconds = wholeSeconds(clamped);
    criteria.requiresNetwork = delegate && delegate->requiresNetwork();
    criteria.priorityUtility = true;
    activity_->setCriteria(criteria);

    const std::string key = targetDateKey(identifier_);
    if (date) {
        platform_->preferences->setObject(key, Value(*date));
    } else {
        platform_->preferences->removeObject(key);
    }

    auto self = shared_from_this();
    activity_->scheduleWithBlock([self](std::function<void(ActivityResult)> completion) {
        qaxLog().info("ZRN activity block occured '%@' at (%@)", self->identifier_,
                      self->platform_->clock->now());
        self->performScheduledOutreachWithBlock(std::move(completion));
    });
}

std::optional<Date> QAXScheduler::scheduledActivityDate() const {
    return platform_->preferences->dateForKey(targetDateKey(identifier_));
}

void QAXScheduler::performScheduledOutreachWithBlock(
    std::function<void(ActivityResult)> completion) {
    const std::optional<Date> target = scheduledActivityDate();
    qaxLog().info("activity for '%@' should occur on: %@", identifier_, target);
    const double remaining = target ? target->timeIntervalSince(platform_->clock->now()) : 0.0;

    // The delegate may report from any thread; the platform hears of it on the main queue.
    auto platform = platform_;
    const std::string key = targetDateKey(identifier_);
    QAXSchedulerActivityDelegate::Completion report =
        [platform, key, completion = std::move(completion)](std::int64_t result) {
            if (result == QAXActivityResultFinished) {
                platform->preferences->removeObject(key);
            }
            platform->dispatcher->mainQueue()->postDelayed(
                [completion, result] { completion(static_cast<ActivityResult>(result)); },
                kResultHandBackDelaySeconds);
        };

    if (remaining <= 0) {
        qaxLog().info("target reached for '%@', trigger activity", identifier_);
        if (auto delegate = activityDelegate()) {
            delegate->performActivityForScheduler(shared_from_this(), std::move(report));
        } else {
            // Nothing to run; without an answer the platform would wait for the run forever.
            report(QAXActivityResultFinished);
        }
        return;
    }
    qaxLog().info("target not past for '%@', defer for: %.02f", identifier_, remaining);
    report(QAXActivityResultDeferred);
}

bool QAXScheduler::shouldDefer() const {
    return activity_->shouldDefer();
}

}  // namespace qax
