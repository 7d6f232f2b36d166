// The offer road with the real agent, coverage-sim and qaxctl on the simulated clock: a fresh
// home whose phone is offered the plan from day 10 to day 40. The first start's upgrade run
// schedules the outreach, which schedules the post for day 10; the post puts the item up and
// starts the refresh chain, which follows the days down to the badge, the notification and the
// end. On the way the agent restarts, the machine boots again, a watch with its own offer is
// paired and the language changes.
#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <cmath>
#include <filesystem>
#include <map>
#include <regex>
#include <thread>

#include "AgentProcess.h"
#include "CoverageSimProcess.h"
#include "core/JsonCodec.h"
#include "core/PlistCodec.h"
#include "platform/host/FilePreferenceStore.h"
#include "platform/host/SystemClock.h"

namespace qax {
namespace {

constexpr double kDay = 86400;
constexpr double kWait = 20;
constexpr const char* kPhone = "ROADPHONE01";
constexpr const char* kWatch = "ROADWATCH01";

class OfferRoadTest : public ::testing::Test {
  protected:
    void SetUp() override {
        if (std::string(QAX_SIM_BINARY).empty()) {
            GTEST_SKIP() << "coverage-sim is not built";
        }
        start = std::floor(SystemClock().now().secondsSince1970());
        writeSummaries();
        sim = std::make_unique<test::CoverageSimProcess>(
            state.str(), agent.platformRoot(),
            std::vector<std::string>{"--fixtures", fixtures.str(), "--simulated-clock"});
        ASSERT_FALSE(sim->base().empty());

        agent.writeDevices(kPhone, std::nullopt, "17.2");
        agent.writeRootFile(
            "features.plist",
            Value::Dictionary{{"Kestova", Value(Value::Dictionary{{"Tessel_3_0", true}})}});
        agent.writeAccounts(sim->base() + "/token");
        // qaxctl asks for an outreach as the settings application would.
        agent.registerApplication("settings", QAX_CTL_BINARY, "com.velmora.Preferences",
                                  Value(true));
        agent.extraEnvironment = {"QAX_CLOCK=simulated", "QAX_NETWORK=up",
                                  "QAX_BOOT_ID=road-boot-1"};
        for (const auto& [key, path] :
             {std::pair{"ServerVersionURL", "/library/VELMORA/asset/qaxV2.plist"},
              std::pair{"WarrantyURL", "/api/v3/coverage/summary"},
              std::pair{"WearablesWarrantyURL", "/api/v2/coverage/summary"}}) {
            ASSERT_EQ(agent.ctl({"defaults", "write", key, "-string", sim->base() + path}).status,
                      0);
        }
    }

    // Epoch milliseconds `days` after the start.
    std::string ms(double days) const {
        return std::to_string(static_cast<long long>((start + days * kDay) * 1000));
    }
    Date day(double days) const { return Date(start + days * kDay); }

    void writeSummaries() {
        const std::filesystem::path templates =
            std::filesystem::path(QAX_SOURCE_DIR) / "share/demo-offer/summaries";
        const std::pair<const char*, std::string> files[] = {
            {"phone.json.in", std::string(kPhone) + ".json"},
            {"phone.fr_FR.json.in", std::string(kPhone) + ".fr_FR.json"},
            {"watch.json.in", std::string(kWatch) + ".json"},
        };
        const std::pair<const char*, std::string> tokens[] = {
            {"@PHONE_DISPLAY@", ms(10)}, {"@PHONE_END@", ms(40)},     {"@WATCH_DISPLAY@", ms(15)},
            {"@WATCH_END@", ms(38)},     {"@COVERAGE_END@", ms(365)}, {"@ENDED@", ms(-1)},
        };
        for (const auto& [from, to] : files) {
            std::string text = test::readFile(templates / from);
            ASSERT_FALSE(text.empty()) << from;
            for (const auto& [token, value] : tokens) {
                text = std::regex_replace(text, std::regex(token), value);
            }
            test::writeFile(fixtures.path() / "summaries" / to, text);
        }
    }

    void advance(const std::string& by) {
        ASSERT_EQ(agent.ctl({"clock", "advance", by}).status, 0);
    }
    bool waitFor(const std::string& text, int times = 1, double seconds = kWait) {
        return agent.waitForLog(text, times, seconds);
    }
    // How many runs of `activity` the platform has heard the end of since the agent started
    // ("finished", or "reported" when the run scheduled its activity again).
    int ends(const std::string& activity) {
        const std::string prefix = "Activity 'com.velmora.qaxagent." + activity + "' ";
        return agent.countInLog(prefix + "finished") + agent.countInLog(prefix + "reported");
    }
    bool waitForEnds(const std::string& activity, int count) {
        for (int i = 0; i < 4000 && ends(activity) < count; ++i) {
            std::this_thread::sleep_for(std::chrono::milliseconds(5));
        }
        return ends(activity) >= count;
    }
    // The activities as `qaxctl activities` shows them, by name without the prefix.
    std::map<std::string, Value> activities() {
        std::map<std::string, Value> byName;
        auto list = parseJson(agent.ctl({"activities", "--json"}).out);
        for (const auto& a : list && list->isArray() ? *list->asArray() : Value::Array{}) {
            byName[a.find("identifier")->asString()->substr(sizeof "com.velmora.qaxagent")] = a;
        }
        return byName;
    }
    Value activity(const std::string& name) { return activities()[name]; }
    std::optional<Date> target(const std::string& name) {
        const Value a = activity(name);
        const Value* date = a.find("targetDate");
        return date && date->isString() ? Date::parseIso8601(*date->asString()) : std::nullopt;
    }
    bool registered(const std::string& name) { return activity(name).find("registration"); }
    // The pending follow-ups as the settings application shows them, in short and sorted:
    // "title|days|badge|notification".
    std::vector<std::string> rows() {
        auto out = agent.ctl({"followups", "--json"});
        auto list = parseJson(out.out);
        EXPECT_TRUE(list && list->isArray()) << out.out << out.err;
        std::vector<std::string> rows;
        for (const auto& item : list && list->isArray() ? *list->asArray() : Value::Array{}) {
            auto text = [&](const Value* v) {
                return v && v->isString() ? *v->asString() : std::string("-");
            };
            const Value* days = item.find("remainingDays");
            const Value* note = item.find("notification");
            rows.push_back(text(item.find("title")) + "|" + (days ? days->description() : "-") +
                           "|" + (item.find("badge")->truthy() ? "badge" : "-") + "|" +
                           text(note ? note->find("text") : nullptr));
        }
        std::sort(rows.begin(), rows.end());
        return rows;
    }

    // Sets coverage-sim's scenario (a JSON object), or clears it without one.
    int scenario(std::optional<std::string> body) {
        auto result = sim->call(body ? "POST" : "DELETE", "/admin/scenario", std::move(body));
        return result.response ? static_cast<int>(result.response->statusCode) : 0;
    }
    // Every cache file of the agent and its bytes.
    std::map<std::string, std::string> cacheFiles() {
        std::map<std::string, std::string> files;
        std::error_code ec;
        for (const auto& entry : std::filesystem::directory_iterator(
                 std::filesystem::path(agent.home()) /
                     "Library/Application Support/com.velmora.Kestova",
                 ec)) {
            files[entry.path().filename().string()] = test::readFile(entry.path());
        }
        return files;
    }

    double start = 0;
    test::TempDir state;
    test::TempDir fixtures;
    test::AgentProcess agent;
    std::unique_ptr<test::CoverageSimProcess> sim;
};

TEST_F(OfferRoadTest, FortyDaysOfAnOffer) {
    // Day 0: the upgrade run schedules the outreach, the outreach the post for day 10.
    ASSERT_TRUE(agent.start()) << agent.log();
    ASSERT_TRUE(waitForEnds("outreach", 1)) << agent.log();
    EXPECT_TRUE(agent.countInLog(
        "post upgrade activity hasn't yet been performed, perform upgrade activity"));
    EXPECT_EQ(target("followuppost"), day(10));
    EXPECT_TRUE(rows().empty());
    // qaxctl activities shows the shipped launch configuration beside the agent's state.
    const std::tuple<const char*, const char*, bool> launch[] = {
        {"upgrade", "upgrade", false},
        {"boot", "boot", false},
        {"outreach", "interval", true},
        {"followuppost", "interval", true},
        {"conversionoutreach", "interval", true},
        {"followuprefresh", "interval", false},
    };
    auto listed = activities();
    EXPECT_EQ(listed.size(), std::size(launch));
    for (const auto& [name, trigger, network] : launch) {
        const Value& a = listed[name];
        EXPECT_EQ(a.find("trigger") ? *a.find("trigger") : Value(), Value(trigger)) << name;
        EXPECT_EQ(a.find("requiresNetwork") ? *a.find("requiresNetwork") : Value(), Value(network))
            << name;
    }
    EXPECT_EQ(listed["outreach"].find("lastResult")->description(), "1");
    EXPECT_NE(agent.ctl({"activities"}).out.find("registration  due"), std::string::npos);

    // Day 10: the clock change reaches the agent at once; the post puts the item up, counts it
    // once and starts the refresh chain.
    const auto advanced = std::chrono::steady_clock::now();
    advance("10d");
    ASSERT_TRUE(waitFor("Firing activity 'com.velmora.qaxagent.followuppost'")) << agent.log();
    const double latency =
        std::chrono::duration<double>(std::chrono::steady_clock::now() - advanced).count();
    std::printf("qaxctl clock advance to the post's fire: %.3f s\n", latency);
    EXPECT_LT(latency, 1.0);
    ASSERT_TRUE(waitForEnds("followuppost", 1)) << agent.log();
    EXPECT_EQ(rows(), std::vector<std::string>{"Add the Haverly plan|30|-|-"});
    EXPECT_EQ(target("followuprefresh"), day(11));
    const auto analytics =
        test::readFile(std::filesystem::path(agent.platformRoot()) / "state/analytics.jsonl");
    EXPECT_EQ(std::count(analytics.begin(), analytics.end(), '\n'), 1) << analytics;
    EXPECT_NE(analytics.find("\"devicetype\":\"Default\""), std::string::npos) << analytics;

    // A restart loses nothing pending; a new boot re-schedules the refresh from its date.
    ASSERT_EQ(agent.stop(), 0);
    ASSERT_TRUE(agent.start()) << agent.log();
    EXPECT_TRUE(registered("followuprefresh"));
    ASSERT_EQ(agent.stop(), 0);
    agent.extraEnvironment.back() = "QAX_BOOT_ID=road-boot-2";
    ASSERT_TRUE(agent.start()) << agent.log();
    ASSERT_TRUE(waitFor("'com.velmora.qaxagent.followuprefresh' not complete, rescheduling"))
        << agent.log();
    EXPECT_EQ(target("followuprefresh"), day(11));

    // Day 11 (the log starts anew with each start): the refresh counts down and chains on.
    advance("1d");
    ASSERT_TRUE(waitForEnds("followuprefresh", 1)) << agent.log();
    EXPECT_EQ(rows(), std::vector<std::string>{"Add the Haverly plan|29|-|-"});
    EXPECT_TRUE(registered("followuprefresh"));

    // The coverage service goes down during an outreach: the run ends without scheduling and
    // the cache and the item stay as they were.
    const auto cacheBefore = cacheFiles();
    ASSERT_FALSE(cacheBefore.empty());
    ASSERT_EQ(scenario(R"({"ROADPHONE01": ["reset", "reset", "reset", "reset"]})"), 200);
    const int outreachRuns = ends("outreach");
    ASSERT_EQ(agent.ctl({"schedule-outreach"}).status, 0);
    ASSERT_TRUE(waitForEnds("outreach", outreachRuns + 1)) << agent.log();
    EXPECT_TRUE(agent.countInLog("Warranty failed to download"));
    EXPECT_TRUE(agent.countInLog("Conversion: 0 -- No devices eligible for followUp posts"));
    ASSERT_EQ(scenario(std::nullopt), 200);
    EXPECT_EQ(cacheFiles(), cacheBefore);
    EXPECT_FALSE(target("followuppost"));
    EXPECT_EQ(rows(), std::vector<std::string>{"Add the Haverly plan|29|-|-"});

    // A watch with its own offer (day 15 to 38) is paired: the post is due again on day 15.
    agent.writeRootFile("paired-devices.plist",
                        Value::Array{Value(Value::Dictionary{{"name", "Road Watch"},
                                                             {"localizedModel", "Watch"},
                                                             {"serialNumber", kWatch},
                                                             {"pairedDate", Value(day(-100))},
                                                             {"isPaired", true},
                                                             {"isArchived", false}})});
    ASSERT_EQ(agent.ctl({"notify", "com.velmora.pairlink.devicedidpair"}).status, 0);
    ASSERT_TRUE(
        waitFor("Found a new followup post date trigerred after a pairing event. Schedule "
                "followUp post for: " +
                day(15).description()))
        << agent.log();
    EXPECT_EQ(target("followuppost"), day(15));

    // The language changes while the item is shown: the phone's summary comes again in French.
    ASSERT_EQ(agent.ctl({"locale", "set", "fr_FR"}).status, 0);
    ASSERT_TRUE(waitFor("Device infos refreshed after locale change")) << agent.log();
    EXPECT_EQ(rows(), std::vector<std::string>{"Ajoutez le plan Haverly|29|-|-"});
    bool askedInFrench = false;
    for (const auto& request : sim->requestLog()) {
        const Value* body = request.find("body");
        askedInFrench |=
            body && body->isString() && body->asString()->find("\"fr_FR\"") != std::string::npos;
    }
    EXPECT_TRUE(askedInFrench);

    // Day 15: the watch's item goes up beside the phone's.
    advance("4d");
    ASSERT_TRUE(waitForEnds("followuppost", 1)) << agent.log();
    ASSERT_TRUE(waitForEnds("followuprefresh", 2)) << agent.log();
    EXPECT_EQ(rows(), (std::vector<std::string>{"Add the Haverly plan|23|-|-",
                                                "Ajoutez le plan Haverly|25|-|-"}));

    // Day 33: a week before the phone's end its badge is on; the watch's too (5 days left).
    advance("18d");
    ASSERT_TRUE(waitForEnds("followuprefresh", 3)) << agent.log();
    EXPECT_EQ(rows(), (std::vector<std::string>{"Add the Haverly plan|5|badge|-",
                                                "Ajoutez le plan Haverly|7|badge|-"}));

    // Day 37: three days before the end the notification is on, and delivered once.
    advance("4d");
    ASSERT_TRUE(waitForEnds("followuprefresh", 4)) << agent.log();
    EXPECT_EQ(rows(), (std::vector<std::string>{
                          "Add the Haverly plan|1|badge|Last day to add the Haverly plan",
                          "Ajoutez le plan Haverly|3|badge|Encore 3 jours pour ajouter le plan "
                          "Haverly"}));
    const auto delivered =
        test::readFile(std::filesystem::path(agent.platformRoot()) / "state/notifications.jsonl");
    EXPECT_EQ(std::count(delivered.begin(), delivered.end(), '\n'), 2) << delivered;

    // Day 40: both offers are over, the items are gone and the chain stops.
    advance("3d");
    ASSERT_TRUE(waitForEnds("followuprefresh", 5)) << agent.log();
    EXPECT_TRUE(rows().empty());
    EXPECT_TRUE(waitFor("No followups present, don't schedule another refresh"));
    EXPECT_FALSE(registered("followuprefresh"));
    EXPECT_FALSE(registered("followuppost"));
    EXPECT_TRUE(agent.running());
}

}  // namespace
}  // namespace qax
