#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <mutex>
#include <thread>
#include <vector>

#include "core/AsioDispatcher.h"
#include "core/JoinCounter.h"
#include "core/VirtualTimeTaskRunner.h"

namespace qax {
namespace {

TEST(VirtualTime, DelayedTasksRunInDueOrderWithTiesInPostOrder) {
    auto clock = std::make_shared<ManualClock>(Date(1000));
    auto runner = std::make_shared<VirtualTimeTaskRunner>(clock);
    std::vector<std::string> ran;
    std::vector<double> at;
    auto record = [&](std::string name) {
        return [&, name] {
            ran.push_back(name);
            at.push_back(clock->now().secondsSince1970());
        };
    };
    runner->postDelayed(record("hour"), 3600);
    runner->postDelayed(record("tie-1"), 10);
    runner->post(record("now"));
    runner->postDelayed(record("tie-2"), 10);
    runner->postDelayed(record("past"), -5);

    runner->runUntilIdle();
    EXPECT_EQ(ran, (std::vector<std::string>{"now", "past"}));
    EXPECT_EQ(clock->now(), Date(1000));

    runner->advanceBy(60);
    EXPECT_EQ(ran, (std::vector<std::string>{"now", "past", "tie-1", "tie-2"}));
    EXPECT_EQ(at[2], 1010);
    EXPECT_EQ(clock->now(), Date(1060));

    // A task posted by a running task for later waits for its own time.
    runner->postDelayed([&] { runner->postDelayed(record("chained"), 100); }, 0);
    runner->advanceBy(3600);
    EXPECT_EQ(ran.back(), "hour");
    EXPECT_EQ(at.back(), 4600);
    EXPECT_EQ(ran[ran.size() - 2], "chained");
    EXPECT_EQ(runner->pendingCount(), 0u);
}

TEST(JoinCounterTest, RunsCompletionsOnceNothingIsOutstanding) {
    auto clock = std::make_shared<ManualClock>();
    auto runner = std::make_shared<VirtualTimeTaskRunner>(clock);
    JoinCounter group;
    int done = 0;

    group.notify(runner, [&] { ++done; });  // nothing outstanding: runs at once
    runner->runUntilIdle();
    EXPECT_EQ(done, 1);

    group.enter();
    group.enter();
    group.notify(runner, [&] { ++done; });
    group.leave();
    runner->runUntilIdle();
    EXPECT_EQ(done, 1);
    group.enter();  // a third query joins before the second one answers
    group.leave();
    runner->runUntilIdle();
    EXPECT_EQ(done, 1);
    group.leave();
    runner->runUntilIdle();
    EXPECT_EQ(done, 2);
    group.leave();  // unbalanced leave is ignored
    EXPECT_EQ(group.outstanding(), 0);
}

TEST(AsioDispatcherTest, SerialQueueNeverRunsTwoTasksAtOnce) {
    AsioDispatcher dispatcher(4, 2);
    constexpr int kQueues = 3, kTasks = 300;
    std::vector<std::shared_ptr<TaskRunner>> queues;
    std::vector<std::unique_ptr<std::atomic<int>>> inFlight;
    std::vector<std::vector<int>> order(kQueues);
    for (int q = 0; q < kQueues; ++q) {
        queues.push_back(dispatcher.makeSerialQueue("test." + std::to_string(q)));
        inFlight.push_back(std::make_unique<std::atomic<int>>(0));
    }
    std::atomic<int> overlaps{0}, finished{0};
    std::mutex m;
    std::condition_variable cv;
    for (int i = 0; i < kTasks; ++i) {
        for (int q = 0; q < kQueues; ++q) {
            queues[q]->post([&, q, i] {
                if (inFlight[q]->fetch_add(1) != 0) {
                    overlaps++;
                }
                std::this_thread::yield();
                order[q].push_back(i);  // unsynchronised on purpose: the strand serialises it
                inFlight[q]->fetch_sub(1);
                if (finished.fetch_add(1) + 1 == kQueues * kTasks) {
                    std::lock_guard lock(m);
                    cv.notify_all();
                }
            });
        }
    }
    std::unique_lock lock(m);
    ASSERT_TRUE(cv.wait_for(lock, std::chrono::seconds(30),
                            [&] { return finished.load() == kQueues * kTasks; }));
    EXPECT_EQ(overlaps.load(), 0);
    for (const auto& o : order) {
        ASSERT_EQ(o.size(), static_cast<std::size_t>(kTasks));
        for (int i = 0; i < kTasks; ++i) {
            EXPECT_EQ(o[i], i);
        }
    }
}

TEST(AsioDispatcherTest, MainQueueRunsDelayedTasksUntilStopped) {
    auto dispatcher = std::make_shared<AsioDispatcher>(1, 1);
    std::vector<int> seen;
    auto main = dispatcher->mainQueue();
    main->postDelayed([&] { seen.push_back(2); }, 0.02);
    main->post([&] { seen.push_back(1); });
    main->postDelayed(
        [&] {
            seen.push_back(3);
            dispatcher->stopMainLoop();
        },
        0.04);
    dispatcher->runMainLoop();
    EXPECT_EQ(seen, (std::vector<int>{1, 2, 3}));
}

}  // namespace
}  // namespace qax
