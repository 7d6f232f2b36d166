#include "fakes/FakeBackgroundActivities.h"

namespace qax::test {

void FakeBackgroundActivity::setPreregistered(bool preregistered) {
    std::lock_guard lock(mutex_);
    preregistered_ = preregistered;
}

void FakeBackgroundActivity::setRepeats(bool repeats) {
    std::lock_guard lock(mutex_);
    repeats_ = repeats;
}

void FakeBackgroundActivity::setQualityOfService(QualityOfService qos) {
    std::lock_guard lock(mutex_);
    qos_ = qos;
}

void FakeBackgroundActivity::setCriteria(const ActivityCriteria& criteria) {
    std::lock_guard lock(mutex_);
    criteria_ = criteria;
}

void FakeBackgroundActivity::scheduleWithBlock(Handler handler) {
    std::lock_guard lock(mutex_);
    handler_ = std::move(handler);
    ++scheduleCount_;
    invalidated_ = false;
}

void FakeBackgroundActivity::invalidate() {
    std::lock_guard lock(mutex_);
    handler_ = nullptr;
    invalidated_ = true;
}

bool FakeBackgroundActivity::shouldDefer() {
    std::lock_guard lock(mutex_);
    return shouldDefer_;
}

bool FakeBackgroundActivity::fire() {
    Handler handler;
    {
        std::lock_guard lock(mutex_);
        handler = handler_;
    }
    if (!handler) {
        return false;
    }
    // Outside the lock: the handler may re-arm this very activity.
    handler([results = results_](ActivityResult result) {
        std::lock_guard lock(results->mutex);
        results->values.push_back(result);
    });
    return true;
}

std::vector<ActivityResult> FakeBackgroundActivity::results() const {
    std::lock_guard lock(results_->mutex);
    return results_->values;
}

bool FakeBackgroundActivity::preregistered() const {
    std::lock_guard lock(mutex_);
    return preregistered_;
}

bool FakeBackgroundActivity::repeats() const {
    std::lock_guard lock(mutex_);
    return repeats_;
}

std::optional<QualityOfService> FakeBackgroundActivity::qualityOfService() const {
    std::lock_guard lock(mutex_);
    return qos_;
}

std::optional<ActivityCriteria> FakeBackgroundActivity::criteria() const {
    std::lock_guard lock(mutex_);
    return criteria_;
}

bool FakeBackgroundActivity::armed() const {
    std::lock_guard lock(mutex_);
    return static_cast<bool>(handler_);
}

int FakeBackgroundActivity::scheduleCount() const {
    std::lock_guard lock(mutex_);
    return scheduleCount_;
}

bool FakeBackgroundActivity::invalidated() const {
    std::lock_guard lock(mutex_);
    return invalidated_;
}

void FakeBackgroundActivity::setShouldDefer(bool defer) {
    std::lock_guard lock(mutex_);
    shouldDefer_ = defer;
}

std::shared_ptr<BackgroundActivity> FakeBackgroundActivityScheduler::activityWithIdentifier(
    const std::string& identifier) {
    return activity(identifier);
}

std::shared_ptr<FakeBackgroundActivity> FakeBackgroundActivityScheduler::activity(
    const std::string& identifier) {
    std::lock_guard lock(mutex_);
    auto& slot = activities_[identifier];
    if (!slot) {
        slot = std::make_shared<FakeBackgroundActivity>(identifier);
    }
    return slot;
}

void FakeBackgroundActivityScheduler::invalidateAll() {
    std::lock_guard lock(mutex_);
    for (auto& [identifier, activity] : activities_) {
        activity->invalidate();
    }
}

}  // namespace qax::test
