// The load client: starts a real qaxagent (and coverage-sim for its downloads) on a temporary
// home and measures, in one run:
//  - start-up to listening, the resident memory after the first launch and that of the idle
//    daemon (started again, its first-launch work done);
//  - the round trip of a bare echo over a Unix socket (the floor: prebuilt frame bytes written
//    back by a server that parses nothing, read back by a client that decodes nothing) and,
//    with the same kind of prebuilt request bytes, the agent's "defaultDevice:",
//    "pairedDevices:" and cached-only all-device-infos for 3 devices, as ratios to the floor.
//    Echo and agent batches alternate, so both see the same load on a shared machine; once
//    with client, echo server and agent on one core, once with the servers on another core;
//  - throughput with 1, 2, 4 and 8 clients, and the agent's CPU time per request;
//  - 1,000 connections held at once, each answered, and the resident memory they add;
//  - a forced download of 10 devices against coverage-sim answering after 200 ms, against
//    a forced download of one device.
// It prints numbers; it asserts nothing.
// Usage: qax_load [calls per latency measurement]   (QAX_LOAD_KEEP_LOG=FILE keeps the log of
//        the agent that downloads)
//        qax_load --hold device|paired|cached SECONDS CLIENTS
//          (only keeps the agent busy with one operation, for a profiler attached to the pid
//          it prints)
#include <sched.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <memory>
#include <sstream>
#include <thread>
#include <vector>

#include "AgentProcess.h"
#include "CoverageSimProcess.h"
#include "core/PlistCodec.h"
#include "platform/host/FilePreferenceStore.h"
#include "platform/host/HostIpcClient.h"
#include "platform/host/IpcFrameCodec.h"

namespace {

using qax::Value;
using SteadyClock = std::chrono::steady_clock;

constexpr const char* kDefaultDevice = "defaultDevice:";
constexpr const char* kPairedDevices = "pairedDevices:";
constexpr const char* kAllDeviceInfos = "getAllDeviceInfosUsingPolicy:updateFollowUps:withReply:";
constexpr const char* kDeviceInfo = "getDeviceInfoForSerialNumber:usingPolicy:withReply:";
constexpr std::int64_t kCachedOnly = 1;
constexpr std::int64_t kForceDownload = 2;
constexpr int kRounds = 30;
constexpr int kConnections = 1000;
constexpr double kThroughputSeconds = 1.5;

double secondsSince(SteadyClock::time_point t) {
    return std::chrono::duration<double>(SteadyClock::now() - t).count();
}

struct Stats {
    double median = 0, p99 = 0, min = 0;
    std::size_t count = 0;
};

Stats stats(std::vector<double> v) {
    if (v.empty()) {
        return {};
    }
    std::sort(v.begin(), v.end());
    return {v[v.size() / 2], v[std::min(v.size() - 1, v.size() * 99 / 100)], v.front(), v.size()};
}

// A request as the bytes a client writes: built once, sent as is every time.
std::string requestFrame(const std::string& op, Value::Array args) {
    auto frame = qax::IpcFrameCodec::encode(
        Value(Value::Dictionary{{"id", Value(std::int64_t{1})}, {"op", op}, {"args", args}}));
    return frame.value_or(std::string());
}

// One blocking stream connection that writes prebuilt frames and reads whole reply frames
// without decoding them.
class RawConnection {
  public:
    explicit RawConnection(const std::string& path) {
        fd_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        sockaddr_un addr{};
        addr.sun_family = AF_UNIX;
        std::snprintf(addr.sun_path, sizeof addr.sun_path, "%s", path.c_str());
        if (fd_ >= 0 && connect(fd_, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0) {
            ::close(fd_);
            fd_ = -1;
        }
    }
    ~RawConnection() {
        if (fd_ >= 0) {
            ::close(fd_);
        }
    }
    RawConnection(const RawConnection&) = delete;
    RawConnection& operator=(const RawConnection&) = delete;
    bool ok() const { return fd_ >= 0; }

    bool send(const std::string& frame) {
        std::size_t off = 0;
        while (off < frame.size()) {
            ssize_t w = ::write(fd_, frame.data() + off, frame.size() - off);
            if (w <= 0) {
                return false;
            }
            off += static_cast<std::size_t>(w);
        }
        return true;
    }
    // The payload of the next frame, or false at the end of the stream.
    bool receive() {
        std::size_t have = 0, want = 4;
        while (have < want) {
            if (buffer_.size() < want) {
                buffer_.resize(want);
            }
            ssize_t n = ::read(fd_, buffer_.data() + have, buffer_.size() - have);
            if (n <= 0) {
                return false;
            }
            have += static_cast<std::size_t>(n);
            if (want == 4 && have >= 4) {
                const auto* p = reinterpret_cast<const unsigned char*>(buffer_.data());
                want = 4 + ((std::size_t(p[0]) << 24) | (std::size_t(p[1]) << 16) |
                            (std::size_t(p[2]) << 8) | std::size_t(p[3]));
            }
        }
        last_ = want;
        return true;
    }
    bool roundTrip(const std::string& frame) { return send(frame) && receive(); }
    // The last reply, decoded (used once per operation, outside the timings, to check it).
    std::optional<Value> lastMessage() const {
        return qax::parsePlist(std::string_view(buffer_.data() + 4, last_ - 4));
    }

  private:
    int fd_ = -1;
    std::vector<char> buffer_ = std::vector<char>(64 * 1024);
    std::size_t last_ = 0;
};

// Writes every byte back as it came, a thread per connection: socket costs only.
class EchoServer {
  public:
    explicit EchoServer(std::string path) : path_(std::move(path)) {
        fd_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        sockaddr_un addr{};
        addr.sun_family = AF_UNIX;
        std::snprintf(addr.sun_path, sizeof addr.sun_path, "%s", path_.c_str());
        bind(fd_, reinterpret_cast<sockaddr*>(&addr), sizeof addr);
        listen(fd_, 64);
        acceptor_ = std::thread([this] { acceptAll(); });
    }
    ~EchoServer() {
        shutdown(fd_, SHUT_RDWR);
        acceptor_.join();
        ::close(fd_);
        for (int c : connections_) {
            shutdown(c, SHUT_RDWR);
        }
        for (auto& t : servers_) {
            t.join();
        }
        for (int c : connections_) {
            ::close(c);
        }
        unlink(path_.c_str());
    }
    const std::string& path() const { return path_; }

  private:
    void acceptAll() {
        int c;
        while ((c = accept4(fd_, nullptr, nullptr, SOCK_CLOEXEC)) >= 0) {
            connections_.push_back(c);
            servers_.emplace_back([c] { echo(c); });
        }
    }
    static void echo(int c) {
        char buf[65536];
        ssize_t n;
        while ((n = read(c, buf, sizeof buf)) > 0) {
            ssize_t off = 0;
            while (off < n) {
                ssize_t w = write(c, buf + off, static_cast<std::size_t>(n - off));
                if (w <= 0) {
                    return;
                }
                off += w;
            }
        }
    }
    std::string path_;
    int fd_ = -1;
    std::thread acceptor_;
    std::vector<int> connections_;
    std::vector<std::thread> servers_;
};

long statusKilobytes(pid_t pid, const char* field) {
    std::ifstream status("/proc/" + std::to_string(pid) + "/status");
    std::string line;
    const std::size_t n = std::strlen(field);
    while (std::getline(status, line)) {
        if (line.compare(0, n, field) == 0 && line.size() > n && line[n] == ':') {
            return std::atol(line.c_str() + n + 1);
        }
    }
    return -1;
}

// User and system CPU time of a process, in seconds.
struct CpuTime {
    double user = 0, system = 0;
    CpuTime operator-(const CpuTime& o) const { return {user - o.user, system - o.system}; }
};

CpuTime cpuTime(pid_t pid) {
    std::ifstream stat("/proc/" + std::to_string(pid) + "/stat");
    std::string text((std::istreambuf_iterator<char>(stat)), std::istreambuf_iterator<char>());
    const auto close = text.rfind(')');
    if (close == std::string::npos) {
        return {};
    }
    std::istringstream fields(text.substr(close + 2));
    std::string field;
    unsigned long long utime = 0, stime = 0;
    for (int i = 3; fields >> field; ++i) {
        if (i == 14) {
            utime = std::stoull(field);
        } else if (i == 15) {
            stime = std::stoull(field);
            break;
        }
    }
    const auto tick = static_cast<double>(sysconf(_SC_CLK_TCK));
    return {static_cast<double>(utime) / tick, static_cast<double>(stime) / tick};
}

std::string describeMachine() {
    std::ifstream cpuinfo("/proc/cpuinfo");
    std::string line, model = "unknown CPU";
    while (std::getline(cpuinfo, line)) {
        if (line.rfind("model name", 0) == 0) {
            model = line.substr(line.find(':') + 2);
            break;
        }
    }
    double load[3] = {};
    getloadavg(load, 3);
    char text[256];
    std::snprintf(text, sizeof text, "%s, %u CPUs online, load average %.2f at start",
                  model.c_str(), std::thread::hardware_concurrency(), load[0]);
    return text;
}

// The platform root of a device with `watches` paired watches, signed in, talking to `sim`.
void describeDevice(qax::test::AgentProcess& agent, const qax::test::CoverageSimProcess& sim,
                    int watches) {
    agent.writeRootFile("device.plist", Value::Dictionary{{"SerialNumber", "C02LOAD00001"},
                                                          {"ProductType", "Model9,1"},
                                                          {"ProductVersion", "4.2"}});
    agent.writeRootFile("features.plist",
                        Value::Dictionary{{"Kestova", Value::Dictionary{{"Tessel_3_0", true}}}});
    Value::Array paired;
    for (int i = 1; i <= watches; ++i) {
        char serial[32];
        std::snprintf(serial, sizeof serial, "W7LOAD%06d", i);
        Value::Dictionary watch;
        watch["name"] = "Watch " + std::to_string(i);
        watch["serialNumber"] = std::string(serial);
        watch["pairedDate"] = qax::Date(1700000000 + i);
        watch["isPaired"] = true;
        watch["isArchived"] = false;
        paired.emplace_back(std::move(watch));
    }
    agent.writeRootFile("paired-devices.plist", paired);
    agent.writeRootFile(
        "accounts.plist",
        Value::Dictionary{
            {"PrimaryCloudAccount", Value::Dictionary{{"altDSID", "primary"}}},
            {"KFAccount",
             Value::Dictionary{{"altDSID", "kf"}, {"TokenServiceURL", sim.base() + "/token"}}}});
    qax::FilePreferenceStore preferences(qax::FilePreferenceStore::domainPath(agent.home()));
    preferences.setObject("ServerVersionURL", sim.base() + "/library/VELMORA/asset/qaxV2.plist");
    preferences.setObject("WarrantyURL", sim.base() + "/api/v3/coverage/summary");
    preferences.setObject("WearablesWarrantyURL", sim.base() + "/api/v2/coverage/summary");
    agent.registerApplication("load", qax::test::selfExecutable(), "com.velmora.Preferences",
                              Value(true));
}

// Device infos in a reply, and how many carry a warranty.
std::pair<std::size_t, std::size_t> countWarranties(const std::optional<Value>& reply) {
    std::size_t infos = 0, warranties = 0;
    if (reply && reply->isArray()) {
        for (const Value& info : *reply->asArray()) {
            ++infos;
            warranties += info.find("warranty") != nullptr;
        }
    }
    return {infos, warranties};
}

// Checks, once and outside the timings, that an operation answers a reply and not an error.
bool answers(RawConnection& c, const std::string& frame, const char* name) {
    if (!c.roundTrip(frame)) {
        std::fprintf(stderr, "%s: the connection closed\n", name);
        return false;
    }
    auto message = c.lastMessage();
    if (!message || message->find("error") || !message->find("reply")) {
        std::fprintf(stderr, "%s: no reply (%s)\n", name,
                     message && message->find("error") ? message->find("error")->asString()->c_str()
                                                       : "undecodable");
        return false;
    }
    return true;
}

struct Operation {
    const char* name;
    std::string frame;
    std::vector<double> agent, echo;
};

void printLatency(const Operation& op, const Stats& floor) {
    const Stats a = stats(op.agent);
    std::printf("  %-34s %8.1f %8.1f   %5.2fx   %5.2fx\n", op.name, a.median * 1e6, a.p99 * 1e6,
                a.median / floor.median, a.p99 / floor.p99);
}

// Puts every thread of `pid` (and the threads they start) on `cpus`.
void setProcessAffinity(pid_t pid, const cpu_set_t& cpus) {
    for (const auto& task :
         std::filesystem::directory_iterator("/proc/" + std::to_string(pid) + "/task")) {
        sched_setaffinity(std::atoi(task.path().filename().c_str()), sizeof cpus, &cpus);
    }
}

// Round trips of the echo floor and of the agent, alternating batches of each operation, with
// the client on core 0 and both servers (echo and agent) on core `serverCore`; prints the table.
bool measureLatency(qax::test::AgentProcess& agent, std::vector<Operation> ops, int perRound,
                    const char* placement, int serverCore) {
    cpu_set_t all, clientCore, serversCore;
    CPU_ZERO(&clientCore);
    CPU_SET(0, &clientCore);
    CPU_ZERO(&serversCore);
    CPU_SET(serverCore, &serversCore);
    sched_getaffinity(0, sizeof all, &all);
    // The echo server's threads start from this thread and keep the mask it has then.
    sched_setaffinity(0, sizeof serversCore, &serversCore);
    setProcessAffinity(agent.pid(), serversCore);
    bool ok = true;
    {
        EchoServer echoServer(agent.home() + "/echo.sock");
        sched_setaffinity(0, sizeof clientCore, &clientCore);
        RawConnection echo(echoServer.path());
        RawConnection toAgent(agent.socketPath());
        if (!echo.ok() || !toAgent.ok()) {
            std::fprintf(stderr, "cannot connect\n");
            ok = false;
        }
        for (auto& op : ops) {
            ok = ok && answers(toAgent, op.frame, op.name);
        }
        // Warm both paths, then alternate batches.
        for (int i = 0; ok && i < perRound; ++i) {
            echo.roundTrip(ops[0].frame);
            toAgent.roundTrip(ops[0].frame);
        }
        for (int round = 0; ok && round < kRounds; ++round) {
            for (auto& op : ops) {
                for (int i = 0; i < perRound; ++i) {
                    auto t = SteadyClock::now();
                    echo.roundTrip(op.frame);
                    op.echo.push_back(secondsSince(t));
                }
                for (int i = 0; ok && i < perRound; ++i) {
                    auto t = SteadyClock::now();
                    if (!toAgent.roundTrip(op.frame)) {
                        std::fprintf(stderr, "%s: the connection closed\n", op.name);
                        ok = false;
                    }
                    op.agent.push_back(secondsSince(t));
                }
            }
        }
    }
    sched_setaffinity(0, sizeof all, &all);
    setProcessAffinity(agent.pid(), all);
    if (!ok) {
        return false;
    }
    std::vector<double> allEcho;
    for (const auto& op : ops) {
        allEcho.insert(allEcho.end(), op.echo.begin(), op.echo.end());
    }
    const Stats floor = stats(allEcho);
    std::printf("round trip, %d calls each, %d alternating rounds, %s\n", perRound * kRounds,
                kRounds, placement);
    std::printf("  %-34s %8s %8s   %6s   %6s\n", "", "median", "p99", "x floor", "p99 x");
    std::printf("  %-34s %8.1f %8.1f   (us)\n", "echo (floor)", floor.median * 1e6,
                floor.p99 * 1e6);
    for (const auto& op : ops) {
        printLatency(op, floor);
    }
    return true;
}

struct Throughput {
    long requests = 0;
    double seconds = 0;
    double rate() const { return seconds > 0 ? static_cast<double>(requests) / seconds : 0; }
};

// Runs `frame` on `clients` connections for `seconds`.
Throughput throughput(const std::string& socketPath, const std::string& frame, int clients,
                      double seconds) {
    std::atomic<long> done{0};
    std::atomic<bool> stop{false};
    std::vector<std::thread> threads;
    auto start = SteadyClock::now();
    for (int c = 0; c < clients; ++c) {
        threads.emplace_back([&] {
            RawConnection connection(socketPath);
            long n = 0;
            while (!stop && connection.roundTrip(frame)) {
                ++n;
            }
            done += n;
        });
    }
    std::this_thread::sleep_for(std::chrono::duration<double>(seconds));
    stop = true;
    for (auto& t : threads) {
        t.join();
    }
    return {done.load(), secondsSince(start)};
}

}  // namespace

int main(int argc, char** argv) {
    const bool hold = argc > 4 && std::string(argv[1]) == "--hold";
    const int calls = argc > 1 && !hold ? std::max(100, std::atoi(argv[1])) : 3000;
    const int perRound = std::max(10, calls / kRounds);
    rlimit lim{};
    getrlimit(RLIMIT_NOFILE, &lim);
    lim.rlim_cur = lim.rlim_max;
    setrlimit(RLIMIT_NOFILE, &lim);  // the agent inherits it: 1,000 connections need fds

    std::printf("machine: %s\n", describeMachine().c_str());

    // Agent A: this device and two watches, for latency, throughput, connections and memory.
    auto agent = std::make_unique<qax::test::AgentProcess>();
    {
        auto sim = std::make_unique<qax::test::CoverageSimProcess>(agent->home() + "/sim",
                                                                   agent->platformRoot());
        if (sim->base().empty()) {
            std::fprintf(stderr, "coverage-sim did not start\n");
            return 1;
        }
        describeDevice(*agent, *sim, 2);
        auto t0 = SteadyClock::now();
        if (!agent->start()) {
            std::fprintf(stderr, "qaxagent did not start:\n%s\n", agent->log().c_str());
            return 1;
        }
        std::printf("start-up to listening            %8.1f ms (process spawn included)\n",
                    secondsSince(t0) * 1e3);
        std::this_thread::sleep_for(std::chrono::milliseconds(300));
        std::printf(
            "resident memory, first launch    %8ld kB (%ld threads; its first outreach "
            "included)\n",
            statusKilobytes(agent->pid(), "VmRSS"), statusKilobytes(agent->pid(), "Threads"));

        // The cache the cached-only requests read: written by the agent's own download.
        qax::HostIpcClient client;
        std::string error;
        std::optional<qax::HostIpcClient::Reply> reply;
        if (client.connect(agent->socketPath(), &error)) {
            reply = client.call(kAllDeviceInfos, {Value(kForceDownload), Value(false)}, 60, &error);
        }
        auto [infos, warranties] = countWarranties(reply ? reply->value : std::nullopt);
        std::printf("warranty cache written           %zu of %zu devices %s\n", warranties, infos,
                    error.c_str());
    }  // coverage-sim stops: from here on nothing reaches the network

    // The daemon as it usually is: started again (on demand, after its first-launch work),
    // with nothing to do.
    agent->stop();
    if (!agent->start()) {
        std::fprintf(stderr, "qaxagent did not start again:\n%s\n", agent->log().c_str());
        return 1;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(300));
    std::printf("resident memory, idle            %8ld kB (%ld threads)\n",
                statusKilobytes(agent->pid(), "VmRSS"), statusKilobytes(agent->pid(), "Threads"));

    std::vector<Operation> ops;
    ops.push_back({kDefaultDevice, requestFrame(kDefaultDevice, {}), {}, {}});
    ops.push_back({kPairedDevices, requestFrame(kPairedDevices, {}), {}, {}});
    ops.push_back({"all-device-infos, cached, 3 devices",
                   requestFrame(kAllDeviceInfos, {Value(kCachedOnly), Value(false)}),
                   {},
                   {}});
    if (hold) {
        const std::string which = argv[2];
        const auto& op = ops[which == "paired" ? 1 : which == "cached" ? 2 : 0];
        std::printf("agent pid %d: %s\n", agent->pid(), op.name);
        std::fflush(stdout);
        const CpuTime before = cpuTime(agent->pid());
        const auto run = throughput(agent->socketPath(), op.frame, std::max(1, std::atoi(argv[4])),
                                    std::atof(argv[3]));
        const CpuTime cpu = cpuTime(agent->pid()) - before;
        const double n = std::max<double>(1, static_cast<double>(run.requests));
        std::printf("%.0f requests/s, agent CPU %.1f us/request (user %.1f, system %.1f)\n",
                    run.rate(), (cpu.user + cpu.system) / n * 1e6, cpu.user / n * 1e6,
                    cpu.system / n * 1e6);
        return 0;
    }
    // Where the client and the server run decides much of a round trip here: a wake-up on the
    // other core costs several times the work of a small request. Left to the scheduler, the
    // echo server and the agent do not land alike (the floor often shares the client's core,
    // the agent seldom), so both are placed, twice: on the client's core, where both sides
    // pay the same switches and the ratio shows the agent's own work, and on the other core,
    // where both pay a cross-core wake-up each way.
    if (!measureLatency(*agent, ops, perRound, "client, echo server and agent on core 0", 0) ||
        (std::thread::hardware_concurrency() > 1 &&
         !measureLatency(*agent, ops, perRound, "client on core 0, echo server and agent on 1",
                         1))) {
        return 1;
    }

    {
        EchoServer echoServer(agent->home() + "/echo-many.sock");
        std::printf(
            "throughput (defaultDevice:)      echo floor   agent      agent CPU per request\n");
        for (int clients : {1, 2, 4, 8}) {
            const auto echo =
                throughput(echoServer.path(), ops[0].frame, clients, kThroughputSeconds);
            const CpuTime before = cpuTime(agent->pid());
            const auto run =
                throughput(agent->socketPath(), ops[0].frame, clients, kThroughputSeconds);
            const CpuTime cpu = cpuTime(agent->pid()) - before;
            const double n = std::max<double>(1, static_cast<double>(run.requests));
            std::printf(
                "  %d client(s)                     %7.0f/s   %7.0f/s  %5.1f us (user %.1f, system "
                "%.1f)\n",
                clients, echo.rate(), run.rate(), (cpu.user + cpu.system) / n * 1e6,
                cpu.user / n * 1e6, cpu.system / n * 1e6);
        }
    }

    {
        std::this_thread::sleep_for(std::chrono::milliseconds(300));
        const long before = statusKilobytes(agent->pid(), "VmRSS");
        std::vector<std::unique_ptr<RawConnection>> held;
        int connectErrors = 0, replyErrors = 0;
        for (int i = 0; i < kConnections; ++i) {
            auto c = std::make_unique<RawConnection>(agent->socketPath());
            if (!c->ok() || !c->send(ops[0].frame)) {
                ++connectErrors;
                continue;
            }
            held.push_back(std::move(c));
        }
        for (auto& c : held) {
            replyErrors += !c->receive();
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(300));
        const long with = statusKilobytes(agent->pid(), "VmRSS");
        std::printf("%d connections held, each answered: %d connect errors, %d reply errors\n",
                    kConnections, connectErrors, replyErrors);
        std::printf(
            "resident memory                  %8ld kB before, %ld kB with them: %.1f kB "
            "per connection\n",
            before, with, static_cast<double>(with - before) / kConnections);
        held.clear();
        std::this_thread::sleep_for(std::chrono::milliseconds(500));
        std::printf("resident memory after they close %8ld kB\n",
                    statusKilobytes(agent->pid(), "VmRSS"));
    }
    agent->stop();
    agent.reset();

    // Agent B: this device and nine watches, against a service that answers after 200 ms.
    qax::test::AgentProcess downloader;
    qax::test::CoverageSimProcess slowSim(downloader.home() + "/sim", downloader.platformRoot(),
                                          {"--delay-ms", "200"});
    if (slowSim.base().empty()) {
        std::fprintf(stderr, "coverage-sim did not start\n");
        return 1;
    }
    describeDevice(downloader, slowSim, 9);
    if (!downloader.start()) {
        std::fprintf(stderr, "qaxagent did not start:\n%s\n", downloader.log().c_str());
        return 1;
    }
    qax::HostIpcClient client;
    std::string error;
    if (!client.connect(downloader.socketPath(), &error)) {
        std::fprintf(stderr, "connect: %s\n", error.c_str());
        return 1;
    }
    // Seconds for one call, and how many warranties its answer carries.
    auto timed = [&](const std::string& op, const Value::Array& args, std::size_t* withWarranty) {
        auto t = SteadyClock::now();
        auto reply = client.call(op, args, 120, &error);
        const double s = secondsSince(t);
        const auto value = reply ? reply->value : std::nullopt;
        if (value && value->isDictionary()) {
            *withWarranty = value->find("warranty") != nullptr;
        } else {
            *withWarranty = countWarranties(value).second;
        }
        return s;
    };
    std::size_t got = 0, oneOk = 0, tenOk = 0;
    timed(kAllDeviceInfos, {Value(kForceDownload), Value(false)}, &got);  // warm: TLS, token
    std::vector<double> one, ten;
    for (int i = 0; i < 5; ++i) {
        one.push_back(timed(kDeviceInfo, {Value("W7LOAD000001"), Value(kForceDownload)}, &got));
        oneOk += got;
        ten.push_back(timed(kAllDeviceInfos, {Value(kForceDownload), Value(false)}, &got));
        tenOk += got;
    }
    if (const char* keep = std::getenv("QAX_LOAD_KEEP_LOG")) {
        std::ofstream(keep) << downloader.log();  // the downloads' timeline, for a closer look
    }
    const Stats oneStats = stats(one), tenStats = stats(ten);
    std::printf("forced download, server answers after 200 ms (median of 5)\n");
    std::printf("  one device                       %8.1f ms   %zu of 5 warranties\n",
                oneStats.median * 1e3, oneOk);
    std::printf(
        "  10 devices (all-device-infos)    %8.1f ms   %4.2fx one device, %zu of 50 "
        "warranties\n",
        tenStats.median * 1e3, tenStats.median / oneStats.median, tenOk);
    return 0;
}
