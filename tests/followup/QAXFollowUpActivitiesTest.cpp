// The follow-up post and refresh activities: their next dates, what one run posts, refreshes
// and schedules, and the post's deferral check, which must report a run exactly once.
#include <gtest/gtest.h>

#include "core/Hash.h"
#include "fakes/FakeAgent.h"
#include "fakes/FakeAgentFactory.h"
#include "fakes/FakeBackgroundActivities.h"
#include "fakes/FakeFollowUpCenter.h"
#include "fakes/TestPlatform.h"
#include "followup/QAXFollowUpPost.h"
#include "followup/QAXFollowUpRefresh.h"
#include "platform/PreferenceStore.h"
#include "platform/QAXSettings.h"
#include "scheduling/QAXScheduler.h"
#include "warranty/QAXWarranty.h"

namespace qax {
namespace {

using Opt = std::optional<double>;
constexpr double kHour = 3600;
constexpr double kDay = 86400;
constexpr Opt none;
constexpr const char* kClient = "com.velmora.Kestova";
constexpr const char* kPost = kQAXFollowUpPostActivityIdentifier;
constexpr const char* kRefresh = kQAXFollowUpRefreshActivityIdentifier;

// One device; dates are seconds from now, none leaves the date out.
struct Dev {
    const char* serial;
    Opt activation, display, until;
    bool displayed = true;
    bool posted = false;
};

class FollowUpActivitiesTest : public ::testing::Test {
  protected:
    FollowUpActivitiesTest() {
        qax_registerDefaults(prefs);
        factory().setAgent(agent);
    }
    // The agent's infos hold warranties, which hold the platform, which holds the agent.
    ~FollowUpActivitiesTest() override { agent->setInfos({}); }
    test::FakeAgentFactory& factory() {
        return static_cast<test::FakeAgentFactory&>(*tp.platform->agentFactory);
    }
    std::optional<Date> at(Opt seconds) const {
        return seconds ? std::optional<Date>(tp.clock->now().byAdding(*seconds)) : std::nullopt;
    }
    QAXDeviceInfoList infos(const std::vector<Dev>& devices) {
        QAXDeviceInfoList out;
        Value::Array posted;
        for (const Dev& d : devices) {
            Value::Dictionary summary{
                {"hvLocalizedOfferPluralDescFormat", "%@ days left"},
                {"featureToggleParameters",
                 Value::Dictionary{{"hvOfferDisplay", d.displayed},
                                   {"hvOfferDurationDaysBeforeEndDate", 30}}}};
            for (auto [key, offset] : {std::pair{"hvOfferFollowupDisplayDate", d.display},
                                       std::pair{"hvOfferEligibleUntil", d.until}}) {
                if (offset) {
                    summary[key] = static_cast<std::int64_t>(at(offset)->secondsSince1970());
                }
            }
            if (d.posted) {
                posted.push_back(Value(sha256Hash(d.serial)));
            }
            out.push_back(QAXDeviceInfo::deviceInfoWithDevice(
                QAXDevice::deviceWithName("Phone", std::string(d.serial), at(d.activation),
                                          QAXDeviceTypeDefault),
                QAXWarranty::initWithDictionary(tp.platform, Value(std::move(summary)))));
        }
        prefs.setObject("FollowupPostedSerialNumberHashes", Value(std::move(posted)));
        return out;
    }
    std::optional<Date> target(const char* identifier) {
        return prefs.dateForKey(QAXScheduler::targetDateKey(identifier));
    }
    // Runs `activity` once; what it reports is collected in the returned list.
    std::shared_ptr<std::vector<std::int64_t>> run(
        const std::shared_ptr<QAXSchedulerActivityDelegate>& activity) {
        auto results = std::make_shared<std::vector<std::int64_t>>();
        activity->performActivityForScheduler(
            QAXScheduler::newSchedulerWithActivityDelegate(tp.platform, activity),
            [results](std::int64_t r) { results->push_back(r); });
        tp.runner->runUntilIdle();
        return results;
    }
    test::InMemoryFollowUpCenter& center() {
        return static_cast<test::InMemoryFollowUpCenter&>(*tp.platform->followUps);
    }
    std::size_t items() { return center().items(kClient).size(); }

    test::TestPlatform tp;
    PreferenceStore& prefs = *tp.platform->preferences;
    std::shared_ptr<test::FakeAgent> agent = std::make_shared<test::FakeAgent>();
};

TEST_F(FollowUpActivitiesTest, NextPostAndRefreshDates) {
    enum Kind { Post, Refresh, RefreshNotInitial };
    struct Row {
        const char* what;
        Kind kind;
        std::vector<Dev> devices;
        Opt expected;
        double oneDay = kDay;
    };
    const double d = kDay, h = kHour;
    // clang-format off
    const Row rows[] = {
        {"earliest display date", Post,
         {{"A", none, 3 * d, 60 * d}, {"B", none, 10 * d, 60 * d}}, 3 * d},
        {"a posted device is skipped", Post,
         {{"A", none, 3 * d, 60 * d, true, true}, {"B", none, 10 * d, 60 * d}}, 10 * d},
        {"the end before the display date", Post, {{"A", none, 5 * d, 2 * d}}, 2 * d},
        {"a later activation is the candidate", Post, {{"A", 7 * d, 3 * d, 60 * d}}, 7 * d},
        {"no display date nor activation: only the end counts", Post,
         {{"A", none, 30 * d, 60 * d}, {"B", none, none, 20 * d}}, 20 * d},
        {"an ended offer listed first ends the walk", Post,
         {{"A", none, -30 * d, -d}, {"B", none, 3 * d, 60 * d}}, -d},
        {"nothing left to post", Post,
         {{"A", none, 3 * d, 60 * d, false}, {"B", none, 3 * d, 60 * d, true, true}}, none},
        {"a missing end turns a future result into none", Post,
         {{"A", none, 3 * d, 60 * d}, {"B", none, 3 * d, none}}, none},
        {"a display date already past is no candidate", Post, {{"A", -2 * d, -d, 9 * d}}, none},
        {"4 days left: the count drops in 5 h", Refresh, {{"A", -60 * d, -30 * d, 3 * d + 5 * h}},
         5 * h},
        {"exactly 3 days left: in 1 day", Refresh, {{"A", -60 * d, -30 * d, 3 * d}}, d},
        {"the last day: none", Refresh, {{"A", -60 * d, -30 * d, 20 * h}}, none},
        {"an offer still to be posted: its start", Refresh, {{"A", -60 * d, 2 * d, 30 * d}}, 2 * d},
        {"the earliest drop of two", Refresh,
         {{"A", -60 * d, -30 * d, 3 * d + 5 * h}, {"B", -60 * d, -30 * d, 2 * d + 3 * h}}, 3 * h},
        {"nothing displayed, not the initial call", RefreshNotInitial,
         {{"A", -60 * d, -30 * d, 9 * d, false}}, d},
        {"hour-long days", Refresh, {{"A", -60 * d, -30 * d, 3.5 * h}}, 0.5 * h, h},
        {"no start in the past, no day step", Refresh, {{"A", none, -30 * d, 3 * d + 5 * h}}, none},
        // 0 days left wraps the day step around to 4,294,967,295 days, and the walk stops.
        {"an ended offer", Refresh, {{"A", -60 * d, -30 * d, -h}, {"B", -60 * d, 2 * d, 30 * d}},
         -h - 4294967295.0 * d},
    };
    // clang-format on
    for (const Row& row : rows) {
        SCOPED_TRACE(row.what);
        prefs.setObject(settings::kOneDayInterval, Value(row.oneDay));
        const auto list = infos(row.devices);
        const auto date =
            row.kind == Post
                ? QAXFollowUpPost::nextFollowUpPostDateWithDevicesInfo(*tp.platform, list)
                : QAXFollowUpRefresh::nextFollowUpRefreshDateWithDevicesInfo(*tp.platform, list,
                                                                             row.kind == Refresh);
        EXPECT_EQ(date, at(row.expected));
    }
}

TEST_F(FollowUpActivitiesTest, RunsPostRefreshAndScheduleWhatComesNext) {
    struct Row {
        const char* what;
        bool post;                              // else a refresh run
        std::optional<std::vector<Dev>> reply;  // none: no agent to ask
        std::int64_t result;
        std::size_t itemsAfter;
        Opt nextPost, nextRefresh;
        const char* logged;
    };
    const Dev due{"A", -10 * kDay, -kDay, 30 * kDay};
    const Dev later{"A", -10 * kDay, 3 * kDay, 30 * kDay};
    const Dev shown{"A", -60 * kDay, -30 * kDay, 3 * kDay + 5 * kHour};
    // clang-format off
    const Row rows[] = {
        {"post: a due device is posted, the refresh starts", true, {{due}}, 1, 1, none, kDay,
         "Schedule refresh for: "},
        {"post: an offer opening later re-schedules the post", true, {{later}}, 1, 0, 3 * kDay,
         none, "Re-schedule followUp post for: "},
        {"post: no devices", true, {{}}, 1, 0, none, none, " -> (\n)"},
        {"post: no device infos", true, std::nullopt, 2, 0, none, none,
         "Unable to load devices info, defer"},
        {"refresh: a shown item is updated and chains", false, {{shown}}, 1, 1, none, 5 * kHour,
         "Followup present, schedule refresh for "},
        {"refresh: a device no longer known is cleared", false, {{}}, 1, 0, none, none,
         "No followups present, don't schedule another refresh"},
        {"refresh: no device infos", false, std::nullopt, 2, 1, none, none,
         "Unable to load device info for followup refresh, defer"},
    };
    // clang-format on
    for (const Row& row : rows) {
        SCOPED_TRACE(row.what);
        tp.log->clear();
        prefs.removeObject(QAXScheduler::targetDateKey(kPost));
        prefs.removeObject(QAXScheduler::targetDateKey(kRefresh));
        center().setItems(kClient, {});
        if (!row.post) {
            QAXFollowUp(tp.platform).postFollowUpWithDeviceInfo(infos({shown})[0]);
        }
        agent->setInfos(row.reply ? infos(*row.reply) : QAXDeviceInfoList{});
        factory().setAgent(row.reply ? agent : nullptr);

        const auto results = row.post ? run(std::make_shared<QAXFollowUpPost>(tp.platform))
                                      : run(std::make_shared<QAXFollowUpRefresh>(tp.platform));
        EXPECT_EQ(*results, std::vector<std::int64_t>{row.result});
        EXPECT_EQ(items(), row.itemsAfter);
        EXPECT_EQ(target(kPost), at(row.nextPost));
        EXPECT_EQ(target(kRefresh), at(row.nextRefresh));
        EXPECT_EQ(tp.log->countContaining(row.logged), 1) << row.logged;
    }
    // Each run asked an agent of its own for fresh downloads (post) or the cache (refresh),
    // without the agent's follow-up update.
    const auto callers = factory().agentCallers();
    EXPECT_EQ(callers.front(), "com.velmora.qaxagent.followuppost");
    EXPECT_EQ(callers.back(), "com.velmora.qaxagent.followuprefresh");
    const auto requests = agent->requests();
    EXPECT_EQ(requests.front().policy, QAXWarrantyPolicyForceDownload);
    EXPECT_EQ(requests.back().policy, QAXWarrantyPolicyCachedOnly);
    EXPECT_FALSE(requests.front().updateFollowUps || requests.back().updateFollowUps);
}

TEST_F(FollowUpActivitiesTest, PostRunIsReportedOnceWhicheverPathEndsIt) {
    const std::tuple<const char*, bool, bool, std::int64_t> rows[] = {
        {"deferral check first", true, true, QAXActivityResultDeferred},
        {"reply first", true, false, QAXActivityResultFinished},
        {"the platform does not ask to defer", false, true, QAXActivityResultFinished},
    };
    for (const auto& [what, shouldDefer, timerFirst, reported] : rows) {
        SCOPED_TRACE(what);
        tp.log->clear();
        std::static_pointer_cast<test::FakeBackgroundActivityScheduler>(tp.platform->activities)
            ->activity(kPost)
            ->setShouldDefer(shouldDefer);
        agent->setInfos(infos({{"A", -10 * kDay, -kDay, 30 * kDay}}));
        agent->hold(true);
        auto activity = std::make_shared<QAXFollowUpPost>(tp.platform);
        activity->setDeferralCheckInterval(10);
        auto results = run(activity);
        EXPECT_TRUE(activity->followUpPostInProgress());
        if (timerFirst) {
            tp.runner->advanceBy(35);
        }
        EXPECT_EQ(agent->release(), 1u);
        tp.runner->advanceBy(35);
        EXPECT_EQ(*results, std::vector<std::int64_t>{reported});
        EXPECT_EQ(tp.log->count("FollowUp Post activity deferred."),
                  reported == QAXActivityResultDeferred ? 1 : 0);
        // The reply's work is done either way, and the run leaves nothing behind.
        EXPECT_EQ(items(), 1u);
        EXPECT_FALSE(activity->followUpPostInProgress() || activity->followUpPostTimer());
        agent->hold(false);
    }
}

}  // namespace
}  // namespace qax
