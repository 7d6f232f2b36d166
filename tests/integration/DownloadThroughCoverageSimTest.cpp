// The agent's whole download path as a client sees it, against the real coverage-sim:
// qaxctl request-preview prints the signed request a download attempt sends, which the service
// accepts against the root attestation-ca prints; a forced all-devices request makes the
// running agent negotiate, renew its token, sign, attest and fetch each device's summary and
// cache it; with the service stopped, cached-only and default-policy requests still answer the
// same warranties.
#include <gtest/gtest.h>

#include <filesystem>
#include <map>
#include <memory>

#include "AgentProcess.h"
#include "CoverageSimProcess.h"
#include "core/JsonCodec.h"
#include "platform/host/FilePreferenceStore.h"
#include "platform/host/HostIpcClient.h"

namespace qax {
namespace {

constexpr double kWait = 60;
constexpr const char* kPhone = "ITEST-DL-PHONE";
constexpr const char* kWatch = "ITEST-DL-WATCH";
constexpr const char* kAllDeviceInfos = "getAllDeviceInfosUsingPolicy:updateFollowUps:withReply:";

// Serial number -> the summary of its warranty (none when the device came without one).
using Answers = std::map<std::string, std::optional<Value>>;

Answers answersOf(const Value& reply) {
    Answers out;
    for (const Value& info : *reply.asArray()) {
        const Value* serial = info.find("device")->find("serialNumber");
        const Value* warranty = info.find("warranty");
        out[*serial->asString()] =
            warranty ? std::optional<Value>(*warranty->find("DictionaryRepresentation"))
                     : std::nullopt;
    }
    return out;
}

TEST(DownloadThroughCoverageSim, PreviewedRequestsThenForcedDownloadThenCachedAnswers) {
    test::AgentProcess agent;
    const std::string root = agent.platformRoot();
    agent.writeDevices(kPhone, kWatch);
    auto refused = agent.ctl({"request-preview", kPhone, "--json"});
    EXPECT_EQ(refused.status, 1);
    EXPECT_TRUE(refused.out.empty()) << refused.out;
    EXPECT_NE(refused.err.find("No primary Skyvault account, can't sign this request"),
              std::string::npos)
        << refused.err;

    // coverage-sim trusts only the root attestation-ca prints.
    auto ca = agent.ctl({"attestation-ca"});
    ASSERT_EQ(ca.status, 0) << ca.err;
    ASSERT_EQ(ca.out.rfind("-----BEGIN CERTIFICATE-----", 0), 0u) << ca.out;
    test::writeFile(agent.home() + "/printed-root.pem", ca.out);
    auto sim = std::make_unique<test::CoverageSimProcess>(
        agent.home() + "/sim", root,
        std::vector<std::string>{"--attestation-root", agent.home() + "/printed-root.pem"});
    ASSERT_FALSE(sim->base().empty()) << "coverage-sim did not start";
    agent.writeAccounts(sim->base() + "/token",
                        {{"com.velmora.kf.supportapp.auth", "stored-token"}});
    FilePreferenceStore preferences(FilePreferenceStore::domainPath(agent.home()));
    preferences.setObject("ServerVersionURL", sim->base() + "/library/VELMORA/asset/qaxV2.plist");
    preferences.setObject("WarrantyURL", sim->base() + "/api/v3/coverage/summary");
    preferences.setObject("WearablesWarrantyURL", sim->base() + "/api/v2/coverage/summary");

    auto own =
        agent.ctl({"request-preview", kPhone, "--bundle-id", "com.velmora.Preferences", "--json"});
    ASSERT_EQ(own.status, 0) << own.err;
    auto printed = parseJson(own.out).value_or(Value());
    EXPECT_EQ(*printed.find("url"), Value(sim->base() + "/api/v3/coverage/summary"));
    EXPECT_EQ(*printed.find("method"), Value("POST"));
    const Value& headers = *printed.find("headers");
    EXPECT_EQ(*headers.find("X-Velmora-KF-Token"), Value("stored-token"));
    EXPECT_EQ(*headers.find("User-Agent"), Value("<com.velmora.Preferences/1.0/Phone1,1>"));
    EXPECT_EQ(*headers.find("storefrontLocale"), Value("143441-1,29"));
    const std::string body = *printed.find("body")->asString();
    EXPECT_EQ(*parseJson(body)->find("serialNumber"), Value(kPhone));
    auto send = [&](const std::string& sentBody) {
        HttpRequest request(*printed.find("url")->asString(), 20);
        request.setMethod("POST");
        for (const auto& [name, value] : *headers.asDictionary()) {
            request.setValue(name, *value.asString());
        }
        request.setBody(sentBody);
        auto result = sim->send(request);
        return result.response ? static_cast<int>(result.response->statusCode) : 0;
    };
    EXPECT_EQ(send(body), 200);
    EXPECT_EQ(*sim->requestLog().back().find("attestation"), Value("valid"));
    EXPECT_EQ(send(body.substr(0, body.size() - 1) + " }"), 403)
        << "the attestation covers the body";

    // Another device's request goes to the wearables endpoint without attestation; a later
    // attempt renews the token first.
    auto other = agent.ctl({"request-preview", kWatch, "--attempt", "2", "--json"});
    ASSERT_EQ(other.status, 0) << other.err;
    auto otherRequest = parseJson(other.out).value_or(Value());
    EXPECT_EQ(*otherRequest.find("url"), Value(sim->base() + "/api/v2/coverage/summary"));
    const Value& otherHeaders = *otherRequest.find("headers");
    EXPECT_FALSE(otherHeaders.find("X-Velmora-Kva"));
    EXPECT_FALSE(otherHeaders.find("X-Velmora-Kva-S"));
    EXPECT_NE(*otherHeaders.find("X-Velmora-KF-Token"), Value("stored-token"));
    EXPECT_EQ(*otherHeaders.find("User-Agent"), Value("<com.velmora.qaxagent/1.0/Phone1,1>"));
    EXPECT_EQ(agent.ctl({"request-preview", kPhone, "--attempt", "3"}).status, 64);

    // The agent starts without a token: it renews one itself.
    agent.writeAccounts(sim->base() + "/token");
    const std::size_t previewRequests = sim->requestLog().size();
    agent.registerApplication("tests", test::selfExecutable(), std::nullopt, Value(true));
    // The first start's outreach would download the same summaries in the background, with
    // dates relative to its own moment; this test is about the client's requests only.
    agent.extraEnvironment = {"QAX_NETWORK=down"};
    ASSERT_TRUE(agent.start()) << agent.log();

    HostIpcClient client;
    std::string error;
    ASSERT_TRUE(client.connect(agent.socketPath(), &error)) << error;
    auto call = [&](const std::string& op, Value::Array args) -> std::optional<Value> {
        auto reply = client.call(op, args, kWait, &error);
        EXPECT_TRUE(reply && !reply->error) << op << ": " << error;
        return reply ? reply->value : std::nullopt;
    };

    // Forced: the versions are negotiated, the token renewed, both devices fetched; only this
    // device's request is attested, and the service verified it.
    auto forced = call(kAllDeviceInfos, {Value(2), Value(false)});
    ASSERT_TRUE(forced && forced->isArray());
    const Answers downloaded = answersOf(*forced);
    ASSERT_EQ(downloaded.size(), 2u);
    ASSERT_TRUE(downloaded.at(kPhone) && downloaded.at(kWatch)) << agent.log();
    EXPECT_EQ(preferences.objectForKey("ServerVersionCache"),
              (Value::Dictionary{{"LowServerVersion", 2}, {"HighServerVersion", 3}}));
    std::map<std::string, std::string> attestation;
    int renewals = 0;
    const auto log = sim->requestLog();
    for (std::size_t i = previewRequests; i < log.size(); ++i) {
        const Value& request = log[i];
        const std::string path = *request.find("path")->asString();
        renewals += path == "/token";
        if (path.find("/coverage/summary") != std::string::npos) {
            const std::string serial =
                request.find("body")->asString()->find(kPhone) != std::string::npos ? kPhone
                                                                                    : kWatch;
            attestation[serial] = *request.find("attestation")->asString();
            const Value* token = request.find("headers")->find("X-Velmora-KF-Token");
            EXPECT_EQ(token ? token->asString()->rfind("kf-", 0) : 1, 0u) << "a renewed token";
        }
    }
    EXPECT_GE(renewals, 1);
    EXPECT_EQ(attestation[kPhone], "valid");
    EXPECT_EQ(attestation[kWatch], "absent");
    // The signing keys are the user's alone, and the log names the devices only as private.
    namespace fs = std::filesystem;
    int keys = 0;
    for (const auto& key : fs::directory_iterator(root + "/state/keys")) {
        ++keys;
        EXPECT_EQ(key.status().permissions() & (fs::perms::group_all | fs::perms::others_all),
                  fs::perms::none)
            << key.path();
    }
    EXPECT_GE(keys, 1);
    EXPECT_GE(agent.countInLog("<private> : warranty download attempt"), 2);
    EXPECT_EQ(agent.countInLog(std::string(kPhone) + " : warranty download attempt"), 0);

    // The service goes away; the cache answers alone.
    sim.reset();
    auto cached = call(kAllDeviceInfos, {Value(1), Value(false)});
    ASSERT_TRUE(cached && cached->isArray());
    EXPECT_EQ(answersOf(*cached), downloaded);
    auto fresh = call("getDeviceInfoForSerialNumber:usingPolicy:withReply:", {kPhone, Value(0)});
    ASSERT_TRUE(fresh && fresh->find("warranty"));
    EXPECT_EQ(*fresh->find("warranty")->find("DictionaryRepresentation"), *downloaded.at(kPhone));
}

}  // namespace
}  // namespace qax
