// qaxctl clock, defer, activities and followups run as real processes against a temporary
// platform root with the shipped launch configuration, and the clock-changed notification
// reaching a host activity scheduler over the real notification socket.
#include <gtest/gtest.h>

#include <chrono>
#include <filesystem>
#include <future>
#include <map>
#include <thread>

#include "AgentProcess.h"
#include "core/AsioDispatcher.h"
#include "core/JsonCodec.h"
#include "fakes/FakeServices.h"
#include "platform/BackgroundActivityScheduler.h"
#include "platform/host/FilePreferenceStore.h"
#include "platform/host/HostActivityRegistry.h"
#include "platform/host/HostBackgroundActivityScheduler.h"
#include "platform/host/HostFollowUpCenter.h"
#include "platform/host/HostPlatform.h"
#include "platform/host/HostUserInterfaceStrings.h"
#include "platform/host/SystemClock.h"

namespace qax {
namespace {

namespace fs = std::filesystem;
using test::runTool;
using test::ToolResult;

class HostRoot {
  public:
    std::string home() const { return dir_.str(); }
    std::string root() const { return (dir_.path() / "root").string(); }
    std::string runtime() const { return (dir_.path() / "run").string(); }
    static std::string share() { return std::string(QAX_SOURCE_DIR) + "/share/qaxagent"; }

    std::vector<std::string> environment() const {
        return {"HOME=" + home(),
                "QAX_PLATFORM_ROOT=" + root(),
                "QAX_RUNTIME_DIR=" + runtime(),
                "QAX_SHARE_DIR=" + share(),
                "QAX_CLOCK=simulated",
                "PATH=/usr/bin:/bin"};
    }
    HostEnvironment hostEnvironment() const {
        return HostEnvironment{home(), root(), runtime(), share(), true};
    }
    ToolResult qaxctl(const std::vector<std::string>& args) const {
        return runTool(QAX_CTL_BINARY, args, environment());
    }
    Value json(const std::vector<std::string>& args) const {
        auto r = qaxctl(args);
        EXPECT_EQ(r.status, 0) << r.err;
        return parseJson(r.out).value_or(Value());
    }

  private:
    test::TempDir dir_;
};

double offsetOf(const Value& clock) {
    return clock.find("offsetSeconds") ? *clock.find("offsetSeconds")->asDouble() : -1;
}

TEST(QaxctlHostState, ClockAndDefer) {
    HostRoot r;
    EXPECT_EQ(offsetOf(r.json({"clock", "--json"})), 0);
    struct Row {
        const char* amount;
        double offset;  // after the step
    } rows[] = {{"3d", 259200}, {"5h", 277200}, {"90s", 277290}, {"30", 277320}, {"-1.5d", 147720}};
    for (const auto& row : rows) {
        SCOPED_TRACE(row.amount);
        auto advanced = r.qaxctl({"clock", "advance", row.amount});
        ASSERT_EQ(advanced.status, 0) << advanced.err << " (no agent listening is no error)";
        auto clock = r.json({"clock", "--json"});
        EXPECT_EQ(offsetOf(clock), row.offset);
        auto now = Date::parseIso8601(*clock.find("now")->asString());
        auto system = Date::parseIso8601(*clock.find("systemTime")->asString());
        EXPECT_NEAR(now->timeIntervalSince(*system), row.offset, 0.01);
    }
    ASSERT_EQ(r.qaxctl({"clock", "set", "2030-01-01T00:00:00Z"}).status, 0);
    auto now = Date::parseIso8601(*r.json({"clock", "--json"}).find("now")->asString());
    EXPECT_NEAR(now->timeIntervalSince(*Date::parseIso8601("2030-01-01T00:00:00Z")), 0, 5);

    const std::string before = test::readFile(fs::path(r.root()) / "state" / "clock.plist");
    for (const auto& bad : std::vector<std::vector<std::string>>{
             {"clock", "advance", "3x"}, {"clock", "set", "tomorrow"}, {"clock", "advance"}}) {
        EXPECT_EQ(r.qaxctl(bad).status, 64) << bad.back();
    }
    EXPECT_EQ(test::readFile(fs::path(r.root()) / "state" / "clock.plist"), before);

    const fs::path deferFile = fs::path(r.root()) / "state" / "defer";
    EXPECT_EQ(r.qaxctl({"defer"}).out, "off\n");
    ASSERT_EQ(r.qaxctl({"defer", "on"}).status, 0);
    EXPECT_TRUE(fs::exists(deferFile));
    EXPECT_EQ(r.qaxctl({"defer"}).out, "on\n");
    ASSERT_EQ(r.qaxctl({"defer", "off"}).status, 0);
    EXPECT_FALSE(fs::exists(deferFile));
    EXPECT_EQ(r.qaxctl({"defer", "maybe"}).status, 64);
}

TEST(QaxctlHostState, ActivitiesFromTheLaunchConfigurationRegistryAndPreferences) {
    HostRoot r;
    const Date now = SystemClock().now();
    HostActivityRegistry::Records records;
    ActivityRecord& outreach = records["com.velmora.qaxagent.outreach"];
    outreach.delay = 3600;
    outreach.gracePeriod = 360;
    outreach.requiresNetwork = true;
    outreach.scheduledAt = now;
    outreach.dueDate = now.byAdding(3600);
    outreach.lastFired = now.byAdding(-600);
    outreach.lastResult = 2;
    outreach.deferrals = 1;
    ASSERT_TRUE(HostActivityRegistry::save(r.root(), records, nullptr));
    FilePreferenceStore(FilePreferenceStore::domainPath(r.home()))
        .setObject("com.velmora.qaxagent.outreach.TargetDate", Value(now.byAdding(3600)));

    std::map<std::string, Value> byId;
    auto list = r.json({"activities", "--json"});
    ASSERT_TRUE(list.isArray());
    for (const auto& a : *list.asArray()) {
        byId[*a.find("identifier")->asString()] = a;
    }
    struct Row {
        const char* identifier;
        const char* trigger;
        bool network;
    } rows[] = {
        {"com.velmora.qaxagent.upgrade", "upgrade", false},
        {"com.velmora.qaxagent.boot", "boot", false},
        {"com.velmora.qaxagent.outreach", "interval", true},
        {"com.velmora.qaxagent.followuppost", "interval", true},
        {"com.velmora.qaxagent.conversionoutreach", "interval", true},
        {"com.velmora.qaxagent.followuprefresh", "interval", false},
    };
    ASSERT_EQ(byId.size(), std::size(rows));
    for (const auto& row : rows) {
        SCOPED_TRACE(row.identifier);
        const Value& a = byId[row.identifier];
        EXPECT_EQ(*a.find("trigger"), Value(row.trigger));
        EXPECT_EQ(*a.find("requiresNetwork"), Value(row.network));
        EXPECT_EQ(*a.find("interval"), Value(0));
    }
    const Value& o = byId["com.velmora.qaxagent.outreach"];
    ASSERT_TRUE(o.find("registration"));
    EXPECT_EQ(*o.find("registration")->find("dueDate"), Value(now.byAdding(3600).iso8601()));
    EXPECT_EQ(*o.find("registration")->find("due"), Value(false));
    // The preference domain is XML: its dates keep whole seconds.
    EXPECT_NEAR(Date::parseIso8601(*o.find("targetDate")->asString())->timeIntervalSince(now), 3600,
                1);
    EXPECT_EQ(*o.find("lastResult"), Value(2));
    EXPECT_FALSE(byId["com.velmora.qaxagent.boot"].find("registration"));

    auto text = r.qaxctl({"activities"});
    EXPECT_NE(text.out.find("due "), std::string::npos) << text.out;
}

TEST(QaxctlHostState, FollowUpsAsTheSettingsApplicationWouldShowThem) {
    HostRoot r;
    HostFollowUpCenter center(r.root(), std::make_shared<SystemClock>());
    auto post = [&](const char* id, std::uint64_t style, bool notification) {
        FollowUpItem i;
        i.uniqueIdentifier = id;
        i.title = std::string("Plan for ") + id;
        i.informativeFooterText = "Buy it";
        i.targetBundleIdentifier = kFollowUpSettingsTargetBundleIdentifier;
        i.displayStyle = style;
        i.expirationDate = SystemClock().now().byAdding(2.5 * 86400);
        i.userInfo = {{kFollowUpRelativeIsCeilingKey, true},
                      {kFollowUpRelativeSingleDayKey, "1 day left"},
                      {kFollowUpRelativePluralDaysFormatKey, "%@ days left"}};
        if (notification) {
            FollowUpNotification n;
            n.title = "Offer";
            n.informativeText = "Ends soon";
            n.activateAction = FollowUpAction{"Details", std::nullopt, "open"};
            n.clearAction = FollowUpAction{"Clear", std::nullopt, "clear"};
            i.notification = n;
        }
        ASSERT_TRUE(center.postFollowUpItem("com.velmora.Kestova", i, nullptr));
    };
    post("a", 2 | 1, true);
    post("b", 2 | 16, false);

    struct Step {
        const char* advance;  // before looking
        const char* dayText;  // of both items; none once expired
        bool expired;
    } steps[] = {
        {nullptr, "3 days left", false}, {"2d", "1 day left", false}, {"1d", nullptr, true}};
    for (const auto& s : steps) {
        SCOPED_TRACE(s.advance ? s.advance : "now");
        if (s.advance) {
            ASSERT_EQ(r.qaxctl({"clock", "advance", s.advance}).status, 0);
        }
        auto list = r.json({"followups", "--json"});
        ASSERT_TRUE(list.isArray());
        ASSERT_EQ(list.size(), 2u);
        for (const auto& item : *list.asArray()) {
            EXPECT_EQ(*item.find("expired"), Value(s.expired));
            if (s.dayText) {
                EXPECT_EQ(*item.find("dayText"), Value(s.dayText));
            } else {
                EXPECT_FALSE(item.find("dayText"));
            }
        }
        const Value& a = (*list.asArray())[0];
        EXPECT_EQ(*a.find("badge"), Value(true));
        EXPECT_EQ(*a.find("target"), Value("com.velmora.Preferences"));
        EXPECT_EQ(*a.find("notification"), Value(Value::Dictionary{{"title", "Offer"},
                                                                   {"text", "Ends soon"},
                                                                   {"activateLabel", "Details"},
                                                                   {"clearLabel", "Clear"}}));
        EXPECT_EQ(*(*list.asArray())[1].find("badge"), Value(false));
    }
}

TEST(QaxctlHostState, ClockChangeReachesARunningSchedulerWithinASecond) {
    HostRoot r;
    auto dispatcher = std::make_shared<AsioDispatcher>(1, 1);
    auto platform = makeHostPlatform(r.hostEnvironment(), dispatcher);
    platform->lifecycle = std::make_shared<test::FakeProcessLifecycle>();
    std::thread loop([&] { dispatcher->runMainLoop(); });

    std::promise<Date> fired;
    auto activity =
        platform->activities->activityWithIdentifier("com.velmora.qaxagent.followuprefresh");
    activity->setPreregistered(false);
    activity->setCriteria({3 * 86400, 3 * 8640, false, true});
    activity->scheduleWithBlock([&](std::function<void(ActivityResult)> completion) {
        fired.set_value(platform->clock->now());
        completion(ActivityResult::Finished);
    });
    auto result = fired.get_future();
    EXPECT_EQ(result.wait_for(std::chrono::milliseconds(300)), std::future_status::timeout);

    // From qaxctl's start: its own start-up, the file, the notification and the fire.
    const auto posted = std::chrono::steady_clock::now();
    ASSERT_EQ(r.qaxctl({"clock", "advance", "3d"}).status, 0);
    ASSERT_EQ(result.wait_for(std::chrono::seconds(5)), std::future_status::ready);
    const double latency =
        std::chrono::duration<double>(std::chrono::steady_clock::now() - posted).count();
    EXPECT_LT(latency, 1.0);
    std::printf("qaxctl clock advance to fire: %.3f s\n", latency);
    EXPECT_NEAR(result.get().timeIntervalSince(SystemClock().now()), 3 * 86400, 5);

    dispatcher->stopMainLoop();
    loop.join();
    dispatcher->shutdown();
    platform.reset();
    auto records = HostActivityRegistry::load(r.root());
    EXPECT_EQ(records["com.velmora.qaxagent.followuprefresh"].lastResult, 1);
}

TEST(QaxctlHostState, ShippedInterfaceStrings) {
    auto locale = std::make_shared<test::FakeLocaleInfo>();
    HostUserInterfaceStrings strings(HostRoot::share(), locale);
    std::map<std::string, std::string> details;
    for (const char* language : {"en_US", "fr_CA", "de_DE", "ja_JP"}) {
        locale->identifier = language;
        for (const char* key : {"DETAILS", "CLEAR_NOTIFICATION", "INSTALLED"}) {
            EXPECT_NE(strings.localizedString(key, "", "Localizable"), "") << language << key;
        }
        details[language] = strings.localizedString("DETAILS", "", "Localizable");
    }
    EXPECT_NE(details["fr_CA"], details["en_US"]);
    EXPECT_NE(details["ja_JP"], details["en_US"]);
}

}  // namespace
}  // namespace qax
