// qaxctl clock, defer and followups run as real processes against a temporary
// platform root with the shipped launch configuration; the shipped interface strings.
#include <gtest/gtest.h>

#include <filesystem>
#include <map>

#include "AgentProcess.h"
#include "core/JsonCodec.h"
#include "fakes/FakeServices.h"
#include "platform/host/HostFollowUpCenter.h"
#include "platform/host/HostUserInterfaceStrings.h"
#include "platform/host/SystemClock.h"

namespace qax {
namespace {

namespace fs = std::filesystem;
const std::string kShare = std::string(QAX_SOURCE_DIR) + "/share/qaxagent";

class QaxctlHostState : public ::testing::Test {
  protected:
    QaxctlHostState() { r.extraEnvironment = {"QAX_SHARE_DIR=" + kShare, "QAX_CLOCK=simulated"}; }
    Value json(const std::vector<std::string>& args) const {
        auto result = r.ctl(args);
        EXPECT_EQ(result.status, 0) << result.err;
        return parseJson(result.out).value_or(Value());
    }
    fs::path state() const { return fs::path(r.platformRoot()) / "state"; }

    test::AgentProcess r;  // its home, platform root and environment; nothing started
};

double offsetOf(const Value& clock) {
    return clock.find("offsetSeconds") ? *clock.find("offsetSeconds")->asDouble() : -1;
}

TEST_F(QaxctlHostState, ClockAndDefer) {
    EXPECT_EQ(offsetOf(json({"clock", "--json"})), 0);
    const std::pair<const char*, double> rows[] = {
        {"3d", 259200}, {"5h", 277200}, {"90s", 277290}, {"30", 277320}, {"-1.5d", 147720}};
    for (const auto& [amount, offset] : rows) {
        SCOPED_TRACE(amount);
        auto advanced = r.ctl({"clock", "advance", amount});
        ASSERT_EQ(advanced.status, 0) << advanced.err << " (no agent listening is no error)";
        auto clock = json({"clock", "--json"});
        EXPECT_EQ(offsetOf(clock), offset);
        auto now = Date::parseIso8601(*clock.find("now")->asString());
        auto system = Date::parseIso8601(*clock.find("systemTime")->asString());
        EXPECT_NEAR(now->timeIntervalSince(*system), offset, 0.01);
    }
    ASSERT_EQ(r.ctl({"clock", "set", "2030-01-01T00:00:00Z"}).status, 0);
    auto now = Date::parseIso8601(*json({"clock", "--json"}).find("now")->asString());
    EXPECT_NEAR(now->timeIntervalSince(*Date::parseIso8601("2030-01-01T00:00:00Z")), 0, 5);

    const std::string before = test::readFile(state() / "clock.plist");
    for (const auto& bad : std::vector<std::vector<std::string>>{
             {"clock", "advance", "3x"}, {"clock", "set", "tomorrow"}, {"clock", "advance"}}) {
        EXPECT_EQ(r.ctl(bad).status, 64) << bad.back();
    }
    EXPECT_EQ(test::readFile(state() / "clock.plist"), before);

    const fs::path deferFile = state() / "defer";
    EXPECT_EQ(r.ctl({"defer"}).out, "off\n");
    ASSERT_EQ(r.ctl({"defer", "on"}).status, 0);
    EXPECT_TRUE(fs::exists(deferFile));
    EXPECT_EQ(r.ctl({"defer"}).out, "on\n");
    ASSERT_EQ(r.ctl({"defer", "off"}).status, 0);
    EXPECT_FALSE(fs::exists(deferFile));
    EXPECT_EQ(r.ctl({"defer", "maybe"}).status, 64);
}

TEST_F(QaxctlHostState, FollowUpsAsTheSettingsApplicationWouldShowThem) {
    HostFollowUpCenter center(r.platformRoot(), std::make_shared<SystemClock>());
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

    // The clock advanced before looking; both items' day text (none once expired); expired.
    const std::tuple<const char*, const char*, bool> steps[] = {
        {nullptr, "3 days left", false}, {"2d", "1 day left", false}, {"1d", nullptr, true}};
    for (const auto& [advance, dayText, expired] : steps) {
        SCOPED_TRACE(advance ? advance : "now");
        if (advance) {
            ASSERT_EQ(r.ctl({"clock", "advance", advance}).status, 0);
        }
        auto list = json({"followups", "--json"});
        ASSERT_TRUE(list.isArray());
        ASSERT_EQ(list.size(), 2u);
        for (const auto& item : *list.asArray()) {
            EXPECT_EQ(*item.find("expired"), Value(expired));
            if (dayText) {
                EXPECT_EQ(*item.find("dayText"), Value(dayText));
            } else {
                EXPECT_FALSE(item.find("dayText"));
            }
        }
        const Value& a = (*list.asArray())[0];
        EXPECT_EQ(*a.find("badge"), Value(true));
        EXPECT_EQ(*a.find("target"), Value("com.velmora.Preferences"));
        EXPECT_EQ(*a.find("notification"), (Value::Dictionary{{"title", "Offer"},
                                                              {"text", "Ends soon"},
                                                              {"activateLabel", "Details"},
                                                              {"clearLabel", "Clear"}}));
        EXPECT_EQ(*(*list.asArray())[1].find("badge"), Value(false));
    }
}

TEST_F(QaxctlHostState, ShippedInterfaceStrings) {
    auto locale = std::make_shared<test::FakeLocaleInfo>();
    HostUserInterfaceStrings strings(kShare, locale);
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
