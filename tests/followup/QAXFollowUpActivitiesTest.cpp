// The follow-up post and refresh activities: their next dates, what one run posts, refreshes
// and schedules, and the post's deferral check, which must report a run exactly once.
#include <gtest/gtest.h>

#include "core/Hash.h"
#include "fakes/FakeAgent.h"
#include "fakes/FakeAgentFactory.h"
#include "fakes/FakeAnalyticsSink.h"
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

constexpr double kHour = 3600;
constexpr double kDay = 86400;
constexpr const char* kClient = "com.velmora.Kestova";

// One device as a test describes it; offsets are seconds from now, none leaves the date out.
struct Dev {
    const char* serial;
    std::optional<double> activation;
    std::optional<double> display;
    std::optional<double> until;
    bool displayed = true;
    bool posted = false;
};

class FollowUpActivitiesTest : public ::testing::Test {
  protected:
    FollowUpActivitiesTest() {
        qax_registerDefaults(prefs);
        factory().setAgent(agent);
    }

    test::FakeAgentFactory& factory() {
        return static_cast<test::FakeAgentFactory&>(*tp.platform->agentFactory);
    }
    Date at(double seconds) const { return tp.clock->now().byAdding(seconds); }
    std::int64_t epoch(double seconds) const {
        return static_cast<std::int64_t>(at(seconds).secondsSince1970());
    }

    QAXDeviceInfoList infos(const std::vector<Dev>& devices) {
        QAXDeviceInfoList out;
        Value::Array posted;
        for (const Dev& d : devices) {
            Value::Dictionary summary{
                {"hvLocalizedOfferLabel", "Add the plan"},
                {"hvLocalizedOfferPluralDescFormat", "%@ days left"},
                {"hvLocalizedOfferSingularDesc", "Last day"},
                {"featureToggleParameters",
                 Value(Value::Dictionary{{"hvOfferDisplay", d.displayed},
                                         {"hvOfferDurationDaysBeforeEndDate", 30}})}};
            if (d.display) {
                summary["hvOfferFollowupDisplayDate"] = epoch(*d.display);
            }
            if (d.until) {
                summary["hvOfferEligibleUntil"] = epoch(*d.until);
            }
            if (d.posted) {
                posted.push_back(Value(sha256Hash(d.serial)));
            }
            auto activation = d.activation ? std::optional<Date>(at(*d.activation)) : std::nullopt;
            out.push_back(QAXDeviceInfo::deviceInfoWithDevice(
                QAXDevice::deviceWithName("Phone", std::string(d.serial), activation,
                                          QAXDeviceTypeDefault),
                QAXWarranty::initWithDictionary(tp.platform, Value(std::move(summary)))));
        }
        prefs.setObject("FollowupPostedSerialNumberHashes", Value(std::move(posted)));
        return out;
    }
    std::optional<Date> target(const char* identifier) {
        return prefs.dateForKey(QAXScheduler::targetDateKey(identifier));
    }
    std::shared_ptr<test::FakeBackgroundActivity> platformActivity(const char* identifier) {
        return std::static_pointer_cast<test::FakeBackgroundActivityScheduler>(
                   tp.platform->activities)
            ->activity(identifier);
    }
    // Runs `activity` once and collects what it reports.
    std::shared_ptr<std::vector<std::int64_t>> run(
        const std::shared_ptr<QAXSchedulerActivityDelegate>& activity) {
        auto results = std::make_shared<std::vector<std::int64_t>>();
        activity->performActivityForScheduler(
            QAXScheduler::newSchedulerWithActivityDelegate(tp.platform, activity),
            [results](std::int64_t r) { results->push_back(r); });
        tp.runner->runUntilIdle();
        return results;
    }
    std::vector<FollowUpItem> items() {
        return std::static_pointer_cast<test::InMemoryFollowUpCenter>(tp.platform->followUps)
            ->items(kClient);
    }

    test::TestPlatform tp;
    PreferenceStore& prefs = *tp.platform->preferences;
    std::shared_ptr<test::FakeAgent> agent = std::make_shared<test::FakeAgent>();
};

TEST_F(FollowUpActivitiesTest, NextPostDate) {
    const std::optional<double> none;
    struct Row {
        const char* what;
        std::vector<Dev> devices;
        std::optional<double> expected;
    };
    const Row rows[] = {
        {"earliest display date",
         {{"A", none, 3 * kDay, 60 * kDay}, {"B", none, 10 * kDay, 60 * kDay}},
         3 * kDay},
        {"a posted device is skipped",
         {{"A", none, 3 * kDay, 60 * kDay, true, true}, {"B", none, 10 * kDay, 60 * kDay}},
         10 * kDay},
        {"eligibility ends before the display date", {{"A", none, 5 * kDay, 2 * kDay}}, 2 * kDay},
        {"a later activation date is the candidate",
         {{"A", 7 * kDay, 3 * kDay, 60 * kDay}},
         7 * kDay},
        {"no display date and no activation: only the end counts",
         {{"A", none, 30 * kDay, 60 * kDay}, {"B", none, none, 20 * kDay}},
         20 * kDay},
        {"an ended offer listed first ends the walk in the past",
         {{"A", none, -30 * kDay, -1 * kDay}, {"B", none, 3 * kDay, 60 * kDay}},
         -1 * kDay},
        {"nothing posted-able",
         {{"A", none, 3 * kDay, 60 * kDay, false}, {"B", none, 3 * kDay, 60 * kDay, true, true}},
         none},
        {"a missing end of eligibility turns a future result into none",
         {{"A", none, 3 * kDay, 60 * kDay}, {"B", none, 3 * kDay, none}},
         none},
        {"a display date already past gives no candidate",
         {{"A", -2 * kDay, -1 * kDay, 9 * kDay}},
         none},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.what);
        const auto date =
            QAXFollowUpPost::nextFollowUpPostDateWithDevicesInfo(*tp.platform, infos(row.devices));
        EXPECT_EQ(date, row.expected ? std::optional<Date>(at(*row.expected)) : std::nullopt);
    }
}

TEST_F(FollowUpActivitiesTest, NextRefreshDate) {
    const std::optional<double> none;
    struct Row {
        const char* what;
        std::vector<Dev> devices;
        bool initial;
        std::optional<double> expected;
        double oneDay = kDay;
    };
    const Row rows[] = {
        {"4 days left: the count drops in 5 hours",
         {{"A", -60 * kDay, -30 * kDay, 3 * kDay + 5 * kHour}},
         true,
         5 * kHour},
        {"exactly 3 days left: in 1 day", {{"A", -60 * kDay, -30 * kDay, 3 * kDay}}, true, kDay},
        {"the last day: none", {{"A", -60 * kDay, -30 * kDay, 20 * kHour}}, true, none},
        {"an offer still to be posted: its start",
         {{"A", -60 * kDay, 2 * kDay, 30 * kDay}},
         true,
         2 * kDay},
        {"the earliest drop over two devices",
         {{"A", -60 * kDay, -30 * kDay, 3 * kDay + 5 * kHour},
          {"B", -60 * kDay, -30 * kDay, 2 * kDay + 3 * kHour}},
         true,
         3 * kHour},
        {"no displayed device, not the initial call: one day",
         {{"A", -60 * kDay, -30 * kDay, 9 * kDay, false}},
         false,
         kDay},
        {"hour-long days", {{"A", -60 * kDay, -30 * kDay, 3.5 * kHour}}, true, 0.5 * kHour, kHour},
        {"no start in the past (display date past, no activation): no day step",
         {{"A", none, -30 * kDay, 3 * kDay + 5 * kHour}},
         true,
         none},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.what);
        prefs.setObject(settings::kOneDayInterval, Value(row.oneDay));
        const auto date = QAXFollowUpRefresh::nextFollowUpRefreshDateWithDevicesInfo(
            *tp.platform, infos(row.devices), row.initial);
        EXPECT_EQ(date, row.expected ? std::optional<Date>(at(*row.expected)) : std::nullopt);
    }

    // An ended offer (0 days left) wraps the day step around to the largest count: the result
    // lies about 4,294,967,295 days back and the walk stops there.
    prefs.setObject(settings::kOneDayInterval, Value(kDay));
    const auto ended = QAXFollowUpRefresh::nextFollowUpRefreshDateWithDevicesInfo(
        *tp.platform,
        infos({{"A", -60 * kDay, -30 * kDay, -kHour}, {"B", -60 * kDay, 2 * kDay, 30 * kDay}}),
        true);
    ASSERT_TRUE(ended);
    EXPECT_EQ(*ended, at(-kHour - 4294967295.0 * kDay));
}

TEST_F(FollowUpActivitiesTest, PostRunPostsDueDevicesAndSchedulesWhatComesNext) {
    struct Row {
        const char* what;
        std::optional<std::vector<Dev>> devices;  // none: no agent
        std::int64_t result;
        std::size_t posted;
        std::optional<double> nextPost;
        std::optional<double> refresh;
    };
    const Row rows[] = {
        {"a due device is posted and the refresh starts",
         std::vector<Dev>{{"A", -10 * kDay, -kDay, 30 * kDay}}, QAXActivityResultFinished, 1,
         std::nullopt, kDay},
        {"an offer opening later re-schedules the post",
         std::vector<Dev>{{"A", -10 * kDay, 3 * kDay, 30 * kDay}}, QAXActivityResultFinished, 0,
         3 * kDay, std::nullopt},
        {"no devices", std::vector<Dev>{}, QAXActivityResultFinished, 0, std::nullopt,
         std::nullopt},
        {"no device infos at all", std::nullopt, QAXActivityResultDeferred, 0, std::nullopt,
         std::nullopt},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.what);
        tp.log->clear();
        for (const char* id :
             {kQAXFollowUpPostActivityIdentifier, kQAXFollowUpRefreshActivityIdentifier}) {
            prefs.removeObject(QAXScheduler::targetDateKey(id));
        }
        std::static_pointer_cast<test::InMemoryFollowUpCenter>(tp.platform->followUps)
            ->clearPendingFollowUpItemsWithUniqueIdentifiers(
                kClient, {"com.velmora.Kestova." + sha256Hash("A")}, nullptr);
        agent->setInfos(row.devices ? infos(*row.devices) : QAXDeviceInfoList{});
        factory().setAgent(row.devices ? agent : nullptr);

        auto results = run(std::make_shared<QAXFollowUpPost>(tp.platform));
        EXPECT_EQ(*results, std::vector<std::int64_t>{row.result});
        EXPECT_EQ(items().size(), row.posted);
        EXPECT_EQ(target(kQAXFollowUpPostActivityIdentifier),
                  row.nextPost ? std::optional<Date>(at(*row.nextPost)) : std::nullopt);
        EXPECT_EQ(target(kQAXFollowUpRefreshActivityIdentifier),
                  row.refresh ? std::optional<Date>(at(*row.refresh)) : std::nullopt);
        EXPECT_EQ(tp.log->count("Unable to load devices info, defer"), row.devices ? 0 : 1);
    }
    // Every run asked its own agent, on the post's behalf, for fresh downloads.
    EXPECT_EQ(factory().agentCallers(),
              std::vector<std::string>(4, "com.velmora.qaxagent.followuppost"));
    for (const auto& request : agent->requests()) {
        EXPECT_EQ(request.policy, QAXWarrantyPolicyForceDownload);
        EXPECT_FALSE(request.updateFollowUps);
    }
    const auto& events =
        std::static_pointer_cast<test::RecordingAnalyticsSink>(tp.platform->analytics)->events();
    EXPECT_EQ(events.size(), 1u);
}

TEST_F(FollowUpActivitiesTest, PostRunIsReportedOnceWhicheverPathEndsIt) {
    struct Row {
        const char* what;
        bool shouldDefer;
        bool timerFirst;
        std::vector<std::int64_t> reported;
    };
    const Row rows[] = {
        {"deferral check first", true, true, {QAXActivityResultDeferred}},
        {"reply first", true, false, {QAXActivityResultFinished}},
        {"the platform does not ask to defer", false, true, {QAXActivityResultFinished}},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.what);
        tp.log->clear();
        platformActivity(kQAXFollowUpPostActivityIdentifier)->setShouldDefer(row.shouldDefer);
        agent->setInfos(infos({{"A", -10 * kDay, -kDay, 30 * kDay}}));
        agent->hold(true);
        auto activity = std::make_shared<QAXFollowUpPost>(tp.platform);
        activity->setDeferralCheckInterval(10);
        auto results = run(activity);
        EXPECT_TRUE(activity->followUpPostInProgress());
        if (row.timerFirst) {
            tp.runner->advanceBy(35);
        }
        EXPECT_EQ(agent->release(), 1u);
        tp.runner->advanceBy(35);
        EXPECT_EQ(*results, row.reported);
        EXPECT_EQ(tp.log->count("FollowUp Post activity deferred."),
                  row.reported[0] == QAXActivityResultDeferred ? 1 : 0);
        // The reply's work is done either way, and the run leaves nothing behind.
        EXPECT_EQ(items().size(), 1u);
        EXPECT_FALSE(activity->followUpPostInProgress());
        EXPECT_FALSE(activity->followUpPostTimer());
        agent->hold(false);
    }
}

TEST_F(FollowUpActivitiesTest, RefreshRunKeepsShownItemsCurrentAndChainsWhileAnyIsShown) {
    const auto shown = infos({{"A", -60 * kDay, -30 * kDay, 3 * kDay + 5 * kHour}});
    struct Row {
        const char* what;
        bool itemPending;
        std::optional<QAXDeviceInfoList> reply;  // none: no agent
        std::int64_t result;
        std::optional<double> next;
        const char* logged;
    };
    const Row rows[] = {
        {"a shown item is updated", true, shown, QAXActivityResultFinished, 5 * kHour,
         "Followup present, schedule refresh for "},
        {"nothing shown", false, shown, QAXActivityResultFinished, std::nullopt,
         "No followups present, don't schedule another refresh"},
        {"a device no longer known is cleared", true, QAXDeviceInfoList{},
         QAXActivityResultFinished, std::nullopt,
         "No followups present, don't schedule another refresh"},
        {"no device infos", true, std::nullopt, QAXActivityResultDeferred, std::nullopt,
         "Unable to load device info for followup refresh, defer"},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.what);
        tp.log->clear();
        prefs.removeObject(QAXScheduler::targetDateKey(kQAXFollowUpRefreshActivityIdentifier));
        if (row.itemPending) {
            QAXFollowUp(tp.platform).postFollowUpWithDeviceInfo(shown[0]);
        } else {
            QAXFollowUp(tp.platform).dismissFollowUpForSerialNumber(std::string("A"));
        }
        agent->setInfos(row.reply.value_or(QAXDeviceInfoList{}));
        factory().setAgent(row.reply ? agent : nullptr);

        auto results = run(std::make_shared<QAXFollowUpRefresh>(tp.platform));
        EXPECT_EQ(*results, std::vector<std::int64_t>{row.result});
        EXPECT_EQ(target(kQAXFollowUpRefreshActivityIdentifier),
                  row.next ? std::optional<Date>(at(*row.next)) : std::nullopt);
        EXPECT_EQ(tp.log->countContaining(row.logged), 1) << row.logged;
        EXPECT_EQ(items().size(), row.result == QAXActivityResultDeferred || row.next ? 1u : 0u);
    }
    for (const auto& request : agent->requests()) {
        EXPECT_EQ(request.policy, QAXWarrantyPolicyCachedOnly);
        EXPECT_FALSE(request.updateFollowUps);
    }
    EXPECT_EQ(factory().agentCallers().front(), "com.velmora.qaxagent.followuprefresh");
}

}  // namespace
}  // namespace qax
