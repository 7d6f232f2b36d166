// The agent's network path end to end against the real coverage-sim: version negotiation
// over HTTPS trusted through tls.plist, KF token renewal at the simulator's token
// endpoint, and a signed, attested coverage request that the simulator verifies.
#include <gtest/gtest.h>

#include <chrono>
#include <future>
#include <thread>

#include "CoverageSimProcess.h"
#include "core/AsioDispatcher.h"
#include "core/AtomicFile.h"
#include "core/JsonCodec.h"
#include "core/PlistCodec.h"
#include "fakes/TestPlatform.h"
#include "platform/HttpClient.h"
#include "platform/PreferenceStore.h"
#include "platform/QAXSettings.h"
#include "platform/host/HostPlatform.h"
#include "signing/AccountHeaders.h"
#include "warranty/QAXServerVersionUtilities.h"
#include "warranty/QAXWarranty.h"

namespace qax::test {
namespace {

constexpr const char* kSerial = "C02E2ETEST01";

HttpResult send(Platform& platform, const HttpRequest& request) {
    std::promise<HttpResult> done;
    platform.http->send(request, [&](HttpResult r) { done.set_value(std::move(r)); });
    return done.get_future().get();
}

TEST(CoverageSim, NegotiatesSignsAttestsAndFetchesASummary) {
    TempDir dir;
    const std::string state = (dir.path() / "sim").string();
    const std::string root = (dir.path() / "root").string();
    CoverageSimProcess sim(state, root);
    ASSERT_FALSE(sim.base().empty()) << "coverage-sim did not start";

    auto write = [&](const char* name, const Value& v) {
        ASSERT_TRUE(writeFileAtomically(root + "/" + name, *toXmlPlist(v)));
    };
    write("device.plist",
          Value::Dictionary{
              {"SerialNumber", kSerial}, {"ProductType", "Model9,1"}, {"ProductVersion", "4.2"}});
    // No token yet: signing must renew it at the simulator's token endpoint.
    write("accounts.plist",
          Value::Dictionary{
              {"PrimaryCloudAccount", Value::Dictionary{{"altDSID", "primary-1"}}},
              {"KFAccount",
               Value::Dictionary{{"altDSID", "kf-1"}, {"TokenServiceURL", sim.base() + "/token"}}},
              {"StoreAccount", Value::Dictionary{{"storefront", "143441-1,29"}}},
          });

    auto dispatcher = std::make_shared<AsioDispatcher>(2, 4);
    HostEnvironment env{(dir.path() / "home").string(), root, root + "/run", ""};
    auto platform = makeHostPlatform(env, dispatcher);
    qax_registerDefaults(*platform->preferences);
    platform->preferences->setObject(settings::kServerVersionURL,
                                     Value(sim.base() + "/library/VELMORA/asset/qaxV2.plist"));
    platform->preferences->setObject(settings::kWarrantyURL,
                                     Value(sim.base() + "/api/v3/coverage/summary"));

    // Version negotiation over HTTPS, trusting the simulator's CA through tls.plist.
    std::promise<bool> supported;
    QAXServerVersionUtilities::serverVersionSupported(platform,
                                                      [&](bool ok) { supported.set_value(ok); });
    EXPECT_TRUE(supported.get_future().get());
    EXPECT_EQ(platform->preferences->objectForKey("ServerVersionCache"),
              Value(Value::Dictionary{{"LowServerVersion", 2}, {"HighServerVersion", 3}}));
    EXPECT_TRUE(QAXServerVersionUtilities::isHighServerVersionFeaturesetEnabled(*platform));

    // A download's first attempt for this device: signed, body, attestation over the body.
    HttpRequest request(*platform->preferences->stringForKey(settings::kWarrantyURL), 30);
    ASSERT_TRUE(qax_signWithAccountHeaders(request, *platform, false, true,
                                           std::string("com.velmora.Preferences")));
    qax_setCoverageRequestBodyWithSerialNumber(request, *platform, kSerial);
    addKVAAuthenticationHeadersWithBody(request, *platform, *request.body());
    ASSERT_TRUE(request.valueForHeader("X-Velmora-Kva"));
    ASSERT_TRUE(request.valueForHeader("X-Velmora-Kva-S"));

    HttpResult result = send(*platform, request);
    ASSERT_TRUE(result.response) << result.error;
    ASSERT_EQ(result.response->statusCode, 200) << result.response->body;
    auto warranty = QAXWarranty::warrantyWithDictionary(platform, parseJson(result.response->body));
    ASSERT_TRUE(warranty);
    EXPECT_TRUE(warranty->covered());
    EXPECT_GE(warranty->daysEligible(), 29u);

    auto log = sim.requestLog();
    ASSERT_GE(log.size(), 3u);  // version list, token, summary
    EXPECT_EQ(*log[log.size() - 2].find("path"), Value("/token"));
    const Value& summaryCall = log.back();
    EXPECT_EQ(*summaryCall.find("attestation"), Value("valid"));
    EXPECT_EQ(*summaryCall.find("body"), Value(*request.body()));
    const Value* token = summaryCall.find("headers")->find("X-Velmora-KF-Token");
    ASSERT_TRUE(token);
    EXPECT_EQ(token->asString()->rfind("kf-", 0), 0u) << "the renewed token was sent";

    // The attestation covers the exact body: a changed body is refused.
    HttpRequest tampered = request;
    tampered.setBody(request.body()->substr(0, request.body()->size() - 1) + " }");
    result = send(*platform, tampered);
    ASSERT_TRUE(result.response);
    EXPECT_EQ(result.response->statusCode, 403);
    platform.reset();
    dispatcher->shutdown();
}

}  // namespace
}  // namespace qax::test
