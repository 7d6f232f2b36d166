// The upgrade and boot activities: the first run ever, later runs by system version, and the
// boot's re-scheduling of pending work from the persisted target dates.
#include <gtest/gtest.h>

#include "fakes/FakeAccounts.h"
#include "fakes/FakeAgentFactory.h"
#include "fakes/FakeServices.h"
#include "fakes/TestPlatform.h"
#include "platform/PreferenceStore.h"
#include "scheduling/QAXPostBootActivity.h"
#include "scheduling/QAXPostUpgradeActivity.h"
#include "scheduling/QAXScheduler.h"

namespace qax {
namespace {

using Scheduling = test::FakeAgentFactory::Scheduling;

class UpgradeBootTest : public ::testing::Test {
  protected:
    UpgradeBootTest() { tp.platform->accounts = accounts; }

    test::FakeAgentFactory& factory() {
        return static_cast<test::FakeAgentFactory&>(*tp.platform->agentFactory);
    }
    std::vector<std::pair<std::string, std::optional<Date>>> schedulings() {
        std::vector<std::pair<std::string, std::optional<Date>>> out;
        for (const Scheduling& s : factory().schedulings()) {
            out.emplace_back(s.identifier, s.date);
        }
        return out;
    }
    std::int64_t run(QAXSchedulerActivityDelegate& activity) {
        std::int64_t result = 0;
        activity.performActivityForScheduler(nullptr, [&](std::int64_t r) { result = r; });
        return result;
    }
    void setTarget(const char* identifier, Date date) {
        prefs.setObject(QAXScheduler::targetDateKey(identifier), Value(date));
    }

    test::TestPlatform tp;
    PreferenceStore& prefs = *tp.platform->preferences;
    test::FakeDeviceProperties& device =
        static_cast<test::FakeDeviceProperties&>(*tp.platform->deviceProperties);
    std::shared_ptr<test::FakeAccountStore> accounts = std::make_shared<test::FakeAccountStore>();
};

TEST_F(UpgradeBootTest, FirstUpgradeRunSetsUpAndSchedulesTheFirstOutreach) {
    for (bool signedIn : {true, false}) {
        SCOPED_TRACE(signedIn);
        test::TestPlatform fresh;
        fresh.platform->accounts = std::make_shared<test::FakeAccountStore>();
        if (!signedIn) {
            std::static_pointer_cast<test::FakeAccountStore>(fresh.platform->accounts)->primary =
                nullptr;
        }
        PreferenceStore& p = *fresh.platform->preferences;
        for (const char* id : {kQAXOutreachActivityIdentifier, kQAXFollowUpPostActivityIdentifier,
                               "com.example.other"}) {
            p.setObject(QAXScheduler::targetDateKey(id), Value(Date(5)));
        }
        p.setObject("UnrelatedKey", Value(1));

        QAXPostUpgradeActivity activity(fresh.platform);
        std::int64_t result = 0;
        activity.performActivityForScheduler(nullptr, [&](std::int64_t r) { result = r; });

        EXPECT_EQ(result, QAXActivityResultFinished);
        for (const std::string& key : p.allKeys()) {
            EXPECT_EQ(key.find(".TargetDate"), std::string::npos) << key;
        }
        EXPECT_TRUE(p.objectForKey("UnrelatedKey"));
        EXPECT_EQ(p.dateForKey("DefaultDeviceActivationDate"), fresh.clock->now());
        EXPECT_TRUE(p.boolForKey("PostUpgradeActivityCompleted"));
        EXPECT_EQ(p.boolForKey("InitialOutreachActivityScheduled"), signedIn);
        EXPECT_EQ(p.stringForKey("PostUpgradeOSVersionKey"), "4.2");
        auto made =
            static_cast<test::FakeAgentFactory&>(*fresh.platform->agentFactory).schedulings();
        ASSERT_EQ(made.size(), signedIn ? 1u : 0u);
        if (signedIn) {
            EXPECT_EQ(made[0].identifier, kQAXOutreachActivityIdentifier);
            EXPECT_EQ(made[0].date, fresh.clock->now());
        }
        EXPECT_EQ(fresh.log->count("No primary account detected. Finishing post upgrade activity "
                                   "without scheduling outreach"),
                  signedIn ? 0 : 1);
    }
}

TEST_F(UpgradeBootTest, LaterUpgradeRunsForceOneConversionOutreachPerNewerVersion) {
    const std::optional<std::string> none;
    struct Row {
        const char* what;
        std::optional<std::string> stored;
        std::optional<std::string> current;
        bool outreachPending;
        bool forces;
        std::optional<std::string> storedAfter;
    };
    const Row rows[] = {
        {"4.9 to 4.10", "4.9", "4.10", false, true, "4.10"},
        {"4.9 to 4.10 with an outreach pending", "4.9", "4.10", true, false, "4.10"},
        {"same version", "4.10", "4.10", false, false, "4.10"},
        {"older version", "4.10", "4.9.9", false, false, "4.9.9"},
        {"no version seen before", none, "4.2", false, true, "4.2"},
        {"system version unavailable", "4.9", none, false, false, "4.9"},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.what);
        tp.log->clear();
        const auto before = factory().schedulings().size();
        prefs.setObject("PostUpgradeActivityCompleted", Value(true));
        row.stored ? prefs.setObject("PostUpgradeOSVersionKey", Value(*row.stored))
                   : prefs.removeObject("PostUpgradeOSVersionKey");
        row.outreachPending
            ? setTarget(kQAXOutreachActivityIdentifier, tp.clock->now().byAdding(600))
            : (void)prefs.removeObject(QAXScheduler::targetDateKey(kQAXOutreachActivityIdentifier));
        device.set("ProductVersion",
                   row.current ? std::optional<Value>(Value(*row.current)) : std::nullopt);

        QAXPostUpgradeActivity activity(tp.platform);
        EXPECT_EQ(run(activity), QAXActivityResultFinished);
        const auto made = factory().schedulings();
        ASSERT_EQ(made.size(), before + (row.forces ? 1 : 0));
        if (row.forces) {
            EXPECT_EQ(made.back().identifier, kQAXConversionOutreachActivityIdentifier);
            EXPECT_EQ(made.back().date, tp.clock->now());
        }
        EXPECT_EQ(tp.log->count("Forcing conversion outreach on upgrade"), row.forces ? 1 : 0);
        EXPECT_EQ(tp.log->count("post upgrade activity already performed"), row.forces ? 0 : 1);
        EXPECT_EQ(tp.log->count("Unable to get OS version"), row.current ? 0 : 1);
        EXPECT_EQ(prefs.stringForKey("PostUpgradeOSVersionKey"), row.storedAfter);
    }
}

TEST_F(UpgradeBootTest, BootRunReschedulesPendingWorkFromItsStoredDates) {
    const Date past = tp.clock->now().byAdding(-3600);
    const Date later = tp.clock->now().byAdding(7200);

    // Before the first upgrade run the boot does nothing.
    setTarget(kQAXOutreachActivityIdentifier, later);
    QAXPostBootActivity activity(tp.platform);
    EXPECT_EQ(run(activity), QAXActivityResultFinished);
    EXPECT_TRUE(
        tp.log->contains("post upgrade activity hasn't yet been performed, skip boot activity"));
    EXPECT_TRUE(schedulings().empty());

    prefs.setObject("PostUpgradeActivityCompleted", Value(true));
    setTarget(kQAXConversionOutreachActivityIdentifier, past);
    setTarget(kQAXFollowUpRefreshActivityIdentifier, later);
    setTarget(kQAXFollowUpPostActivityIdentifier, later);
    EXPECT_EQ(run(activity), QAXActivityResultFinished);
    const std::vector<std::pair<std::string, std::optional<Date>>> expected = {
        {kQAXOutreachActivityIdentifier, later},
        {kQAXConversionOutreachActivityIdentifier, past},
        {kQAXFollowUpRefreshActivityIdentifier, later},
    };
    EXPECT_EQ(schedulings(), expected);
    EXPECT_EQ(prefs.dateForKey("ConversionOutreachScheduledDate"), past);
    EXPECT_TRUE(tp.log->contains("Running post boot activity"));
    EXPECT_TRUE(
        tp.log->contains("'com.velmora.qaxagent.conversionoutreach' not complete, rescheduling"));

    // Nothing pending: nothing to re-schedule.
    for (const std::string& key : prefs.allKeys()) {
        prefs.removeObject(key);
    }
    prefs.setObject("PostUpgradeActivityCompleted", Value(true));
    EXPECT_EQ(run(activity), QAXActivityResultFinished);
    EXPECT_EQ(schedulings().size(), expected.size());
}

}  // namespace
}  // namespace qax
