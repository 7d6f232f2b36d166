// Outreach runs with fake downloads that complete on threads of their own: which devices count,
// the earliest follow-up date over all of them, the carrier check, the calling process of the
// downloads, and the deferral check that reports 2 while the downloads go on.
#include <gtest/gtest.h>

#include <chrono>
#include <random>
#include <thread>

#include "fakes/FakeAgentFactory.h"
#include "fakes/FakeBackgroundActivities.h"
#include "fakes/FixedDeviceProvider.h"
#include "fakes/TestPlatform.h"
#include "platform/TelephonyInfo.h"
#include "scheduling/QAXOutreachActivity.h"
#include "scheduling/QAXOutreachActivityUtilities.h"
#include "scheduling/QAXScheduler.h"
#include "warranty/QAXWarranty.h"

namespace qax {
namespace {

using Opt = std::optional<double>;
constexpr double kDay = 86400;
constexpr Opt none;

struct FixedTelephony : TelephonyInfo {
    std::vector<SubscriberCarrier> subscriberCarriers() override { return carriers; }
    std::vector<SubscriberCarrier> carriers;
};

// One device's download; dates in days from now. A failed download has no warranty.
struct Download {
    std::string serial;
    bool success = true;
    Opt display{};
    Opt until = 40;
    std::vector<std::string> toggle{};
    bool displayed = true;
};

class OutreachTest : public ::testing::Test {
  protected:
    OutreachTest() { tp.platform->telephony = telephony; }
    ~OutreachTest() override { joinThreads(); }

    std::optional<Date> at(Opt days) const {
        return days ? std::optional<Date>(tp.clock->now().byAdding(*days * kDay)) : std::nullopt;
    }
    std::shared_ptr<QAXWarranty> warranty(const Download& d) {
        Value::Array toggle(d.toggle.begin(), d.toggle.end());
        Value::Dictionary summary{
            {"featureToggleParameters", Value::Dictionary{{"hvOfferDisplay", d.displayed},
                                                          {"hvOfferDurationDaysBeforeEndDate", 30},
                                                          {"hvOfferToggle", Value(toggle)}}}};
        for (auto [key, days] : {std::pair{"hvOfferFollowupDisplayDate", d.display},
                                 std::pair{"hvOfferEligibleUntil", d.until}}) {
            if (days) {
                summary[key] = static_cast<std::int64_t>(at(days)->secondsSince1970());
            }
        }
        return QAXWarranty::initWithDictionary(tp.platform, Value(std::move(summary)));
    }
    // A run's utilities whose downloads answer on threads of their own after a short random
    // wait (while `holding`, only on release()).
    std::shared_ptr<QAXOutreachActivityUtilities> utilities(
        const std::vector<Download>& downloads) {
        auto devices = std::make_shared<test::FixedDeviceProvider>();
        devices->phone = nullptr;
        devices->watches.clear();
        for (const auto& d : downloads) {
            devices->watches[d.serial] =
                QAXDevice::deviceWithName(d.serial, d.serial, std::nullopt, QAXDeviceTypeWatch);
            answers[d.serial] = d.success ? warranty(d) : nullptr;
        }
        return std::make_shared<QAXOutreachActivityUtilities>(
            tp.platform, devices, [this](const std::string& caller) {
                callers.push_back(caller);
                return [this](const std::string& serial, QAXWarrantyDownloader::Completion done) {
                    std::lock_guard lock(mutex);
                    held.emplace_back(answers[serial], std::move(done));
                    if (!holding) {
                        releaseLocked();
                    }
                };
            });
    }
    void releaseLocked() {
        for (auto& entry : held) {
            threads.emplace_back([answer = entry.first, done = entry.second, wait = rng() % 300] {
                std::this_thread::sleep_for(std::chrono::microseconds(wait));
                done(answer != nullptr, answer);
            });
        }
        held.clear();
    }
    void release() {
        std::lock_guard lock(mutex);
        holding = false;
        releaseLocked();
    }
    void joinThreads() {
        std::vector<std::thread> running;
        {
            std::lock_guard lock(mutex);
            running.swap(threads);
        }
        for (auto& t : running) {
            t.join();
        }
    }
    // Starts a run; what it reports is collected in the returned list.
    std::shared_ptr<std::vector<std::int64_t>> start(
        const std::shared_ptr<QAXOutreachActivityUtilities>& utilities, bool conversion) {
        auto results = std::make_shared<std::vector<std::int64_t>>();
        utilities->performOutreachActivityForConversion(
            conversion,
            QAXScheduler::newSchedulerWithActivityDelegate(
                tp.platform, std::make_shared<QAXOutreachActivity>(tp.platform)),
            [results](std::int64_t r) { results->push_back(r); });
        return results;
    }
    // Lets every download thread finish, then runs the final step.
    void settle() {
        joinThreads();
        tp.runner->runUntilIdle();
    }
    std::vector<test::FakeAgentFactory::Scheduling> made() {
        return static_cast<test::FakeAgentFactory&>(*tp.platform->agentFactory).schedulings();
    }
    std::optional<Date> scheduledPost(std::size_t before) {
        const auto made = this->made();
        EXPECT_LE(made.size(), before + 1);
        if (made.size() == before) {
            return std::nullopt;
        }
        EXPECT_EQ(made.back().identifier, kQAXFollowUpPostActivityIdentifier);
        return made.back().date;
    }
    std::size_t schedulings() { return made().size(); }

    test::TestPlatform tp;
    std::shared_ptr<FixedTelephony> telephony = std::make_shared<FixedTelephony>();
    std::mutex mutex;
    bool holding = false;
    std::vector<std::pair<std::shared_ptr<QAXWarranty>, QAXWarrantyDownloader::Completion>> held;
    std::map<std::string, std::shared_ptr<QAXWarranty>> answers;
    std::vector<std::thread> threads;
    std::vector<std::string> callers;
    std::minstd_rand rng{7};
};

TEST_F(OutreachTest, SchedulesThePostForTheEarliestOfferAmongEligibleDevices) {
    struct Row {
        const char* what;
        std::vector<Download> downloads;
        Opt expected;
        const char* logged;
        bool conversion = false;
        std::vector<SubscriberCarrier> carriers = {{"208", "01"}, {"310", "260"}};
    };
    const std::optional<std::string> noCode;
    // clang-format off
    const Row rows[] = {
        {"no devices", {}, none, "Conversion: 0 -- No devices eligible for followUp posts"},
        {"the earlier of two display dates", {{"A", true, 10.0}, {"B", true, 3.0}}, 3.0,
         "Conversion: 0 -- Complete activity and schedule followUp post for: "},
        {"no display date: the end less the offer's duration", {{"A", true, none, 40.0}}, 10.0,
         "Warranty downloaded successfully"},
        {"a display date wins even when later", {{"A", true, 20.0, 40.0}}, 20.0,
         "Coverage check shows device should display HV offer, check on-device state"},
        {"failed downloads count for nothing", {{"A", false, 1.0}, {"B", true, 5.0}}, 5.0,
         "Warranty failed to download"},
        {"every download fails", {{"A", false, 1.0}, {"B", false}}, none,
         "Conversion: 1 -- No devices eligible for followUp posts", true},
        {"an offer not displayed", {{"A", true, 5.0, 40.0, {}, false}}, none,
         "Warranty shows device is ineligible, complete activity without scheduling followup"},
        {"a carrier that excludes the offer",
         {{"A", true, 5.0, 40.0, {"310260"}}, {"B", true, 8.0, 40.0, {"26201"}}}, 8.0,
         "Configuration does not support current device. Complete activity without scheduling "
         "followup", true},
        {"a carrier without a country code never matches",
         {{"A", true, 5.0, 40.0, {"260", "(null)260", "310260"}}}, 5.0,
         "No mobileCountryCode for networkInfo: ", false, {{noCode, "260"}}},
        {"no cellular subscription", {{"A", true, 5.0, 40.0, {"310260"}}}, 5.0,
         "Warranty downloaded successfully", false, {}},
    };
    // clang-format on
    for (const Row& row : rows) {
        SCOPED_TRACE(row.what);
        tp.log->clear();
        telephony->carriers = row.carriers;
        const auto before = schedulings();
        auto results = start(utilities(row.downloads), row.conversion);
        settle();
        EXPECT_EQ(*results, std::vector<std::int64_t>{QAXActivityResultFinished});
        EXPECT_EQ(scheduledPost(before), at(row.expected));
        EXPECT_EQ(tp.log->countContaining(row.logged), 1) << row.logged;
        // One downloader per run, named after the run's activity.
        EXPECT_EQ(callers.back(), row.conversion ? "com.velmora.qaxagent.conversionoutreach"
                                                 : "com.velmora.qaxagent.outreach");
    }

    // Many devices whose completions race on their threads: the earliest date still wins.
    telephony->carriers.clear();
    for (int round = 0; round < 25; ++round) {
        std::vector<Download> downloads;
        double earliest = 1e9;
        for (int i = 0; i < 24; ++i) {
            // A failed download's date (the earliest of all) must not count.
            const bool success = i % 7 != 3;
            const double display = success ? 2.0 + static_cast<double>(rng() % 5000) / 100 : 1.0;
            earliest = success ? std::min(earliest, display) : earliest;
            downloads.push_back({"D" + std::to_string(i), success, display, 90.0});
        }
        const auto before = schedulings();
        auto results = start(utilities(downloads), false);
        settle();
        EXPECT_EQ(*results, std::vector<std::int64_t>{QAXActivityResultFinished});
        EXPECT_EQ(scheduledPost(before), at(earliest)) << round;
    }
}

TEST_F(OutreachTest, DeferralReportsTwoAndTheDownloadsStillFinishTheRun) {
    for (bool defer : {true, false}) {
        SCOPED_TRACE(defer);
        tp.log->clear();
        std::static_pointer_cast<test::FakeBackgroundActivityScheduler>(tp.platform->activities)
            ->activity(kQAXOutreachActivityIdentifier)
            ->setShouldDefer(defer);
        holding = true;
        auto utilities = this->utilities({{"A", true, 4.0}, {"B", true, 6.0}});
        utilities->setDeferralCheckInterval(10);
        const auto expected = at(4.0);
        const auto before = schedulings();
        auto results = start(utilities, false);
        tp.runner->advanceBy(25);
        EXPECT_EQ(tp.log->count("Warranty download activity deferred. Conversion: 0"), defer);
        EXPECT_EQ(results->size(), defer ? 1u : 0u);
        release();
        settle();
        const std::vector<std::int64_t> reported =
            defer ? std::vector<std::int64_t>{2, 1} : std::vector<std::int64_t>{1};
        EXPECT_EQ(*results, reported);
        EXPECT_EQ(scheduledPost(before), expected);
        EXPECT_FALSE(utilities->outreachInProgress() || utilities->outReachTimer());
    }
}

}  // namespace
}  // namespace qax
