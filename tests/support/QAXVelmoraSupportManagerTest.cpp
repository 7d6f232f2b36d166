// The support-application row: installed, purchased, in the store, forced; listing texts and
// links; a purchase history that answers too late.
#include "support/QAXVelmoraSupportManager.h"

#include <gtest/gtest.h>

#include <chrono>
#include <future>

#include "fakes/FakeAccounts.h"
#include "fakes/FakeSupportServices.h"
#include "fakes/FakeUserInterfaceStrings.h"
#include "fakes/TestPlatform.h"
#include "platform/PreferenceStore.h"

namespace qax {
namespace {

using namespace std::chrono_literals;

constexpr const char* kApp = "com.velmora.support";
constexpr const char* kCampaign = "?pt=2003&ct=coverage.settings&mt=8";

class QAXVelmoraSupportManagerTest : public ::testing::Test {
  protected:
    QAXVelmoraSupportManagerTest() {
        tp.platform->applications = apps;
        tp.platform->store = store;
        tp.platform->purchases = purchases;
        tp.platform->accounts = accounts;
        strings->set("INSTALLED", "Installée");
        tp.platform->uiStrings = strings;
    }
    ~QAXVelmoraSupportManagerTest() override {
        store->drain();
        purchases->drain();
    }

    Value::Dictionary availability(double purchaseWait = 5) {
        std::promise<Value::Dictionary> promise;
        auto future = promise.get_future();
        QAXVelmoraSupportManager(tp.platform, purchaseWait)
            .appSupportAvailability(
                kApp, [&promise](Value::Dictionary d) { promise.set_value(std::move(d)); });
        EXPECT_EQ(future.wait_for(10s), std::future_status::ready);
        return future.get();
    }

    test::TestPlatform tp;
    std::shared_ptr<test::FakeApplicationRegistry> apps =
        std::make_shared<test::FakeApplicationRegistry>();
    std::shared_ptr<test::FakeStoreLookup> store = std::make_shared<test::FakeStoreLookup>();
    std::shared_ptr<test::FakePurchaseHistory> purchases =
        std::make_shared<test::FakePurchaseHistory>();
    std::shared_ptr<test::FakeAccountStore> accounts = std::make_shared<test::FakeAccountStore>();
    std::shared_ptr<test::FakeUserInterfaceStrings> strings =
        std::make_shared<test::FakeUserInterfaceStrings>();
};

Value::Dictionary dict(std::initializer_list<std::pair<const std::string, Value>> entries) {
    Value::Dictionary d;
    for (const auto& [k, v] : entries) {
        d[k] = v;
    }
    return d;
}

TEST_F(QAXVelmoraSupportManagerTest, InstalledThenPurchasedThenStore) {
    const StoreItem listing{kApp,
                            "Support",
                            "Velmora Inc.",
                            {"https://img/1.png", "https://img/2"},
                            "https://store.example/app/1"};
    struct Row {
        const char* name;
        bool installed;
        std::vector<PurchaseRecord> purchases;
        std::vector<StoreItem> items;
        std::optional<std::string> storeError;
        bool forced;
        Value::Dictionary expected;
        bool asksPurchases, asksStore;
    } rows[] = {
        {"installed",
         true,
         {},
         {listing},
         std::nullopt,
         false,
         dict({{"AppBundleID", kApp},
               {"AppTitleKey", "Support App"},
               {"AppVendorName", "Velmora"},
               {"AppAvailablityText", "Installée"},
               {"AppAvailabilityType", 1}}),
         false,
         false},
        {"purchased",
         false,
         {{"com.other", "Other", "X", "https://o"},
          {kApp, "Support", "Velmora Inc.", "https://store.example/p"}},
         {listing},
         std::nullopt,
         false,
         dict({{"AppBundleID", kApp},
               {"AppLinkURL", std::string("https://store.example/p") + kCampaign},
               {"AppTitleKey", "Support"},
               {"AppVendorName", "Velmora Inc."},
               {"AppAvailablityText", "DOWNLOAD"},
               {"AppAvailabilityType", 2}}),
         true,
         false},
        {"purchase without listing texts",
         false,
         {{kApp, std::nullopt, std::nullopt, std::nullopt}},
         {},
         std::nullopt,
         false,
         dict({{"AppBundleID", kApp},
               {"AppLinkURL", ""},
               {"AppTitleKey", "== Velmora Support =="},
               {"AppVendorName", "== Velmora =="},
               {"AppAvailablityText", "DOWNLOAD"},
               {"AppAvailabilityType", 2}}),
         true,
         false},
        {"in the store",
         false,
         {{"com.other", "Other", "X", "https://o"}},
         {listing},
         std::nullopt,
         false,
         dict({{"AppBundleID", kApp},
               {"AppLinkURL", std::string("https://store.example/app/1") + kCampaign},
               {"AppIconURL", "https://img/1.png"},
               {"AppTitleKey", "Support"},
               {"AppVendorName", "Velmora Inc."},
               {"AppAvailablityText", "Free – On the Marketa"},
               {"AppAvailabilityType", 3}}),
         true,
         true},
        {"store listing without URLs or names",
         false,
         {},
         {StoreItem{kApp, {}, {}, {}, ""}},
         std::nullopt,
         false,
         dict({{"AppBundleID", kApp},
               {"AppLinkURL", ""},
               {"AppIconURL", ""},
               {"AppTitleKey", ""},
               {"AppVendorName", ""},
               {"AppAvailablityText", "Free – On the Marketa"},
               {"AppAvailabilityType", 3}}),
         true,
         true},
        {"two store items",
         false,
         {},
         {listing, listing},
         std::nullopt,
         false,
         dict({{"AppBundleID", kApp}, {"AppAvailabilityType", 0}}),
         true,
         true},
        {"store error",
         false,
         {},
         {listing},
         "network down",
         false,
         dict({{"AppBundleID", kApp}}),
         true,
         true},
        {"no store result",
         false,
         {},
         {},
         std::nullopt,
         false,
         dict({{"AppBundleID", kApp}}),
         true,
         true},
        {"forced available",
         false,
         {},
         {listing},
         std::nullopt,
         true,
         dict({{"AppBundleID", kApp},
               {"AppTitleKey", "Velmora Support"},
               {"AppVendorName", "Velmora"},
               {"AppAvailablityText", "OVERRIDE"},
               {"AppAvailabilityType", 1}}),
         true,
         false},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.name);
        test::TestPlatform local;
        local.platform->applications = std::make_shared<test::FakeApplicationRegistry>();
        auto localStore = std::make_shared<test::FakeStoreLookup>();
        auto localPurchases = std::make_shared<test::FakePurchaseHistory>();
        local.platform->store = localStore;
        local.platform->purchases = localPurchases;
        local.platform->accounts = accounts;
        local.platform->uiStrings = strings;
        static_cast<test::FakeApplicationRegistry&>(*local.platform->applications)
            .add({kApp, "/apps/support", "Support App", "Velmora", row.installed, {}});
        localPurchases->answer(row.purchases);
        localStore->answer(row.items, row.storeError);
        if (row.forced) {
            local.platform->preferences->setObject("AppSupportAvailability", true);
        }

        std::promise<Value::Dictionary> promise;
        QAXVelmoraSupportManager(local.platform)
            .appSupportAvailability(kApp,
                                    [&promise](Value::Dictionary d) { promise.set_value(d); });
        auto future = promise.get_future();
        ASSERT_EQ(future.wait_for(10s), std::future_status::ready);
        EXPECT_EQ(Value(future.get()), Value(row.expected));
        EXPECT_EQ(localPurchases->queries().size(), row.asksPurchases ? 1u : 0u);
        EXPECT_EQ(localStore->lookups().size(), row.asksStore ? 1u : 0u);
        if (row.storeError || (row.asksStore && row.items.empty())) {
            EXPECT_EQ(local.log->countContaining("Lookup for com.velmora.support in the Marketa "
                                                 "failed with error "),
                      1);
        }
        localStore->drain();
        localPurchases->drain();
    }
    EXPECT_EQ(strings->tablesAsked(), std::vector<std::string>{"Localizable"});
}

TEST_F(QAXVelmoraSupportManagerTest, PurchaseQueryUsesThePrimaryAccountsStoreAccount) {
    store->answer({});
    availability();
    accounts->primary = nullptr;
    availability();
    auto queries = purchases->queries();
    ASSERT_EQ(queries.size(), 2u);
    EXPECT_EQ(queries[0].accountId, 12345);
    EXPECT_EQ(queries[1].accountId, 0);
    EXPECT_EQ(queries[0].bundleIdentifiers, std::vector<std::string>{kApp});
}

TEST_F(QAXVelmoraSupportManagerTest, ALatePurchaseAnswerChangesNothing) {
    purchases->answer({{kApp, "Support", "Velmora Inc.", "https://store.example/p"}});
    purchases->hold(true);
    auto late = QAXVelmoraSupportManager(tp.platform, 0.05).checkAppIsPurchased(kApp);
    EXPECT_EQ(Value(late), Value(dict({{"AppAvailabilityType", 0}})));
    purchases->releaseHeld();
    purchases->drain();
    EXPECT_EQ(Value(late), Value(dict({{"AppAvailabilityType", 0}})));

    purchases->hold(false);
    auto inTime = QAXVelmoraSupportManager(tp.platform).checkAppIsPurchased(kApp);
    EXPECT_EQ(inTime.at("AppAvailabilityType"), Value(2));
}

}  // namespace
}  // namespace qax
