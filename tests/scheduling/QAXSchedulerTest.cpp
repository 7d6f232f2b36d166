#include <gtest/gtest.h>

#include <cmath>
#include <limits>

#include "fakes/FakeBackgroundActivities.h"
#include "fakes/FakeServices.h"
#include "fakes/TestPlatform.h"
#include "platform/PreferenceStore.h"
#include "scheduling/QAXScheduler.h"

namespace qax {
namespace {

constexpr const char* kIdentifier = kQAXOutreachActivityIdentifier;

// Counts runs and keeps the completion of the latest one, so a test reports when it likes.
class RecordingActivity : public QAXSchedulerActivityDelegate {
  public:
    explicit RecordingActivity(bool network = true) : network_(network) {}
    std::string identifier() const override { return kIdentifier; }
    bool requiresNetwork() const override { return network_; }
    void performActivityForScheduler(const std::shared_ptr<QAXScheduler>& scheduler,
                                     Completion completion) override {
        ++runs;
        if (duringRun) {
            duringRun(scheduler);
        }
        pending = std::move(completion);
    }

    int runs = 0;
    Completion pending;
    std::function<void(const std::shared_ptr<QAXScheduler>&)> duringRun;

  private:
    bool network_;
};

class QAXSchedulerTest : public ::testing::Test {
  protected:
    std::shared_ptr<QAXScheduler> make(std::shared_ptr<RecordingActivity> delegate) {
        return QAXScheduler::newSchedulerWithActivityDelegate(tp.platform, std::move(delegate));
    }
    std::shared_ptr<test::FakeBackgroundActivity> activity() {
        return std::static_pointer_cast<test::FakeBackgroundActivityScheduler>(
                   tp.platform->activities)
            ->activity(kIdentifier);
    }
    bool hasTarget() {
        return tp.platform->preferences->objectForKey(QAXScheduler::targetDateKey(kIdentifier))
            .has_value();
    }

    test::TestPlatform tp;
    std::shared_ptr<RecordingActivity> delegate = std::make_shared<RecordingActivity>();
};

TEST_F(QAXSchedulerTest, DelayIsClampedAndTruncatedToWholeSeconds) {
    const double inf = std::numeric_limits<double>::infinity();
    const std::tuple<double, std::int64_t, std::int64_t, bool> rows[] = {
        {25, 25, 2, true},  {9.9, 9, 0, true},   {3600, 3600, 360, true},
        {0, 0, 0, true},    {-30, 0, 0, true},   {std::nan(""), 0, 0, false},
        {inf, 0, 0, false}, {-inf, 0, 0, false},
    };
    for (const auto& [delay, delaySeconds, grace, targetIsNowPlusDelay] : rows) {
        SCOPED_TRACE(delay);
        const bool network = delaySeconds % 2 == 0;
        auto scheduler = make(std::make_shared<RecordingActivity>(network));
        scheduler->scheduleActivityWithDelay(delay);

        auto criteria = activity()->told().criteria;
        ASSERT_TRUE(criteria);
        EXPECT_EQ(criteria->delaySeconds, delaySeconds);
        EXPECT_EQ(criteria->gracePeriodSeconds, grace);
        EXPECT_EQ(criteria->requiresNetwork, network);
        EXPECT_TRUE(criteria->priorityUtility);
        EXPECT_FALSE(activity()->told().preregistered);
        EXPECT_FALSE(activity()->told().repeats);
        EXPECT_EQ(activity()->told().qualityOfService, QualityOfService::Background);
        EXPECT_TRUE(activity()->armed());

        const Date now = tp.clock->now();
        const Date expected = targetIsNowPlusDelay ? now.byAdding(delay) : now;
        EXPECT_EQ(scheduler->scheduledActivityDate(), expected);
    }
}

TEST_F(QAXSchedulerTest, ScheduleForDateSetsOrRemovesTheTarget) {
    auto scheduler = make(delegate);
    const Date past = tp.clock->now().byAdding(-86400);
    scheduler->scheduleActivityForDate(past);
    EXPECT_EQ(scheduler->scheduledActivityDate(), past);
    EXPECT_EQ(activity()->told().criteria->delaySeconds, 0);
    EXPECT_TRUE(
        tp.log->contains("scheduled 'com.velmora.qaxagent.outreach' with delay: "
                         "-86400.00 (" +
                         past.description() + ")"));

    scheduler->scheduleActivityForDate(tp.clock->now().byAdding(90.5));
    EXPECT_EQ(activity()->told().criteria->delaySeconds, 90);
    EXPECT_EQ(activity()->told().criteria->gracePeriodSeconds, 9);

    // No date: run at the first opportunity and leave no target behind.
    scheduler->scheduleActivityForDate(std::nullopt);
    EXPECT_FALSE(hasTarget());
    EXPECT_EQ(activity()->told().criteria->delaySeconds, 0);
    EXPECT_TRUE(
        tp.log->contains("scheduled 'com.velmora.qaxagent.outreach' with delay: 0.00 ((null))"));
}

TEST_F(QAXSchedulerTest, FiringDecidesByTheStoredTarget) {
    // The target, what the run reports (none: the run is deferred unrun), what the platform hears.
    const std::tuple<const char*, std::optional<double>, std::optional<std::int64_t>,
                     ActivityResult, bool>
        rows[] = {
            {"ten minutes early", 600, std::nullopt, ActivityResult::Deferred, true},
            {"exactly at target, finished", 0, QAXActivityResultFinished, ActivityResult::Finished,
             false},
            {"late, finished", -5, QAXActivityResultFinished, ActivityResult::Finished, false},
            {"late, deferred by the run", -5, QAXActivityResultDeferred, ActivityResult::Deferred,
             true},
            {"no target", std::nullopt, QAXActivityResultFinished, ActivityResult::Finished, false},
        };
    for (const auto& [name, targetFromNow, delegateResult, handedBack, targetKept] : rows) {
        SCOPED_TRACE(name);
        auto run = std::make_shared<RecordingActivity>();
        auto scheduler = make(run);
        if (targetFromNow) {
            scheduler->scheduleActivityWithDelay(*targetFromNow);
        } else {
            scheduler->scheduleActivityForDate(std::nullopt);
        }
        const auto before = activity()->results().size();
        ASSERT_TRUE(activity()->fire());
        if (delegateResult) {
            EXPECT_EQ(run->runs, 1);
            ASSERT_TRUE(run->pending);
            run->pending(*delegateResult);
        } else {
            EXPECT_EQ(run->runs, 0);
            EXPECT_TRUE(tp.log->contains(
                "target not past for 'com.velmora.qaxagent.outreach', defer for: 600.00"));
        }
        EXPECT_EQ(hasTarget(), targetKept);
        if (!targetKept) {
            EXPECT_FALSE(scheduler->scheduledActivityDate());
        }

        // The platform hears the result one second after it was reported, unchanged.
        tp.runner->advanceBy(0.999);
        EXPECT_EQ(activity()->results().size(), before);
        tp.runner->advanceBy(0.001);
        ASSERT_EQ(activity()->results().size(), before + 1);
        EXPECT_EQ(activity()->results().back(), handedBack);
    }
}

TEST_F(QAXSchedulerTest, MonitoringAttachesToThePreregisteredActivity) {
    auto scheduler = make(delegate);
    scheduler->monitorForScheduledActivity();
    EXPECT_TRUE(activity()->told().preregistered);

    // A wake-up of the pre-registered activity with a target still in the future defers.
    tp.platform->preferences->setObject(QAXScheduler::targetDateKey(kIdentifier),
                                        Value(tp.clock->now().byAdding(120)));
    activity()->fire();
    EXPECT_EQ(delegate->runs, 0);
    tp.clock->advanceBy(120);
    activity()->fire();
    EXPECT_EQ(delegate->runs, 1);

    activity()->setShouldDefer(true);
    EXPECT_TRUE(scheduler->shouldDefer());
}

TEST_F(QAXSchedulerTest, RunThatReschedulesItselfAndFinishesLosesTheNewTarget) {
    auto scheduler = make(delegate);
    scheduler->scheduleActivityWithDelay(0);
    delegate->duringRun = [this](const std::shared_ptr<QAXScheduler>&) {
        make(delegate)->scheduleActivityWithDelay(3600);
    };
    activity()->fire();
    ASSERT_TRUE(hasTarget());
    EXPECT_EQ(activity()->told().criteria->delaySeconds, 3600);

    delegate->duringRun = nullptr;
    delegate->pending(QAXActivityResultFinished);
    EXPECT_FALSE(scheduler->scheduledActivityDate());

    // The platform fires the new registration early; with no target the delegate runs at once.
    tp.runner->advanceBy(1);
    activity()->fire();
    EXPECT_EQ(delegate->runs, 2);
}

TEST_F(QAXSchedulerTest, ClearRemovesOnlyTargetDates) {
    PreferenceStore& prefs = *tp.platform->preferences;
    const char* identifiers[] = {
        kQAXPostUpgradeActivityIdentifier,        kQAXPostBootActivityIdentifier,
        kQAXOutreachActivityIdentifier,           kQAXFollowUpPostActivityIdentifier,
        kQAXConversionOutreachActivityIdentifier, kQAXFollowUpRefreshActivityIdentifier,
    };
    for (const char* id : identifiers) {
        prefs.setObject(QAXScheduler::targetDateKey(id), Value(tp.clock->now()));
    }
    prefs.setObject("something.else.TargetDate", Value(tp.clock->now()));
    prefs.setObject("TargetDate", Value(1));
    prefs.setObject("com.velmora.qaxagent.outreach.TargetDate.old", Value(1));
    prefs.setObject("FollowupPostedSerialNumberHashes", Value::Array{"abc"});

    QAXScheduler::clearScheduledActivities(*tp.platform);

    auto keys = prefs.allKeys();
    std::sort(keys.begin(), keys.end());
    EXPECT_EQ(keys, (std::vector<std::string>{"FollowupPostedSerialNumberHashes", "TargetDate",
                                              "com.velmora.qaxagent.outreach.TargetDate.old"}));
}

}  // namespace
}  // namespace qax
