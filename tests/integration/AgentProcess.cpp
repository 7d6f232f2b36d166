#include "AgentProcess.h"

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <thread>

#include "core/PlistCodec.h"

namespace qax::test {
namespace {

using Clock = std::chrono::steady_clock;
constexpr auto kPollStep = std::chrono::milliseconds(5);

Clock::time_point deadlineIn(double seconds) {
    return Clock::now() +
           std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(seconds));
}

std::vector<char*> cStrings(std::vector<std::string>& strings) {
    std::vector<char*> out;
    for (auto& s : strings) {
        out.push_back(s.data());
    }
    out.push_back(nullptr);
    return out;
}

pid_t spawn(const std::string& program, std::vector<std::string> args,
            std::vector<std::string> environment, const std::string& outPath,
            const std::string& errPath) {
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
    posix_spawn_file_actions_addopen(&actions, 1, outPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC,
                                     0644);
    posix_spawn_file_actions_addopen(&actions, 2, errPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC,
                                     0644);
    args.insert(args.begin(), program);
    auto argv = cStrings(args);
    auto envp = cStrings(environment);
    pid_t pid = -1;
    if (posix_spawn(&pid, program.c_str(), &actions, nullptr, argv.data(), envp.data()) != 0) {
        pid = -1;
    }
    posix_spawn_file_actions_destroy(&actions);
    return pid;
}

// The wait status, or none if the process is still running at the deadline.
std::optional<int> waitUntil(pid_t pid, Clock::time_point deadline) {
    for (;;) {
        int status = 0;
        const pid_t r = waitpid(pid, &status, WNOHANG);
        if (r == pid) {
            return status;
        }
        if (r < 0 || Clock::now() >= deadline) {
            return r < 0 ? std::optional<int>(-1) : std::nullopt;
        }
        std::this_thread::sleep_for(kPollStep);
    }
}

}  // namespace

AgentProcess::AgentProcess() {
    std::filesystem::create_directories(platformRoot());
}

AgentProcess::~AgentProcess() {
    stop();
}

std::string AgentProcess::home() const {
    return dir_.str();
}
std::string AgentProcess::platformRoot() const {
    return dir_.str() + "/root";
}
std::string AgentProcess::runtimeDirectory() const {
    return dir_.str() + "/run";
}
std::string AgentProcess::socketPath() const {
    return runtimeDirectory() + "/com.velmora.qaxagent";
}

void AgentProcess::writeRootFile(const std::string& relativePath, const Value& plist) {
    writeFile(std::filesystem::path(platformRoot()) / relativePath, toXmlPlist(plist).value());
}

void AgentProcess::registerApplication(const std::string& name, const std::string& executablePath,
                                       std::optional<std::string> bundleIdentifier,
                                       std::optional<Value> entitlement) {
    Value::Dictionary app{{"ExecutablePath", Value(executablePath)},
                          {"Installed", Value(true)},
                          {"Entitlements", Value(Value::Dictionary{})}};
    if (bundleIdentifier) {
        app["BundleIdentifier"] = *bundleIdentifier;
    }
    if (entitlement) {
        app["Entitlements"] =
            Value(Value::Dictionary{{"com.velmora.private.qaxagent", *entitlement}});
    }
    writeRootFile("apps/" + name + ".plist", Value(std::move(app)));
}

std::vector<std::string> AgentProcess::environment() const {
    const char* path = std::getenv("PATH");
    std::vector<std::string> env = {"HOME=" + home(), "QAX_PLATFORM_ROOT=" + platformRoot(),
                                    "QAX_RUNTIME_DIR=" + runtimeDirectory(),
                                    std::string("PATH=") + (path ? path : "/usr/bin:/bin")};
    env.insert(env.end(), extraEnvironment.begin(), extraEnvironment.end());
    return env;
}

bool AgentProcess::start() {
    pid_ = spawn(QAX_AGENT_BINARY, {}, environment(), "/dev/null", dir_.str() + "/agent.log");
    if (pid_ < 0) {
        return false;
    }
    const auto deadline = deadlineIn(10);
    struct stat st {};
    while (Clock::now() < deadline) {
        if (::stat(socketPath().c_str(), &st) == 0 && S_ISSOCK(st.st_mode)) {
            return true;
        }
        if (!running()) {
            return false;
        }
        std::this_thread::sleep_for(kPollStep);
    }
    return false;
}

bool AgentProcess::running() {
    if (pid_ < 0) {
        return false;
    }
    int status = 0;
    if (waitpid(pid_, &status, WNOHANG) == pid_) {
        pid_ = -1;
        return false;
    }
    return true;
}

int AgentProcess::stop(int signal) {
    if (pid_ < 0) {
        return -1;
    }
    ::kill(pid_, signal);
    auto status = waitUntil(pid_, deadlineIn(10));
    if (!status) {
        ::kill(pid_, SIGKILL);
        waitUntil(pid_, deadlineIn(10));
        status = -1;
    }
    pid_ = -1;
    return *status;
}

std::string AgentProcess::log() const {
    return readFile(dir_.path() / "agent.log");
}

int AgentProcess::countInLog(const std::string& text) const {
    const std::string all = log();
    int n = 0;
    for (auto at = all.find(text); at != std::string::npos; at = all.find(text, at + 1)) {
        ++n;
    }
    return n;
}

bool AgentProcess::waitForLog(const std::string& text, int times, double seconds) const {
    const auto deadline = deadlineIn(seconds);
    while (countInLog(text) < times) {
        if (Clock::now() >= deadline) {
            return false;
        }
        std::this_thread::sleep_for(kPollStep);
    }
    return true;
}

ToolResult runTool(const std::string& program, const std::vector<std::string>& args,
                   const std::vector<std::string>& environment, double seconds) {
    TempDir out;
    ToolResult result;
    const pid_t pid = spawn(program, args, environment, out.str() + "/out", out.str() + "/err");
    if (pid < 0) {
        return result;
    }
    auto status = waitUntil(pid, deadlineIn(seconds));
    if (!status) {
        ::kill(pid, SIGKILL);
        waitUntil(pid, deadlineIn(5));
    } else if (WIFEXITED(*status)) {
        result.status = WEXITSTATUS(*status);
    }
    result.out = readFile(out.path() / "out");
    result.err = readFile(out.path() / "err");
    return result;
}

std::string selfExecutable() {
    return std::filesystem::canonical("/proc/self/exe").string();
}

}  // namespace qax::test
