// qaxctl's client verbs: what each sends, how it prints each kind of reply, and how it
// reports bad usage, an absent agent or an error reply. The replies come from a stand-in on
// the agent's socket, so every reply shape can be tried (the real agent's refusal and round
// trips are in AgentServiceTest).
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <mutex>
#include <thread>

#include "AgentProcess.h"
#include "core/JsonCodec.h"
#include "core/PlistCodec.h"
#include "devices/QAXDeviceInfo.h"
#include "platform/host/IpcFrameCodec.h"
#include "warranty/QAXWarranty.h"

namespace qax {
namespace {

// Stands in for the agent on its socket: answers every request with the message set last
// ({"reply": v}, {"error": text} or {} for a reply of none) and keeps the last request.
class FakeAgent {
  public:
    explicit FakeAgent(const std::string& runtimeDirectory) {
        std::filesystem::create_directories(runtimeDirectory);
        const std::string path = runtimeDirectory + "/com.velmora.qaxagent";
        sockaddr_un addr{};
        addr.sun_family = AF_UNIX;
        std::snprintf(addr.sun_path, sizeof addr.sun_path, "%s", path.c_str());
        fd_ = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        if (::bind(fd_, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0 ||
            ::listen(fd_, 4) != 0) {
            ADD_FAILURE() << "cannot listen on " << path;
        }
        thread_ = std::thread([this] { serve(); });
    }
    ~FakeAgent() {
        stop_ = true;
        thread_.join();
        ::close(fd_);
    }

    void answer(Value::Dictionary message) {
        std::lock_guard lock(mutex_);
        message_ = std::move(message);
    }
    std::pair<std::string, Value::Array> lastRequest() {
        std::lock_guard lock(mutex_);
        return last_;
    }

  private:
    void serve() {
        while (!stop_) {
            pollfd p{fd_, POLLIN, 0};
            if (::poll(&p, 1, 50) <= 0) {
                continue;
            }
            const int client = ::accept4(fd_, nullptr, nullptr, SOCK_CLOEXEC);
            if (client >= 0) {
                answerOne(client);
                ::close(client);
            }
        }
    }

    void answerOne(int client) {
        IpcFrameCodec codec;
        std::string payload;
        char buffer[4096];
        while (codec.next(payload) != IpcFrameCodec::Status::Frame) {
            pollfd p{client, POLLIN, 0};
            const ssize_t n =
                ::poll(&p, 1, 5000) > 0 ? ::recv(client, buffer, sizeof buffer, 0) : 0;
            if (n <= 0) {
                return;
            }
            codec.append(std::string_view(buffer, static_cast<std::size_t>(n)));
        }
        auto request = parsePlist(payload);
        if (!request) {
            return;
        }
        Value::Dictionary reply;
        {
            std::lock_guard lock(mutex_);
            last_ = {*request->find("op")->asString(), *request->find("args")->asArray()};
            reply = message_;
        }
        reply["id"] = *request->find("id");
        auto frame = IpcFrameCodec::encode(Value(std::move(reply)));
        ::send(client, frame->data(), frame->size(), MSG_NOSIGNAL);
    }

    int fd_ = -1;
    std::thread thread_;
    std::atomic<bool> stop_{false};
    std::mutex mutex_;
    Value::Dictionary message_;
    std::pair<std::string, Value::Array> last_;
};

Value summaryEndingIn(double seconds) {
    using namespace std::chrono;
    const double now = duration<double>(system_clock::now().time_since_epoch()).count();
    return Value(Value::Dictionary{
        {"covered", Value(true)},
        {"coverageLocalizedLabel", Value("Limited Warranty")},
        {"hvOfferEligible", Value(true)},
        {"hvOfferEligibleUntil", Value(static_cast<long long>((now + seconds) * 1000))},
        {"hvLocalizedOfferLabel", Value("Add the plan")},
        {"hvLocalizedOfferPluralDescFormat", Value("%@ days left")},
        {"featureToggleParameters", Value(Value::Dictionary{{"hvOfferDisplay", Value(true)}})},
    });
}

class QaxctlClientVerbsTest : public ::testing::Test {
  protected:
    test::ToolResult run(const std::vector<std::string>& args) {
        return test::runTool(QAX_CTL_BINARY, args, agent.environment());
    }

    test::AgentProcess agent;  // its directories and environment; started only where needed
    test::TestPlatform tp;
};

TEST_F(QaxctlClientVerbsTest, EachVerbSendsItsRequestAndPrintsTheReply) {
    auto absent = run({"device-info"});
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
        auto result = run(args);
        EXPECT_EQ(result.status, 64) << args[0] << " " << result.err;
        EXPECT_EQ(result.err.rfind("usage: qaxctl " + args[0], 0), 0u) << result.err;
    }

    FakeAgent fake(agent.runtimeDirectory());
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
         {Value(1), Value(true)}, reply(Value(Value::Array{offer, bare})), 0,
         "\"serialNumber\": \"SN-0\""},
        {{"device-infos"}, all, {Value(0), Value(false)}, reply(Value(Value::Array{})), 0,
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
         reply(Value(Value::Array{Value(Value::Dictionary{{"$class", Value("QAXDevice")}})})), 70,
         "not what was expected"},
        // clang-format on
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.args[0] + (row.args.size() > 1 ? " " + row.args[1] : ""));
        fake.answer(row.answer);
        auto result = run(row.args);
        EXPECT_EQ(result.status, row.status) << result.err;
        EXPECT_NE((row.status == 0 ? result.out : result.err).find(row.out), std::string::npos)
            << result.out << result.err;
        auto [op, sent] = fake.lastRequest();
        EXPECT_EQ(op, row.op);
        EXPECT_EQ(Value(sent), Value(row.sent));
    }

    // The JSON form of a device info, which scripts read.
    fake.answer(reply(offer));
    auto json = parseJson(run({"device-info", "--json"}).out);
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
    fake.answer(reply(Value(true)));
    EXPECT_EQ(test::runTool(QAX_CTL_BINARY, {"schedule-outreach"}, env).status, 0);
}

}  // namespace
}  // namespace qax
