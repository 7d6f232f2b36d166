#include "platform/host/HostAccountStore.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <chrono>
#include <future>
#include <regex>
#include <thread>

#include "core/AsioDispatcher.h"
#include "core/JsonCodec.h"
#include "core/PlistCodec.h"
#include "fakes/Await.h"
#include "fakes/FakeServices.h"
#include "fakes/TestHttpsServer.h"
#include "fakes/TestPlatform.h"
#include "platform/host/CurlHttpClient.h"
#include "platform/host/HostIdentityAccountManager.h"
#include "signing/AccountHeaders.h"

namespace qax {
namespace {

using namespace std::chrono_literals;

constexpr const char* kService = "com.velmora.kf.supportapp.auth";

Value accountsFile(std::optional<std::string> tokenServiceURL,
                   std::optional<std::string> token = std::nullopt) {
    Value::Dictionary kf{{"altDSID", "kf-alt"}, {"Tokens", Value::Dictionary{}}};
    if (token) {
        kf["Tokens"][kService] = Value(*token);
    }
    if (tokenServiceURL) {
        kf["TokenServiceURL"] = Value(*tokenServiceURL);
    }
    return Value::Dictionary{
        {"PrimaryCloudAccount", Value(Value::Dictionary{{"altDSID", "primary-alt"}})},
        {"KFAccount", Value(std::move(kf))},
        {"StoreAccount",
         Value(Value::Dictionary{{"storefront", "143441-1,29"}, {"accountID", 42}})},
        {"IdentityHeaders", Value(Value::Dictionary{{"X-Extra", "yes"}, {"X-Number", 5}})},
    };
}

struct Renewal {
    long code = 0;
    std::optional<std::string> error;
    std::thread::id thread;
};

Renewal renew(AccountStore& store, const Account& kf) {
    return test::await<Renewal>([&](auto done) {
        store.renewCredentialsForAccount(kf, {true, {kService}},
                                         [done](long code, std::optional<std::string> error) {
                                             done({code, error, std::this_thread::get_id()});
                                         });
    });
}

class HostAccountStoreTest : public ::testing::Test {
  protected:
    HostAccountStoreTest() {
        file = std::filesystem::path(tp.platform->platformRoot) / "accounts.plist";
        dispatcher = std::make_shared<AsioDispatcher>(1, 1);
    }
    ~HostAccountStoreTest() override { dispatcher->shutdown(); }

    void write(const Value& accounts) { test::writeFile(file, *toXmlPlist(accounts)); }
    std::optional<std::string> storedToken() {
        auto root = parsePlist(test::readFile(file));
        const Value* kf = root ? root->find("KFAccount") : nullptr;
        const Value* tokens = kf ? kf->find("Tokens") : nullptr;
        const Value* token = tokens ? tokens->find(kService) : nullptr;
        return token && token->asString() ? std::optional<std::string>(*token->asString())
                                          : std::nullopt;
    }

    test::TestPlatform tp;
    std::filesystem::path file;
    std::shared_ptr<AsioDispatcher> dispatcher;
};

TEST_F(HostAccountStoreTest, AccountsFromTheFile) {
    HostAccountStore store(tp.platform->platformRoot, nullptr, dispatcher);
    EXPECT_FALSE(store.primaryCloudAccount()) << "no file: nobody signed in";

    write(accountsFile(std::nullopt, "tok"));
    auto primary = store.primaryCloudAccount();
    ASSERT_TRUE(primary);
    EXPECT_EQ(primary->altDSID, "primary-alt");
    auto kf = store.kfAccountForCloudAccount(*primary);
    ASSERT_TRUE(kf);
    EXPECT_EQ(kf->altDSID, "kf-alt");
    EXPECT_EQ(store.credentialTokenForAccount(*kf, kService), "tok");
    EXPECT_FALSE(store.credentialTokenForAccount(*kf, "other.service"));
    auto ostara = store.ostaraAccountForCloudAccount(*primary);
    ASSERT_TRUE(ostara);
    EXPECT_EQ(ostara->storefront, "143441-1,29");
    EXPECT_EQ(ostara->storeAccountID, 42);

    // No SilentAuthStoreAccount section: silent authentication fails, off the caller's thread.
    auto promise = std::make_shared<std::promise<std::pair<bool, std::thread::id>>>();
    store.authenticateSilently(*primary, "reason",
                               [promise](std::shared_ptr<const Account> a, auto error) {
                                   promise->set_value({!a && error, std::this_thread::get_id()});
                               });
    auto [failed, thread] = promise->get_future().get();
    EXPECT_TRUE(failed);
    EXPECT_NE(thread, std::this_thread::get_id());

    Value accounts = accountsFile(std::nullopt);
    accounts["SilentAuthStoreAccount"] = Value::Dictionary{{"storefront", "silent-front"}};
    accounts.asDictionary()->erase("StoreAccount");
    accounts.asDictionary()->erase("KFAccount");
    write(accounts);
    EXPECT_FALSE(store.ostaraAccountForCloudAccount(*primary));
    EXPECT_FALSE(store.kfAccountForCloudAccount(*primary));
    auto silent = std::make_shared<std::promise<std::optional<std::string>>>();
    store.authenticateSilently(*primary, "reason", [silent](auto a, auto) {
        silent->set_value(a ? a->storefront : std::nullopt);
    });
    EXPECT_EQ(silent->get_future().get(), "silent-front");
    EXPECT_EQ(renew(store, *primary).code, HostAccountStore::kRenewalNoAccount);
}

TEST_F(HostAccountStoreTest, RenewalWithoutTokenServiceMintsAndStoresAToken) {
    write(accountsFile(std::nullopt, "old-token"));
    HostAccountStore store(tp.platform->platformRoot, nullptr, dispatcher);
    auto kf = store.kfAccountForCloudAccount(*store.primaryCloudAccount());
    auto result = renew(store, *kf);
    EXPECT_EQ(result.code, 0);
    EXPECT_FALSE(result.error);
    EXPECT_NE(result.thread, std::this_thread::get_id());
    auto token = storedToken();
    ASSERT_TRUE(token);
    EXPECT_TRUE(std::regex_match(*token, std::regex("[0-9a-f]{64}"))) << *token;
    EXPECT_NE(token, "old-token");
    EXPECT_EQ(store.credentialTokenForAccount(*kf, kService), token);

    // Signers wait for renewals on the blocking pool: the answer must not need a thread of
    // that pool (here its only one).
    std::promise<long> fromBlocking;
    dispatcher->blockingQueue()->post([&] { fromBlocking.set_value(renew(store, *kf).code); });
    auto code = fromBlocking.get_future();
    ASSERT_EQ(code.wait_for(30s), std::future_status::ready);
    EXPECT_EQ(code.get(), 0);

    // The rest of the file is kept, and the file is private to its owner.
    auto root = parsePlist(test::readFile(file));
    EXPECT_EQ(*root->find("IdentityHeaders"), *accountsFile(std::nullopt).find("IdentityHeaders"));
    struct stat st {};
    ASSERT_EQ(::stat(file.c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0600u);
}

TEST_F(HostAccountStoreTest, SigningRenewsThroughTheTokenService) {
    test::TestHttpsServer server;
    server.answer("/token", {});
    server.queue("/token",
                 {{200, R"({"token":"server-token-1"})"}, {200, R"({"token":"server-token-2"})"}});
    server.start();
    CurlHttpClient::Options options;
    options.extraCAFile = server.caFile();
    auto http = std::make_shared<CurlHttpClient>(options);

    write(accountsFile(server.url("/token")));
    tp.platform->accounts =
        std::make_shared<HostAccountStore>(tp.platform->platformRoot, http, dispatcher);
    tp.platform->identity = std::make_shared<HostIdentityAccountManager>(
        tp.platform->platformRoot, tp.platform->deviceProperties);

    HttpRequest request("https://coverage.example/");
    ASSERT_TRUE(qax_signWithAccountHeaders(request, *tp.platform, false, true, "com.example.app"));
    EXPECT_EQ(request.valueForHeader("X-Velmora-KF-Token"), "server-token-1");
    EXPECT_EQ(storedToken(), "server-token-1");
    ASSERT_EQ(server.requests().size(), 1u);
    EXPECT_EQ(parseJson(server.requests()[0].body),
              (Value::Dictionary{{"altDSID", "kf-alt"}, {"services", Value::Array{kService}}}));
    // A stored token needs no renewal unless forced.
    HttpRequest second("https://coverage.example/");
    ASSERT_TRUE(qax_signWithAccountHeaders(second, *tp.platform, false, true, "com.example.app"));
    EXPECT_EQ(second.valueForHeader("X-Velmora-KF-Token"), "server-token-1");
    HttpRequest forced("https://coverage.example/");
    ASSERT_TRUE(qax_signWithAccountHeaders(forced, *tp.platform, true, true, "com.example.app"));
    EXPECT_EQ(forced.valueForHeader("X-Velmora-KF-Token"), "server-token-2");

    // The identity headers of the host binding.
    EXPECT_EQ(forced.valueForHeader("X-Velmora-Client-Info"),
              "ProductType=Model9,1; ProductVersion=4.2");
    auto udid = forced.valueForHeader("X-Velmora-Device-UDID");
    ASSERT_TRUE(udid);
    EXPECT_TRUE(std::regex_match(*udid, std::regex("[0-9a-f]{64}")));
    EXPECT_EQ(udid, second.valueForHeader("X-Velmora-Device-UDID")) << "stable";
    EXPECT_EQ(forced.valueForHeader("X-Extra"), "yes");
    EXPECT_FALSE(forced.valueForHeader("X-Number")) << "only text values are headers";
    EXPECT_EQ(forced.valueForHeader("storefrontLocale"), "143441-1,29");

    // Close the session's kept-alive connection before the server stops.
    tp.platform->accounts.reset();
    http.reset();
}

TEST_F(HostAccountStoreTest, TokenServiceFailures) {
    test::TestHttpsServer server;
    server.answer("/error", {503});
    server.answer("/garbage", {200, "<html/>", "text/html"});
    server.answer("/empty", {200, R"({"token":""})"});
    server.start();
    CurlHttpClient::Options options;
    options.extraCAFile = server.caFile();
    auto http = std::make_shared<CurlHttpClient>(options);
    const std::pair<std::string, long> rows[] = {
        {server.url("/error"), 503},
        {server.url("/garbage"), HostAccountStore::kRenewalBadAnswer},
        {server.url("/empty"), HostAccountStore::kRenewalBadAnswer},
        {"https://127.0.0.1:" + std::to_string(test::unusedLocalPort()) + "/token",
         HostAccountStore::kRenewalTransportError},
    };
    for (const auto& [url, code] : rows) {
        SCOPED_TRACE(url);
        write(accountsFile(url, "kept"));
        HostAccountStore store(tp.platform->platformRoot, http, dispatcher);
        auto result = renew(store, *store.kfAccountForCloudAccount(Account{}));
        EXPECT_EQ(result.code, code);
        EXPECT_TRUE(result.error && !result.error->empty());
        EXPECT_EQ(storedToken(), "kept");
    }
}

}  // namespace
}  // namespace qax
