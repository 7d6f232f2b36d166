#include "platform/host/CurlHttpClient.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <future>
#include <mutex>
#include <set>
#include <thread>
#include <vector>

#include "core/VirtualTimeTaskRunner.h"
#include "fakes/Await.h"
#include "fakes/FakeServices.h"
#include "fakes/TestHttpsServer.h"
#include "fakes/TestPlatform.h"

namespace qax {
namespace {

using namespace std::chrono_literals;
using test::TestHttpsServer;

// Holds handlers until the test lets them go (or a safety limit passes).
class Gate {
  public:
    void arrive() {
        std::unique_lock<std::mutex> lock(mutex_);
        ++inFlight_;
        maxInFlight_ = std::max(maxInFlight_, inFlight_);
        changed_.notify_all();
    }
    void waitForRelease(int untilInFlight = 1 << 30) {
        std::unique_lock<std::mutex> lock(mutex_);
        changed_.wait_for(lock, 10s, [&] { return released_ || inFlight_ >= untilInFlight; });
        // Once the threshold is met the gate stays open for the others woken with us.
        released_ = true;
        changed_.notify_all();
        --inFlight_;
    }
    bool waitForInFlight(int n) {
        std::unique_lock<std::mutex> lock(mutex_);
        return changed_.wait_for(lock, 10s, [&] { return inFlight_ >= n; });
    }
    void release() {
        std::lock_guard<std::mutex> lock(mutex_);
        released_ = true;
        changed_.notify_all();
    }
    int maxInFlight() {
        std::lock_guard<std::mutex> lock(mutex_);
        return maxInFlight_;
    }

  private:
    std::mutex mutex_;
    std::condition_variable changed_;
    int inFlight_ = 0;
    int maxInFlight_ = 0;
    bool released_ = false;
};

CurlHttpClient::Options trusting(const TestHttpsServer& server) {
    CurlHttpClient::Options options;
    options.extraCAFile = server.caFile();
    return options;
}

HttpResult sendAndWait(HttpClient& client, const HttpRequest& request) {
    return test::await<HttpResult>([&](auto done) { client.send(request, done); });
}

TEST(CurlHttpClientTest, RunsTransfersConcurrentlyAndCompletesEachOnceOnTheSessionThread) {
    constexpr int kTransfers = 6;
    Gate gate;  // outlives the server's handler threads
    TestHttpsServer server;
    server.server().Get("/hold", [&gate](const httplib::Request&, httplib::Response& res) {
        gate.arrive();
        // Answers only once every transfer is in flight at the same time.
        gate.waitForRelease(kTransfers);
        res.set_content("held", "text/plain");
    });
    server.start();
    CurlHttpClient client(trusting(server));

    std::mutex mutex;
    std::condition_variable done;
    int completions = 0;
    std::set<std::thread::id> threads;
    for (int i = 0; i < kTransfers; ++i) {
        client.send(HttpRequest(server.url("/hold")), [&](HttpResult r) {
            std::lock_guard<std::mutex> lock(mutex);
            EXPECT_TRUE(r.response) << r.error;
            threads.insert(std::this_thread::get_id());
            ++completions;
            done.notify_all();
        });
    }
    std::unique_lock<std::mutex> lock(mutex);
    ASSERT_TRUE(done.wait_for(lock, 20s, [&] { return completions == kTransfers; }));
    EXPECT_EQ(gate.maxInFlight(), kTransfers);
    EXPECT_EQ(threads.size(), 1u);
    EXPECT_FALSE(threads.contains(std::this_thread::get_id()));
}

TEST(CurlHttpClientTest, CompletionsRunOnTheCompletionQueueWhenOneIsGiven) {
    TestHttpsServer server;
    server.answer("/ok", {200, "ok", "text/plain"});
    server.start();
    // Holds what is posted until the test runs it.
    auto queue = std::make_shared<VirtualTimeTaskRunner>(std::make_shared<ManualClock>());
    auto options = trusting(server);
    options.completionQueue = queue;
    CurlHttpClient client(options);

    std::atomic<int> completions = 0;
    std::string body;
    client.send(HttpRequest(server.url("/ok")), [&](HttpResult r) {
        body = r.response ? r.response->body : r.error;
        ++completions;
    });
    for (int i = 0; i < 4000 && queue->pendingCount() == 0; ++i) {
        std::this_thread::sleep_for(5ms);
    }
    ASSERT_EQ(queue->pendingCount(), 1u);
    EXPECT_EQ(completions, 0);
    queue->runUntilIdle();
    EXPECT_EQ(completions, 1);
    EXPECT_EQ(body, "ok");
}

TEST(CurlHttpClientTest, TransportFailuresComeBackAsErrors) {
    Gate gate;  // outlives the server's handler threads
    TestHttpsServer server;
    server.answer("/ok", {200, "ok", "text/plain"});
    server.server().Get("/slow", [&gate](const httplib::Request&, httplib::Response& res) {
        gate.arrive();
        gate.waitForRelease();
        res.set_content("late", "text/plain");
    });
    server.start();
    TestHttpsServer stranger;  // its CA did not issue the server's certificate

    test::TempDir root;
    server.trustIn(root.str());
    test::TempDir relativeRoot;
    std::filesystem::copy_file(server.caFile(), relativeRoot.path() / "ca.pem");
    test::writeFile(relativeRoot.path() / "tls.plist",
                    "<?xml version=\"1.0\" encoding=\"UTF-8\"?><plist version=\"1.0\"><dict>"
                    "<key>ExtraCAFile</key><string>ca.pem</string></dict></plist>");
    test::TempDir emptyRoot;

    CurlHttpClient::Options strangerCA;
    strangerCA.extraCAFile = stranger.caFile();
    const std::tuple<const char*, CurlHttpClient::Options, std::string, double, bool, const char*>
        cases[] = {
            {"tls.plist names the CA", CurlHttpClient::optionsForPlatformRoot(root.str()),
             server.url("/ok"), 10, true, ""},
            {"tls.plist names the CA relative to the root",
             CurlHttpClient::optionsForPlatformRoot(relativeRoot.str()), server.url("/ok"), 10,
             true, ""},
            {"system CAs only", CurlHttpClient::optionsForPlatformRoot(emptyRoot.str()),
             server.url("/ok"), 10, false, "SSL"},
            {"another CA", strangerCA, server.url("/ok"), 10, false, "SSL"},
            {"nothing listens", trusting(server),
             "https://127.0.0.1:" + std::to_string(test::unusedLocalPort()) + "/ok", 10, false,
             "connect"},
            {"time-out", trusting(server), server.url("/slow"), 0.3, false, "Timeout"},
            {"not a URL", trusting(server), "not a url at all", 10, false, ""},
        };
    for (const auto& [name, options, url, timeout, succeeds, errorFragment] : cases) {
        SCOPED_TRACE(name);
        CurlHttpClient client(options);
        auto result = sendAndWait(client, HttpRequest(url, timeout));
        EXPECT_EQ(result.response.has_value(), succeeds) << result.error;
        EXPECT_EQ(result.error.empty(), succeeds) << result.error;
        EXPECT_NE(result.error.find(errorFragment), std::string::npos) << result.error;
    }
    gate.release();
}

TEST(CurlHttpClientTest, CachesGetAnswersThatAllowItUnlessTheRequestIgnoresTheCache) {
    std::atomic<int> cachedHits{0}, noStoreHits{0};  // outlive the server's handler threads
    TestHttpsServer server;
    server.server().Get("/cached", [&](const httplib::Request&, httplib::Response& res) {
        res.set_header("Cache-Control", "public, max-age=60");
        res.set_content("answer " + std::to_string(++cachedHits), "text/plain");
    });
    server.server().Post("/cached", [&](const httplib::Request&, httplib::Response& res) {
        res.set_header("Cache-Control", "max-age=60");
        res.set_content("posted " + std::to_string(++cachedHits), "text/plain");
    });
    server.server().Get("/nostore", [&](const httplib::Request&, httplib::Response& res) {
        res.set_header("Cache-Control", "no-store, max-age=60");
        res.set_content("fresh " + std::to_string(++noStoreHits), "text/plain");
    });
    server.start();
    auto clock = std::make_shared<ManualClock>();
    auto options = trusting(server);
    options.clock = clock;
    CurlHttpClient client(options);

    auto body = [&](const std::string& path, bool ignoreCache, const char* method = "GET") {
        HttpRequest r(server.url(path));
        r.setIgnoresLocalCache(ignoreCache);
        r.setMethod(method);
        auto result = sendAndWait(client, r);
        return result.response ? result.response->body : "error: " + result.error;
    };
    EXPECT_EQ(body("/cached", false), "answer 1");
    EXPECT_EQ(body("/cached", false), "answer 1");  // from the cache
    EXPECT_EQ(body("/cached", true), "answer 2");   // bypassed, and stored again
    EXPECT_EQ(body("/cached", false), "answer 2");
    clock->advanceBy(61);
    EXPECT_EQ(body("/cached", false), "answer 3");  // expired
    EXPECT_EQ(body("/cached", false, "POST"), "posted 4");
    EXPECT_EQ(body("/cached", false, "POST"), "posted 5");
    EXPECT_EQ(body("/nostore", false), "fresh 1");
    EXPECT_EQ(body("/nostore", false), "fresh 2");
}

TEST(CurlHttpClientTest, DestructionCompletesOutstandingTransfersWithAnError) {
    auto lifecycle = std::make_shared<test::FakeProcessLifecycle>();
    Gate gate;  // outlives the server's handler threads
    TestHttpsServer server;
    server.server().Get("/hang", [&gate](const httplib::Request&, httplib::Response& res) {
        gate.arrive();
        gate.waitForRelease();
        res.set_content("too late", "text/plain");
    });
    server.answer("/ok", {200, "ok", "text/plain"});
    server.start();

    std::atomic<int> calls{0}, errors{0};
    {
        auto options = trusting(server);
        options.lifecycle = lifecycle;
        CurlHttpClient client(options);
        for (int i = 0; i < 3; ++i) {
            client.send(HttpRequest(server.url("/hang")), [&](HttpResult r) {
                ++calls;
                errors += (!r.response && !r.error.empty()) ? 1 : 0;
            });
        }
        ASSERT_TRUE(gate.waitForInFlight(3));
        EXPECT_EQ(lifecycle->transactionsOpen(), 3) << "each outstanding request keeps the agent";
    }
    EXPECT_EQ(calls.load(), 3);
    EXPECT_EQ(errors.load(), 3);
    EXPECT_EQ(lifecycle->transactionsOpen(), 0);
    gate.release();

    // A completion may release the last reference to the client on the session thread.
    auto holder = std::make_shared<std::shared_ptr<CurlHttpClient>>(
        std::make_shared<CurlHttpClient>(trusting(server)));
    std::promise<bool> released;
    auto future = released.get_future();
    (*holder)->send(HttpRequest(server.url("/ok")), [holder, &released](HttpResult r) {
        holder->reset();
        released.set_value(r.response.has_value());
    });
    ASSERT_EQ(future.wait_for(20s), std::future_status::ready);
    EXPECT_TRUE(future.get());
}

}  // namespace
}  // namespace qax
