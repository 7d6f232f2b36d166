// coverage-sim as a misbehaving service and as the store: scenario answers consumed in
// order per serial number or endpoint, the admin endpoints, the store endpoints reached
// through the host bindings, and "@now" dates that follow an offset clock.
#include <gtest/gtest.h>

#include <chrono>
#include <future>
#include <set>

#include "CoverageSimProcess.h"
#include "core/AsioDispatcher.h"
#include "core/AtomicFile.h"
#include "core/JsonCodec.h"
#include "core/PlistCodec.h"
#include "fakes/TestPlatform.h"
#include "platform/PurchaseHistory.h"
#include "platform/StoreLookup.h"
#include "platform/host/HostPlatform.h"

namespace qax::test {
namespace {

using SteadyClock = std::chrono::steady_clock;

HttpRequest summaryRequest(const std::string& base, const std::string& serial,
                           double timeout = 20) {
    HttpRequest request(base + "/api/v3/coverage/summary", timeout);
    request.setMethod("POST");
    request.setValue("X-Velmora-KF-Token", std::string("token"));
    request.setBody(toJsonString(Value::Dictionary{{"serialNumber", Value(serial)},
                                                   {"locale", Value("en_US")},
                                                   {"requestTimestamp", Value(1)},
                                                   {"requestTimezone", Value("UTC")}}));
    return request;
}

double nowSeconds() {
    using namespace std::chrono;
    return duration<double>(system_clock::now().time_since_epoch()).count();
}

class CoverageSimScenarioTest : public ::testing::Test {
  protected:
    std::string state() const { return (dir.path() / "sim").string(); }
    std::string root() const { return (dir.path() / "root").string(); }

    TempDir dir;
};

TEST_F(CoverageSimScenarioTest, AnswersFollowTheScenarioThenTheService) {
    CoverageSimProcess sim(state(), root(), {"--answer", "SN-A=401", "--answer", "*=500"});
    ASSERT_FALSE(sim.base().empty()) << "coverage-sim did not start";

    // The lists given at start: a serial number's own, then "*" for any other.
    EXPECT_EQ(sim.send(summaryRequest(sim.base(), "SN-A")).response->statusCode, 401);
    EXPECT_EQ(sim.send(summaryRequest(sim.base(), "SN-B")).response->statusCode, 500);
    EXPECT_EQ(sim.send(summaryRequest(sim.base(), "SN-B")).response->statusCode, 200);

    const std::string scenario = "/admin/scenario";
    auto set = sim.call("POST", scenario, R"({
        "SN-A": ["garbage", "html", "array", "deep 1000", "huge 40000000", "reset", "reset 2000", "hang",
                 "delay 300 503", "OK"],
        "@lookup": 404})");
    ASSERT_TRUE(set.response);
    EXPECT_EQ(set.response->statusCode, 200) << set.response->body;
    auto refused = sim.call("POST", scenario, R"({"SN-A": ["sometimes"]})");
    EXPECT_EQ(refused.response->statusCode, 400);
    EXPECT_NE(refused.response->body.find("sometimes"), std::string::npos);
    auto shown = sim.call("GET", scenario);
    EXPECT_EQ(parseJson(shown.response->body), parseJson(set.response->body))
        << "a refused scenario changes nothing";

    // Per answer: the status (0: no response at all) and what the body parses as.
    enum Body { None, NotJson, Array, Summary };
    const std::tuple<const char*, double, long, Body> rows[] = {
        {"garbage", 20, 200, NotJson},       {"html", 20, 200, NotJson},
        {"array", 20, 200, Array},           {"deep 1000", 20, 200, NotJson},
        {"huge 40000000", 20, 0, None},      {"reset", 20, 0, None},
        {"reset 2000", 20, 0, None},         {"hang", 1, 0, None},
        {"delay 300 503", 20, 503, NotJson}, {"ok", 20, 200, Summary},
        {"(used up)", 20, 200, Summary},
    };
    for (const auto& [step, timeout, status, kind] : rows) {
        SCOPED_TRACE(step);
        const auto started = SteadyClock::now();
        auto result = sim.send(summaryRequest(sim.base(), "SN-A", timeout));
        const double took = std::chrono::duration<double>(SteadyClock::now() - started).count();
        ASSERT_EQ(result.response.has_value(), status != 0) << result.error;
        if (!result.response) {
            continue;
        }
        EXPECT_EQ(result.response->statusCode, status);
        auto body = parseJson(result.response->body);
        EXPECT_EQ(body && body->isArray(), kind == Array);
        EXPECT_EQ(body && body->find("covered"), kind == Summary) << result.response->body;
        EXPECT_TRUE(kind != NotJson || !body || body->find("error")) << result.response->body;
        EXPECT_TRUE(status != 503 || took >= 0.3) << took;
    }
    EXPECT_EQ(sim.call("GET", "/store/lookup?bundleId=x").response->statusCode, 404);
    EXPECT_EQ(parseJson(sim.call("GET", scenario).response->body), Value::Dictionary{})
        << "every list used up";

    // The log shows which answer each request got; the admin endpoints stay out of it.
    auto log = parseJson(sim.call("GET", "/admin/requests?since=3").response->body);
    ASSERT_TRUE(log && log->isArray());
    std::multiset<std::string> played;
    for (const auto& entry : *log->asArray()) {
        EXPECT_EQ(entry.find("path")->asString()->rfind("/admin", 0), std::string::npos);
        if (const Value* step = entry.find("scenario")) {
            played.insert(*step->asString());
            if (step->asString()->starts_with("reset") || *step == Value("hang")) {
                EXPECT_EQ(*entry.find("status"), Value(0));
            }
        }
    }
    EXPECT_EQ(played, (std::multiset<std::string>{"garbage", "html", "array", "deep 1000",
                                                  "huge 40000000", "reset", "reset 2000", "hang",
                                                  "delay 300 503", "ok", "404"}));
    EXPECT_EQ(sim.requestLog().size(), log->size() + 3);
}

TEST_F(CoverageSimScenarioTest, StoreEndpointsServeTheHostBindings) {
    const auto fixtures = dir.path() / "fixtures";
    writeFile(fixtures / "store/purchases/42.json",
              R"({"purchases":[{"bundleId":"com.velmora.support","title":"Velmora Support",
                  "developerName":"Velmora","productURL":"https://p/1"},
                  {"bundleId":"other.app","title":"Other"}]})");
    writeFile(fixtures / "store/lookup/com.example.two.json",
              R"({"results":[{"displayName":"One"},{"displayName":"Two"}]})");
    CoverageSimProcess sim(state(), root(), {"--fixtures", fixtures.string()});
    ASSERT_FALSE(sim.base().empty()) << "coverage-sim did not start";

    // The bindings find the endpoints and the CA through the files the simulator wrote.
    auto dispatcher = std::make_shared<AsioDispatcher>(1, 1);
    auto platform = makeHostPlatform(
        HostEnvironment{(dir.path() / "home").string(), root(), root() + "/run", ""}, dispatcher);
    auto lookUp = [&](const std::string& id) {
        std::promise<std::pair<std::vector<StoreItem>, std::optional<std::string>>> done;
        platform->store->lookUpBundleIdentifier(id, [&](auto items, auto error) {
            done.set_value({items, error});
        });
        return done.get_future().get();
    };
    auto purchases = [&](std::int64_t account, std::vector<std::string> ids) {
        std::promise<std::pair<std::vector<PurchaseRecord>, std::optional<std::string>>> done;
        platform->purchases->purchasesForAccount(account, ids, [&](auto records, auto error) {
            done.set_value({records, error});
        });
        return done.get_future().get();
    };

    auto [support, supportError] = lookUp("com.velmora.support");
    ASSERT_FALSE(supportError) << *supportError;
    ASSERT_EQ(support.size(), 1u);
    EXPECT_EQ(support[0].displayName, "Velmora Support");
    EXPECT_EQ(support[0].artistName, "Velmora");
    EXPECT_EQ(support[0].artworkURLs.size(), 1u);
    EXPECT_TRUE(support[0].productPageURL && !support[0].productPageURL->empty());
    EXPECT_EQ(lookUp("com.example.two").first.size(), 2u) << "from the fixture";
    auto unknown = lookUp("a&b=c d");
    EXPECT_FALSE(unknown.second);
    EXPECT_TRUE(unknown.first.empty());
    EXPECT_EQ(*sim.requestLog().back().find("query"),
              (Value::Dictionary{{"bundleId", Value("a&b=c d")}}));

    auto [bought, boughtError] = purchases(42, {"com.velmora.support"});
    ASSERT_FALSE(boughtError) << *boughtError;
    ASSERT_EQ(bought.size(), 1u) << "only what was asked about";
    EXPECT_EQ(bought[0].title, "Velmora Support");
    EXPECT_EQ(bought[0].productURL, "https://p/1");
    EXPECT_TRUE(purchases(7, {"com.velmora.support"}).first.empty());

    ASSERT_EQ(
        sim.call("POST", "/admin/scenario", R"({"@purchases": ["500"]})").response->statusCode,
        200);
    auto failed = purchases(42, {"com.velmora.support"});
    ASSERT_TRUE(failed.second);
    EXPECT_NE(failed.second->find("HTTP 500"), std::string::npos) << *failed.second;

    const Value query(
        Value::Dictionary{{"accountId", Value("42")}, {"bundleIds", Value("com.velmora.support")}});
    int logged = 0;
    for (const auto& entry : sim.requestLog()) {
        if (*entry.find("path") == Value("/store/purchases") && *entry.find("query") == query) {
            ++logged;
        }
    }
    EXPECT_EQ(logged, 2);
    platform.reset();
    dispatcher->shutdown();
}

TEST_F(CoverageSimScenarioTest, RelativeDatesFollowTheClock) {
    const std::string clockFile = root() + "/state/clock.plist";
    writeFile(clockFile, *toXmlPlist(Value::Dictionary{{"OffsetSeconds", Value(864000)}}));
    CoverageSimProcess sim(state(), root(), {"--clock-offset", "86400"}, {"QAX_CLOCK=simulated"});
    ASSERT_FALSE(sim.base().empty()) << "coverage-sim did not start";
    auto eligibleUntil = [&] {
        auto result = sim.send(summaryRequest(sim.base(), "SN-C"));
        auto body = result.response ? parseJson(result.response->body) : std::nullopt;
        const Value* until = body ? body->find("hvOfferEligibleUntil") : nullptr;
        return until && until->asInteger() ? *until->asInteger() / 1000.0 : 0.0;
    };
    // The built-in summary's offer ends 30 days after "now".
    EXPECT_NEAR(eligibleUntil(), nowSeconds() + 86400 + 864000 + 30 * 86400, 60);
    writeFile(clockFile, *toXmlPlist(Value::Dictionary{{"OffsetSeconds", Value(-3600.5)}}));
    EXPECT_NEAR(eligibleUntil(), nowSeconds() + 86400 - 3600.5 + 30 * 86400, 60)
        << "the clock file is read on each request";
}

}  // namespace
}  // namespace qax::test
