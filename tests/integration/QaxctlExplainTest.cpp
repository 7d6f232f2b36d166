// qaxctl explain against a home prepared with the agent's own code (cached warranty, posted
// item, preferences, an activity registration), on the simulated clock: what it says about the
// badge, the notification, the end of the offer and the next refresh is what the real agent
// then does, and no run of it changes a single file.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <chrono>
#include <cmath>
#include <filesystem>
#include <map>
#include <thread>

#include "AgentProcess.h"
#include "core/Hash.h"
#include "core/JsonCodec.h"
#include "devices/QAXDeviceInfo.h"
#include "followup/QAXFollowUp.h"
#include "platform/PreferenceStore.h"
#include "platform/QAXSettings.h"
#include "platform/host/HostActivityRegistry.h"
#include "platform/host/HostActivityTriggerRecord.h"
#include "platform/host/HostPlatform.h"
#include "platform/host/SimulatedClock.h"
#include "platform/host/SystemClock.h"
#include "scheduling/QAXScheduler.h"
#include "warranty/QAXWarranty.h"

namespace qax {
namespace {

namespace fs = std::filesystem;

constexpr double kDay = 86400;
constexpr const char* kPhone = "EXPLAINPHONE1";
constexpr const char* kRefresh = "com.velmora.qaxagent.followuprefresh";

// Every file below `root`: content digest, inode and modification time, so that a rewrite
// with the same bytes counts as a change too.
std::map<std::string, std::string> fingerprint(const fs::path& root) {
    std::map<std::string, std::string> files;
    for (const auto& entry : fs::recursive_directory_iterator(root)) {
        struct stat st {};
        ::lstat(entry.path().c_str(), &st);
        std::string print = std::to_string(st.st_ino) + " " + std::to_string(st.st_mtim.tv_sec) +
                            "." + std::to_string(st.st_mtim.tv_nsec);
        if (entry.is_regular_file()) {
            print += " " + sha256Hash(test::readFile(entry.path()));
        }
        files[fs::relative(entry.path(), root).string()] = print;
    }
    return files;
}

// The value at a dotted path ("offer.badge.date"); null when there is none.
const Value& at(const Value& v, const std::string& path) {
    static const Value none;
    const Value* at = &v;
    for (std::size_t from = 0; at && from <= path.size();) {
        const auto dot = std::min(path.find('.', from), path.size());
        at = at->find(path.substr(from, dot - from));
        from = dot + 1;
    }
    return at ? *at : none;
}

std::optional<Date> dateAt(const Value& v, const std::string& path) {
    const Value& date = at(v, path);
    return date.isString() ? Date::parseIso8601(*date.asString()) : std::nullopt;
}

void expectAt(const Value& x, std::initializer_list<std::pair<const char*, Value>> expected) {
    for (const auto& [path, value] : expected) {
        EXPECT_EQ(at(x, path), value) << path << " is " << at(x, path).description();
    }
}

class QaxctlExplainTest : public ::testing::Test {
  protected:
    void SetUp() override {
        agent.extraEnvironment = {
            "QAX_CLOCK=simulated", "QAX_NETWORK=down", "QAX_BOOT_ID=explain-boot",
            "QAX_SHARE_DIR=" + std::string(QAX_SOURCE_DIR) + "/share/qaxagent"};
        agent.writeDevices(kPhone, std::nullopt, "17.2");
        agent.writeAccounts();
        agent.writeRootFile("locale.plist", Value::Dictionary{{"PreferredLocale", Value("en_US")}});
        // This boot and this system version are behind the agent already: its start-up runs
        // no upgrade or boot work, only what is registered.
        ASSERT_TRUE(HostActivityTriggerRecord::save(
            agent.platformRoot(),
            {{"com.velmora.qaxagent.upgrade", TriggerRecord{std::nullopt, {"17.2"}}},
             {"com.velmora.qaxagent.boot", TriggerRecord{"explain-boot", {}}}},
            nullptr));
        platform = makeHostPlatform(
            HostEnvironment{agent.home(), agent.platformRoot(), agent.runtimeDirectory(),
                            std::string(QAX_SOURCE_DIR) + "/share/qaxagent", true},
            nullptr);
        qax_registerDefaults(*platform->preferences);
        start = std::floor(platform->clock->now().secondsSince1970());
        // As the first upgrade run leaves it, long before the offer.
        platform->preferences->setObject("DefaultDeviceActivationDate",
                                         Value(Date(start - 60 * kDay)));
        previousSink = qaxLog().sink();
        qaxLog().setSink(std::make_shared<CapturingLogSink>());
    }
    void TearDown() override { qaxLog().setSink(previousSink); }

    // A coverage summary whose offer opened `openedDaysAgo` days ago and ends `endsInDays`
    // days from the start; the badge 7 days and the notification 3 days before the end.
    Value summary(double openedDaysAgo, double endsInDays) const {
        auto ms = [&](double days) {
            return Value(static_cast<std::int64_t>((start + days * kDay) * 1000));
        };
        return Value::Dictionary{
            {"covered", true},
            {"hvOfferEligible", true},
            {"hvOfferEligibleUntil", ms(endsInDays)},
            {"hvOfferFollowupDisplayDate", ms(-openedDaysAgo)},
            {"hvLocalizedOfferLabel", "Add the Haverly plan"},
            {"hvLocalizedOfferPluralDescFormat", "%@ days left to add coverage"},
            {"hvLocalizedOfferSingularDesc", "Last day to add coverage"},
            {"hvNotificationLocalizedOfferLabel", "Coverage is ending soon"},
            {"hvNotificationLocalizedOfferPluralDescFormat", "%@ days left to add the plan"},
            {"hvNotificationLocalizedOfferSingularDesc", "Last day to add the plan"},
            {"hvLocalizedOfferCTA", "Add Coverage"},
            {"featureToggleParameters",
             Value(Value::Dictionary{{"hvOfferDisplay", true},
                                     {"hvOfferSettingsRowBadge", true},
                                     {"hvOfferDurationDaysBeforeEndDate", 30}})},
            {"hvOfferBadgeBeforeEndDate", 7},
            {"showNotificationToggle", true},
            {"showNotificationBeforeEndDate", 3}};
    }

    // The cache file and its keys, as a download leaves them.
    void cacheSummary(const Value& s) {
        ASSERT_TRUE(
            QAXWarranty::warrantyWithDictionary(platform, s, kPhone)->cacheWarranty(kPhone));
        const std::string hash = sha256Hash(kPhone);
        auto& prefs = *platform->preferences;
        prefs.setObject(hash + "_CachedWarrantyLastUpdatedDate", Value(Date(start - 3600)));
        prefs.setObject(hash + "_CachedWarrantyLocale", Value("en_US"));
        prefs.setObject(hash + "_CachedWarrantyVersion", Value("2"));
    }
    std::shared_ptr<QAXDeviceInfo> phoneInfo() {
        return QAXDeviceInfo::deviceInfoWithDevice(
            QAXDevice::deviceWithName(
                "Default Device", kPhone,
                platform->preferences->dateForKey("DefaultDeviceActivationDate"),
                QAXDeviceTypeDefault),
            QAXWarranty::cachedWarrantyForSerialNumber(platform, kPhone));
    }
    // A refresh registration due now, as a post run would have left it.
    void registerRefreshNow() {
        const Date now = Date(platform->clock->now().secondsSince1970());
        HostActivityRegistry::Records records = HostActivityRegistry::load(agent.platformRoot());
        ActivityRecord& r = records[kRefresh];
        r.scheduledAt = now;
        r.dueDate = now;
        ASSERT_TRUE(HostActivityRegistry::save(agent.platformRoot(), records, nullptr));
        platform->preferences->setObject(QAXScheduler::targetDateKey(kRefresh), Value(now));
    }

    void advanceTo(Date date) {
        const double by = std::ceil(date.timeIntervalSince(platform->clock->now()));
        ASSERT_EQ(
            agent.ctl({"clock", "advance", std::to_string(static_cast<long long>(by))}).status, 0);
        std::static_pointer_cast<SimulatedClock>(platform->clock)->reloadOffset();
    }
    // Runs explain and checks that it changed no file of the home and platform root.
    Value explain(const std::vector<std::string>& extra = {}, std::string* textOut = nullptr) {
        const auto before = fingerprint(agent.home());
        std::vector<std::string> args{"explain", "--json"};
        args.insert(args.end(), extra.begin(), extra.end());
        auto r = agent.ctl(args);
        EXPECT_EQ(r.status, 0) << r.err;
        EXPECT_EQ(fingerprint(agent.home()), before) << "explain changed a file";
        args.erase(args.begin() + 1);
        auto text = agent.ctl(args);
        EXPECT_EQ(text.status, 0) << text.err;
        EXPECT_EQ(fingerprint(agent.home()), before) << "explain changed a file";
        if (textOut) {
            *textOut = text.out;
        }
        auto v = parseJson(r.out);
        EXPECT_TRUE(v && v->isDictionary()) << r.out;
        return v.value_or(Value());
    }
    // Starts the agent, lets it run the due refresh, and stops it.
    void runAgentRefresh() {
        ASSERT_TRUE(agent.start()) << agent.log();
        const std::string prefix = "Activity '" + std::string(kRefresh) + "' ";
        auto ended = [&] {
            return agent.countInLog(prefix + "finished") + agent.countInLog(prefix + "reported");
        };
        for (int i = 0; i < 2000 && ended() == 0; ++i) {
            std::this_thread::sleep_for(std::chrono::milliseconds(10));
        }
        EXPECT_GT(ended(), 0) << agent.log();
        agent.stop();
    }
    // The platform's pending registration of the refresh: what the agent's run scheduled.
    std::optional<Date> refreshDue() {
        auto records = HostActivityRegistry::load(agent.platformRoot());
        auto r = records.find(kRefresh);
        return r == records.end() ? std::nullopt : r->second.dueDate;
    }
    Value followUp() {
        auto list = parseJson(agent.ctl({"followups", "--json"}).out);
        return list && list->isArray() && list->asArray()->size() == 1 ? list->asArray()->front()
                                                                       : Value();
    }

    test::AgentProcess agent;
    std::shared_ptr<Platform> platform;
    double start = 0;
    std::shared_ptr<LogSink> previousSink;
};

TEST_F(QaxctlExplainTest, PredictsWhatTheAgentsRefreshDoes) {
    cacheSummary(summary(5, 10.5));
    ASSERT_TRUE(QAXFollowUp(platform).postFollowUpWithDevicesInfo({phoneInfo()}));

    Value x = explain();
    expectAt(x, {{"cache.state", "valid"},
                 {"cache.fresh", true},
                 {"offer.posted", true},
                 {"offer.postRule", "due"},
                 {"refresh.rule", "update"},
                 {"item.badge", false}});
    const Value* policies = x.find("policies");
    ASSERT_TRUE(policies && policies->isArray() && policies->asArray()->size() == 3);
    const char* answers[] = {"cached", "cached", "download"};
    for (int p = 0; p < 3; ++p) {
        EXPECT_EQ(*(*policies->asArray())[p].find("answer"), Value(answers[p])) << p;
    }
    const auto badgeOn = dateAt(x, "offer.badge.date");
    const auto notificationOn = dateAt(x, "offer.notification.date");
    const auto end = dateAt(x, "offer.eligibleUntil");
    ASSERT_TRUE(badgeOn && notificationOn && end);
    EXPECT_EQ(end->timeIntervalSince(*badgeOn), 7 * kDay);
    EXPECT_EQ(end->timeIntervalSince(*notificationOn), 3 * kDay);

    // Past the badge date: explain says a refresh turns the badge on, and the agent's refresh
    // does, then schedules the next refresh when explain said it would.
    const std::tuple<Date, bool, bool> steps[] = {{badgeOn->byAdding(60), true, false},
                                                  {notificationOn->byAdding(60), true, true}};
    for (const auto& [to, badge, notification] : steps) {
        SCOPED_TRACE(to.description());
        advanceTo(to);
        x = explain();
        EXPECT_EQ(at(x, "offer.badge.on").truthy(), badge);
        EXPECT_EQ(at(x, "offer.notification.on").truthy(), notification);
        expectAt(x, {{"refresh.updatesThisDevice", true}, {"refresh.item.badge", badge}});
        const auto next = dateAt(x, "refresh.nextRefreshDate");
        ASSERT_TRUE(next);
        registerRefreshNow();
        runAgentRefresh();
        const Value item = followUp();
        ASSERT_TRUE(item.isDictionary()) << agent.log();
        EXPECT_EQ(*item.find("badge"), Value(badge)) << item.description();
        EXPECT_EQ(item.find("notification") != nullptr, notification) << item.description();
        EXPECT_EQ(*item.find("dayText"), at(x, "refresh.item.dayText"));
        // The platform keeps whole seconds of the delay.
        const auto due = refreshDue();
        ASSERT_TRUE(due) << agent.log();
        EXPECT_NEAR(due->timeIntervalSince(*next), 0, 1.5);
    }

    // Past the end: explain says the refresh removes the item and ends the chain; it does.
    advanceTo(end->byAdding(60));
    x = explain();
    expectAt(x, {{"offer.eligible", false},
                 {"refresh.rule", "noLongerEligible"},
                 {"refresh.clearsThisDevice", true},
                 {"refresh.continues", false}});
    registerRefreshNow();
    runAgentRefresh();
    EXPECT_EQ(followUp(), Value());
    EXPECT_FALSE(refreshDue()) << agent.log();
}

TEST_F(QaxctlExplainTest, DismissalConversionAndActivationAgreeWithThePostRule) {
    // A dismissal (days ago; < 0: none), the activation, and what explain and the rule say.
    const std::tuple<const char*, double, double, const char*, bool, bool> rows[] = {
        {"dismissed before the offer opened", 8, -60, "due", true, false},
        {"dismissed after it opened", 2, -60, "dismissed", false, false},
        {"activated after it opened", -1, 2, "futurePostDate", false, true},
    };
    cacheSummary(summary(5, 20));
    for (const auto& [name, dismissedDaysAgo, activatedInDays, postRule, reopens, moved] : rows) {
        SCOPED_TRACE(name);
        auto& prefs = *platform->preferences;
        const std::string hash = sha256Hash(kPhone);
        for (const char* key :
             {"FollowupDismissedSerialNumberHashes", "FollowupPostedSerialNumberHashes",
              "DefaultDeviceActivationDate"}) {
            prefs.removeObject(key);
        }
        prefs.removeObject(hash + ".dismissed");
        if (dismissedDaysAgo >= 0) {
            prefs.setObject("FollowupDismissedSerialNumberHashes", Value::Array{Value(hash)});
            prefs.setObject(hash + ".dismissed", Value(Date(start - dismissedDaysAgo * kDay)));
        }
        prefs.setObject("DefaultDeviceActivationDate", Value(Date(start + activatedInDays * kDay)));
        const Value x = explain({kPhone});
        expectAt(x, {{"offer.postRule", postRule},
                     {"offer.conversionReopens", reopens},
                     {"offer.postDateMovedByActivation", moved},
                     {"post.postsThisDevice", std::string(postRule) == "due"}});
        // The agent's post rule, for real on these files, does what explain said.
        EXPECT_EQ(QAXFollowUp(platform).postFollowUpWithDevicesInfo({phoneInfo()}),
                  std::string(postRule) == "due");
    }
}

TEST_F(QaxctlExplainTest, BadInputGetsAClearAnswer) {
    cacheSummary(summary(5, 20));
    const fs::path root = agent.platformRoot();
    const fs::path cacheFile = fs::path(agent.home()) /
                               "Library/Application Support/com.velmora.Kestova" /
                               (sha256Hash(kPhone) + "_Warranty.plist");
    // The arguments, a file written with garbage first, and what the text output says.
    const std::tuple<const char*, std::vector<std::string>, fs::path, const char*> rows[] = {
        {"unknown serial", {"NOSUCHSERIAL"}, {}, "tracks no device with the serial number"},
        {"no cache", {"NOSUCHSERIAL"}, {}, "No cached warranty"},
        {"corrupt follow-up store",
         {},
         root / "state/followups/com.velmora.Kestova.plist",
         "Ignoring platform file"},
        {"corrupt activity registry", {}, root / "state/activities.plist", "Problems"},
        {"corrupt cache", {}, cacheFile, "holds no coverage summary"},
        {"corrupt preferences",
         {},
         fs::path(agent.home()) / "Library/Preferences/com.velmora.qaxagent.plist",
         "Preference domain file"},
    };
    for (const auto& [name, args, corrupt, said] : rows) {
        SCOPED_TRACE(name);
        if (!corrupt.empty()) {
            test::writeFile(corrupt, "<plist><dict><key>x</key>");
        }
        std::string text;
        explain(args, &text);
        EXPECT_NE(text.find(said), std::string::npos) << text;
    }
    for (const auto& bad :
         std::vector<std::vector<std::string>>{{"explain", "A", "B"}, {"explain", "--verbose"}}) {
        EXPECT_EQ(agent.ctl(bad).status, 64) << bad.back();
    }
}

}  // namespace
}  // namespace qax
