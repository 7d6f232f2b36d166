// qaxctl request-preview and attestation-ca on a temporary home, checked by the real
// coverage-sim: the printed request is the one a download attempt sends, the service accepts
// its attestation against the root that attestation-ca prints, and refuses it once the body
// changes.
#include <gtest/gtest.h>

#include <future>

#include "AgentProcess.h"
#include "CoverageSimProcess.h"
#include "core/JsonCodec.h"
#include "platform/host/CurlHttpClient.h"

namespace qax {
namespace {

TEST(RequestPreview, PrintsTheSignedRequestThatCoverageSimAccepts) {
    test::AgentProcess home;  // its home, platform root and environment; nothing started
    auto ctl = [&](const std::vector<std::string>& args) {
        return test::runTool(QAX_CTL_BINARY, args, home.environment());
    };
    home.writeRootFile("device.plist", Value::Dictionary{{"SerialNumber", "C02DEVICE"},
                                                         {"ProductType", "Model9,1"},
                                                         {"ProductVersion", "4.2"}});
    auto refused = ctl({"request-preview", "C02DEVICE", "--json"});
    EXPECT_EQ(refused.status, 1);
    EXPECT_TRUE(refused.out.empty()) << refused.out;
    EXPECT_NE(refused.err.find("No primary Skyvault account, can't sign this request"),
              std::string::npos)
        << refused.err;

    home.writeRootFile(
        "accounts.plist",
        Value::Dictionary{
            {"PrimaryCloudAccount", Value::Dictionary{{"altDSID", "primary"}}},
            {"KFAccount",
             Value::Dictionary{{"altDSID", "kf"},
                               {"Tokens", Value::Dictionary{{"com.velmora.kf.supportapp.auth",
                                                             "stored-token"}}}}},
            {"StoreAccount", Value::Dictionary{{"storefront", "143441-1,29"}}}});
    // coverage-sim trusts only the root attestation-ca prints.
    auto ca = ctl({"attestation-ca"});
    ASSERT_EQ(ca.status, 0) << ca.err;
    ASSERT_EQ(ca.out.rfind("-----BEGIN CERTIFICATE-----", 0), 0u) << ca.out;
    const std::string rootFile = home.home() + "/printed-root.pem";
    test::writeFile(rootFile, ca.out);
    test::CoverageSimProcess sim(home.home() + "/sim", home.home() + "/sim-root",
                                 {"--attestation-root", rootFile});
    ASSERT_FALSE(sim.base().empty()) << "coverage-sim did not start";
    const std::string url = sim.base() + "/api/v3/coverage/summary";
    ASSERT_EQ(ctl({"defaults", "write", "WarrantyURL", "-string", url}).status, 0);

    auto own =
        ctl({"request-preview", "C02DEVICE", "--bundle-id", "com.velmora.Preferences", "--json"});
    ASSERT_EQ(own.status, 0) << own.err;
    auto printed = parseJson(own.out).value_or(Value());
    EXPECT_EQ(*printed.find("url"), Value(url));
    EXPECT_EQ(*printed.find("method"), Value("POST"));
    const Value& headers = *printed.find("headers");
    EXPECT_EQ(*headers.find("X-Velmora-KF-Token"), Value("stored-token"));
    EXPECT_EQ(*headers.find("User-Agent"), Value("<com.velmora.Preferences/4.2/Model9,1>"));
    EXPECT_EQ(*headers.find("storefrontLocale"), Value("143441-1,29"));
    const std::string body = *printed.find("body")->asString();
    EXPECT_EQ(*parseJson(body)->find("serialNumber"), Value("C02DEVICE"));

    CurlHttpClient::Options options;
    options.extraCAFile = sim.caFile();
    CurlHttpClient http(options);
    auto send = [&](const std::string& sentBody) {
        HttpRequest request(url, 20);
        request.setMethod("POST");
        for (const auto& [name, value] : *headers.asDictionary()) {
            request.setValue(name, *value.asString());
        }
        request.setBody(sentBody);
        std::promise<HttpResult> done;
        http.send(request, [&](HttpResult r) { done.set_value(std::move(r)); });
        auto result = done.get_future().get();
        return result.response ? static_cast<int>(result.response->statusCode) : 0;
    };
    EXPECT_EQ(send(body), 200);
    ASSERT_FALSE(sim.requestLog().empty());
    EXPECT_EQ(*sim.requestLog().back().find("attestation"), Value("valid"));
    EXPECT_EQ(send(body.substr(0, body.size() - 1) + " }"), 403)
        << "the attestation covers the body";

    // Another device's request goes to the wearables endpoint without attestation; a later
    // attempt renews the token first.
    auto other = ctl({"request-preview", "WATCH-1", "--attempt", "2", "--json"});
    ASSERT_EQ(other.status, 0) << other.err;
    auto otherRequest = parseJson(other.out).value_or(Value());
    EXPECT_EQ(*otherRequest.find("url"),
              Value("https://coverage.velmora.example/api/v2/coverage/summary"));
    const Value& otherHeaders = *otherRequest.find("headers");
    EXPECT_FALSE(otherHeaders.find("X-Velmora-Kva"));
    EXPECT_FALSE(otherHeaders.find("X-Velmora-Kva-S"));
    EXPECT_NE(*otherHeaders.find("X-Velmora-KF-Token"), Value("stored-token"));
    EXPECT_EQ(*otherHeaders.find("User-Agent"), Value("<com.velmora.qaxagent/4.2/Model9,1>"));
    EXPECT_EQ(ctl({"request-preview", "C02DEVICE", "--attempt", "3"}).status, 64);
}

}  // namespace
}  // namespace qax
