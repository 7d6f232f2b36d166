// The host's store bindings against a real HTTPS server: every way a store answer or its
// configuration can be wrong ends in one completion with a reason, off the caller's thread.
// Good answers are checked against coverage-sim (CoverageSimScenarioTest).
#include <gtest/gtest.h>

#include <thread>

#include "core/AsioDispatcher.h"
#include "core/PlistCodec.h"
#include "fakes/Await.h"
#include "fakes/TestHttpsServer.h"
#include "fakes/TestPlatform.h"
#include "platform/host/CurlHttpClient.h"
#include "platform/host/HostPurchaseHistory.h"
#include "platform/host/HostStoreLookup.h"

namespace qax {
namespace {

template <typename Record>
struct Answer {
    std::vector<Record> records;
    std::optional<std::string> error;
    std::thread::id thread;
};

template <typename Record, typename Ask>
Answer<Record> wait(Ask ask) {
    return test::await<Answer<Record>>([&](auto done) {
        ask([done](std::vector<Record> records, std::optional<std::string> error) {
            done({std::move(records), std::move(error), std::this_thread::get_id()});
        });
    });
}

TEST(HostStoreBindings, FailuresCompleteOnceWithAReason) {
    test::TestHttpsServer server;
    server.answer("/empty", {200, R"({"results":[],"purchases":[]})"});
    server.answer("/status", {503, R"({"results":[],"purchases":[]})"});
    server.answer("/garbage", {200, "<html>nope</html>"});
    server.answer("/object", {200, R"({"results":{},"purchases":"none"})"});
    server.answer("/array", {200, R"([{"results":[]}])"});
    server.answer("/bad-item", {200, R"({"results":[5],"purchases":[7]})"});
    server.answer("/bad-field",
                  {200, R"({"results":[{"artworkURLs":"x"}],"purchases":[{"title":5}]})"});
    server.start();
    CurlHttpClient::Options options;
    options.extraCAFile = server.caFile();
    auto http = std::make_shared<CurlHttpClient>(options);
    auto dispatcher = std::make_shared<AsioDispatcher>(1, 1);
    test::TempDir root;
    auto storeFile = [&](const std::optional<std::string>& url) {
        const auto path = root.path() / "store.plist";
        if (!url) {
            std::filesystem::remove(path);
            return;
        }
        test::writeFile(
            path, *toXmlPlist(Value::Dictionary{{"LookupURL", *url}, {"PurchasesURL", *url}}));
    };

    const std::string unreachable =
        "https://127.0.0.1:" + std::to_string(test::unusedLocalPort()) + "/lookup";
    // The URL in store.plist (none: no file) and what each binding's reason says.
    const std::tuple<std::optional<std::string>, const char*, const char*> rows[] = {
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
    for (const auto& [url, lookupReason, purchasesReason] : rows) {
        SCOPED_TRACE(url.value_or("no store.plist"));
        storeFile(url);
        auto found = wait<StoreItem>(
            [&](auto done) { lookup.lookUpBundleIdentifier("x", std::move(done)); });
        ASSERT_TRUE(found.error);
        EXPECT_NE(found.error->find(lookupReason), std::string::npos) << *found.error;
        EXPECT_EQ(found.error->rfind("store look-up: ", 0), 0u) << *found.error;
        EXPECT_TRUE(found.records.empty());
        EXPECT_NE(found.thread, std::this_thread::get_id());

        auto bought = wait<PurchaseRecord>(
            [&](auto done) { purchases.purchasesForAccount(0, {"x"}, std::move(done)); });
        ASSERT_TRUE(bought.error);
        EXPECT_NE(bought.error->find(purchasesReason), std::string::npos) << *bought.error;
        EXPECT_TRUE(bought.records.empty());
    }

    // An empty answer is not an error: the store knows no such application.
    storeFile(server.url("/empty"));
    auto none =
        wait<StoreItem>([&](auto done) { lookup.lookUpBundleIdentifier("x", std::move(done)); });
    EXPECT_FALSE(none.error);
    EXPECT_TRUE(none.records.empty());
    http.reset();
    dispatcher->shutdown();
}

}  // namespace
}  // namespace qax
