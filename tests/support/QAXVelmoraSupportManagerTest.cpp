// The support-application row: installed, purchased, in the store, forced; listing texts and
// links; a purchase history that answers too late.
#include "support/QAXVelmoraSupportManager.h"

#include <gtest/gtest.h>

#include "fakes/FakeAccounts.h"
#include "fakes/FakeSupportServices.h"
#include "fakes/FakeUserInterfaceStrings.h"
#include "fakes/TestPlatform.h"
#include "platform/PreferenceStore.h"

namespace qax {
namespace {

constexpr const char* kApp = "com.velmora.support";
const std::string kCampaign = "?pt=2003&ct=coverage.settings&mt=8";

struct Env {
    Env() {
        tp.platform->applications = apps;
        tp.platform->store = store;
        tp.platform->purchases = purchases;
        tp.platform->accounts = accounts;
        static_cast<test::FakeUserInterfaceStrings&>(*tp.platform->uiStrings)
            .set("INSTALLED", "Installée");
        apps->records.push_back({kApp, "/apps/support", "Support App", "Velmora", false, {}});
    }
    std::string answer(double purchaseWait = 5) {
        std::string got = "no reply";
        QAXVelmoraSupportManager(tp.platform, purchaseWait)
            .appSupportAvailability(kApp,
                                    [&](Value::Dictionary d) { got = Value(d).description(); });
        return got;
    }
    test::TestPlatform tp;
    std::shared_ptr<test::FakeApplicationRegistry> apps =
        std::make_shared<test::FakeApplicationRegistry>();
    std::shared_ptr<test::FakeStoreLookup> store = std::make_shared<test::FakeStoreLookup>();
    std::shared_ptr<test::FakePurchaseHistory> purchases =
        std::make_shared<test::FakePurchaseHistory>();
    std::shared_ptr<test::FakeAccountStore> accounts = std::make_shared<test::FakeAccountStore>();
};

std::string dict(Value::Dictionary d) {
    d["AppBundleID"] = kApp;
    return Value(d).description();
}

TEST(QAXVelmoraSupportManagerTest, InstalledThenPurchasedThenStore) {
    const StoreItem listing{
        kApp, "Support", "Velmora Inc.", {"https://img/1", "https://img/2"}, "https://store/app"};
    const PurchaseRecord other{"com.other", "Other", "X", "https://o"};
    struct Row {
        const char* name;
        std::function<void(Env&)> setUp;
        std::string expected;
        int purchaseQueries, lookups;
    };
    // The answer with its keys in the order of the columns below; "-" leaves a key out.
    auto answer = [](const std::string& link, const std::string& icon, const std::string& title,
                     const std::string& vendor, const std::string& text, int type) {
        Value::Dictionary d{{"AppAvailabilityType", type}};
        const std::pair<const char*, const std::string*> keys[] = {{"AppLinkURL", &link},
                                                                   {"AppIconURL", &icon},
                                                                   {"AppTitleKey", &title},
                                                                   {"AppVendorName", &vendor},
                                                                   {"AppAvailablityText", &text}};
        for (const auto& [key, value] : keys) {
            if (*value != "-") {
                d[key] = *value;
            }
        }
        return dict(d);
    };
    const std::string store = "Free – On the Marketa";
    // clang-format off
    const Row rows[] = {
        {"installed", [](Env& e) { e.apps->records[0].installed = true; },
         answer("-", "-", "Support App", "Velmora", "Installée", 1), 0, 0},
        {"purchased", [&](Env& e) {
             e.purchases->records = {other, {kApp, "Support", "Velmora Inc.", "https://store/p"}}; },
         answer("https://store/p" + kCampaign, "-", "Support", "Velmora Inc.", "DOWNLOAD", 2), 1, 0},
        {"purchase without texts", [](Env& e) { e.purchases->records = {{kApp, {}, {}, {}}}; },
         answer("", "-", "== Velmora Support ==", "== Velmora ==", "DOWNLOAD", 2), 1, 0},
        {"in the store", [&](Env& e) { e.purchases->records = {other}; e.store->items = {listing}; },
         answer("https://store/app" + kCampaign, "https://img/1", "Support", "Velmora Inc.", store, 3),
         1, 1},
        {"listing without URLs or names", [](Env& e) { e.store->items = {{kApp, {}, {}, {}, ""}}; },
         answer("", "", "", "", store, 3), 1, 1},
        {"two store items", [&](Env& e) { e.store->items = {listing, listing}; },
         dict({{"AppAvailabilityType", 0}}), 1, 1},
        {"store error", [&](Env& e) { e.store->items = {listing}; e.store->error = "offline"; },
         dict({}), 1, 1},
        {"no store result", [](Env&) {}, dict({}), 1, 1},
        {"forced", [](Env& e) { e.tp.platform->preferences->setObject("AppSupportAvailability", true); },
         answer("-", "-", "Velmora Support", "Velmora", "OVERRIDE", 1), 1, 0},
    };
    // clang-format on
    for (const auto& row : rows) {
        SCOPED_TRACE(row.name);
        Env env;
        row.setUp(env);
        EXPECT_EQ(env.answer(), row.expected);
        EXPECT_EQ(env.purchases->queries.size(), static_cast<std::size_t>(row.purchaseQueries));
        EXPECT_EQ(env.store->lookups, row.lookups);
        if (row.purchaseQueries) {
            EXPECT_EQ(env.purchases->queries[0],
                      std::make_pair(std::int64_t{12345}, std::vector<std::string>{kApp}));
        }
    }
}

TEST(QAXVelmoraSupportManagerTest, NoAccountAndLatePurchaseAnswersCountAsNotPurchased) {
    Env env;
    env.accounts->primary = nullptr;
    env.purchases->records = {{kApp, "Support", "Velmora Inc.", "https://store/p"}};
    env.purchases->hold = true;
    EXPECT_EQ(env.answer(0.05), dict({}));  // the store, asked next, has nothing
    EXPECT_EQ(env.purchases->queries.at(0).first, 0);
    env.purchases->releaseHeld();  // too late, and harmless
    EXPECT_TRUE(env.tp.log->contains(
        "Lookup for com.velmora.support in the Marketa failed with error (null)"));
}

}  // namespace
}  // namespace qax
