// The running agent over its real socket: who gets served, what a request gets back, what
// hostile or broken clients do to the others, launch events, and a clean stop.
#include <gtest/gtest.h>

#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>

#include <set>

#include "AgentProcess.h"
#include "core/JsonCodec.h"
#include "core/PlistCodec.h"
#include "devices/QAXDevice.h"
#include "platform/host/FilePreferenceStore.h"
#include "platform/host/HostIpcClient.h"
#include "platform/host/HostNotificationSocket.h"
#include "platform/host/IpcFrameCodec.h"

namespace qax {
namespace {

constexpr double kWait = 10;
constexpr const char* kRejected =
    "Rejecting connection to qaxagent: missing entitlement 'com.velmora.private.qaxagent'";

class AgentServiceTest : public ::testing::Test {
  protected:
    void SetUp() override {
        agent.writeRootFile("device.plist",
                            Value(Value::Dictionary{{"SerialNumber", Value("ITEST-SN-1")},
                                                    {"ProductType", Value("Phone1,1")},
                                                    {"ProductVersion", Value("1.0")}}));
        // This test process is the entitled client; it is registered outside any bundle.
        entitle(Value(true));
        ASSERT_TRUE(agent.start()) << agent.log();
    }

    void entitle(std::optional<Value> value) {
        agent.registerApplication("tests", test::selfExecutable(), std::nullopt, std::move(value));
    }

    std::unique_ptr<HostIpcClient> connect() {
        auto client = std::make_unique<HostIpcClient>();
        std::string error;
        EXPECT_TRUE(client->connect(agent.socketPath(), &error)) << error;
        return client;
    }

    // The default device's serial number as a client sees it; none when the call failed.
    std::optional<std::string> defaultSerial(HostIpcClient& client) {
        std::string error;
        auto reply = client.call("defaultDevice:", {}, kWait, &error);
        if (!reply || !reply->value) {
            return std::nullopt;
        }
        auto device = QAXDevice::decode(*reply->value);
        return device ? device->serialNumber() : std::nullopt;
    }

    test::AgentProcess agent;
};

TEST_F(AgentServiceTest, EntitledClientGetsTheDefaultDevice) {
    auto client = connect();
    std::string error;
    auto reply = client->call("defaultDevice:", {}, kWait, &error);
    ASSERT_TRUE(reply) << error;
    ASSERT_FALSE(reply->error) << *reply->error;
    ASSERT_TRUE(reply->value);
    auto device = QAXDevice::decode(*reply->value);
    ASSERT_NE(device, nullptr) << reply->value->description();
    EXPECT_EQ(device->name(), "Default Device");
    EXPECT_EQ(device->serialNumber(), "ITEST-SN-1");
    EXPECT_EQ(device->deviceType(), QAXDeviceTypeDefault);
    EXPECT_TRUE(agent.waitForLog("connection added from " + std::to_string(getpid()) +
                                 " with calling process: (null)"));
}

TEST_F(AgentServiceTest, DeviceInfosAndDismissalsAreServed) {
    auto client = connect();
    std::string error;
    // Cached only: nothing is cached, so the one device comes back without a warranty.
    auto all = client->call("getAllDeviceInfosUsingPolicy:updateFollowUps:withReply:",
                            {Value(1), Value(true)}, kWait, &error);
    ASSERT_TRUE(all && all->value && all->value->isArray()) << error;
    ASSERT_EQ(all->value->size(), 1u);
    const Value& info = (*all->value->asArray())[0];
    EXPECT_EQ(*info.find("$class"), Value("QAXDeviceInfo"));
    EXPECT_EQ(*info.find("device")->find("serialNumber"), Value("ITEST-SN-1"));
    EXPECT_FALSE(info.find("warranty"));

    auto dismissed = client->call(
        "dismissFollowUpForSerialNumber:completion:", {Value("ITEST-SN-1")}, kWait, &error);
    ASSERT_TRUE(dismissed) << error;
    EXPECT_EQ(dismissed->value, Value(true));
    EXPECT_TRUE(agent.running());
}

TEST_F(AgentServiceTest, ClientsWithoutTheEntitlementAreClosed) {
    const std::pair<const char*, std::optional<Value>> refused[] = {
        {"no entitlement", std::nullopt},
        {"the string YES", Value("YES")},
        {"false", Value(false)},
        {"zero", Value(0)},
    };
    int rejections = 0;
    for (const auto& [what, value] : refused) {
        entitle(value);
        auto client = connect();
        std::string error;
        client->sendRequest(1, "defaultDevice:", {}, &error);
        EXPECT_TRUE(client->waitForClose(kWait)) << what;
        EXPECT_TRUE(agent.waitForLog(kRejected, ++rejections)) << what << "\n" << agent.log();
    }
    // A program the registry does not know at all.
    auto ctl = test::runTool(QAX_CTL_BINARY, {"default-device"}, agent.environment());
    EXPECT_EQ(ctl.status, 69) << ctl.err;
    EXPECT_TRUE(agent.waitForLog(kRejected, ++rejections));

    entitle(Value(1));
    auto client = connect();
    EXPECT_EQ(defaultSerial(*client), "ITEST-SN-1");
    EXPECT_TRUE(agent.running());
}

TEST_F(AgentServiceTest, TwoClientsAtOnceEachGetTheirOwnAgent) {
    auto a = connect();
    auto b = connect();
    std::string error;
    ASSERT_TRUE(a->sendRequest(7, "defaultDevice:", {}, &error)) << error;
    ASSERT_TRUE(b->sendRequest(7, "defaultDevice:", {}, &error)) << error;
    for (auto* client : {a.get(), b.get()}) {
        auto message = client->receive(kWait, &error);
        ASSERT_TRUE(message) << error;
        EXPECT_EQ(message->find("id")->asInteger(), 7);
        EXPECT_TRUE(message->find("reply"));
    }
    // Each connection made its agent (both fell back to the settings application's name).
    EXPECT_TRUE(agent.waitForLog("callingProcessBundleID is nil. Falling back to Preferences", 2));
    EXPECT_EQ(agent.countInLog("connection added from"), 2);

    a.reset();
    EXPECT_EQ(defaultSerial(*b), "ITEST-SN-1");
}

TEST_F(AgentServiceTest, BrokenFramesCloseOnlyTheirOwnConnection) {
    auto bytes = [](std::initializer_list<unsigned char> b) {
        return std::string(b.begin(), b.end());
    };
    std::string deep;
    for (int i = 0; i < 200; ++i) {
        deep += "<array>";
    }
    for (int i = 0; i < 200; ++i) {
        deep += "</array>";
    }
    deep = "<?xml version=\"1.0\" encoding=\"UTF-8\"?><plist version=\"1.0\">" + deep + "</plist>";
    const std::pair<const char*, std::string> broken[] = {
        {"not a property list", *IpcFrameCodec::frame("this is not a plist")},
        {"zero length", bytes({0, 0, 0, 0})},
        {"over 4 MiB", bytes({0, 0x40, 0, 1})},
        {"nested 200 deep", *IpcFrameCodec::frame(deep)},
        {"request without an id",
         *IpcFrameCodec::encode(Value(Value::Dictionary{{"op", Value("defaultDevice:")}}))},
        {"not a dictionary", *IpcFrameCodec::encode(Value(Value::Array{Value(1)}))},
    };
    auto bystander = connect();
    int closures = 0;
    for (const auto& [what, frame] : broken) {
        auto bad = connect();
        std::string error;
        ASSERT_TRUE(bad->sendRaw(frame, &error)) << what << ": " << error;
        EXPECT_TRUE(bad->waitForClose(kWait)) << what;
        EXPECT_TRUE(agent.waitForLog("Closing connection from pid", ++closures)) << what;
        EXPECT_EQ(defaultSerial(*bystander), "ITEST-SN-1") << "after " << what;
    }
    EXPECT_TRUE(agent.running());
}

TEST_F(AgentServiceTest, ErrorRepliesLeaveTheConnectionOpen) {
    auto client = connect();
    const std::tuple<const char*, Value::Array, const char*> cases[] = {
        {"noSuchOperation:", {}, "unknown operation 'noSuchOperation:'"},
        {"defaultDevice:", {Value(1)}, "wrong arguments"},
        {"getDeviceInfoForSerialNumber:usingPolicy:withReply:",
         {Value(""), Value(0)},
         "wrong arguments"},
    };
    for (const auto& [op, args, error] : cases) {
        std::string transport;
        auto reply = client->call(op, args, kWait, &transport);
        ASSERT_TRUE(reply) << op << ": " << transport;
        ASSERT_TRUE(reply->error) << op;
        EXPECT_EQ(reply->error->rfind(error, 0), 0u) << *reply->error;
    }
    // An XML request on the same connection is served as well.
    std::string error;
    auto xml = toXmlPlist(Value(Value::Dictionary{
        {"id", Value(99)}, {"op", Value("defaultDevice:")}, {"args", Value(Value::Array{})}}));
    ASSERT_TRUE(client->sendRaw(*IpcFrameCodec::frame(*xml), &error)) << error;
    auto message = client->receive(kWait, &error);
    ASSERT_TRUE(message) << error;
    EXPECT_EQ(message->find("id")->asInteger(), 99);
    EXPECT_EQ(defaultSerial(*client), "ITEST-SN-1");
}

TEST_F(AgentServiceTest, ManyOutstandingRequestsOnOneConnection) {
    auto client = connect();
    constexpr int kRequests = 300;  // well past what the agent keeps in flight at once
    std::string all;
    for (int id = 1; id <= kRequests; ++id) {
        all += *IpcFrameCodec::encode(
            Value(Value::Dictionary{{"id", Value(id)},
                                    {"op", Value(id % 2 ? "defaultDevice:" : "pairedDevices:")},
                                    {"args", Value(Value::Array{})}}));
    }
    std::string error;
    ASSERT_TRUE(client->sendRaw(all, &error)) << error;
    std::set<std::int64_t> ids;
    for (int i = 0; i < kRequests; ++i) {
        auto message = client->receive(kWait, &error);
        ASSERT_TRUE(message) << "reply " << i << ": " << error << "\n" << agent.log();
        EXPECT_FALSE(message->find("error"));
        ids.insert(message->find("id")->asInteger().value_or(0));
    }
    EXPECT_EQ(ids.size(), static_cast<std::size_t>(kRequests));
    EXPECT_EQ(*ids.begin(), 1);
    EXPECT_EQ(*ids.rbegin(), kRequests);
}

TEST_F(AgentServiceTest, LaunchEventsReachTheHandler) {
    ASSERT_TRUE(HostNotificationSocket::post(agent.runtimeDirectory(),
                                             "com.velmora.pairlink.devicedidunpair"));
    EXPECT_TRUE(agent.waitForLog(
        "got launched with notificationName: com.velmora.pairlink.devicedidunpair"));
    EXPECT_EQ(agent.countInLog("entered stream for test"), 1);

    auto ctl = test::runTool(QAX_CTL_BINARY, {"notify", "com.velmora.pairlink.devicedidpair"},
                             agent.environment());
    EXPECT_EQ(ctl.status, 0) << ctl.err;
    EXPECT_TRUE(
        agent.waitForLog("got launched with notificationName: com.velmora.pairlink.devicedidpair"));
    EXPECT_EQ(agent.countInLog("entered stream for test"), 2);
}

TEST_F(AgentServiceTest, SecondAgentRefusesAndSignalsStopCleanly) {
    test::AgentProcess second;
    auto twin = test::runTool(QAX_AGENT_BINARY, {}, agent.environment(), 10);
    EXPECT_EQ(twin.status, 1) << "a second agent on the same socket must not start";
    EXPECT_NE(twin.err.find("another process serves"), std::string::npos) << twin.err;

    auto client = connect();
    EXPECT_EQ(defaultSerial(*client), "ITEST-SN-1") << "the first agent is undisturbed";

    const int status = agent.stop(SIGTERM);
    ASSERT_NE(status, -1) << "did not stop on SIGTERM";
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
    struct stat st {};
    EXPECT_NE(::stat(agent.socketPath().c_str(), &st), 0) << "socket file left behind";
    EXPECT_NE(::stat((agent.runtimeDirectory() + "/notify").c_str(), &st), 0);
    EXPECT_TRUE(client->waitForClose(kWait));

    // SIGINT the same way, and the agent starts again on the same directory.
    ASSERT_TRUE(agent.start()) << agent.log();
    const int interrupted = agent.stop(SIGINT);
    EXPECT_TRUE(WIFEXITED(interrupted) && WEXITSTATUS(interrupted) == 0) << interrupted;
}

TEST_F(AgentServiceTest, QaxctlShowsTheDevices) {
    agent.registerApplication("settings", std::filesystem::canonical(QAX_CTL_BINARY).string(),
                              "com.velmora.Preferences", Value(true));
    agent.writeRootFile("features.plist",
                        Value(Value::Dictionary{
                            {"Kestova", Value(Value::Dictionary{{"Tessel_3_0", Value(true)}})}}));
    Value::Dictionary watch{{"name", Value("Morning")},    {"localizedModel", Value("Watch")},
                            {"serialNumber", Value("W1")}, {"pairedDate", Value(Date(1.7e9))},
                            {"isPaired", Value(true)},     {"isArchived", Value(false)}};
    Value::Dictionary archived = watch;
    archived["serialNumber"] = "W0";
    archived["isArchived"] = true;
    agent.writeRootFile("paired-devices.plist", Value(Value::Array{Value(watch), Value(archived)}));
    FilePreferenceStore(FilePreferenceStore::domainPath(agent.home()))
        .setObject("ServerVersionOverride",
                   Value(Value::Dictionary{{"LowServerVersion", Value(2)},
                                           {"HighServerVersion", Value(3)}}));

    auto device = test::runTool(QAX_CTL_BINARY, {"default-device", "--json"}, agent.environment());
    ASSERT_EQ(device.status, 0) << device.err;
    auto json = parseJson(device.out);
    ASSERT_TRUE(json) << device.out;
    EXPECT_EQ(*json->find("serialNumber"), Value("ITEST-SN-1"));
    EXPECT_EQ(*json->find("deviceTypeString"), Value("Default"));
    EXPECT_TRUE(agent.waitForLog("with calling process: com.velmora.Preferences"));

    auto paired = test::runTool(QAX_CTL_BINARY, {"paired-devices", "--json"}, agent.environment());
    ASSERT_EQ(paired.status, 0) << paired.err;
    auto list = parseJson(paired.out);
    ASSERT_TRUE(list && list->isArray()) << paired.out;
    ASSERT_EQ(list->size(), 1u) << paired.out;
    EXPECT_EQ(*(*list->asArray())[0].find("serialNumber"), Value("W1"));
    EXPECT_EQ(*(*list->asArray())[0].find("name"), Value("Morning"));

    auto table = test::runTool(QAX_CTL_BINARY, {"paired-devices"}, agent.environment());
    EXPECT_EQ(table.status, 0);
    EXPECT_NE(table.out.find("Morning  W1"), std::string::npos) << table.out;
}

}  // namespace
}  // namespace qax
