// The host's background activities on virtual time against a temporary platform root: due
// times, restarts, deferral back-off and spacing, launch triggers, re-registration during a
// run, the network requirement and the simulated clock's jumps.
#include <gtest/gtest.h>

#include <functional>
#include <limits>
#include <map>
#include <vector>

#include "core/PlistCodec.h"
#include "fakes/FakeNotificationCenter.h"
#include "fakes/FakeServices.h"
#include "fakes/TestPlatform.h"
#include "platform/host/HostActivityRegistry.h"
#include "platform/host/HostBackgroundActivityScheduler.h"
#include "platform/host/SimulatedClock.h"

namespace qax {
namespace {

using test::writeFile;
using Completion = std::function<void(ActivityResult)>;

constexpr const char* kLaunchConfiguration = R"(<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0"><dict>
  <key>boot</key><dict><key>Trigger</key><string>boot</string></dict>
  <key>upgrade</key><dict><key>Trigger</key><string>upgrade</string></dict>
  <key>hourly</key><dict><key>Trigger</key><string>interval</string>
    <key>Interval</key><integer>3600</integer></dict>
  <key>net</key><dict><key>Trigger</key><string>interval</string>
    <key>Interval</key><integer>0</integer><key>RequiresNetwork</key><true/></dict>
</dict></plist>)";

class Harness {
  public:
    Harness() {
        writeFile(share.path() / "activities.plist", kLaunchConfiguration);
        setBootId("boot-1");
        start();
    }

    void start() {
        HostBackgroundActivityScheduler::Options options;
        options.platformRoot = env.platform->platformRoot;
        options.shareDirectory = share.str();
        options.bootIdPath = (share.path() / "boot_id").string();
        options.networkAvailable = [this] { return network; };
        options.clockChanged = clockChanged;
        scheduler = std::make_shared<HostBackgroundActivityScheduler>(env.platform, options);
        env.platform->activities = scheduler;
    }
    // A new scheduler on the same root, as after the agent restarted.
    void restart() {
        env.platform->activities.reset();
        scheduler.reset();
        start();
    }
    void setBootId(const std::string& id) { writeFile(share.path() / "boot_id", id + "\n"); }

    // Records the seconds since the start of each fire; answers with `answer(fire number)`, or
    // keeps the completion in `held` when that is none.
    HostBackgroundActivityScheduler::Handler recorder(
        std::vector<double>& fires,
        std::function<std::optional<ActivityResult>(std::size_t)> answer = nullptr) {
        return [this, &fires, answer](Completion completion) {
            fires.push_back(env.clock->now().timeIntervalSince(start_));
            auto result = answer ? answer(fires.size()) : ActivityResult::Finished;
            if (result) {
                completion(*result);
            } else {
                held.push_back(std::move(completion));
            }
        };
    }
    void schedule(const std::string& id, std::int64_t delay,
                  HostBackgroundActivityScheduler::Handler handler, bool requiresNetwork = false) {
        auto activity = scheduler->activityWithIdentifier(id);
        activity->setPreregistered(false);
        activity->setCriteria({delay, delay / 10, requiresNetwork, true});
        activity->scheduleWithBlock(std::move(handler));
    }
    void attach(const std::string& id, HostBackgroundActivityScheduler::Handler handler) {
        auto activity = scheduler->activityWithIdentifier(id);
        activity->setPreregistered(true);
        activity->scheduleWithBlock(std::move(handler));
    }
    ActivityRecord record(const std::string& id) {
        return HostActivityRegistry::load(env.platform->platformRoot)[id];
    }
    double elapsed() const { return env.clock->now().timeIntervalSince(start_); }

    test::TestPlatform env;
    test::TempDir share;
    bool network = true;
    std::function<void()> clockChanged;
    std::shared_ptr<HostBackgroundActivityScheduler> scheduler;
    std::vector<Completion> held;

  private:
    const Date start_ = env.clock->now();
};

TEST(HostBackgroundActivityScheduler, FiresAtItsDueTimeAndSurvivesARestart) {
    // A restart (< 0: none), when the handler is attached again after it, the expected fire.
    const std::tuple<const char*, double, double, double> rows[] = {
        {"no restart", -1, 0, 100},
        {"restart before due, attached at once", 40, 40, 100},
        {"restart before due, attached late", 40, 250, 250},
    };
    for (const auto& [name, restartAfter, attachAfter, expectedFire] : rows) {
        SCOPED_TRACE(name);
        Harness h;
        std::vector<double> fires;
        h.schedule("x", 100, h.recorder(fires));
        if (restartAfter >= 0) {
            h.env.runner->advanceBy(restartAfter);
            h.restart();
            h.env.runner->advanceBy(attachAfter - restartAfter);
            ASSERT_TRUE(fires.empty());
            h.attach("x", h.recorder(fires));
        }
        if (expectedFire > h.elapsed()) {
            h.env.runner->advanceBy(expectedFire - h.elapsed() - 0.5);
            EXPECT_TRUE(fires.empty()) << "not before its due time";
        }
        h.env.runner->advanceBy(1000);
        ASSERT_EQ(fires.size(), 1u);
        EXPECT_NEAR(fires[0], expectedFire, 0.01);
        auto record = h.record("x");
        EXPECT_FALSE(record.pending()) << "result 1 removes the registration";
        EXPECT_EQ(record.lastResult, 1);
        ASSERT_TRUE(record.lastFired);
    }
}

TEST(HostBackgroundActivityScheduler, DeferralsBackOffAcrossARestartAndFiresStayAMinuteApart) {
    Harness h;
    std::vector<double> fires;
    auto deferFifteenTimes = [](std::size_t n) {
        return n < 16 ? ActivityResult::Deferred : ActivityResult::Finished;
    };
    h.schedule("x", 0, h.recorder(fires, deferFifteenTimes));
    h.env.runner->advanceBy(4 * 60 + 1);  // fires at 0, 60, 120, 180, 240
    ASSERT_EQ(fires.size(), 5u);
    EXPECT_EQ(h.record("x").deferrals, 5);
    // The count is persisted: the agent restarting changes no wait.
    h.restart();
    h.attach("x", h.recorder(fires, deferFifteenTimes));
    h.env.runner->advanceBy(48 * 3600);
    // Waits after each deferral: 5 s doubling (never under the 60 s spacing), at most 6 h.
    const double expectedGaps[] = {60,   60,   60,   60,    80,    160,   320,  640,
                                   1280, 2560, 5120, 10240, 20480, 21600, 21600};
    ASSERT_EQ(fires.size(), std::size(expectedGaps) + 1);
    for (std::size_t i = 0; i < std::size(expectedGaps); ++i) {
        EXPECT_NEAR(fires[i + 1] - fires[i], expectedGaps[i], 0.01) << "gap " << i;
    }
    EXPECT_FALSE(h.record("x").pending());
}

TEST(HostBackgroundActivityScheduler, RegistrationMadeDuringARunOutlivesItsResult) {
    const std::pair<std::int64_t, double> rows[] = {{300, 300}, {0, 60}};
    for (const auto& [delayDuringRun, expectedSecondFire] : rows) {
        SCOPED_TRACE(delayDuringRun);
        Harness h;
        std::vector<double> fires;
        h.schedule("x", 0, [&](Completion completion) {
            fires.push_back(h.elapsed());
            if (fires.size() == 1) {
                h.schedule("x", delayDuringRun, h.recorder(fires));
            }
            completion(ActivityResult::Finished);
        });
        h.env.runner->advanceBy(3600);
        ASSERT_EQ(fires.size(), 2u);
        EXPECT_NEAR(fires[1], expectedSecondFire, 0.01);
        EXPECT_FALSE(h.record("x").pending());
    }
}

TEST(HostBackgroundActivityScheduler, OutstandingRunHoldsATransactionAndBlocksFires) {
    Harness h;
    auto& lifecycle = static_cast<test::FakeProcessLifecycle&>(*h.env.platform->lifecycle);
    std::vector<double> fires;
    h.schedule("x", 0, h.recorder(fires, [](std::size_t) { return std::nullopt; }));
    h.env.runner->runUntilIdle();
    ASSERT_EQ(fires.size(), 1u);
    EXPECT_EQ(lifecycle.transactionsOpen(), 1);
    h.env.runner->advanceBy(3600);
    EXPECT_EQ(fires.size(), 1u) << "no second fire while the run is outstanding";
    ASSERT_EQ(h.held.size(), 1u);
    h.held[0](ActivityResult::Deferred);
    h.held[0](ActivityResult::Finished);  // a run that deferred and then finished after all
    EXPECT_EQ(lifecycle.transactionsOpen(), 0);
    h.env.runner->advanceBy(3600);
    EXPECT_EQ(fires.size(), 1u);
    EXPECT_FALSE(h.record("x").pending());
}

TEST(HostBackgroundActivityScheduler, NetworkRequirementNegativeDelayAndDefer) {
    Harness h;
    h.network = false;
    std::vector<double> fires;
    h.schedule("net", -30, h.recorder(fires), true);
    EXPECT_EQ(h.record("net").delay, 0);
    h.schedule("far", std::numeric_limits<std::int64_t>::max(), h.recorder(fires));
    EXPECT_TRUE(h.record("far").pending()) << "an absurd delay still leaves a writable registry";
    EXPECT_TRUE(h.record("net").pending());
    h.env.runner->advanceBy(600);
    EXPECT_TRUE(fires.empty());
    h.network = true;
    h.env.runner->advanceBy(10);
    ASSERT_EQ(fires.size(), 1u);
    EXPECT_GT(fires[0], 600);

    auto activity = h.scheduler->activityWithIdentifier("net");
    EXPECT_FALSE(activity->shouldDefer());
    writeFile(HostBackgroundActivityScheduler::deferPath(h.env.platform->platformRoot), "");
    EXPECT_TRUE(activity->shouldDefer());
}

TEST(HostBackgroundActivityScheduler, LaunchTriggersFireOncePerBootAndPerNewVersion) {
    Harness h;
    auto& device = static_cast<test::FakeDeviceProperties&>(*h.env.platform->deviceProperties);
    std::map<std::string, int> count;
    auto attachAll = [&] {
        for (const char* id : {"boot", "upgrade", "hourly"}) {
            h.attach(id, [&count, id](Completion completion) {
                ++count[id];
                completion(ActivityResult::Finished);
            });
        }
        h.env.runner->advanceBy(120);
    };
    const std::tuple<const char*, const char*, const char*, int, int> steps[] = {
        {"first start", "boot-1", "4.2", 1, 1},
        {"restart, same boot", "boot-1", "4.2", 1, 1},
        {"reboot", "boot-2", "4.2", 2, 1},
        {"upgrade", "boot-2", "4.3", 2, 2},
        {"back to a version seen before", "boot-2", "4.2", 2, 2},
    };
    for (const auto& [name, bootId, version, boots, upgrades] : steps) {
        SCOPED_TRACE(name);
        h.setBootId(bootId);
        device.set("ProductVersion", Value(version));
        h.restart();
        attachAll();
        EXPECT_EQ(count["boot"], boots);
        EXPECT_EQ(count["upgrade"], upgrades);
    }
    // The interval activity fired on its first attach, then every hour of platform time.
    const int before = count["hourly"];
    h.env.runner->advanceBy(3 * 3600);
    EXPECT_EQ(count["hourly"] - before, 3);
}

TEST(HostBackgroundActivityScheduler, ClockJumpFiresWhatCameDue) {
    Harness h;
    auto simulated = std::make_shared<SimulatedClock>(h.env.platform->platformRoot, h.env.clock);
    h.env.platform->clock = simulated;
    h.env.platform->notifications = std::make_shared<test::FakeNotificationCenter>();
    h.clockChanged = [simulated] { simulated->reloadOffset(); };
    h.restart();

    std::vector<double> fires;
    h.schedule("x", 3 * 86400, h.recorder(fires));
    h.env.runner->advanceBy(10);
    ASSERT_TRUE(SimulatedClock::updateOffset(
        h.env.platform->platformRoot, [](double) { return 3 * 86400.0; }, nullptr, nullptr));
    EXPECT_TRUE(fires.empty()) << "the offset applies once the change is announced";
    h.env.platform->notifications->postNotification(kClockChangedNotification);
    h.env.runner->advanceBy(1);
    ASSERT_EQ(fires.size(), 1u);
    EXPECT_NEAR(fires[0], 10, 0.01) << "seconds of the base clock";
}

}  // namespace
}  // namespace qax
