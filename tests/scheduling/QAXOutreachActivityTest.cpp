// Outreach runs with fake downloads that complete on their own threads: which devices count,
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
#include "scheduling/QAXOutreachActivityUtilities.h"
#include "scheduling/QAXScheduler.h"
#include "warranty/QAXWarranty.h"

namespace qax {
namespace {

constexpr double kDay = 86400;

class FixedTelephony : public TelephonyInfo {
  public:
    std::vector<SubscriberCarrier> subscriberCarriers() override { return carriers; }
    std::vector<SubscriberCarrier> carriers;
};

// One device's download as a test describes it; offsets are days from now.
struct Download {
    std::string serial;
    bool success = true;
    bool displayed = true;
    std::optional<double> display{};
    std::optional<double> until = 40;
    std::vector<std::string> toggle{};
};

class OutreachTest : public ::testing::Test {
  protected:
    OutreachTest() { tp.platform->telephony = telephony; }
    ~OutreachTest() override { joinThreads(); }

    test::FakeAgentFactory& factory() {
        return static_cast<test::FakeAgentFactory&>(*tp.platform->agentFactory);
    }
    Date at(double days) const { return tp.clock->now().byAdding(days * kDay); }

    std::shared_ptr<QAXWarranty> warranty(const Download& d) {
        Value::Array toggle;
        for (const auto& t : d.toggle) {
            toggle.push_back(Value(t));
        }
        Value::Dictionary summary{
            {"featureToggleParameters",
             Value(Value::Dictionary{{"hvOfferDisplay", d.displayed},
                                     {"hvOfferDurationDaysBeforeEndDate", 30},
                                     {"hvOfferToggle", Value(std::move(toggle))}})}};
        auto epoch = [&](double days) {
            return Value(static_cast<std::int64_t>(at(days).secondsSince1970()));
        };
        if (d.display) {
            summary["hvOfferFollowupDisplayDate"] = epoch(*d.display);
        }
        if (d.until) {
            summary["hvOfferEligibleUntil"] = epoch(*d.until);
        }
        return QAXWarranty::initWithDictionary(tp.platform, Value(std::move(summary)));
    }

    // Utilities whose downloads answer `downloads` each on a thread of its own after a short
    // random wait, or, while `held`, only when released.
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
                return [this](const std::string& serial,
                              QAXWarrantyDownloader::Completion completion) {
                    std::lock_guard lock(mutex);
                    held.emplace_back(serial, std::move(completion));
                    if (!holding) {
                        releaseLocked();
                    }
                };
            });
    }
    void releaseLocked() {
        for (auto& [serial, completion] : held) {
            auto answer = answers[serial];
            const int waitMicros = static_cast<int>(rng() % 300);
            threads.emplace_back([answer, waitMicros, completion = std::move(completion)] {
                std::this_thread::sleep_for(std::chrono::microseconds(waitMicros));
                completion(answer != nullptr, answer);
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
    // Starts a run; the completions' results are collected in the returned list.
    std::shared_ptr<std::vector<std::int64_t>> start(
        const std::shared_ptr<QAXOutreachActivityUtilities>& utilities, bool conversion) {
        auto results = std::make_shared<std::vector<std::int64_t>>();
        auto scheduler = QAXScheduler::newSchedulerWithActivityDelegate(
            tp.platform, std::make_shared<FakeActivity>());
        utilities->performOutreachActivityForConversion(
            conversion, scheduler, [results](std::int64_t r) { results->push_back(r); });
        return results;
    }
    // Lets every download thread finish, then runs the final step.
    void settle() {
        joinThreads();
        tp.runner->runUntilIdle();
    }

    struct FakeActivity : QAXSchedulerActivityDelegate {
        std::string identifier() const override { return kQAXOutreachActivityIdentifier; }
        bool requiresNetwork() const override { return true; }
        void performActivityForScheduler(const std::shared_ptr<QAXScheduler>&,
                                         Completion) override {}
    };

    test::TestPlatform tp;
    std::shared_ptr<FixedTelephony> telephony = std::make_shared<FixedTelephony>();
    std::mutex mutex;
    bool holding = false;
    std::vector<std::pair<std::string, QAXWarrantyDownloader::Completion>> held;
    std::map<std::string, std::shared_ptr<QAXWarranty>> answers;
    std::vector<std::thread> threads;
    std::vector<std::string> callers;
    std::minstd_rand rng{7};
};

TEST_F(OutreachTest, SchedulesThePostForTheEarliestOfferAmongEligibleDevices) {
    const std::optional<double> none;
    struct Row {
        const char* what;
        std::vector<Download> downloads;
        std::optional<double> expected;
        const char* logged;
    };
    const Row rows[] = {
        {"no devices", {}, none, "Conversion: 0 -- No devices eligible for followUp posts"},
        {"the earlier of two display dates",
         {{"A", true, true, 10.0}, {"B", true, true, 3.0}},
         3.0,
         "Conversion: 0 -- Complete activity and schedule followUp post for: "},
        {"without a display date: the end less the offer's duration",
         {{"A", true, true, none, 40.0}},
         10.0,
         "Warranty downloaded successfully"},
        {"a display date wins even when later",
         {{"A", true, true, 20.0, 40.0}},
         20.0,
         "Coverage check shows device should display HV offer, check on-device state"},
        {"failed downloads count for nothing",
         {{"A", false}, {"B", false}, {"C", true, true, 5.0}},
         5.0,
         "Warranty failed to download"},
        {"every download fails",
         {{"A", false}, {"B", false}},
         none,
         "Conversion: 0 -- No devices eligible for followUp posts"},
        {"an offer not displayed",
         {{"A", true, false, 5.0}},
         none,
         "Warranty shows device is ineligible, complete activity without scheduling followup"},
        {"a carrier that excludes the offer",
         {{"A", true, true, 5.0, 40.0, {"310260"}}, {"B", true, true, 8.0, 40.0, {"26201"}}},
         8.0,
         "Configuration does not support current device. Complete activity without scheduling "
         "followup"},
    };
    telephony->carriers = {{"310", "260"}};
    for (const Row& row : rows) {
        SCOPED_TRACE(row.what);
        tp.log->clear();
        const auto before = factory().schedulings().size();
        auto results = start(utilities(row.downloads), false);
        settle();
        EXPECT_EQ(*results, std::vector<std::int64_t>{QAXActivityResultFinished});
        const auto schedulings = factory().schedulings();
        ASSERT_EQ(schedulings.size(), before + (row.expected ? 1 : 0));
        if (row.expected) {
            EXPECT_EQ(schedulings.back().identifier, kQAXFollowUpPostActivityIdentifier);
            EXPECT_EQ(schedulings.back().date, at(*row.expected));
        }
        EXPECT_GE(tp.log->countContaining(row.logged), 1) << row.logged;
    }
}

TEST_F(OutreachTest, CompletionsOnManyThreadsKeepTheEarliestDate) {
    for (int round = 0; round < 25; ++round) {
        SCOPED_TRACE(round);
        std::vector<Download> downloads;
        double earliest = 1e9;
        for (int i = 0; i < 24; ++i) {
            const bool success = i % 7 != 3;
            // A failed download's date must not count, so it would be the earliest.
            const double display = success ? 2.0 + static_cast<double>(rng() % 5000) / 100 : 1.0;
            if (success) {
                earliest = std::min(earliest, display);
            }
            downloads.push_back({"D" + std::to_string(i), success, true, display, 90.0});
        }
        auto results = start(utilities(downloads), round % 2 == 1);
        settle();
        EXPECT_EQ(*results, std::vector<std::int64_t>{QAXActivityResultFinished});
        ASSERT_FALSE(factory().schedulings().empty());
        EXPECT_EQ(factory().schedulings().back().date, at(earliest));
        EXPECT_EQ(tp.log->count("serialNumber: D0 success: 1 -- Conversion: " +
                                std::to_string(round % 2)),
                  1);
        tp.log->clear();
    }
    // One downloader per run, named after the run's activity.
    ASSERT_EQ(callers.size(), 25u);
    EXPECT_EQ(callers[0], "com.velmora.qaxagent.outreach");
    EXPECT_EQ(callers[1], "com.velmora.qaxagent.conversionoutreach");
}

TEST_F(OutreachTest, CarrierCheck) {
    using Carriers = std::vector<SubscriberCarrier>;
    const std::optional<std::string> none;
    struct Row {
        const char* what;
        Carriers carriers;
        std::vector<std::string> toggle;
        bool expected;
        int missingCountryErrors;
    };
    const Row rows[] = {
        {"no subscription", {}, {"310260"}, true, 0},
        {"listed carrier", {{"310", "260"}}, {"310260"}, false, 0},
        {"second subscription listed", {{"208", "01"}, {"310", "260"}}, {"310260"}, false, 0},
        {"carrier not listed", {{"310", "410"}}, {"310260", "410"}, true, 0},
        {"no country code never matches", {{none, "260"}}, {"260", "(null)260"}, true, 1},
        {"empty list", {{"310", "260"}}, {}, true, 0},
    };
    auto utilities = std::make_shared<QAXOutreachActivityUtilities>(tp.platform);
    for (const Row& row : rows) {
        SCOPED_TRACE(row.what);
        tp.log->clear();
        telephony->carriers = row.carriers;
        Download d{"A"};
        d.toggle = row.toggle;
        EXPECT_EQ(utilities->currentDeviceShouldReceiveOutreachForWarranty(*warranty(d)),
                  row.expected);
        EXPECT_EQ(tp.log->countContaining("No mobileCountryCode for networkInfo: "),
                  row.missingCountryErrors);
        EXPECT_EQ(tp.log->count("carrier matched"), row.expected ? 0 : 1);
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
        auto utilities = this->utilities({{"A", true, true, 4.0}, {"B", true, true, 6.0}});
        utilities->setDeferralCheckInterval(10);
        const Date expected = at(4.0);
        auto results = start(utilities, false);
        tp.runner->advanceBy(25);
        EXPECT_EQ(tp.log->count("Warranty download activity deferred. Conversion: 0"),
                  defer ? 1 : 0);
        EXPECT_EQ(*results, defer ? std::vector<std::int64_t>{QAXActivityResultDeferred}
                                  : std::vector<std::int64_t>{});
        release();
        settle();
        EXPECT_EQ(results->back(), QAXActivityResultFinished);
        EXPECT_EQ(results->size(), defer ? 2u : 1u);
        EXPECT_EQ(factory().schedulings().back().date, expected);
        EXPECT_FALSE(utilities->outreachInProgress());
        EXPECT_FALSE(utilities->outReachTimer());
    }
}

}  // namespace
}  // namespace qax
