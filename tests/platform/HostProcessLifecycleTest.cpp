#include "platform/host/HostProcessLifecycle.h"

#include <gtest/gtest.h>

#include <vector>

#include "fakes/TestPlatform.h"

namespace qax {
namespace {

// A lifecycle on virtual time that records when it ends the main loop and what it asks of the
// listener.
struct Harness {
    explicit Harness(bool onDemand)
        : lifecycle(std::make_shared<HostProcessLifecycle>(onDemand, 60, env.runner,
                                                           [this] { ++exits; })) {
        lifecycle->setAcceptGate([this](bool accepting) { gate.push_back(accepting); });
        lifecycle->start();
    }

    test::TestPlatform env;
    int exits = 0;
    std::vector<bool> gate;
    std::shared_ptr<HostProcessLifecycle> lifecycle;
};

TEST(HostProcessLifecycleTest, ExitsOnlyWhenStartedOnDemandAndNothingIsOpen) {
    // Started on demand, the transactions still held, a clean-exit request, the virtual seconds
    // waited, and whether the main loop is ended.
    const std::tuple<const char*, bool, std::vector<const char*>, bool, double, bool> rows[] = {
        {"idle, not yet 60 s", true, {}, false, 59.9, false},
        {"idle for 60 s", true, {}, false, 60, true},
        {"client connected", true, {"client connection"}, false, 3600, false},
        {"activity running", true, {"activity run"}, false, 3600, false},
        {"download outstanding", true, {"HTTP request"}, false, 3600, false},
        // clang-format off
        {"all three", true, {"client connection", "activity run", "HTTP request"}, false, 3600,
         false},
        // clang-format on
        {"clean exit when idle: at once", true, {}, true, 0, true},
        {"clean exit with a client", true, {"client connection"}, true, 3600, false},
        {"clean exit with a download", true, {"HTTP request"}, true, 3600, false},
        {"started by hand, idle", false, {}, false, 3600, false},
        {"started by hand, clean exit", false, {}, true, 3600, false},
    };
    for (const auto& [name, onDemand, open, cleanExit, after, exits] : rows) {
        SCOPED_TRACE(name);
        Harness h(onDemand);
        std::vector<std::shared_ptr<void>> held;
        for (const char* reason : open) {
            held.push_back(h.lifecycle->beginTransaction(reason));
        }
        if (cleanExit) {
            h.lifecycle->requestCleanExit();
        }
        h.env.runner->advanceBy(after);
        EXPECT_EQ(h.exits, exits ? 1 : 0);
        if (!onDemand && cleanExit) {
            EXPECT_EQ(h.env.log->countContaining("it keeps running"), 1);
        }
    }
}

TEST(HostProcessLifecycleTest, IdleTimeCountsFromTheLastEndAndACleanExitWaitsForIt) {
    Harness h(true);
    auto client = h.lifecycle->beginTransaction("client connection");
    auto download = h.lifecycle->beginTransaction("HTTP request");
    h.env.runner->advanceBy(100);
    client.reset();
    h.env.runner->advanceBy(100);
    EXPECT_EQ(h.exits, 0) << "a download is still outstanding";
    download.reset();
    h.env.runner->advanceBy(59);
    EXPECT_EQ(h.exits, 0);
    h.env.runner->advanceBy(1);
    EXPECT_EQ(h.exits, 1);
    h.env.runner->advanceBy(3600);
    EXPECT_EQ(h.exits, 1) << "the main loop is ended once";

    Harness busy(true);
    auto run = busy.lifecycle->beginTransaction("activity run");
    busy.lifecycle->requestCleanExit();
    busy.env.runner->advanceBy(30);
    EXPECT_EQ(busy.exits, 0);
    run.reset();
    busy.env.runner->runUntilIdle();
    EXPECT_EQ(busy.exits, 1) << "no idle wait after a clean-exit request";
    EXPECT_EQ(busy.env.log->countContaining("Exiting on request"), 1);
}

TEST(HostProcessLifecycleTest, AClientTakenWhileStoppingIsServedAndAcceptingResumes) {
    Harness h(true);
    std::shared_ptr<void> client;
    bool handedOver = false;
    // The listener hands over a client it had already taken off the socket when it was told
    // to stop accepting.
    h.lifecycle->setAcceptGate([&](bool accepting) {
        h.gate.push_back(accepting);
        if (!accepting && !handedOver) {
            handedOver = true;
            client = h.lifecycle->beginTransaction("client connection");
        }
    });
    h.env.runner->advanceBy(60);
    EXPECT_EQ(h.exits, 0);
    EXPECT_EQ(h.gate, (std::vector<bool>{false, true}));

    client.reset();
    h.env.runner->advanceBy(60);
    EXPECT_EQ(h.exits, 1);
    EXPECT_EQ(h.gate, (std::vector<bool>{false, true, false})) << "stopped accepting, then exited";
}

}  // namespace
}  // namespace qax
