// qaxctl's client verbs: what each sends, how it prints each kind of reply, and how it
// reports bad usage, an absent agent or an error reply. The replies come from a stand-in on
// the agent's socket, so every reply shape can be tried (the real agent's refusal and round
// trips are in AgentServiceTest).
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>

#include "AgentProcess.h"
#include "core/JsonCodec.h"
#include "core/PlistCodec.h"
#include "devices/QAXDeviceInfo.h"
#include "platform/host/IpcFrameCodec.h"
#include "warranty/QAXWarranty.h"

namespace qax {
namespace {

struct Exchange {
    test::ToolResult result;
    Value op, args;  // of the request qaxctl sent; null without one
};

// Runs qaxctl with `args` while standing in for the agent on `listening`: the one request it
// sends is answered with `message` ({"reply": v}, {"error": text} or {} for a reply of none).
Exchange exchange(int listening, const std::vector<std::string>& environment,
                  const std::vector<std::string>& args, Value::Dictionary message) {
    test::TempDir out;
    test::SpawnedProcess ctl(QAX_CTL_BINARY, args, environment, out.str() + "/out",
                             out.str() + "/err");
    Exchange e;
    pollfd p{listening, POLLIN, 0};
    const int client =
        ::poll(&p, 1, 10'000) == 1 ? ::accept4(listening, nullptr, nullptr, SOCK_CLOEXEC) : -1;
    IpcFrameCodec codec;
    std::string payload;
    char buffer[4096];
    ssize_t n = 1;
    while (client >= 0 && n > 0 && codec.next(payload) != IpcFrameCodec::Status::Frame) {
        n = ::recv(client, buffer, sizeof buffer, 0);
        codec.append(std::string_view(buffer, n > 0 ? static_cast<std::size_t>(n) : 0));
    }
    if (auto request = parsePlist(payload); request && request->isDictionary()) {
        e.op = *request->find("op");
        e.args = *request->find("args");
        message["id"] = *request->find("id");
        auto frame = IpcFrameCodec::encode(Value(std::move(message)));
        ::send(client, frame->data(), frame->size(), MSG_NOSIGNAL);
    }
    if (client >= 0) {
        ::close(client);
    }
    auto status = ctl.waitForExit(30);
    e.result = {status && WIFEXITED(*status) ? WEXITSTATUS(*status) : -1,
                test::readFile(out.path() / "out"), test::readFile(out.path() / "err")};
    return e;
}

Value summaryEndingIn(double seconds) {
    using namespace std::chrono;
    const double now = duration<double>(system_clock::now().time_since_epoch()).count();
    return Value::Dictionary{
        {"covered", Value(true)},
        {"coverageLocalizedLabel", Value("Limited Warranty")},
        {"hvOfferEligible", Value(true)},
        {"hvOfferEligibleUntil", Value(static_cast<long long>((now + seconds) * 1000))},
        {"hvLocalizedOfferLabel", Value("Add the plan")},
        {"hvLocalizedOfferPluralDescFormat", Value("%@ days left")},
        {"featureToggleParameters", Value(Value::Dictionary{{"hvOfferDisplay", Value(true)}})},
    };
}

class QaxctlClientVerbsTest : public ::testing::Test {
  protected:
    test::AgentProcess agent;  // its directories and environment; started only where needed
    test::TestPlatform tp;
};

TEST_F(QaxctlClientVerbsTest, EachVerbSendsItsRequestAndPrintsTheReply) {
    auto absent = agent.ctl({"device-info"});
    EXPECT_EQ(absent.status, 69);
    EXPECT_NE(absent.err.find("is qaxagent running?"), std::string::npos) << absent.err;
    for (const auto& args : std::vector<std::vector<std::string>>{
             {"device-info", "A", "B"},
             {"device-info", "--policy", "soon"},
             {"device-infos", "extra"},
             {"dismiss-notification", "A", "B"},
             {"schedule-outreach", "--after", "-5"},
             {"account-added", "--timeout", "soon"},
             {"store-check", "--json"},
         }) {
        auto result = agent.ctl(args);
        EXPECT_EQ(result.status, 64) << args[0] << " " << result.err;
        EXPECT_EQ(result.err.rfind("usage: qaxctl " + args[0], 0), 0u) << result.err;
    }

    std::filesystem::create_directories(agent.runtimeDirectory());
    const int listening = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_un address{.sun_family = AF_UNIX, .sun_path = {}};
    std::snprintf(address.sun_path, sizeof address.sun_path, "%s", agent.socketPath().c_str());
    ASSERT_EQ(::bind(listening, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
    ASSERT_EQ(::listen(listening, 4), 0);
    auto device = QAXDevice::deviceWithName("Morning", "W1", Date(1.7e9), QAXDeviceTypeWatch);
    auto offer = QAXDeviceInfo::deviceInfoWithDevice(
                     device, QAXWarranty::initWithDictionary(tp.platform,
                                                             summaryEndingIn(10 * 86400 - 3600)))
                     ->encode();
    auto bare =
        QAXDeviceInfo::deviceInfoWithDevice(
            QAXDevice::deviceWithName("Phone", "SN-0", std::nullopt, QAXDeviceTypeDefault), nullptr)
            ->encode();
    const Value availability(Value::Dictionary{{"AppBundleID", Value("com.velmora.support")},
                                               {"AppTitleKey", Value("Velmora Support")},
                                               {"AppAvailabilityType", Value(3)}});
    auto reply = [](Value v) { return Value::Dictionary{{"reply", std::move(v)}}; };
    const std::string byDefault = "getDefaultDeviceInfoUsingPolicy:withReply:",
                      bySerial = "getDeviceInfoForSerialNumber:usingPolicy:withReply:",
                      all = "getAllDeviceInfosUsingPolicy:updateFollowUps:withReply:",
                      store = "checkIsAvailableInStore:withReply:",
                      dismiss = "dismissFollowUpForSerialNumber:completion:";
    const Value::Array none;
    const Value::Dictionary noReply;
    struct Row {
        std::vector<std::string> args;
        std::string op;
        Value::Array sent;
        Value::Dictionary answer;
        int status;
        std::string out;  // expected in stdout (exit 0) or stderr (otherwise)
    } rows[] = {
        // clang-format off
        {{"device-info"}, byDefault, {Value(0)}, reply(offer), 0, "10 days left"},
        {{"device-info", "W1", "--policy", "force", "--json"}, bySerial, {Value("W1"), Value(2)},
         reply(offer), 0, "\"daysEligible\": 10"},
        {{"device-info", "SN-0", "--policy", "7"}, bySerial, {Value("SN-0"), Value(7)}, reply(bare),
         0, "no warranty"},
        {{"device-infos", "--policy", "cached", "--update-followups", "--json"}, all,
         {Value(1), Value(true)}, reply(Value::Array{offer, bare}), 0,
         "\"serialNumber\": \"SN-0\""},
        {{"device-infos"}, all, {Value(0), Value(false)}, reply(Value::Array{}), 0,
         "No devices."},
        {{"dismiss-followup", "W1"}, dismiss, {Value("W1")}, reply(Value(true)), 0,
         "follow-up of W1 dismissed"},
        {{"dismiss-notification", "W1", "--json"}, "dismissNotificationForSerialNumber:completion:",
         {Value("W1")}, reply(Value(false)), 0, "false"},
        {{"schedule-outreach"}, "scheduleOutreachWithReply:", none, reply(Value(true)), 0,
         "outreach scheduled"},
        {{"schedule-outreach", "--after", "2h", "--json"}, "scheduleOutreachAfter:withReply:",
         {Value(7200.0)}, reply(Value(true)), 0, "true"},
        {{"account-added"}, "velmoraAccountAddedWithReply:", none, reply(Value(false)), 0,
         "skipped"},
        {{"support-availability", "com.velmora.support"}, "appSupportAvailability:withReply:",
         {Value("com.velmora.support")}, reply(availability), 0, "available in the Marketa"},
        {{"store-check", "x", "--json"}, store, {Value("x")}, reply(availability), 0,
         "\"AppTitleKey\": \"Velmora Support\""},
        {{"store-check", "x"}, store, {Value("x")}, noReply, 0, "not found in the Marketa"},
        {{"web-url-override", "--json"}, "readWebURLOverride:", none, noReply, 0, "null"},
        // Errors and replies of the wrong kind.
        {{"device-info"}, byDefault, {Value(0)}, {{"error", Value("unsupported operation")}}, 70,
         "the agent answered an error: unsupported operation"},
        {{"dismiss-followup", "W1"}, dismiss, {Value("W1")}, reply(Value("yes")), 70,
         "not what was expected"},
        {{"device-infos"}, all, {Value(0), Value(false)},
         reply(Value::Array{Value(Value::Dictionary{{"$class", Value("QAXDevice")}})}), 70,
         "not what was expected"},
        // clang-format on
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.args[0] + (row.args.size() > 1 ? " " + row.args[1] : ""));
        auto [result, op, sent] = exchange(listening, agent.environment(), row.args, row.answer);
        EXPECT_EQ(result.status, row.status) << result.err;
        EXPECT_NE((row.status == 0 ? result.out : result.err).find(row.out), std::string::npos)
            << result.out << result.err;
        EXPECT_EQ(op, Value(row.op));
        EXPECT_EQ(sent, Value(row.sent));
    }

    // The JSON form of a device info, which scripts read.
    auto json =
        parseJson(exchange(listening, agent.environment(), {"device-info", "--json"}, reply(offer))
                      .result.out);
    ASSERT_TRUE(json && json->isDictionary());
    const Value* warranty = json->find("warranty");
    ASSERT_TRUE(warranty && warranty->isDictionary());
    EXPECT_EQ(*json->find("device")->find("serialNumber"), Value("W1"));
    EXPECT_EQ(*warranty->find("hvLocalizedOfferDesc"), Value("10 days left"));
    EXPECT_EQ(*warranty->find("covered"), Value(true));
    EXPECT_TRUE(warranty->find("hvOfferEligibleUntil")->isString());
    EXPECT_EQ(*warranty->find("summary")->find("hvLocalizedOfferLabel"), Value("Add the plan"));

    // Under systemd the socket lives in $XDG_RUNTIME_DIR/qaxagent.
    std::vector<std::string> env;
    for (const auto& variable : agent.environment()) {
        if (variable.rfind("QAX_RUNTIME_DIR=", 0) != 0) {
            env.push_back(variable);
        }
    }
    env.push_back("QAX_RUNTIME_DIR=" + agent.home() + "/elsewhere");
    env.push_back("XDG_RUNTIME_DIR=" + agent.home());
    std::filesystem::rename(agent.runtimeDirectory(), agent.home() + "/qaxagent");
    EXPECT_EQ(exchange(listening, env, {"schedule-outreach"}, reply(Value(true))).result.status, 0);
    ::close(listening);
}

}  // namespace
}  // namespace qax
