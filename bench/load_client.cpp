// The load client: starts a real qaxagent on a temporary home and measures, in one run,
//  - start-up to listening, and the idle daemon's resident memory;
//  - the round trip of a bare echo over a Unix socket (the floor) and of "defaultDevice:"
//    and "pairedDevices:", with their ratio to the floor;
//  - throughput with 1, 2, 4 and 8 clients;
//  - 1,000 connections held at once, each answered.
// It prints numbers; it asserts nothing.  Usage: qax_load [calls per measurement]
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <thread>
#include <vector>

#include "AgentProcess.h"
#include "core/PlistCodec.h"
#include "platform/host/HostIpcClient.h"
#include "platform/host/IpcFrameCodec.h"

namespace {

using qax::HostIpcClient;
using qax::Value;
using SteadyClock = std::chrono::steady_clock;

double secondsSince(SteadyClock::time_point t) {
    return std::chrono::duration<double>(SteadyClock::now() - t).count();
}

struct Stats {
    double median = 0, p99 = 0;
};

Stats stats(std::vector<double> v) {
    std::sort(v.begin(), v.end());
    if (v.empty()) {
        return {};
    }
    return {v[v.size() / 2], v[std::min(v.size() - 1, v.size() * 99 / 100)]};
}

// A server that writes every frame back as it came: framing and socket costs only.
class EchoServer {
  public:
    explicit EchoServer(std::string path) : path_(std::move(path)) {
        fd_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        sockaddr_un addr{};
        addr.sun_family = AF_UNIX;
        std::snprintf(addr.sun_path, sizeof addr.sun_path, "%s", path_.c_str());
        bind(fd_, reinterpret_cast<sockaddr*>(&addr), sizeof addr);
        listen(fd_, 16);
        thread_ = std::thread([this] { serve(); });
    }
    ~EchoServer() {
        shutdown(fd_, SHUT_RDWR);
        close(fd_);
        thread_.join();
    }

  private:
    void serve() {
        int c = accept(fd_, nullptr, nullptr);
        if (c < 0) {
            return;
        }
        char buf[65536];
        ssize_t n;
        while ((n = read(c, buf, sizeof buf)) > 0) {
            ssize_t off = 0;
            while (off < n) {
                ssize_t w = write(c, buf + off, static_cast<std::size_t>(n - off));
                if (w <= 0) {
                    break;
                }
                off += w;
            }
        }
        close(c);
    }
    std::string path_;
    int fd_ = -1;
    std::thread thread_;
};

// Round trips of one request on one connection; the reply is decoded as a client would.
std::vector<double> roundTrips(const std::string& socketPath, const std::string& op, int calls) {
    HostIpcClient client;
    std::string error;
    std::vector<double> out;
    if (!client.connect(socketPath, &error)) {
        std::fprintf(stderr, "connect %s: %s\n", socketPath.c_str(), error.c_str());
        return out;
    }
    out.reserve(static_cast<std::size_t>(calls));
    for (int i = 0; i < calls; ++i) {
        auto t = SteadyClock::now();
        if (!client.sendRequest(i + 1, op, {}, &error) || !client.receive(5, &error)) {
            std::fprintf(stderr, "%s: %s\n", op.c_str(), error.c_str());
            break;
        }
        out.push_back(secondsSince(t));
    }
    return out;
}

long residentKilobytes(pid_t pid) {
    std::ifstream status("/proc/" + std::to_string(pid) + "/status");
    std::string line;
    while (std::getline(status, line)) {
        if (line.rfind("VmRSS:", 0) == 0) {
            return std::atol(line.c_str() + 6);
        }
    }
    return -1;
}

}  // namespace

int main(int argc, char** argv) {
    const int calls = argc > 1 ? std::max(100, std::atoi(argv[1])) : 3000;
    rlimit lim{};
    getrlimit(RLIMIT_NOFILE, &lim);
    lim.rlim_cur = lim.rlim_max;
    setrlimit(RLIMIT_NOFILE, &lim);  // the agent inherits it: 1,000 connections need fds

    qax::test::AgentProcess agent;
    agent.writeRootFile("device.plist", Value::Dictionary{{"SerialNumber", "C02LOAD00001"},
                                                          {"ProductType", "Model9,1"},
                                                          {"ProductVersion", "4.2"}});
    agent.writeRootFile("features.plist",
                        Value::Dictionary{{"Kestova", Value::Dictionary{{"Tessel_3_0", true}}}});
    agent.writeRootFile("paired-devices.plist",
                        Value::Array{Value::Dictionary{{"name", "Watch"},
                                                       {"serialNumber", "W7LOAD000001"},
                                                       {"pairedDate", qax::Date(1700000000)},
                                                       {"isPaired", true},
                                                       {"isArchived", false}}});
    agent.registerApplication("load", qax::test::selfExecutable(), "com.velmora.Preferences",
                              Value(true));

    auto t0 = SteadyClock::now();
    if (!agent.start()) {
        std::fprintf(stderr, "qaxagent did not start:\n%s\n", agent.log().c_str());
        return 1;
    }
    std::printf("start-up to listening      %8.1f ms (includes process spawn)\n",
                secondsSince(t0) * 1e3);
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
    std::printf("resident memory, idle      %8ld kB\n", residentKilobytes(agent.pid()));

    const std::string echoPath = agent.home() + "/echo.sock";
    Stats echo, device, paired;
    {
        EchoServer server(echoPath);
        echo = stats(roundTrips(echoPath, "echo", calls));
    }
    device = stats(roundTrips(agent.socketPath(), "defaultDevice:", calls));
    paired = stats(roundTrips(agent.socketPath(), "pairedDevices:", calls));
    std::printf("round trip, %d calls       median      p99   x floor (median)\n", calls);
    std::printf("  echo (floor)            %7.1f us %7.1f us\n", echo.median * 1e6, echo.p99 * 1e6);
    std::printf("  defaultDevice:          %7.1f us %7.1f us   %5.1fx\n", device.median * 1e6,
                device.p99 * 1e6, device.median / echo.median);
    std::printf("  pairedDevices:          %7.1f us %7.1f us   %5.1fx\n", paired.median * 1e6,
                paired.p99 * 1e6, paired.median / echo.median);

    for (int clients : {1, 2, 4, 8}) {
        std::atomic<long> done{0};
        std::vector<std::thread> threads;
        auto start = SteadyClock::now();
        for (int c = 0; c < clients; ++c) {
            threads.emplace_back([&] {
                done += static_cast<long>(
                    roundTrips(agent.socketPath(), "defaultDevice:", calls / 2).size());
            });
        }
        for (auto& t : threads) {
            t.join();
        }
        std::printf("throughput, %d client(s)    %8.0f requests/s\n", clients,
                    static_cast<double>(done.load()) / secondsSince(start));
    }

    constexpr int kConnections = 1000;
    std::vector<std::unique_ptr<HostIpcClient>> held;
    int connectErrors = 0, replyErrors = 0;
    std::string error;
    for (int i = 0; i < kConnections; ++i) {
        auto c = std::make_unique<HostIpcClient>();
        if (!c->connect(agent.socketPath(), &error) ||
            !c->sendRequest(1, "defaultDevice:", {}, &error)) {
            ++connectErrors;
            continue;
        }
        held.push_back(std::move(c));
    }
    for (auto& c : held) {
        if (!c->receive(10, &error)) {
            ++replyErrors;
        }
    }
    std::printf("%d connections held      %d connect errors, %d reply errors\n", kConnections,
                connectErrors, replyErrors);
    held.clear();

    std::this_thread::sleep_for(std::chrono::milliseconds(300));
    std::printf("resident memory after load %8ld kB\n", residentKilobytes(agent.pid()));
    agent.stop();
    return 0;
}
