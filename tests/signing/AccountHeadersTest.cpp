#include "signing/AccountHeaders.h"

#include <gtest/gtest.h>

#include <regex>

#include "core/Hash.h"
#include "core/JsonCodec.h"
#include "fakes/FakeAccounts.h"
#include "fakes/FakeServices.h"
#include "fakes/TestPlatform.h"
#include "platform/HttpClient.h"
#include "platform/PreferenceStore.h"

namespace qax {
namespace {

using test::FakeAccountStore;
using test::FakeIdentityAccountManager;

constexpr const char* kNoTokenAfterRenewal =
    "Error: still no KF token even after calling renewCredentialsForAccount.";

// A platform signed in as the fake account store is.
struct Local {
    Local() {
        tp.platform->accounts = store;
        tp.platform->identity = std::make_shared<FakeIdentityAccountManager>();
    }
    test::TestPlatform tp;
    std::shared_ptr<FakeAccountStore> store = std::make_shared<FakeAccountStore>();
    HttpRequest request{"https://coverage.example/api/v3/coverage/summary", 30};
};

class AccountHeadersTest : public ::testing::Test, protected Local {
  protected:
    bool sign(bool force = false, std::optional<std::string> bundleID = "com.velmora.Preferences") {
        return qax_signWithAccountHeaders(request, *tp.platform, force, true, bundleID);
    }
    std::shared_ptr<FakeAccountStore>& accounts = store;
};

TEST_F(AccountHeadersTest, SignedRequestCarriesEveryHeaderInOrder) {
    ASSERT_TRUE(sign());
    std::vector<std::pair<std::string, std::string>> expected{
        {"X-Velmora-KF-Token", "stored-token"},
        {"X-Fake-Client-Info", "client-info"},
        {"X-Fake-UDID", "device-udid"},
        {"X-Fake-Identity", "identity-value"},
        {"altDSID", "primary-altdsid"},
        {"User-Agent", "<com.velmora.Preferences/4.2/Model9,1>"},
        {"storefrontLocale", "143441-1,29"},
    };
    EXPECT_EQ(request.headers(), expected);
    EXPECT_TRUE(accounts->renewals().empty());
    // Signing alone sets neither method nor body.
    EXPECT_EQ(request.method(), "GET");
    EXPECT_FALSE(request.body());

    // Without a bundle identifier the agent names itself.
    ASSERT_TRUE(sign(false, std::nullopt));
    EXPECT_EQ(request.valueForHeader("User-Agent"), "<com.velmora.qaxagent/4.2/Model9,1>");
    ASSERT_TRUE(qax_signWithAccountHeaders(request, *tp.platform, false, false));
    EXPECT_EQ(request.valueForHeader("User-Agent"), _userAgent(*tp.platform));
}

TEST_F(AccountHeadersTest, MissingAccountsRefuseToSignAndLeaveTheRequestUntouched) {
    struct Row {
        const char* name;
        void (*setUp)(FakeAccountStore&);
        std::vector<std::string> messages;
    };
    const char* kNoKF = "Failed to add KF headers, can't sign this request";
    // clang-format off
    const Row rows[] = {
        {"no primary account", [](FakeAccountStore& a) { a.primary = nullptr; },
         {"No primary Skyvault account, can't sign this request"}},
        {"no KF account", [](FakeAccountStore& a) { a.kf = nullptr; },
         {"Keyforge signing failed because no KF account was provided.", kNoKF}},
        {"KF account without altDSID", [](FakeAccountStore& a) { a.kf = std::make_shared<Account>(); },
         {"Keyforge signing failed because no there's no altDSID on the account.", kNoKF}},
    };
    // clang-format on
    for (const auto& row : rows) {
        SCOPED_TRACE(row.name);
        Local l;
        row.setUp(*l.store);
        EXPECT_FALSE(qax_signWithAccountHeaders(l.request, *l.tp.platform, true, true, "b"));
        EXPECT_TRUE(l.request.headers().empty());
        EXPECT_EQ(l.tp.log->messages(), row.messages);
        EXPECT_TRUE(l.store->renewals().empty());
    }
}

TEST_F(AccountHeadersTest, TokenRenewal) {
    struct Row {
        const char* name;
        std::optional<std::string> stored;
        bool force;
        FakeAccountStore::Renewal renewal;
        bool signs;
        std::optional<std::string> header;
        std::size_t renewals;
        std::vector<std::string> messages;
    };
    const char* kRenew = "Reprovision KF tokens";
    const std::string failed =
        "No way to sign request with KF token because renewal of KF credential failed: ";
    // clang-format off
    const Row rows[] = {
        {"stored token, not forced: no renewal", "old", false, {}, true, "old", 0, {}},
        {"forced renewal succeeds", "old", true, {0, std::nullopt, "new"}, true, "new", 1, {kRenew}},
        {"forced renewal fails: the previous token stays", "old", true, {7, "offline", std::nullopt},
         true, "old", 1, {kRenew, failed + "7, offline"}},
        {"no token, renewal succeeds", std::nullopt, false, {0, std::nullopt, "new"}, true, "new", 1,
         {kRenew}},
        {"no token, renewal yields no token", std::nullopt, false, {0, std::nullopt, std::nullopt},
         false, std::nullopt, 1, {kRenew, kNoTokenAfterRenewal}},
        {"no token, renewal fails", std::nullopt, false, {-3, std::nullopt, std::nullopt}, false,
         std::nullopt, 1, {kRenew, failed + "-3, (null)", kNoTokenAfterRenewal}},
    };
    // clang-format on
    for (const auto& row : rows) {
        SCOPED_TRACE(row.name);
        test::TestPlatform local;
        FakeAccountStore store;
        store.setToken(row.stored);
        store.renewal = row.renewal;
        HttpRequest r("https://coverage.example/");
        EXPECT_EQ(_addKFHeadersForAccount(r, *store.primary, store, row.force, true), row.signs);
        EXPECT_EQ(r.valueForHeader("X-Velmora-KF-Token"), row.header);
        EXPECT_EQ(local.log->messages(), row.messages);
        auto renewals = store.renewals();
        ASSERT_EQ(renewals.size(), row.renewals);
        for (const auto& options : renewals) {
            EXPECT_TRUE(options.avoidUserInterface);
            EXPECT_EQ(options.services, std::vector<std::string>{"com.velmora.kf.supportapp.auth"});
        }
    }
}

TEST_F(AccountHeadersTest, StoreFront) {
    struct Row {
        const char* name;
        std::optional<Value> preference;
        bool ostara;
        std::optional<std::string> silentStorefront;
        std::optional<std::string> header;
        int ostaraLookups;
        std::size_t silentCalls;
        const char* message;
    };
    // clang-format off
    const Row rows[] = {
        {"preference overrides everything", Value("override-front"), true, "silent",
         "override-front", 0, 0, nullptr},
        {"a number in the preference is sent as text", Value(143441), true, std::nullopt, "143441",
         0, 0, nullptr},
        {"store account", std::nullopt, true, "silent", "143441-1,29", 1, 0, nullptr},
        {"silent authentication", std::nullopt, false, "silent-front", "silent-front", 1, 1,
         "Couldn't find an OstaraAccount"},
        {"silent authentication fails", std::nullopt, false, std::nullopt, std::nullopt, 1, 1,
         "Couldn't find an OstaraAccount with error: silent authentication failed"},
    };
    // clang-format on
    for (const auto& row : rows) {
        SCOPED_TRACE(row.name);
        Local l;
        if (!row.ostara) {
            l.store->ostara = nullptr;
        }
        if (row.silentStorefront) {
            l.store->silentAccount =
                std::make_shared<Account>(Account{std::nullopt, row.silentStorefront, 1});
        }
        if (row.preference) {
            l.tp.platform->preferences->setObject("storefrontLocale", *row.preference);
        }
        ASSERT_TRUE(qax_signWithAccountHeaders(l.request, *l.tp.platform, false, true, "b"));
        EXPECT_EQ(l.request.valueForHeader("storefrontLocale"), row.header);
        EXPECT_EQ(l.store->ostaraLookups(), row.ostaraLookups);
        EXPECT_EQ(l.store->silentReasons().size(), row.silentCalls);
        if (row.message) {
            EXPECT_TRUE(l.tp.log->contains(row.message));
        }
    }
}

TEST_F(AccountHeadersTest, CoverageBody) {
    const std::tuple<double, int, std::uint64_t, int> rows[] = {
        {1700000000.9999, 0, 1700000000999ULL, 0},
        {1700000000.0, 5 * 3600 + 1800, 1700000000000ULL, 5},      // +5:30
        {1700000000.0, -(3 * 3600 + 1800), 1700000000000ULL, -3},  // -3:30
        {1700000000.0, 5 * 3600 + 2700, 1700000000000ULL, 5},      // +5:45
        {1700000000.0, -(9 * 3600 + 1800), 1700000000000ULL, -9},  // -9:30
        {1700000000.5, -8 * 3600, 1700000000500ULL, -8},
    };
    for (const auto& [now, secondsFromGMT, timestamp, timezone] : rows) {
        SCOPED_TRACE(secondsFromGMT);
        tp.clock->set(Date(now));
        tp.clock->setSecondsFromGMT(secondsFromGMT);
        HttpRequest r("https://coverage.example/");
        qax_setCoverageRequestBodyWithSerialNumber(r, *tp.platform, "C02SERIAL");
        EXPECT_EQ(r.method(), "POST");
        EXPECT_EQ(r.valueForHeader("Content-Type"), "application/json");
        // Compact JSON with integer numbers, keys in order.
        EXPECT_EQ(bodyDescription(r), R"({"locale":"en_US","requestTimestamp":)" +
                                          std::to_string(timestamp) + R"(,"requestTimezone":)" +
                                          std::to_string(timezone) +
                                          R"(,"serialNumber":"C02SERIAL"})");
    }
}

TEST_F(AccountHeadersTest, OfferServiceHeaders) {
    HttpRequest first("https://offers.example/"), second("https://offers.example/");
    qax_addOASHeadersWithOfferID(first, *tp.platform, "OFFER-1", "C02SERIAL");
    qax_addOASHeadersWithOfferID(second, *tp.platform, "OFFER-1", "C02SERIAL");

    EXPECT_EQ(first.valueForHeader("X-Velmora-SN"), "C02SERIAL");
    auto locale = std::static_pointer_cast<test::FakeLocaleInfo>(tp.platform->locale);
    ASSERT_TRUE(locale->contentSize);
    EXPECT_EQ(first.valueForHeader("X-Velmora-Content-Size"), locale->contentSize);
    EXPECT_EQ(first.valueForHeader("X-Velmora-DM"), "No");
    EXPECT_EQ(first.valueForHeader("User-Agent"), "<com.velmora.qaxagent/4.2/Model9,1>");
    EXPECT_EQ(first.valueForHeader("Offer-ID"), "OFFER-1");
    EXPECT_EQ(first.valueForHeader("storefrontLocale"), "143441-1,29");
    const std::regex uuid("[0-9A-F]{8}-[0-9A-F]{4}-4[0-9A-F]{3}-[89AB][0-9A-F]{3}-[0-9A-F]{12}");
    auto id1 = first.valueForHeader("X-Velmora-Txn-ID").value_or("");
    auto id2 = second.valueForHeader("X-Velmora-Txn-ID").value_or("");
    EXPECT_TRUE(std::regex_match(id1, uuid)) << id1;
    EXPECT_TRUE(std::regex_match(id2, uuid)) << id2;
    EXPECT_NE(id1, id2);
    EXPECT_EQ(first.method(), "GET");
    EXPECT_FALSE(first.body());
    EXPECT_FALSE(first.valueForHeader("X-Velmora-KF-Token"));

    // Without a primary account the store front is missing, the rest is still set, and no
    // silent authentication is tried.
    accounts->primary = nullptr;
    locale->contentSize.reset();
    HttpRequest third("https://offers.example/");
    qax_addOASHeadersWithOfferID(third, *tp.platform, "OFFER-2", "C02SERIAL");
    EXPECT_TRUE(tp.log->contains("Primary Skyvault Account is nil!"));
    EXPECT_FALSE(third.valueForHeader("storefrontLocale"));
    EXPECT_FALSE(third.valueForHeader("X-Velmora-Content-Size"));
    EXPECT_EQ(third.valueForHeader("Offer-ID"), "OFFER-2");
    EXPECT_TRUE(accounts->silentReasons().empty());
}

TEST_F(AccountHeadersTest, Descriptions) {
    HttpRequest r("https://coverage.example/");
    EXPECT_FALSE(bodyDescription(r));
    r.setBody(std::string("\xC3\x28", 2));
    EXPECT_FALSE(bodyDescription(r)) << "invalid UTF-8";
    r.setBody(std::string("caf\xC3\xA9"));
    EXPECT_EQ(bodyDescription(r), "caf\xC3\xA9");

    r.setValue("B-Header", std::string("2"));
    r.setValue("A-Header", std::string("1"));
    EXPECT_EQ(headerDescription(r),
              (Value(Value::Dictionary{{"A-Header", "1"}, {"B-Header", "2"}}).description()));
}

}  // namespace
}  // namespace qax
