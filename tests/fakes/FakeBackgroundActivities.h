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

    explicit FakeBackgroundActivity(std::string identifier) : identifier_(std::move(identifier)) {}

    const std::string& identifier() const override { return identifier_; }
    void setPreregistered(bool preregistered) override;
    void setRepeats(bool repeats) override;
    void setQualityOfService(QualityOfService qos) override;
    void setCriteria(const ActivityCriteria& criteria) override;
    // A later handler replaces the earlier one, as the platform does for one identifier.
    void scheduleWithBlock(Handler handler) override;
    void invalidate() override;
    bool shouldDefer() override;

    // Runs the latest handler on the caller's thread; false when none is armed. The results
    // it hands back are collected in results().
    bool fire();
    std::vector<ActivityResult> results() const;

    bool preregistered() const;
    bool repeats() const;
    std::optional<QualityOfService> qualityOfService() const;
    std::optional<ActivityCriteria> criteria() const;
    bool armed() const;
    int scheduleCount() const;
    bool invalidated() const;
    void setShouldDefer(bool defer);

  private:
    const std::string identifier_;
    mutable std::mutex mutex_;
    bool preregistered_ = false;
    bool repeats_ = false;
    std::optional<QualityOfService> qos_;
    std::optional<ActivityCriteria> criteria_;
    Handler handler_;
    int scheduleCount_ = 0;
    bool invalidated_ = false;
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
    std::shared_ptr<BackgroundActivity> activityWithIdentifier(
        const std::string& identifier) override;
    // The activity of this identifier, made on first use.
    std::shared_ptr<FakeBackgroundActivity> activity(const std::string& identifier);
    // Drops every activity's handler (and what it holds), as the test platform goes.
    void invalidateAll();

  private:
    std::mutex mutex_;
    std::map<std::string, std::shared_ptr<FakeBackgroundActivity>> activities_;
};

}  // namespace qax::test
