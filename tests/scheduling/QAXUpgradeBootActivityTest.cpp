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

using Schedulings = std::vector<std::pair<std::string, std::optional<Date>>>;

class UpgradeBootTest : public ::testing::Test {
  protected:
    UpgradeBootTest() { tp.platform->accounts = accounts; }

    Schedulings schedulings() {
        Schedulings out;
        for (const auto& s :
             static_cast<test::FakeAgentFactory&>(*tp.platform->agentFactory).schedulings()) {
            out.emplace_back(s.identifier, s.date);
        }
        return out;
    }
    std::int64_t run(QAXSchedulerActivityDelegate&& activity) {
        std::int64_t result = 0;
        activity.performActivityForScheduler(nullptr, [&](std::int64_t r) { result = r; });
        return result;
    }
    void setTarget(const std::string& identifier, std::optional<Date> date) {
        const auto key = QAXScheduler::targetDateKey(identifier);
        date ? prefs.setObject(key, Value(*date)) : prefs.removeObject(key);
    }

    test::TestPlatform tp;
    PreferenceStore& prefs = *tp.platform->preferences;
    std::shared_ptr<test::FakeAccountStore> accounts = std::make_shared<test::FakeAccountStore>();
    const Date now = tp.clock->now();
};

TEST_F(UpgradeBootTest, UpgradeRuns) {
    const std::optional<std::string> none;
    struct Row {
        const char* what;
        bool firstRun, signedIn;
        std::optional<std::string> stored, current;
        bool outreachPending;
        Schedulings scheduled;
        const char* logged;
        std::optional<std::string> storedAfter;
    };
    const char* kOutreach = kQAXOutreachActivityIdentifier;
    const char* kConversion = kQAXConversionOutreachActivityIdentifier;
    const char* kPerformed = "post upgrade activity already performed";
    // clang-format off
    const Row rows[] = {
        {"first run, signed in", true, true, none, "4.2", true, {{kOutreach, now}},
         "post upgrade activity hasn't yet been performed, perform upgrade activity", "4.2"},
        {"first run, nobody signed in", true, false, none, "4.2", false, {},
         "No primary account detected. Finishing post upgrade activity without scheduling outreach",
         "4.2"},
        {"4.9 to 4.10", false, true, "4.9", "4.10", false, {{kConversion, now}},
         "Forcing conversion outreach on upgrade", "4.10"},
        {"4.9 to 4.10, an outreach pending", false, true, "4.9", "4.10", true, {}, kPerformed,
         "4.10"},
        {"same version", false, true, "4.10", "4.10", false, {}, kPerformed, "4.10"},
        {"older version", false, true, "4.10", "4.9.9", false, {}, kPerformed, "4.9.9"},
        {"no version seen before", false, true, none, "4.2", false, {{kConversion, now}},
         "Forcing conversion outreach on upgrade", "4.2"},
        {"system version unavailable", false, true, "4.9", none, false, {},
         "Unable to get OS version", "4.9"},
    };
    // clang-format on
    for (const Row& row : rows) {
        SCOPED_TRACE(row.what);
        test::TestPlatform fresh;
        tp.platform = fresh.platform;
        accounts->primary = row.signedIn ? std::make_shared<Account>() : nullptr;
        fresh.platform->accounts = accounts;
        PreferenceStore& p = *fresh.platform->preferences;
        p.setObject("PostUpgradeActivityCompleted", Value(!row.firstRun));
        row.stored ? p.setObject("PostUpgradeOSVersionKey", Value(*row.stored))
                   : p.removeObject("PostUpgradeOSVersionKey");
        static_cast<test::FakeDeviceProperties&>(*fresh.platform->deviceProperties)
            .set("ProductVersion", row.current ? std::optional(Value(*row.current)) : std::nullopt);
        for (const char* id : {kOutreach, "com.example.other"}) {
            p.setObject(QAXScheduler::targetDateKey(id), Value(now.byAdding(600)));
        }
        if (!row.outreachPending) {
            p.removeObject(QAXScheduler::targetDateKey(kOutreach));
        }

        EXPECT_EQ(run(QAXPostUpgradeActivity(fresh.platform)), QAXActivityResultFinished);
        EXPECT_EQ(schedulings(), row.scheduled);
        EXPECT_EQ(fresh.log->count(row.logged), 1) << row.logged;
        EXPECT_EQ(p.stringForKey("PostUpgradeOSVersionKey"), row.storedAfter);
        EXPECT_TRUE(p.boolForKey("PostUpgradeActivityCompleted"));
        if (row.firstRun) {
            // Every target date went; the device's activation date is now.
            for (const std::string& key : p.allKeys()) {
                EXPECT_EQ(key.find(".TargetDate"), std::string::npos) << key;
            }
            EXPECT_EQ(p.dateForKey("DefaultDeviceActivationDate"), now);
            EXPECT_EQ(p.boolForKey("InitialOutreachActivityScheduled"), row.signedIn);
        }
    }
}

TEST_F(UpgradeBootTest, BootRunReschedulesPendingWorkFromItsStoredDates) {
    const Date past = now.byAdding(-3600), later = now.byAdding(7200);
    setTarget(kQAXOutreachActivityIdentifier, later);
    setTarget(kQAXConversionOutreachActivityIdentifier, past);
    setTarget(kQAXFollowUpRefreshActivityIdentifier, later);
    setTarget(kQAXFollowUpPostActivityIdentifier, later);

    // Before the first upgrade run the boot does nothing.
    EXPECT_EQ(run(QAXPostBootActivity(tp.platform)), QAXActivityResultFinished);
    EXPECT_TRUE(schedulings().empty());

    // After it: outreach, conversion outreach and refresh again for their dates; the post is
    // left alone.
    prefs.setObject("PostUpgradeActivityCompleted", Value(true));
    EXPECT_EQ(run(QAXPostBootActivity(tp.platform)), QAXActivityResultFinished);
    const Schedulings expected = {{kQAXOutreachActivityIdentifier, later},
                                  {kQAXConversionOutreachActivityIdentifier, past},
                                  {kQAXFollowUpRefreshActivityIdentifier, later}};
    EXPECT_EQ(schedulings(), expected);
    EXPECT_EQ(prefs.dateForKey("ConversionOutreachScheduledDate"), past);

    // Nothing pending, nothing re-scheduled.
    for (const char* id : {kQAXOutreachActivityIdentifier, kQAXConversionOutreachActivityIdentifier,
                           kQAXFollowUpRefreshActivityIdentifier}) {
        setTarget(id, std::nullopt);
    }
    EXPECT_EQ(run(QAXPostBootActivity(tp.platform)), QAXActivityResultFinished);
    EXPECT_EQ(schedulings().size(), expected.size());
}

}  // namespace
}  // namespace qax
