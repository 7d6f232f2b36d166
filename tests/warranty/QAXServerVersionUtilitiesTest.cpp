#include "warranty/QAXServerVersionUtilities.h"

#include <gtest/gtest.h>

#include "core/PlistCodec.h"
#include "fakes/Await.h"
#include "fakes/TestHttpsServer.h"
#include "fakes/TestPlatform.h"
#include "platform/PreferenceStore.h"
#include "platform/QAXSettings.h"
#include "platform/host/CurlHttpClient.h"

namespace qax {
namespace {

using test::await;

constexpr const char* kListPath = "/library/VELMORA/asset/qaxV2.plist";
constexpr const char* kCache = "ServerVersionCache";
constexpr const char* kOverride = "ServerVersionOverride";
constexpr const char* kFetchFailed = "Failed to fetch plist data from URL";

Value versionList(Value low, Value high) {
    Value list{Value::Dictionary{}};
    list["LowServerVersion"] = std::move(low);
    list["HighServerVersion"] = std::move(high);
    return list;
}

// The version list served over real HTTPS, and an agent platform whose HTTP session trusts
// the server through tls.plist, as the host's does.
class QAXServerVersionUtilitiesTest : public ::testing::Test {
  protected:
    QAXServerVersionUtilitiesTest() {
        server.answer(kListPath, {});
        server.start();
        server.trustIn(tp.platform->platformRoot);
        tp.platform->http = std::make_shared<CurlHttpClient>(
            CurlHttpClient::optionsForPlatformRoot(tp.platform->platformRoot));
        qax_registerDefaults(preferences());
        preferences().setObject(settings::kServerVersionURL, server.url(kListPath));
    }

    PreferenceStore& preferences() { return *tp.platform->preferences; }

    void serve(const std::string& body, const std::string& cacheControl = "") {
        httplib::Headers headers;
        if (!cacheControl.empty()) {
            headers.emplace("Cache-Control", cacheControl);
        }
        server.setAnswer(kListPath, {200, body, "application/x-plist", headers});
    }
    void serveList(const Value& list) { serve(*toXmlPlist(list)); }
    int hits() { return static_cast<int>(server.requests().size()); }

    std::optional<QAXVersionSet> negotiate(QAXServerLookupPolicy policy) {
        return await<std::optional<QAXVersionSet>>([&](auto done) {
            QAXServerVersionUtilities::_supportedVersionsForClientAndServer(*tp.platform, policy,
                                                                            done);
        });
    }
    bool supported() {
        return await<bool>([&](auto done) {
            QAXServerVersionUtilities::serverVersionSupported(tp.platform, done);
        });
    }
    bool highEnabled(QAXServerLookupPolicy policy) {
        return await<bool>([&](auto done) {
            QAXServerVersionUtilities::isHighServerVersionFeaturesetEnabled(tp.platform, policy,
                                                                            done);
        });
    }
    std::optional<Value> cache() { return preferences().objectForKey(kCache); }

    test::TestHttpsServer server;  // outlives the platform's HTTP session
    test::TestPlatform tp;
};

TEST_F(QAXServerVersionUtilitiesTest, OverlapOfTheEndPointsDecidesSupportAndTheHighFeatureSet) {
    Value withExtraKey = versionList(2, 3);
    withExtraKey["MinimumClient"] = "4.0";
    const std::tuple<const char*, Value, std::optional<QAXVersionSet>, bool, const char*> cases[] =
        {
            {"same pair", versionList(2, 3), QAXVersionSet{2, 3}, true,
             "clientAndServerSet '{(2, 3)}'"},
            {"strings", versionList("2", "2"), QAXVersionSet{2}, false,
             "clientAndServerSet '{(2)}'"},
            {"end points only", versionList(1, 4), QAXVersionSet{}, false,
             "clientAndServerSet '{()}'"},
            {"newer server", versionList(3, 5), QAXVersionSet{3}, true,
             "Server versions '{(3, 5)}'"},
            {"other keys are kept", withExtraKey, QAXVersionSet{2, 3}, true,
             "Client versions '{(2, 3)}'"},
            {"no high version", Value::Dictionary{{"LowServerVersion", 2}}, std::nullopt, false,
             "Server version dictionary missing key 'HighServerVersion'"},
            {"no low version", Value::Dictionary{{"HighServerVersion", 3}}, std::nullopt, false,
             "Server version dictionary missing key 'LowServerVersion'"},
        };
    for (const auto& [name, list, overlap, enabled, message] : cases) {
        SCOPED_TRACE(name);
        preferences().removeObject(kCache);
        tp.log->clear();
        serveList(list);
        const int before = hits();

        EXPECT_EQ(negotiate(QAXServerLookupPolicyNetworkFirst), overlap);
        EXPECT_EQ(tp.log->count(message), 1);
        EXPECT_EQ(cache(), list);  // the fetched list, as it was
        EXPECT_EQ(supported(), overlap && !overlap->empty());
        EXPECT_EQ(hits(), before + 2);

        // The other policies answer from the cache, without the network.
        EXPECT_EQ(highEnabled(QAXServerLookupPolicyCacheFirst), enabled);
        EXPECT_EQ(QAXServerVersionUtilities::isHighServerVersionFeaturesetEnabled(*tp.platform),
                  enabled);
        EXPECT_EQ(hits(), before + 2);
    }
}

TEST_F(QAXServerVersionUtilitiesTest, AListThatIsNotADictionaryIsFetchedOnceMoreBypassingTheCache) {
    constexpr const char* kRetrying = "Incorrect format in response detected. retrying...";
    const std::string array = *toXmlPlist(Value::Array{2, 3});
    const std::string abort =
        "Incorrect format in response detected from URL '" + server.url(kListPath) +
        "'. Response: " + Value(Value::Array{2, 3}).description() + ". Aborting without retry.";

    // An array twice: the retry reaches the server, then the cache from before is used.
    preferences().setObject(kCache, versionList(3, 5));
    serve(array);
    EXPECT_EQ(negotiate(QAXServerLookupPolicyNetworkFirst), (QAXVersionSet{3}));
    EXPECT_EQ(hits(), 2);
    EXPECT_EQ(tp.log->count(kRetrying), 1);
    EXPECT_EQ(tp.log->count(abort), 1);
    EXPECT_EQ(cache(), versionList(3, 5));

    // Without a cache, the client versions; this time the array may be kept locally.
    preferences().removeObject(kCache);
    serve(array, "max-age=300");
    tp.log->clear();
    EXPECT_EQ(negotiate(QAXServerLookupPolicyNetworkFirst), (QAXVersionSet{2, 3}));
    EXPECT_EQ(hits(), 4);
    EXPECT_EQ(tp.log->count(abort), 1);
    EXPECT_EQ(tp.log->countContaining("Using Client version: "), 1);
    EXPECT_EQ(cache(), versionList(2, 3));

    // The array stays in the session's local cache, so only the retry, which bypasses it,
    // can see the list the server publishes now.
    serveList(versionList(3, 5));
    tp.log->clear();
    EXPECT_EQ(negotiate(QAXServerLookupPolicyNetworkFirst), (QAXVersionSet{3}));
    EXPECT_EQ(hits(), 5);
    EXPECT_EQ(tp.log->count(kRetrying), 1);
    EXPECT_EQ(tp.log->count(abort), 0);
    EXPECT_EQ(cache(), versionList(3, 5));
}

TEST_F(QAXServerVersionUtilitiesTest, APageThatIsNoPropertyListFallsBackByPolicy) {
    serve("<!DOCTYPE html><html><body>Service unavailable</body></html>");
    const std::string parseError =
        "Error serializing plist file from URL '" + server.url(kListPath) + "': ";

    // Cache first, nothing cached: the client versions, not stored.
    EXPECT_EQ(negotiate(QAXServerLookupPolicyCacheFirst), (QAXVersionSet{2, 3}));
    EXPECT_EQ(tp.log->countContaining(parseError), 1);
    EXPECT_FALSE(cache());

    // Network first with a cache: the cache as it was.
    preferences().setObject(kCache, versionList(3, 5));
    EXPECT_EQ(negotiate(QAXServerLookupPolicyNetworkFirst), (QAXVersionSet{3}));
    EXPECT_EQ(tp.log->countContaining(parseError), 2);
    EXPECT_EQ(cache(), versionList(3, 5));
    EXPECT_EQ(hits(), 2);  // a parse failure is not retried

    // A binary list is read as well as an XML one.
    serve(*toBinaryPlist(versionList(2, 2)));
    EXPECT_EQ(await<std::optional<Value>>([&](auto done) {
                  QAXServerVersionUtilities::_dictionaryFromURL(*tp.platform, server.url(kListPath),
                                                                true, done);
              }),
              versionList(2, 2));
}

TEST_F(QAXServerVersionUtilitiesTest, AnUnreachableServerFallsBackByPolicy) {
    preferences().setObject(
        settings::kServerVersionURL,
        "https://127.0.0.1:" + std::to_string(test::unusedLocalPort()) + kListPath);
    const std::tuple<QAXServerLookupPolicy, std::optional<Value>, QAXVersionSet,
                     std::optional<Value>, int>
        cases[] = {
            {QAXServerLookupPolicyCacheFirst, std::nullopt, {2, 3}, std::nullopt, 1},
            {QAXServerLookupPolicyCacheFirst, versionList(3, 5), {3}, versionList(3, 5), 0},
            {QAXServerLookupPolicy(7), std::nullopt, {2, 3}, std::nullopt, 1},
            {QAXServerLookupPolicyNoNetwork, std::nullopt, {2, 3}, std::nullopt, 0},
            {QAXServerLookupPolicyNoNetwork, versionList(3, 5), {3}, versionList(3, 5), 0},
            {QAXServerLookupPolicyNetworkFirst, std::nullopt, {2, 3}, versionList(2, 3), 1},
            {QAXServerLookupPolicyNetworkFirst, versionList(3, 5), {3}, versionList(3, 5), 1},
        };
    for (const auto& [policy, cached, overlap, cacheAfter, fetchFailures] : cases) {
        SCOPED_TRACE(testing::Message() << "policy " << policy << " cached " << cached.has_value());
        preferences().removeObject(kCache);
        if (cached) {
            preferences().setObject(kCache, *cached);
        }
        tp.log->clear();
        EXPECT_EQ(negotiate(policy), overlap);
        EXPECT_EQ(cache(), cacheAfter);
        EXPECT_EQ(tp.log->countContaining(kFetchFailed), fetchFailures);
        EXPECT_EQ(tp.log->count(std::string(" Server lookup policy:") +
                                std::to_string(static_cast<std::uint64_t>(policy))),
                  1);
    }
    // Downloads still go ahead when the list cannot be fetched.
    preferences().removeObject(kCache);
    EXPECT_TRUE(supported());
}

TEST_F(QAXServerVersionUtilitiesTest, AnOverrideIsUsedAndCachedUnderEveryPolicyWithoutTheNetwork) {
    serveList(versionList(2, 3));
    preferences().setObject(kOverride, versionList(3, 5));
    for (auto policy : {QAXServerLookupPolicyCacheFirst, QAXServerLookupPolicyNoNetwork,
                        QAXServerLookupPolicyNetworkFirst}) {
        SCOPED_TRACE(policy);
        preferences().removeObject(kCache);
        tp.log->clear();
        EXPECT_EQ(negotiate(policy), (QAXVersionSet{3}));
        EXPECT_EQ(cache(), versionList(3, 5));
        EXPECT_EQ(
            tp.log->count("Using Overridden Server version  " + versionList(3, 5).description()),
            1);
    }
    EXPECT_TRUE(QAXServerVersionUtilities::isHighServerVersionFeaturesetEnabled(*tp.platform));
    EXPECT_EQ(hits(), 0);

    // An override of the wrong kind is still the override: nothing usable, nothing fetched.
    preferences().setObject(kOverride, "3");
    tp.log->clear();
    EXPECT_EQ(negotiate(QAXServerLookupPolicyNetworkFirst), std::nullopt);
    EXPECT_EQ(tp.log->count("Incorrect serverDictionary format"), 1);
    EXPECT_FALSE(supported());
    EXPECT_EQ(hits(), 0);
}

TEST_F(QAXServerVersionUtilitiesTest, ACacheThatIsNoDictionaryIsRemovedAndIgnored) {
    constexpr const char* kRemoving =
        "Incorrect format stored in server version cache. Removing it.";
    serveList(versionList(3, 5));
    const std::tuple<QAXServerLookupPolicy, QAXVersionSet, std::optional<Value>, int> cases[] = {
        {QAXServerLookupPolicyNoNetwork, {2, 3}, std::nullopt, 0},
        {QAXServerLookupPolicyCacheFirst, {3}, versionList(3, 5), 1},
    };
    for (const auto& [policy, overlap, cacheAfter, fetches] : cases) {
        SCOPED_TRACE(policy);
        preferences().setObject(kCache, "not a list");
        tp.log->clear();
        const int before = hits();
        EXPECT_EQ(negotiate(policy), overlap);
        EXPECT_EQ(tp.log->count(kRemoving), 1);
        EXPECT_EQ(cache(), cacheAfter);
        EXPECT_EQ(hits(), before + fetches);
    }

    // With nothing cached, the immediate form answers from the client versions and leaves
    // the cache absent.
    preferences().removeObject(kCache);
    tp.log->clear();
    EXPECT_TRUE(QAXServerVersionUtilities::isHighServerVersionFeaturesetEnabled(*tp.platform));
    EXPECT_EQ(tp.log->count("Using Client version: " + versionList(2, 3).description()), 1);
    EXPECT_FALSE(cache());
}

}  // namespace
}  // namespace qax
