// The agent started on demand, the way the user's service manager runs it: the first client
// connection starts it, it exits once idle, the next connection starts it again, and nothing is
// lost in between (preferences kept, a client that arrives while it exits is served by the next
// instance).
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <thread>

#include "AgentProcess.h"
#include "SpawnedProcess.h"
#include "devices/QAXDevice.h"
#include "platform/host/HostIpcClient.h"

namespace qax {
namespace {

using namespace std::chrono_literals;

constexpr double kWait = 10;
constexpr const char* kIdleExit = "QAX_IDLE_EXIT_SECONDS=1";
constexpr const char* kExitedIdle = "Exiting after 1 seconds without a client";
constexpr const char* kStartedOnDemand = "Started on demand";

// A Unix socket of `type` bound at `path`; -1 on failure.
int bindUnixSocket(int type, const std::string& path) {
    const int fd = ::socket(AF_UNIX, type | SOCK_CLOEXEC, 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::snprintf(address.sun_path, sizeof address.sun_path, "%s", path.c_str());
    if (fd < 0 || ::bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) {
        return -1;
    }
    return fd;
}

// The next datagram on `fd`, or an empty text after 10 seconds.
std::string receiveNotice(int fd) {
    pollfd p{fd, POLLIN, 0};
    if (::poll(&p, 1, 10'000) != 1) {
        return "";
    }
    char buffer[512];
    const ssize_t n = ::recv(fd, buffer, sizeof buffer, 0);
    return n > 0 ? std::string(buffer, static_cast<std::size_t>(n)) : "";
}

class OnDemandStartTest : public ::testing::Test {
  protected:
    void SetUp() override {
        agent.writeRootFile("device.plist",
                            Value(Value::Dictionary{{"SerialNumber", Value("OD-SN-1")},
                                                    {"ProductType", Value("Phone1,1")},
                                                    {"ProductVersion", Value("1.0")},
                                                    {"InternalBuild", Value(true)}}));
        agent.registerApplication("tests", test::selfExecutable(), std::nullopt, Value(true));
        std::filesystem::create_directories(agent.runtimeDirectory());
        std::filesystem::permissions(agent.runtimeDirectory(), std::filesystem::perms::owner_all);
    }

    std::string logPath() const { return agent.home() + "/agent.log"; }

    // The default device's serial number through a new connection held by `client`.
    std::optional<std::string> defaultSerial(HostIpcClient& client) {
        std::string error;
        if (!client.isConnected() && !client.connect(agent.socketPath(), &error)) {
            ADD_FAILURE() << error;
            return std::nullopt;
        }
        auto reply = client.call("defaultDevice:", {}, kWait, &error);
        if (!reply || !reply->value) {
            ADD_FAILURE() << "no reply: " << error << "\n" << agent.log();
            return std::nullopt;
        }
        auto device = QAXDevice::decode(*reply->value);
        return device ? device->serialNumber() : std::nullopt;
    }

    static bool exitedCleanly(const std::optional<int>& status) {
        return status && WIFEXITED(*status) && WEXITSTATUS(*status) == 0;
    }

    test::AgentProcess agent;
};

TEST_F(OnDemandStartTest, FirstConnectionStartsItIdleEndsItTheNextStartsItAgainWithStateKept) {
    const auto activator = test::findProgram("systemd-socket-activate");
    if (!activator) {
        GTEST_SKIP() << "systemd-socket-activate (Debian package systemd) is not installed";
    }
    // The activator listens on the agent's socket and starts the agent on the first connection,
    // passing the socket as the service manager does.
    auto listen = [&] {
        std::vector<std::string> args{"-l", agent.socketPath()};
        for (const auto& variable : agent.environment()) {
            args.insert(args.end(), {"-E", variable});
        }
        args.insert(args.end(), {"-E", kIdleExit, QAX_AGENT_BINARY});
        const int listening = agent.countInLog("Listening on");
        auto process = std::make_unique<test::SpawnedProcess>(*activator, args, agent.environment(),
                                                              logPath());
        EXPECT_TRUE(agent.waitForLog("Listening on", listening + 1, kWait)) << agent.log();
        return process;
    };

    auto first = listen();
    EXPECT_EQ(agent.countInLog("launched"), 0) << "nothing starts the agent before a client";
    {
        HostIpcClient client;
        EXPECT_EQ(defaultSerial(client), "OD-SN-1");
        EXPECT_EQ(agent.countInLog(kStartedOnDemand), 1);
        std::this_thread::sleep_for(2500ms);
        EXPECT_TRUE(first->running()) << "a connected client keeps the agent past its idle time";

        auto written = test::runTool(QAX_CTL_BINARY,
                                     {"defaults", "write", "SerialNumber", "-string", "OD-KEPT"},
                                     agent.environment());
        ASSERT_EQ(written.status, 0) << written.err;
        EXPECT_EQ(defaultSerial(client), "OD-KEPT");
    }
    EXPECT_TRUE(exitedCleanly(first->waitForExit(kWait))) << agent.log();
    EXPECT_EQ(agent.countInLog(kExitedIdle), 1);

    auto second = listen();
    {
        HostIpcClient client;
        EXPECT_EQ(defaultSerial(client), "OD-KEPT");
    }
    EXPECT_EQ(agent.countInLog(kStartedOnDemand), 2);
    EXPECT_TRUE(exitedCleanly(second->waitForExit(kWait))) << agent.log();
}

// The service manager keeps its listening socket across instances; this test holds one the
// same way, hands it to each instance it starts and reads their readiness notices.
TEST_F(OnDemandStartTest, AClientArrivingWhileTheAgentExitsIsServedByTheNextInstance) {
    const int listening = bindUnixSocket(SOCK_STREAM, agent.socketPath());
    ASSERT_GE(listening, 0);
    ASSERT_EQ(::listen(listening, 16), 0);
    // Where the agent reports readiness, as to the service manager.
    const std::string notifyPath = agent.home() + "/manager-notify";
    const int notices = bindUnixSocket(SOCK_DGRAM, notifyPath);
    ASSERT_GE(notices, 0);
    // The agent reads the socket from descriptor 3, named for its own process id.
    auto start = [&] {
        auto environment = agent.environment();
        environment.push_back(kIdleExit);
        environment.push_back("NOTIFY_SOCKET=" + notifyPath);
        // The descriptor is close-on-exec in this process: the shell gets a copy made for it.
        const int inherited = ::dup(listening);
        EXPECT_GE(inherited, 0);
        const std::string script = "exec 3<&" + std::to_string(inherited) + " " +
                                   std::to_string(inherited) + "<&-" +
                                   "; LISTEN_PID=$$ LISTEN_FDS=1 exec \"$0\"";
        auto process = std::make_unique<test::SpawnedProcess>(
            "/bin/sh", std::vector<std::string>{"-c", script, QAX_AGENT_BINARY}, environment,
            logPath());
        ::close(inherited);
        return process;
    };

    auto first = start();
    {
        HostIpcClient client;
        EXPECT_EQ(defaultSerial(client), "OD-SN-1");
    }
    EXPECT_EQ(receiveNotice(notices), "READY=1\nSTATUS=Serving clients");
    // Connects the moment the first instance decides to go.
    ASSERT_TRUE(agent.waitForLog(kExitedIdle, 1, kWait)) << agent.log();
    HostIpcClient late;
    std::string error;
    ASSERT_TRUE(late.connect(agent.socketPath(), &error)) << error;
    ASSERT_TRUE(late.sendRequest(7, "defaultDevice:", {}, &error)) << error;
    EXPECT_TRUE(exitedCleanly(first->waitForExit(kWait))) << agent.log();
    EXPECT_EQ(receiveNotice(notices), "STOPPING=1");
    struct stat st {};
    EXPECT_TRUE(::stat(agent.socketPath().c_str(), &st) == 0 && S_ISSOCK(st.st_mode))
        << "the socket path belongs to the service manager and stays";

    auto second = start();
    auto reply = late.receive(kWait, &error);
    ASSERT_TRUE(reply) << error << "\n" << agent.log();
    const Value* device = reply->find("reply");
    ASSERT_NE(device, nullptr) << reply->description();
    auto decoded = QAXDevice::decode(*device);
    ASSERT_NE(decoded, nullptr);
    EXPECT_EQ(decoded->serialNumber(), "OD-SN-1");
    EXPECT_EQ(agent.countInLog(kStartedOnDemand), 2);
    late.close();
    EXPECT_TRUE(exitedCleanly(second->waitForExit(kWait))) << agent.log();
    ::close(listening);
    ::close(notices);
}

}  // namespace
}  // namespace qax
