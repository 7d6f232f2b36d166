#include <gtest/gtest.h>

#include <chrono>
#include <future>
#include <thread>

#include "core/AsioDispatcher.h"
#include "core/PlistCodec.h"
#include "fakes/TestHttpsServer.h"
#include "fakes/TestPlatform.h"
#include "platform/host/CurlHttpClient.h"
#include "platform/host/HostPurchaseHistory.h"
#include "platform/host/HostStoreLookup.h"

namespace qax {
namespace {

using namespace std::chrono_literals;

template <typename Record>
struct Answer {
    std::vector<Record> records;
    std::optional<std::string> error;
    std::thread::id thread;
};

template <typename Record, typename Ask>
Answer<Record> wait(Ask ask) {
    auto promise = std::make_shared<std::promise<Answer<Record>>>();
    auto future = promise->get_future();
    ask([promise](std::vector<Record> records, std::optional<std::string> error) {
        promise->set_value({std::move(records), std::move(error), std::this_thread::get_id()});
    });
    if (future.wait_for(20s) != std::future_status::ready) {
        ADD_FAILURE() << "no completion";
        return {};
    }
    return future.get();
}

class HostStoreBindingsTest : public ::testing::Test {
  protected:
    HostStoreBindingsTest() {
        // Handler state lives in the fixture, declared before the server, so it outlives
        // the server's threads.
        auto answer = [](int status, std::string body) {
            return [status, body](const httplib::Request&, httplib::Response& res) {
                res.status = status;
                res.set_content(body, "application/json");
            };
        };
        server.server().Get("/lookup", [this](const httplib::Request& req, httplib::Response& res) {
            std::lock_guard lock(mutex);
            queries.push_back(req.params);
            res.set_content(
                R"({"results":[{"bundleId":"com.velmora.support","displayName":"Velmora Support",
                    "artistName":"Velmora","artworkURLs":["https://a/1.png","https://a/2.png"],
                    "productPageURL":"https://store/app/1"}]})",
                "application/json");
        });
        server.server().Get("/purchases",
                            [this](const httplib::Request& req, httplib::Response& res) {
                                std::lock_guard lock(mutex);
                                queries.push_back(req.params);
                                res.set_content(
                                    R"({"purchases":[{"bundleId":"a.b","title":"Support",
                                        "developerName":"Velmora","productURL":"https://p/1"},
                                        {"bundleId":"c.d"}]})",
                                    "application/json");
                            });
        server.server().Get("/empty", answer(200, R"({"results":[],"purchases":[]})"));
        server.server().Get("/status", answer(503, R"({"results":[],"purchases":[]})"));
        server.server().Get("/garbage", answer(200, "<html>nope</html>"));
        server.server().Get("/object", answer(200, R"({"results":{},"purchases":"none"})"));
        server.server().Get("/array", answer(200, R"([{"results":[]}])"));
        server.server().Get("/bad-item", answer(200, R"({"results":[5],"purchases":[7]})"));
        server.server().Get("/bad-field", answer(200, R"({"results":[{"artworkURLs":"x"}],
                                            "purchases":[{"title":5}]})"));
        server.start();
        CurlHttpClient::Options options;
        options.extraCAFile = server.caFile();
        http = std::make_shared<CurlHttpClient>(options);
        dispatcher = std::make_shared<AsioDispatcher>(1, 1);
    }
    ~HostStoreBindingsTest() override {
        http.reset();
        dispatcher->shutdown();
    }

    void storeFile(const std::optional<std::string>& url) {
        const auto path = root.path() / "store.plist";
        if (!url) {
            std::filesystem::remove(path);
            return;
        }
        test::writeFile(
            path,
            *toXmlPlist(Value(Value::Dictionary{{"LookupURL", *url}, {"PurchasesURL", *url}})));
    }

    std::mutex mutex;
    std::vector<httplib::Params> queries;
    test::TestHttpsServer server;
    test::TempDir root;
    std::shared_ptr<CurlHttpClient> http;
    std::shared_ptr<AsioDispatcher> dispatcher;
};

TEST_F(HostStoreBindingsTest, GoodAnswersBecomeRecords) {
    HostStoreLookup lookup(root.path().string(), http, dispatcher);
    HostPurchaseHistory purchases(root.path().string(), http, dispatcher);

    storeFile(server.url("/lookup"));
    auto found = wait<StoreItem>([&](auto done) {
        lookup.lookUpBundleIdentifier("com.velmora.support&x=1", std::move(done));
    });
    ASSERT_FALSE(found.error) << *found.error;
    ASSERT_EQ(found.records.size(), 1u);
    const StoreItem& item = found.records[0];
    EXPECT_EQ(item.bundleIdentifier, "com.velmora.support");
    EXPECT_EQ(item.displayName, "Velmora Support");
    EXPECT_EQ(item.artistName, "Velmora");
    EXPECT_EQ(item.artworkURLs, (std::vector<std::string>{"https://a/1.png", "https://a/2.png"}));
    EXPECT_EQ(item.productPageURL, "https://store/app/1");
    EXPECT_NE(found.thread, std::this_thread::get_id());

    storeFile(server.url("/purchases"));
    auto bought = wait<PurchaseRecord>([&](auto done) {
        purchases.purchasesForAccount(42, {"a.b", "c.d"}, std::move(done));
    });
    ASSERT_FALSE(bought.error) << *bought.error;
    ASSERT_EQ(bought.records.size(), 2u);
    EXPECT_EQ(bought.records[0].bundleIdentifier, "a.b");
    EXPECT_EQ(bought.records[0].title, "Support");
    EXPECT_EQ(bought.records[0].developerName, "Velmora");
    EXPECT_EQ(bought.records[0].productURL, "https://p/1");
    EXPECT_EQ(bought.records[1].bundleIdentifier, "c.d");
    EXPECT_FALSE(bought.records[1].title);

    // The parameters arrive intact, however they are spelt.
    std::lock_guard lock(mutex);
    ASSERT_EQ(queries.size(), 2u);
    EXPECT_EQ(queries[0], (httplib::Params{{"bundleId", "com.velmora.support&x=1"}}));
    EXPECT_EQ(queries[1], (httplib::Params{{"accountId", "42"}, {"bundleIds", "a.b,c.d"}}));
}

TEST_F(HostStoreBindingsTest, FailuresCompleteOnceWithAReason) {
    const std::string unreachable =
        "https://127.0.0.1:" + std::to_string(test::unusedLocalPort()) + "/lookup";
    struct Row {
        std::optional<std::string> url;  // none: no store.plist
        const char* lookupReason;
        const char* purchasesReason;
    } rows[] = {
        {std::nullopt, "names no LookupURL", "names no PurchasesURL"},
        {"ftp://127.0.0.1/lookup", "is not an http(s) URL", "is not an http(s) URL"},
        {"not a url", "is not an http(s) URL", "is not an http(s) URL"},
        {unreachable, "request failed", "request failed"},
        {server.url("/status"), "HTTP 503", "HTTP 503"},
        {server.url("/garbage"), "not JSON", "not JSON"},
        {server.url("/object"), "no \"results\" array", "no \"purchases\" array"},
        {server.url("/array"), "no \"results\" array", "no \"purchases\" array"},
        {server.url("/bad-item"), "result 0 is not a store item",
         "purchase 0 is not a purchase record"},
        {server.url("/bad-field"), "result 0 is not a store item",
         "purchase 0 is not a purchase record"},
    };
    HostStoreLookup lookup(root.path().string(), http, dispatcher);
    HostPurchaseHistory purchases(root.path().string(), http, dispatcher);
    for (const auto& row : rows) {
        SCOPED_TRACE(row.url.value_or("no store.plist"));
        storeFile(row.url);
        auto found = wait<StoreItem>(
            [&](auto done) { lookup.lookUpBundleIdentifier("x", std::move(done)); });
        ASSERT_TRUE(found.error);
        EXPECT_NE(found.error->find(row.lookupReason), std::string::npos) << *found.error;
        EXPECT_EQ(found.error->rfind("store look-up: ", 0), 0u) << *found.error;
        EXPECT_TRUE(found.records.empty());
        EXPECT_NE(found.thread, std::this_thread::get_id());

        auto bought = wait<PurchaseRecord>(
            [&](auto done) { purchases.purchasesForAccount(0, {"x"}, std::move(done)); });
        ASSERT_TRUE(bought.error);
        EXPECT_NE(bought.error->find(row.purchasesReason), std::string::npos) << *bought.error;
        EXPECT_TRUE(bought.records.empty());
    }

    // An empty answer is not an error: the store knows no such application.
    storeFile(server.url("/empty"));
    auto none =
        wait<StoreItem>([&](auto done) { lookup.lookUpBundleIdentifier("x", std::move(done)); });
    EXPECT_FALSE(none.error);
    EXPECT_TRUE(none.records.empty());
}

}  // namespace
}  // namespace qax
