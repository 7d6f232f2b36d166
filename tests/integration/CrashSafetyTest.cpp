// The agent's persisted stores survive a writer's death and a full disk: a writer rewriting the
// preference domain, a warranty cache file, the follow-up store and the activity registry is
// killed (SIGKILL) at random moments a thousand times, and every file is then the previous or
// the next generation, whole; the agent then starts on those files and serves them. With the
// file size limited as on a full disk, every write fails, is logged, and leaves the old file.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <random>
#include <thread>

#include "AgentProcess.h"
#include "fakes/TestPlatform.h"
#include "helpers/CrashTrialStores.h"
#include "platform/host/FilePreferenceStore.h"
#include "platform/host/HostActivityRegistry.h"
#include "platform/host/HostFollowUpCenter.h"
#include "platform/host/HostIpcClient.h"
#include "warranty/QAXWarranty.h"

namespace qax {
namespace {

namespace fs = std::filesystem;
namespace trial = test::crashtrial;
using SteadyClock = std::chrono::steady_clock;

constexpr int kKills = 1000;
constexpr const char* kStoreNames[] = {"preferences", "cache", "followups", "registry"};

// The trials kill a process, not the machine: the page cache survives them either way, so
// they run in memory when they can and a thousand of them stay quick.
void preferMemoryForTemporaryFiles() {
    struct stat st {};
    if (::stat("/dev/shm", &st) == 0 && S_ISDIR(st.st_mode) && ::access("/dev/shm", W_OK) == 0) {
        ::setenv("TMPDIR", "/dev/shm", 1);
    }
}

// A running writer with its stdout and stderr on pipes.
class Writer {
  public:
    explicit Writer(std::vector<std::string> args, std::vector<std::string> environment = {}) {
        int out[2], err[2];
        EXPECT_EQ(::pipe2(out, O_CLOEXEC), 0);
        EXPECT_EQ(::pipe2(err, O_CLOEXEC), 0);
        posix_spawn_file_actions_t actions;
        posix_spawn_file_actions_init(&actions);
        posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
        posix_spawn_file_actions_adddup2(&actions, out[1], 1);
        posix_spawn_file_actions_adddup2(&actions, err[1], 2);
        args.insert(args.begin(), QAX_STORE_WRITER_BINARY);
        std::vector<char*> argv, envp;
        for (auto& a : args) {
            argv.push_back(a.data());
        }
        for (auto& e : environment) {
            envp.push_back(e.data());
        }
        argv.push_back(nullptr);
        envp.push_back(nullptr);
        EXPECT_EQ(posix_spawn(&pid_, argv[0], &actions, nullptr, argv.data(),
                              environment.empty() ? environ : envp.data()),
                  0);
        posix_spawn_file_actions_destroy(&actions);
        ::close(out[1]);
        ::close(err[1]);
        out_ = out[0];
        err_ = err[0];
    }
    ~Writer() {
        kill();
        ::close(out_);
        ::close(err_);
    }

    // The next line of stdout; none at its end or after `seconds`.
    std::optional<std::string> line(double seconds) {
        const auto deadline =
            SteadyClock::now() + std::chrono::duration_cast<SteadyClock::duration>(
                                     std::chrono::duration<double>(seconds));
        for (;;) {
            if (auto at = pending_.find('\n'); at != std::string::npos) {
                std::string text = pending_.substr(0, at);
                pending_.erase(0, at + 1);
                return text;
            }
            const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
                deadline - SteadyClock::now());
            pollfd p{out_, POLLIN, 0};
            if (left.count() <= 0 || ::poll(&p, 1, static_cast<int>(left.count())) <= 0) {
                return std::nullopt;
            }
            char buf[4096];
            const ssize_t n = ::read(out_, buf, sizeof buf);
            if (n <= 0) {
                return std::nullopt;
            }
            pending_.append(buf, static_cast<std::size_t>(n));
        }
    }
    // Everything on stderr until it closes.
    std::string errors() {
        std::string text;
        char buf[4096];
        ssize_t n;
        while ((n = ::read(err_, buf, sizeof buf)) > 0) {
            text.append(buf, static_cast<std::size_t>(n));
        }
        return text;
    }
    // Kills with SIGKILL (if still running) and reaps; the wait status.
    int kill() {
        if (pid_ > 0) {
            ::kill(pid_, SIGKILL);
            return wait();
        }
        return status_;
    }
    int wait() {
        if (pid_ > 0) {
            while (::waitpid(pid_, &status_, 0) < 0 && errno == EINTR) {
            }
            pid_ = -1;
        }
        return status_;
    }

  private:
    pid_t pid_ = -1;
    int status_ = -1;
    int out_ = -1, err_ = -1;
    std::string pending_;
};

// The generation each store holds, read through the classes the agent reads them with; none
// for a store that is missing, unreadable, or whose content is not exactly one generation's.
using Generations = std::array<std::optional<std::int64_t>, 4>;

class Stores {
  public:
    Stores(std::string home, std::string root) : home_(std::move(home)), root_(std::move(root)) {
        env_.platform->homeDirectory = home_;
    }

    Generations read() { return {preferences(), cache(), followUps(), registry()}; }

  private:
    std::optional<std::int64_t> preferences() {
        FilePreferenceStore store(FilePreferenceStore::domainPath(home_));
        auto value = store.objectForKey(trial::kPreferenceKey);
        return whole(value ? value->find(trial::kGenerationKey) : nullptr,
                     value ? value->find(trial::kPayloadKey) : nullptr);
    }
    std::optional<std::int64_t> cache() {
        auto warranty = QAXWarranty::cachedWarrantyForSerialNumber(
            env_.platform, std::string(trial::kSerialNumber));
        if (!warranty) {
            return std::nullopt;
        }
        const Value& summary = warranty->dictionaryRepresentation();
        return whole(summary.find(trial::kGenerationKey), summary.find("coverageLocalizedDesc"));
    }
    std::optional<std::int64_t> followUps() {
        HostFollowUpCenter center(root_, env_.clock);
        for (const auto& stored : center.storedItems(trial::kFollowUpClient)) {
            const FollowUpItem& item = stored.item;
            if (item.uniqueIdentifier == trial::kFollowUpIdentifier && item.title &&
                item.informativeFooterText) {
                const Value generation(std::atoll(item.title->c_str() + 1));
                const Value payload(*item.informativeFooterText);
                return whole(&generation, &payload);
            }
        }
        return std::nullopt;
    }
    std::optional<std::int64_t> registry() {
        auto records = HostActivityRegistry::load(root_);
        auto it = records.find(trial::kActivityIdentifier);
        if (it == records.end() || !it->second.pending()) {
            return std::nullopt;
        }
        return it->second.delay;
    }
    static std::optional<std::int64_t> whole(const Value* generation, const Value* payload) {
        if (!generation || !generation->asInteger() || !payload || !payload->asString() ||
            *payload->asString() != trial::payload(*generation->asInteger())) {
            return std::nullopt;
        }
        return generation->asInteger();
    }

    std::string home_, root_;
    test::TestPlatform env_;
};

// Temporary files that writers killed between creating and renaming them left behind.
int leftoverTemporaryFiles(const std::string& dir) {
    int n = 0;
    std::error_code ec;
    for (const auto& entry : fs::recursive_directory_iterator(dir, ec)) {
        const std::string name = entry.path().filename().string();
        if (name.front() == '.' && name.find(".plist.") != std::string::npos &&
            name.find(".lock") == std::string::npos) {
            ++n;
        }
    }
    return n;
}

TEST(CrashSafety, WritersKilledAtRandomLeaveEveryStoreOldOrNewAndTheAgentServes) {
    preferMemoryForTemporaryFiles();
    test::AgentProcess agent;
    const std::string home = agent.home(), root = agent.platformRoot();
    Stores stores(home, root);

    // Generation 0 everywhere, and how long one generation of four writes takes here.
    const auto started = SteadyClock::now();
    {
        Writer writer({home, root, "0", "50"}, agent.environment());
        ASSERT_EQ(writer.wait(), 0);
    }
    const double generationSeconds =
        std::chrono::duration<double>(SteadyClock::now() - started).count() / 51;
    Generations current = stores.read();
    for (const auto& g : current) {
        ASSERT_EQ(g, 50);
    }

    std::mt19937 rng(std::random_device{}());
    // Kills land anywhere from just before the first write to well into the third generation.
    std::uniform_int_distribution<int> delayMicros(
        0, std::max(1000, static_cast<int>(generationSeconds * 2.5e6)));
    std::int64_t next = 51;
    std::array<int, 4> killedMidWrite{};  // the store held a generation not yet reported whole
    int beforeAnyWrite = 0, midGeneration = 0;
    for (int kill = 0; kill < kKills; ++kill) {
        Writer writer({home, root, std::to_string(next)}, agent.environment());
        ASSERT_EQ(writer.line(10), "ready");
        std::this_thread::sleep_for(std::chrono::microseconds(delayMicros(rng)));
        writer.kill();
        std::optional<std::int64_t> done;
        while (auto line = writer.line(1)) {
            done = std::atoll(line->c_str());
        }
        const Generations after = stores.read();
        bool changed = false, anyInProgress = false, anyLast = false;
        for (std::size_t s = 0; s < after.size(); ++s) {
            SCOPED_TRACE(std::string(kStoreNames[s]) + " after kill " + std::to_string(kill));
            ASSERT_TRUE(after[s].has_value()) << "torn, empty or missing";
            const std::int64_t last = done.value_or(*current[s]);
            const std::int64_t inProgress = done ? *done + 1 : next;
            ASSERT_TRUE(*after[s] == last || *after[s] == inProgress)
                << "holds " << *after[s] << ", expected " << last << " or " << inProgress;
            changed = changed || *after[s] != *current[s];
            if (*after[s] == inProgress) {
                ++killedMidWrite[s];
                anyInProgress = true;
            } else {
                anyLast = true;
            }
        }
        beforeAnyWrite += changed ? 0 : 1;
        midGeneration += anyInProgress && anyLast ? 1 : 0;
        current = after;
        next = std::max({*after[0], *after[1], *after[2], *after[3]}) + 1;
    }
    EXPECT_GT(midGeneration, 0) << "no kill landed between the writes of one generation";
    std::printf(
        "%d kills: %d before any write, %d between the stores of one generation; "
        "stores found holding the unfinished generation: preferences %d, cache %d, "
        "follow-ups %d, registry %d; %d temporary files left behind; %lld generations\n",
        kKills, beforeAnyWrite, midGeneration, killedMidWrite[0], killedMidWrite[1],
        killedMidWrite[2], killedMidWrite[3],
        leftoverTemporaryFiles(home) + leftoverTemporaryFiles(root),
        static_cast<long long>(next - 1));

    // The agent starts on what the writers left and serves the cached warranty.
    agent.writeDevices(trial::kSerialNumber);
    agent.writeAccounts();
    agent.registerApplication("tests", test::selfExecutable(), std::nullopt, Value(true));
    ASSERT_TRUE(agent.start()) << agent.log();
    HostIpcClient client;
    std::string error;
    ASSERT_TRUE(client.connect(agent.socketPath(), &error)) << error;
    auto reply = client.call("getDeviceInfoForSerialNumber:usingPolicy:withReply:",
                             {Value(trial::kSerialNumber), Value(1)}, 10, &error);
    ASSERT_TRUE(reply && reply->value) << error;
    const Value* warranty = reply->value->find("warranty");
    ASSERT_TRUE(warranty) << reply->value->description();
    EXPECT_EQ(*warranty->find("DictionaryRepresentation")->find(trial::kGenerationKey),
              Value(*current[1]));
    EXPECT_EQ(agent.countInLog("unreadable"), 0) << agent.log();
    EXPECT_EQ(agent.countInLog("Ignoring platform file"), 0) << agent.log();
}

TEST(CrashSafety, AFullDiskKeepsTheOldFilesAndLogsTheError) {
    test::TempDir dir;
    const std::string home = (dir.path() / "home").string(), root = (dir.path() / "root").string();
    {
        Writer writer({home, root, "1", "1"});
        ASSERT_EQ(writer.wait(), 0);
    }
    // Every new file is larger than this; the old ones stay readable.
    Writer writer({"--file-limit", "64", home, root, "2"});
    std::vector<std::string> results;
    while (auto line = writer.line(10)) {
        results.push_back(*line);
    }
    const std::string log = writer.errors();
    EXPECT_EQ(writer.wait(), 0) << log;

    const char* messages[] = {
        "Cannot write preference domain file", "Unable to write the warranty cache",
        "Cannot write the follow-up store", "Cannot write the activity registry"};
    const Generations held = Stores(home, root).read();
    ASSERT_EQ(results.size(), 4u) << log;
    for (std::size_t s = 0; s < 4; ++s) {
        SCOPED_TRACE(kStoreNames[s]);
        EXPECT_EQ(results[s], std::string(kStoreNames[s]) + " failed");
        EXPECT_NE(log.find(messages[s]), std::string::npos) << log;
        EXPECT_EQ(held[s], 1);
    }
    EXPECT_NE(log.find("File too large"), std::string::npos) << log;
    EXPECT_EQ(leftoverTemporaryFiles(home) + leftoverTemporaryFiles(root), 0);
}

}  // namespace
}  // namespace qax
