// The pairing and locale monitors: one pairing refresh at a time whoever reports the pairing
// (notifications, the launch-event handler, several threads at once), the post scheduled for the
// date the follow-up layer finds, and the language change that refreshes only while a follow-up
// is shown and then lets the process go.
#include <gtest/gtest.h>

#include <barrier>
#include <thread>

#include "agent/QAXLaunchEventHandler.h"
#include "devices/QAXLocaleMonitor.h"
#include "devices/QAXPairedDevicesMonitor.h"
#include "fakes/FakeAgent.h"
#include "fakes/FakeNotificationCenter.h"
#include "fakes/FakeServices.h"
#include "fakes/TestPlatform.h"

namespace qax {
namespace {

constexpr const char* kAlready = "Already executing with a pairing event";

class MonitorsTest : public ::testing::Test {
  protected:
    MonitorsTest() { tp.platform->notifications = notifications; }

    std::shared_ptr<QAXPairedDevicesMonitor> pairedMonitor() {
        QAXPairedDevicesMonitor::FollowUpPostScheduling post;
        post.nextFollowUpPostDate = [this](const auto& infos) {
            askedWith.push_back(infos.size());
            return nextDate;
        };
        post.scheduleFollowUpPost = [this](Date date) { scheduled.push_back(date); };
        auto monitor = std::make_shared<QAXPairedDevicesMonitor>(tp.platform, agent, post);
        monitor->start();
        return monitor;
    }

    test::TestPlatform tp;
    std::shared_ptr<test::FakeNotificationCenter> notifications =
        std::make_shared<test::FakeNotificationCenter>();
    std::shared_ptr<test::FakeAgent> agent = std::make_shared<test::FakeAgent>();
    std::optional<Date> nextDate;
    std::vector<std::size_t> askedWith;
    std::vector<Date> scheduled;
};

TEST_F(MonitorsTest, PairingEventsFromEverywhereStartOneRefreshAtATime) {
    auto monitor = pairedMonitor();
    agent->setInfos({QAXDeviceInfo::deviceInfoWithDevice(nullptr, nullptr)});
    agent->hold(true);

    // The registry's notification and the launch event for one pairing, plus a burst of
    // launch events on other threads, all while the first refresh is out.
    constexpr int kThreads = 6;
    QAXLaunchEventHandler handler(monitor);
    notifications->postNotification("com.velmora.pairlink.devicedidpair");
    std::barrier sync(kThreads);
    std::vector<std::thread> threads;
    for (int i = 0; i < kThreads; ++i) {
        threads.emplace_back([&, i] {
            sync.arrive_and_wait();
            handler.handleEvent(
                LaunchEvent(std::string(i % 2 ? "com.velmora.pairlink.devicedidunpair"
                                              : "com.velmora.pairlink.devicedidpair")));
        });
    }
    for (auto& t : threads) {
        t.join();
    }
    tp.runner->runUntilIdle();
    ASSERT_EQ(agent->requests().size(), 1u);
    EXPECT_EQ(agent->requests()[0].policy, QAXWarrantyPolicyDefault);
    EXPECT_TRUE(agent->requests()[0].updateFollowUps);
    EXPECT_EQ(tp.log->count(kAlready), kThreads);

    // The reply: no date, nothing scheduled, and the monitor takes the next event.
    EXPECT_EQ(agent->release(), 1u);
    EXPECT_FALSE(monitor->isExecuting());
    EXPECT_TRUE(scheduled.empty());

    // An unpair notification runs the same refresh; this time a post date is found.
    nextDate = tp.clock->now().byAdding(3 * 86400);
    notifications->postNotification("com.velmora.pairlink.devicedidunpair");
    tp.runner->runUntilIdle();
    EXPECT_EQ(agent->release(), 1u);
    EXPECT_EQ(agent->requests().size(), 2u);
    EXPECT_EQ(scheduled, std::vector<Date>{*nextDate});
    EXPECT_EQ(askedWith, (std::vector<std::size_t>{1, 1}));

    // Other launch events are not pairings. The handler keeps the monitor, and with it its
    // registrations, alive.
    handler.handleEvent(LaunchEvent(std::string("com.velmora.language.changed")));
    EXPECT_EQ(agent->requests().size(), 2u);
    monitor.reset();
    EXPECT_EQ(notifications->registeredNames(),
              (std::multiset<std::string>{"com.velmora.pairlink.devicedidpair",
                                          "com.velmora.pairlink.devicedidunpair"}));
}

TEST_F(MonitorsTest, LanguageChangeRefreshesOnlyWhileAFollowUpIsShown) {
    // Follow-ups shown, the changes (seconds from the start), the refreshes that follow.
    const std::tuple<const char*, std::uint64_t, std::vector<double>, int> rows[] = {
        {"nothing shown", 0, {0}, 0},
        {"one follow-up shown", 1, {0}, 1},
        {"two changes a second apart", 2, {0, 1}, 2},
    };
    for (const auto& [what, pending, notifiedAt, refreshes] : rows) {
        SCOPED_TRACE(what);
        test::TestPlatform env;
        auto center = std::make_shared<test::FakeNotificationCenter>();
        env.platform->notifications = center;
        auto refreshAgent = std::make_shared<test::FakeAgent>();
        auto monitor =
            std::make_shared<QAXLocaleMonitor>(env.platform, refreshAgent, [&] { return pending; });
        monitor->start();
        auto& lifecycle = static_cast<test::FakeProcessLifecycle&>(*env.platform->lifecycle);

        double now = 0;
        for (double at : notifiedAt) {
            env.runner->advanceBy(at - now);
            now = at;
            center->postNotification("com.velmora.language.changed");
        }
        env.runner->runUntilIdle();
        // Nothing happens before 5 s have passed since the first notification.
        env.runner->advanceBy(4.9 - now);
        EXPECT_EQ(lifecycle.cleanExitRequests, 0);
        EXPECT_TRUE(refreshAgent->requests().empty());
        env.runner->advanceBy(10);

        const int changes = static_cast<int>(notifiedAt.size());
        EXPECT_EQ(lifecycle.cleanExitRequests, changes);
        EXPECT_EQ(static_cast<int>(refreshAgent->requests().size()), refreshes);
        for (const auto& request : refreshAgent->requests()) {
            EXPECT_EQ(request.policy, QAXWarrantyPolicyDefault);
            EXPECT_TRUE(request.updateFollowUps);
        }
    }
}

}  // namespace
}  // namespace qax
