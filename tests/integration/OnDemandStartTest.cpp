// The agent started on demand, as the user's service manager runs it: it serves the listening
// socket it is handed, stays while a client is connected, exits once idle, and the next
// instance on the same socket finds everything kept (preferences, a client that arrived while
// the first was exiting).
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <thread>

#include "AgentProcess.h"
#include "devices/QAXDevice.h"
#include "platform/host/HostIpcClient.h"

namespace qax {
namespace {

constexpr double kWait = 10;
constexpr const char* kExitedIdle = "Exiting after 1 seconds without a client";

int bindUnixSocket(int type, const std::string& path) {
    const int fd = ::socket(AF_UNIX, type | SOCK_CLOEXEC, 0);
    sockaddr_un address{.sun_family = AF_UNIX, .sun_path = {}};
    std::snprintf(address.sun_path, sizeof address.sun_path, "%s", path.c_str());
    return ::bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) == 0 ? fd : -1;
}

std::string receiveNotice(int fd) {
    pollfd p{fd, POLLIN, 0};
    char buffer[512];
    const ssize_t n = ::poll(&p, 1, 10'000) == 1 ? ::recv(fd, buffer, sizeof buffer, 0) : -1;
    return n > 0 ? std::string(buffer, static_cast<std::size_t>(n)) : "";
}

bool exitedCleanly(const std::optional<int>& status) {
    return status && WIFEXITED(*status) && WEXITSTATUS(*status) == 0;
}

std::optional<std::string> serialIn(const Value* reply) {
    auto device = reply ? QAXDevice::decode(*reply) : nullptr;
    return device ? device->serialNumber() : std::nullopt;
}

// The default device's serial number as `client` (connected to `socket` first if need be) gets it.
std::optional<std::string> defaultSerial(HostIpcClient& client, const std::string& socket) {
    std::string error;
    if (!client.isConnected() && !client.connect(socket, &error)) {
        return std::nullopt;
    }
    auto reply = client.call("defaultDevice:", {}, kWait, &error);
    return reply && reply->value ? serialIn(&*reply->value) : std::nullopt;
}

// The service manager keeps its listening socket across instances: this test holds one the
// same way, hands it to each instance and reads their readiness notices.
TEST(OnDemandStartTest, IdleExitAndTheNextInstanceKeepStateAndALateClient) {
    test::AgentProcess agent;  // its home, platform root and environment; started here instead
    agent.writeRootFile("device.plist", Value::Dictionary{{"SerialNumber", Value("OD-1")},
                                                          {"InternalBuild", Value(true)}});
    agent.registerApplication("tests", test::selfExecutable(), std::nullopt, Value(true));
    std::filesystem::create_directories(agent.runtimeDirectory());
    const int listening = bindUnixSocket(SOCK_STREAM, agent.socketPath());
    ASSERT_EQ(::listen(listening, 16), 0);
    const std::string notifyPath = agent.home() + "/manager-notify";
    const int notices = bindUnixSocket(SOCK_DGRAM, notifyPath);
    ASSERT_GE(notices, 0);
    auto start = [&] {
        auto environment = agent.environment();
        environment.insert(environment.end(),
                           {"QAX_IDLE_EXIT_SECONDS=1", "NOTIFY_SOCKET=" + notifyPath});
        // A copy without close-on-exec for the shell, which moves it to descriptor 3 and names
        // the agent's process id, as the service manager does.
        const std::string inherited = std::to_string(::dup(listening));
        auto process = std::make_unique<test::SpawnedProcess>(
            "/bin/sh",
            std::vector<std::string>{"-c",
                                     "exec 3<&" + inherited + " " + inherited +
                                         "<&-; LISTEN_PID=$$ LISTEN_FDS=1 exec \"$0\"",
                                     QAX_AGENT_BINARY},
            environment, agent.logPath());
        ::close(std::stoi(inherited));
        return process;
    };

    auto first = start();
    {
        HostIpcClient client;
        EXPECT_EQ(defaultSerial(client, agent.socketPath()), "OD-1") << agent.log();
        EXPECT_EQ(receiveNotice(notices), "READY=1\nSTATUS=Serving clients");
        std::this_thread::sleep_for(std::chrono::milliseconds(1500));
        EXPECT_TRUE(first->running()) << "a connected client keeps the agent past its idle time";
        auto written = agent.ctl({"defaults", "write", "SerialNumber", "-string", "OD-KEPT"});
        ASSERT_EQ(written.status, 0) << written.err;
        EXPECT_EQ(defaultSerial(client, agent.socketPath()), "OD-KEPT");
    }
    // Connects the moment the first instance decides to go.
    ASSERT_TRUE(agent.waitForLog(kExitedIdle, 1, kWait)) << agent.log();
    HostIpcClient late;
    std::string error;
    ASSERT_TRUE(late.connect(agent.socketPath(), &error)) << error;
    ASSERT_TRUE(late.sendRequest(7, "defaultDevice:", {}, &error)) << error;
    EXPECT_TRUE(exitedCleanly(first->waitForExit(kWait))) << agent.log();
    EXPECT_EQ(receiveNotice(notices), "STOPPING=1");
    EXPECT_TRUE(std::filesystem::is_socket(agent.socketPath())) << "the path is not the agent's";

    auto second = start();
    auto reply = late.receive(kWait, &error);
    ASSERT_TRUE(reply) << error << "\n" << agent.log();
    EXPECT_EQ(serialIn(reply->find("reply")), "OD-KEPT");
    late.close();
    EXPECT_TRUE(exitedCleanly(second->waitForExit(kWait))) << agent.log();
    EXPECT_EQ(agent.countInLog("Started on demand"), 2);
    ::close(listening);
    ::close(notices);
}

// The same under the real activator: nothing runs before the first client, the agent exits
// once idle, and the next connection starts it again with its state kept.
TEST(OnDemandStartTest, UnderSystemdSocketActivateTheFirstConnectionStartsIt) {
    const auto activator = test::findProgram("systemd-socket-activate");
    if (!activator) {
        GTEST_SKIP() << "systemd-socket-activate (Debian package systemd) is not installed";
    }
    test::AgentProcess agent;
    agent.writeRootFile("device.plist", Value::Dictionary{{"SerialNumber", Value("OD-2")},
                                                          {"InternalBuild", Value(true)}});
    agent.registerApplication("tests", test::selfExecutable(), std::nullopt, Value(true));
    std::filesystem::create_directories(agent.runtimeDirectory());
    std::vector<std::string> args{"-l", agent.socketPath(), "-E", "QAX_IDLE_EXIT_SECONDS=1"};
    for (const auto& variable : agent.environment()) {
        args.insert(args.end(), {"-E", variable});
    }
    args.push_back(QAX_AGENT_BINARY);

    for (int instance = 1; instance <= 2; ++instance) {
        SCOPED_TRACE(instance);
        const int listening = agent.countInLog("Listening on");
        test::SpawnedProcess activated(*activator, args, agent.environment(), agent.logPath());
        ASSERT_TRUE(agent.waitForLog("Listening on", listening + 1, kWait)) << agent.log();
        EXPECT_EQ(agent.countInLog("Started on demand"), instance - 1)
            << "nothing starts the agent before a client";
        {
            HostIpcClient client;  // gone before the idle exit is awaited
            EXPECT_EQ(defaultSerial(client, agent.socketPath()), instance == 1 ? "OD-2" : "OD-KEPT")
                << agent.log();
        }
        if (instance == 1) {
            auto written = agent.ctl({"defaults", "write", "SerialNumber", "-string", "OD-KEPT"});
            ASSERT_EQ(written.status, 0) << written.err;
        }
        EXPECT_TRUE(exitedCleanly(activated.waitForExit(kWait))) << agent.log();
        EXPECT_EQ(agent.countInLog(kExitedIdle), instance);
    }
}

}  // namespace
}  // namespace qax
