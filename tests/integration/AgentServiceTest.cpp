// The running agent over its real socket: who gets served, what a request and qaxctl get back,
// what hostile or broken clients do to the others, launch events, and a clean stop.
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
        agent.writeRootFile("device.plist", Value::Dictionary{{"SerialNumber", Value("ITEST-SN-1")},
                                                              {"ProductType", Value("Phone1,1")},
                                                              {"ProductVersion", Value("1.0")},
                                                              {"InternalBuild", Value(true)}});
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
        auto device = reply && reply->value ? QAXDevice::decode(*reply->value) : nullptr;
        return device ? device->serialNumber() : std::nullopt;
    }

    test::AgentProcess agent;
};

TEST_F(AgentServiceTest, EntitledClientsAreServedOthersClosedAndBrokenSendersAlone) {
    auto client = connect();
    std::string error;
    auto reply = client->call("defaultDevice:", {}, kWait, &error);
    ASSERT_TRUE(reply && reply->value) << error;
    auto device = QAXDevice::decode(*reply->value);
    ASSERT_NE(device, nullptr) << reply->value->description();
    EXPECT_EQ(device->name(), "Default Device");
    EXPECT_EQ(device->serialNumber(), "ITEST-SN-1");
    EXPECT_EQ(device->deviceType(), QAXDeviceTypeDefault);
    EXPECT_TRUE(agent.waitForLog("connection added from " + std::to_string(getpid()) +
                                 " with calling process: (null)"));

    // Cached only: nothing is cached, so the one device comes back without a warranty, and the
    // log names no serial number by default.
    auto all = client->call("getAllDeviceInfosUsingPolicy:updateFollowUps:withReply:",
                            {Value(1), Value(true)}, kWait, &error);
    ASSERT_TRUE(all && all->value && all->value->size() == 1) << error;
    const Value& info = (*all->value->asArray())[0];
    EXPECT_EQ(*info.find("$class"), Value("QAXDeviceInfo"));
    EXPECT_EQ(*info.find("device")->find("serialNumber"), Value("ITEST-SN-1"));
    EXPECT_FALSE(info.find("warranty"));
    EXPECT_TRUE(agent.waitForLog("getWarrantyUsingPolicy completionBlock <private> : 0"));
    auto dismissed = client->call(
        "dismissFollowUpForSerialNumber:completion:", {Value("ITEST-SN-1")}, kWait, &error);
    ASSERT_TRUE(dismissed) << error;
    EXPECT_EQ(dismissed->value, Value(true));
    EXPECT_EQ(agent.log().find("ITEST-SN-1"), std::string::npos) << agent.log();

    // A second client at once gets its own agent (both fall back to the settings name).
    auto second = connect();
    EXPECT_EQ(defaultSerial(*second), "ITEST-SN-1");
    EXPECT_TRUE(agent.waitForLog("callingProcessBundleID is nil. Falling back to Preferences", 2));
    EXPECT_EQ(agent.countInLog("connection added from"), 2);
    second.reset();
    EXPECT_EQ(defaultSerial(*client), "ITEST-SN-1");

    const std::pair<const char*, std::optional<Value>> refused[] = {
        {"no entitlement", std::nullopt},
        {"the string YES", Value("YES")},
        {"false", Value(false)},
        {"zero", Value(0)},
    };
    int rejections = 0;
    for (const auto& [what, value] : refused) {
        entitle(value);
        auto bad = connect();
        bad->sendRequest(1, "defaultDevice:", {}, &error);
        EXPECT_TRUE(bad->waitForClose(kWait)) << what;
        EXPECT_TRUE(agent.waitForLog(kRejected, ++rejections)) << what << "\n" << agent.log();
    }
    // A program the registry does not know at all.
    auto unknown = agent.ctl({"store-check", "com.velmora.support"});
    EXPECT_EQ(unknown.status, 69);
    EXPECT_NE(unknown.err.find("the agent closed the connection"), std::string::npos)
        << unknown.err;
    EXPECT_TRUE(agent.waitForLog(kRejected, ++rejections));
    entitle(Value(1));
    EXPECT_EQ(defaultSerial(*connect()), "ITEST-SN-1");
    EXPECT_EQ(defaultSerial(*client), "ITEST-SN-1") << "the first client is still served";

    // Broken frames and bad requests harm only their sender.
    auto bytes = [](std::initializer_list<unsigned char> b) {
        return std::string(b.begin(), b.end());
    };
    std::string deep;
    for (int i = 0; i < 200; ++i) {
        deep = "<array>" + deep + "</array>";
    }
    deep = "<?xml version=\"1.0\" encoding=\"UTF-8\"?><plist version=\"1.0\">" + deep + "</plist>";
    const std::pair<const char*, std::string> broken[] = {
        {"not a property list", *IpcFrameCodec::frame("this is not a plist")},
        {"zero length", bytes({0, 0, 0, 0})},
        {"over 4 MiB", bytes({0, 0x40, 0, 1})},
        {"nested 200 deep", *IpcFrameCodec::frame(deep)},
        {"request without an id",
         *IpcFrameCodec::encode(Value::Dictionary{{"op", Value("defaultDevice:")}})},
        {"not a dictionary", *IpcFrameCodec::encode(Value::Array{Value(1)})},
    };
    int closures = 0;
    for (const auto& [what, frame] : broken) {
        auto bad = connect();
        ASSERT_TRUE(bad->sendRaw(frame, &error)) << what << ": " << error;
        EXPECT_TRUE(bad->waitForClose(kWait)) << what;
        EXPECT_TRUE(agent.waitForLog("Closing connection from pid", ++closures)) << what;
        EXPECT_EQ(defaultSerial(*client), "ITEST-SN-1") << "after " << what;
    }

    // Error replies leave the connection open.
    const std::tuple<const char*, Value::Array, const char*> errors[] = {
        {"noSuchOperation:", {}, "unknown operation 'noSuchOperation:'"},
        {"defaultDevice:", {Value(1)}, "wrong arguments"},
        {"getDeviceInfoForSerialNumber:usingPolicy:withReply:",
         {Value(""), Value(0)},
         "wrong arguments"},
    };
    for (const auto& [op, args, text] : errors) {
        std::string transport;
        auto answer = client->call(op, args, kWait, &transport);
        ASSERT_TRUE(answer && answer->error) << op << ": " << transport;
        EXPECT_EQ(answer->error->rfind(text, 0), 0u) << *answer->error;
    }

    // Far more requests at once than the agent keeps in flight, one of them in XML: each is
    // answered once.
    constexpr int kRequests = 300;
    std::string frames = *IpcFrameCodec::frame(*toXmlPlist(Value::Dictionary{
        {"id", Value(kRequests)}, {"op", Value("defaultDevice:")}, {"args", Value::Array{}}}));
    for (int id = 1; id < kRequests; ++id) {
        frames += *IpcFrameCodec::encode(
            Value::Dictionary{{"id", Value(id)},
                              {"op", Value(id % 2 ? "defaultDevice:" : "pairedDevices:")},
                              {"args", Value(Value::Array{})}});
    }
    ASSERT_TRUE(client->sendRaw(frames, &error)) << error;
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
    EXPECT_TRUE(agent.running());
}

TEST_F(AgentServiceTest, QaxctlLaunchEventsASecondAgentAndACleanStop) {
    agent.registerApplication("settings", std::filesystem::canonical(QAX_CTL_BINARY).string(),
                              "com.velmora.Preferences", Value(true));
    Value::Dictionary watch{{"name", Value("Morning")},    {"localizedModel", Value("Watch")},
                            {"serialNumber", Value("W1")}, {"pairedDate", Value(Date(1.7e9))},
                            {"isPaired", Value(true)},     {"isArchived", Value(false)}};
    Value::Dictionary archived = watch;
    archived["serialNumber"] = "W0";
    archived["isArchived"] = true;
    agent.writeRootFile("paired-devices.plist", Value::Array{Value(watch), Value(archived)});
    agent.writeRootFile(
        "features.plist",
        Value::Dictionary{{"Kestova", Value(Value::Dictionary{{"Tessel_3_0", Value(true)}})}});
    FilePreferenceStore(FilePreferenceStore::domainPath(agent.home()))
        .setObject("ServerVersionOverride", Value::Dictionary{{"LowServerVersion", Value(2)},
                                                              {"HighServerVersion", Value(3)}});

    auto device = agent.ctl({"default-device", "--json"});
    ASSERT_EQ(device.status, 0) << device.err;
    auto json = parseJson(device.out);
    ASSERT_TRUE(json) << device.out;
    EXPECT_EQ(*json->find("serialNumber"), Value("ITEST-SN-1"));
    EXPECT_EQ(*json->find("deviceTypeString"), Value("Default"));
    EXPECT_TRUE(agent.waitForLog("with calling process: com.velmora.Preferences"));
    auto paired = agent.ctl({"paired-devices", "--json"});
    ASSERT_EQ(paired.status, 0) << paired.err;
    auto list = parseJson(paired.out);
    ASSERT_TRUE(list && list->isArray() && list->size() == 1) << paired.out;
    EXPECT_EQ(*(*list->asArray())[0].find("serialNumber"), Value("W1"));
    EXPECT_EQ(*(*list->asArray())[0].find("name"), Value("Morning"));
    EXPECT_NE(agent.ctl({"paired-devices"}).out.find("Morning  W1"), std::string::npos);

    // An internal build reads the web URL override.
    auto plain = agent.ctl({"web-url-override"});
    EXPECT_EQ(plain.status, 0) << plain.err;
    EXPECT_EQ(plain.out, "no web URL override\n");
    FilePreferenceStore(FilePreferenceStore::domainPath(agent.home()))
        .setObject("WebFlowURL", Value("https://flow.example/x"));
    auto stored = agent.ctl({"web-url-override", "--json"});
    EXPECT_EQ(stored.status, 0) << stored.err;
    EXPECT_EQ(stored.out, "\"https://flow.example/x\"\n");

    ASSERT_TRUE(HostNotificationSocket::post(agent.runtimeDirectory(),
                                             "com.velmora.pairlink.devicedidunpair"));
    EXPECT_TRUE(agent.waitForLog(
        "got launched with notificationName: com.velmora.pairlink.devicedidunpair"));
    auto notified = agent.ctl({"notify", "com.velmora.pairlink.devicedidpair"});
    EXPECT_EQ(notified.status, 0) << notified.err;
    EXPECT_TRUE(
        agent.waitForLog("got launched with notificationName: com.velmora.pairlink.devicedidpair"));
    EXPECT_EQ(agent.countInLog("entered stream for test"), 2);

    // Others can neither reach the socket nor read the preferences the agent wrote on start.
    struct stat st {};
    ASSERT_EQ(::stat(agent.runtimeDirectory().c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 077, 0u) << std::oct << st.st_mode;
    ASSERT_EQ(::stat(FilePreferenceStore::domainPath(agent.home()).c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 077, 0u) << std::oct << st.st_mode;
    // Nor anything else it keeps (certificates are public by nature).
    int kept = 0;
    for (const auto& root : {agent.home() + "/Library", agent.platformRoot() + "/state"}) {
        for (const auto& entry : std::filesystem::recursive_directory_iterator(root)) {
            if (entry.is_regular_file() && entry.path().extension() != ".pem") {
                ++kept;
                ASSERT_EQ(::stat(entry.path().c_str(), &st), 0);
                EXPECT_EQ(st.st_mode & 077, 0u) << entry.path() << " " << std::oct << st.st_mode;
            }
        }
    }
    EXPECT_GE(kept, 2);

    auto twin = test::runTool(QAX_AGENT_BINARY, {}, agent.environment(), 10);
    EXPECT_EQ(twin.status, 1) << "a second agent on the same socket must not start";
    EXPECT_NE(twin.err.find("another process serves"), std::string::npos) << twin.err;
    auto client = connect();
    EXPECT_EQ(defaultSerial(*client), "ITEST-SN-1") << "the first agent is undisturbed";

    const int status = agent.stop(SIGTERM);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
    EXPECT_FALSE(std::filesystem::exists(agent.socketPath())) << "socket file left behind";
    EXPECT_FALSE(std::filesystem::exists(agent.runtimeDirectory() + "/notify"));
    EXPECT_TRUE(client->waitForClose(kWait));
    // SIGINT the same way, and the agent starts again on the same directory.
    ASSERT_TRUE(agent.start()) << agent.log();
    const int interrupted = agent.stop(SIGINT);
    EXPECT_TRUE(WIFEXITED(interrupted) && WEXITSTATUS(interrupted) == 0) << interrupted;
}

}  // namespace
}  // namespace qax
