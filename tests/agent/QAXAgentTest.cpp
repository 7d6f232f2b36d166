// The agent's rules over a provider of the test's making: the warranty policies, the
// all-devices join, serial-number substitutions, the start-up migration and account-added.
#include "agent/QAXAgent.h"

#include <gtest/gtest.h>

#include <thread>

#include "fakes/FakeAgentFactory.h"
#include "fakes/FakeWarrantyProvider.h"
#include "fakes/FixedDeviceProvider.h"
#include "fakes/TestPlatform.h"
#include "platform/PreferenceStore.h"
#include "platform/QAXSettings.h"
#include "scheduling/QAXSchedulerActivityDelegate.h"
#include "warranty/QAXWarranty.h"

namespace qax {
namespace {

using Cache = test::FakeWarrantyProvider::Cache;

class QAXAgentTest : public ::testing::Test {
  protected:
    QAXAgentTest() { qax_registerDefaults(*env.platform->preferences); }

    std::shared_ptr<QAXWarranty> warranty(const char* tag) {
        return QAXWarranty::warrantyWithDictionary(env.platform, Value::Dictionary{{"tag", tag}});
    }
    static std::string tagOf(const std::shared_ptr<QAXWarranty>& w) {
        if (!w) {
            return "none";
        }
        const Value* tag = w->dictionaryRepresentation().find("tag");
        return tag && tag->asString() ? *tag->asString() : "?";
    }
    std::vector<std::string> downloads() {
        std::vector<std::string> out;
        for (const auto& call : provider->calls()) {
            if (call.rfind("download ", 0) == 0) {
                out.push_back(call);
            }
        }
        return out;
    }
    test::FakeAgentFactory& factory() {
        return static_cast<test::FakeAgentFactory&>(*env.platform->agentFactory);
    }

    test::TestPlatform env;
    std::shared_ptr<test::FakeWarrantyProvider> provider =
        std::make_shared<test::FakeWarrantyProvider>();
    std::shared_ptr<test::FixedDeviceProvider> devices =
        std::make_shared<test::FixedDeviceProvider>();
    std::shared_ptr<QAXAgent> agent =
        QAXAgent::initWithWarrantyProvider(env.platform, provider, devices);
};

TEST_F(QAXAgentTest, PolicyDecisionTable) {
    enum State { Fresh, Expired, NoDate, Missing, OldVersion, OtherLocale, SignedOut, WeekOld };
    // clang-format off
    const std::tuple<State, std::uint64_t, bool, bool, const char*, const char*> rows[] = {
        {Fresh, 0, true, false, "cached", "warranty valid for 1.00 seconds"},
        {Expired, 0, true, true, "new", "warranty validity expired 0.00 seconds ago, refresh it"},
        {Expired, 0, false, true, "cached", nullptr},
        {NoDate, 0, false, true, "cached", "warranty validity expired, refresh it"},
        {Missing, 0, true, true, "new", "no cached warranty : S"},
        {Missing, 0, false, true, "none", nullptr},
        {OldVersion, 0, false, true, "none", "cached warranty is of outdated version '1', "
         "current version is '2', consider it invalid"},
        {OtherLocale, 0, false, true, "none",
         "cached warranty is for locale 'en_GB', system is now in 'en_US', consider it invalid"},
        {SignedOut, 0, false, true, "none", "user is signed out of Skyvault, cached warranty not allowed"},
        {Fresh, 1, true, false, "cached", nullptr},
        {WeekOld, 1, true, false, "cached", nullptr},
        {OldVersion, 1, true, false, "none", nullptr},
        {OtherLocale, 1, true, false, "none", nullptr},
        {SignedOut, 1, true, false, "none", nullptr},
        {Fresh, 2, true, true, "new", nullptr},
        {Fresh, 2, false, true, "none", nullptr},
        {SignedOut, 2, true, true, "new", nullptr},
        {WeekOld, 5, true, false, "cached", nullptr},
        {Missing, 5, true, false, "none", nullptr},
        {SignedOut, 5, true, false, "none", nullptr},
    };
    // clang-format on
    const Date now = env.clock->now();
    for (const auto& [state, policy, downloadGives, downloaded, reply, message] : rows) {
        SCOPED_TRACE("state " + std::to_string(state) + ", policy " + std::to_string(policy));
        provider = std::make_shared<test::FakeWarrantyProvider>();
        agent->setWarrantyProvider(provider);
        Cache cache{warranty("cached"), "2", "en_US", now.byAdding(-86399)};
        switch (state) {
            case Fresh:
                break;
            case Expired:
                cache.lastUpdated = now.byAdding(-86400);
                break;
            case WeekOld:
                cache.lastUpdated = now.byAdding(-7 * 86400);
                break;
            case NoDate:
                cache.lastUpdated.reset();
                break;
            case Missing:
                cache = Cache{};
                break;
            case OldVersion:
                cache.version = "1";
                break;
            case OtherLocale:
                cache.locale = "en_GB";
                break;
            case SignedOut:
                provider->signedIn = false;
                break;
        }
        provider->setCache("S", cache);
        provider->setDownloadResult("S", downloadGives ? warranty("new") : nullptr);
        env.log->clear();
        // The evaluation alone acts on nothing; what it would answer without a download is
        // the reply whenever no new warranty comes.
        const auto evaluation = QAXAgent::evaluateWarrantyPolicy(
            *env.platform, *provider, static_cast<QAXWarrantyPolicy>(policy), "S");
        EXPECT_TRUE(provider->calls().empty());
        if (std::string(reply) != "new") {
            EXPECT_EQ(evaluation.answerWithoutDownload() != nullptr,
                      std::string(reply) == "cached");
        }

        int replies = 0;
        std::string got;
        agent->getWarrantyUsingPolicy(static_cast<QAXWarrantyPolicy>(policy), "S",
                                      [&](std::shared_ptr<QAXWarranty> w) {
                                          ++replies;
                                          got = tagOf(w);
                                      });
        EXPECT_EQ(replies, 1);
        EXPECT_EQ(got, reply);
        EXPECT_EQ(downloads().size(), downloaded ? 1u : 0u);
        if (message) {
            EXPECT_EQ(env.log->count(message), 1);
        }
    }
}

TEST_F(QAXAgentTest, AllDevicesJoinWaitsForOverlappingCallsOnOneAgent) {
    provider->setDownloadResult("W1", warranty("w1"));
    provider->holdDownloads(true);
    std::vector<std::vector<std::shared_ptr<QAXDeviceInfo>>> first, second;
    agent->getAllDeviceInfosUsingPolicy(QAXWarrantyPolicyForceDownload, true,
                                        [&](auto infos) { first.push_back(infos); });
    agent->getAllDeviceInfosUsingPolicy(QAXWarrantyPolicyForceDownload, false,
                                        [&](auto infos) { second.push_back(infos); });
    env.runner->runUntilIdle();
    ASSERT_EQ(provider->heldDownloads(), 6u);
    EXPECT_TRUE(first.empty() && second.empty());

    // The first call's own answers are not enough: the counter is the agent's.
    EXPECT_EQ(provider->releaseDownloads(3), 3u);
    env.runner->runUntilIdle();
    EXPECT_TRUE(first.empty() && second.empty());

    // The rest come from several threads at once, as download completions do.
    std::vector<std::thread> threads;
    for (int i = 0; i < 3; ++i) {
        threads.emplace_back([this] { provider->releaseDownloads(1); });
    }
    for (auto& t : threads) {
        t.join();
    }
    env.runner->runUntilIdle();
    ASSERT_EQ(first.size(), 1u);
    ASSERT_EQ(second.size(), 1u);
    for (const auto& infos : {first[0], second[0]}) {
        std::map<std::string, std::string> bySerial;
        for (const auto& info : infos) {
            bySerial[*info->device()->serialNumber()] = tagOf(info->warranty());
        }
        EXPECT_EQ(bySerial, (std::map<std::string, std::string>{
                                {"PHONE1", "none"}, {"W1", "w1"}, {"W2", "none"}}));
    }
    // Only the call that asked refreshes the follow-ups, with its own answers.
    auto refreshed = provider->refreshedLists();
    ASSERT_EQ(refreshed.size(), 1u);
    EXPECT_EQ(refreshed[0], first[0]);

    // Nothing outstanding: an empty array, still on the policy queue.
    devices->phone = nullptr;
    devices->watches.clear();
    agent->getAllDeviceInfosUsingPolicy(QAXWarrantyPolicyDefault, true,
                                        [&](auto infos) { first.push_back(infos); });
    EXPECT_EQ(first.size(), 1u);
    env.runner->runUntilIdle();
    ASSERT_EQ(first.size(), 2u);
    EXPECT_TRUE(first[1].empty());
}

TEST_F(QAXAgentTest, SerialNumberSubstitutionsWatchesWinOverAccessories) {
    env.platform->preferences->setObject("PairedWatchesSerialNumbers",
                                         Value::Dictionary{{"X", "W1"}, {"Q", "Q2"}});
    env.platform->preferences->setObject("PairedBluetoothDevicesSerialNumbers",
                                         Value::Dictionary{{"X", "ACC"}, {"A", "B"}, {"N", 7}});
    provider->setDownloadResult("W1", warranty("w1"));
    const std::tuple<const char*, const char*, const char*, QAXDeviceType> rows[] = {
        {"X", "W1", "One", QAXDeviceTypeWatch},
        {"A", "B", "<unknown>", QAXDeviceTypeOther},
        {"N", "N", "<unknown>", QAXDeviceTypeOther},
        {"PHONE1", "PHONE1", "Default Device", QAXDeviceTypeDefault},
    };
    for (const auto& [asked, evaluated, name, type] : rows) {
        SCOPED_TRACE(asked);
        std::shared_ptr<QAXDeviceInfo> info;
        agent->getDeviceInfoForSerialNumber(asked, QAXWarrantyPolicyForceDownload,
                                            [&](auto i) { info = i; });
        ASSERT_TRUE(info);
        EXPECT_EQ(info->device()->serialNumber(), evaluated);
        EXPECT_EQ(info->device()->name(), name);
        EXPECT_EQ(info->device()->deviceType(), type);
        if (type == QAXDeviceTypeOther) {
            EXPECT_FALSE(info->device()->activationDate());
        }
        EXPECT_EQ(downloads().back(), std::string("download ") + evaluated);
        EXPECT_EQ(provider->calls().back(), std::string("refreshOne ") + evaluated);
    }
}

TEST_F(QAXAgentTest, MigrationRunsOnceBeforeVersionTwo) {
    const std::vector<std::string> migrates = {
        "migrateWarranty PHONE1", "migrateFollowUp PHONE1 with warranty", "setMigrationVersion 2"};
    const std::pair<std::int32_t, std::vector<std::string>> rows[] = {
        {0, migrates}, {1, migrates}, {2, {}}, {3, {}}};
    for (const auto& [stored, calls] : rows) {
        SCOPED_TRACE(stored);
        provider = std::make_shared<test::FakeWarrantyProvider>();
        provider->legacyWarranty = warranty("legacy");
        provider->storedMigrationVersion = stored;
        agent->setWarrantyProvider(provider);
        agent->performMigrationIfNeeded();
        EXPECT_EQ(provider->calls(), calls);
        agent->performMigrationIfNeeded();  // a second start-up finds version 2
        EXPECT_EQ(provider->calls(), calls);
    }
}

TEST_F(QAXAgentTest, AccountAddedSchedulesOutreachOnceThenDownloadsAfterTheDelay) {
    PreferenceStore& prefs = *env.platform->preferences;
    std::vector<bool> replies;
    auto reply = [&](bool b) { replies.push_back(b); };

    agent->velmoraAccountAdded(reply);
    EXPECT_EQ(replies, std::vector<bool>{false});
    EXPECT_TRUE(factory().schedulings().empty());

    prefs.setObject("PostUpgradeActivityCompleted", true);
    const Date now = env.clock->now();
    agent->velmoraAccountAdded(reply);
    EXPECT_EQ(replies, (std::vector<bool>{false, true}));
    ASSERT_EQ(factory().schedulings().size(), 1u);
    EXPECT_EQ(factory().schedulings()[0].identifier, kQAXOutreachActivityIdentifier);
    EXPECT_EQ(factory().schedulings()[0].date, now.byAdding(3600));
    EXPECT_TRUE(prefs.boolForKey("InitialOutreachActivityScheduled"));

    agent->velmoraAccountAdded(reply);
    env.runner->advanceBy(3599);
    EXPECT_EQ(replies.size(), 2u);
    EXPECT_TRUE(downloads().empty());
    env.runner->advanceBy(1);
    EXPECT_EQ(replies, (std::vector<bool>{false, true, true}));
    EXPECT_EQ(downloads().size(), 3u);
    EXPECT_EQ(factory().schedulings().size(), 1u);
    // The follow-ups are left alone by this download.
    EXPECT_TRUE(provider->refreshedLists().empty());
}

}  // namespace
}  // namespace qax
