// An in-memory double of the platform's background activities: one activity per identifier
// that records what it was told (flags, criteria, the latest handler) and fires only when a
// test says so, handing back the result the handler reports. Thread-safe.
#pragma once

#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/BackgroundActivityScheduler.h"

namespace qax::test {

class FakeBackgroundActivity : public BackgroundActivity {
  public:
    using Handler = std::function<void(std::function<void(ActivityResult)> completion)>;
    // What the activity was told last.
    struct Told {
        bool preregistered = false;
        bool repeats = false;
        std::optional<QualityOfService> qualityOfService;
        std::optional<ActivityCriteria> criteria;
    };

    explicit FakeBackgroundActivity(std::string identifier) : identifier_(std::move(identifier)) {}

    const std::string& identifier() const override { return identifier_; }
    void setPreregistered(bool v) override {
        locked([&] { told_.preregistered = v; });
    }
    void setRepeats(bool v) override {
        locked([&] { told_.repeats = v; });
    }
    void setQualityOfService(QualityOfService v) override {
        locked([&] { told_.qualityOfService = v; });
    }
    void setCriteria(const ActivityCriteria& v) override {
        locked([&] { told_.criteria = v; });
    }
    // A later handler replaces the earlier one, as the platform does for one identifier.
    void scheduleWithBlock(Handler h) override {
        locked([&] { handler_ = std::move(h); });
    }
    void invalidate() override {
        locked([&] { handler_ = nullptr; });
    }
    bool shouldDefer() override {
        return locked([&] { return shouldDefer_; });
    }
    void setShouldDefer(bool v) {
        locked([&] { shouldDefer_ = v; });
    }

    Told told() const {
        return locked([&] { return told_; });
    }
    bool armed() const {
        return locked([&] { return static_cast<bool>(handler_); });
    }
    // Runs the latest handler on the caller's thread (outside the lock: the handler may re-arm
    // this very activity); false when none is armed. The results it hands back are collected.
    bool fire() {
        Handler handler = locked([&] { return handler_; });
        if (handler) {
            handler([results = results_](ActivityResult result) {
                std::lock_guard lock(results->mutex);
                results->values.push_back(result);
            });
        }
        return static_cast<bool>(handler);
    }
    std::vector<ActivityResult> results() const {
        std::lock_guard lock(results_->mutex);
        return results_->values;
    }

  private:
    template <typename F>
    auto locked(F f) const -> decltype(f()) {
        std::lock_guard lock(mutex_);
        return f();
    }

    const std::string identifier_;
    mutable std::mutex mutex_;
    Told told_;
    Handler handler_;
    bool shouldDefer_ = false;
    // Shared with the completions handed out, which may outlive a fire() call.
    struct Results {
        std::mutex mutex;
        std::vector<ActivityResult> values;
    };
    const std::shared_ptr<Results> results_ = std::make_shared<Results>();
};

class FakeBackgroundActivityScheduler : public BackgroundActivityScheduler {
  public:
    std::shared_ptr<BackgroundActivity> activityWithIdentifier(const std::string& id) override {
        return activity(id);
    }
    // The activity of this identifier, made on first use.
    std::shared_ptr<FakeBackgroundActivity> activity(const std::string& identifier) {
        std::lock_guard lock(mutex_);
        auto& slot = activities_[identifier];
        if (!slot) {
            slot = std::make_shared<FakeBackgroundActivity>(identifier);
        }
        return slot;
    }
    // Drops every activity's handler (and what it holds), as the test platform goes.
    void invalidateAll() {
        std::lock_guard lock(mutex_);
        for (auto& [identifier, activity] : activities_) {
            activity->invalidate();
        }
    }

  private:
    std::mutex mutex_;
    std::map<std::string, std::shared_ptr<FakeBackgroundActivity>> activities_;
};

}  // namespace qax::test
