// A program started in the background with its own environment, its output appended to files;
// stopped (SIGKILL) if it still runs when the object goes. Used from one thread. Header-only:
// the load client builds the helpers that use it without the test's build.
#pragma once

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <optional>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

namespace qax::test {

class SpawnedProcess {
  public:
    // stderr goes to `errPath`, or with stdout to `outPath` when it is empty.
    SpawnedProcess(const std::string& program, std::vector<std::string> args,
                   std::vector<std::string> environment, const std::string& outPath,
                   const std::string& errPath = "");
    ~SpawnedProcess();
    SpawnedProcess(const SpawnedProcess&) = delete;
    SpawnedProcess& operator=(const SpawnedProcess&) = delete;

    pid_t pid() const { return pid_; }
    bool running() { return pid_ > 0 && !waitForExit(0); }
    // The raw wait status, none if it still runs after `seconds`.
    std::optional<int> waitForExit(double seconds);
    // Sends `signal` and waits; the raw wait status, or -1 if it had to be killed.
    int stop(int signal = 15);

  private:
    pid_t pid_ = -1;
    std::optional<int> status_;
};

inline SpawnedProcess::SpawnedProcess(const std::string& program, std::vector<std::string> args,
                                      std::vector<std::string> environment,
                                      const std::string& outPath, const std::string& errPath) {
    args.insert(args.begin(), program);
    std::vector<char*> argv, envp;
    for (auto& s : args) {
        argv.push_back(s.data());
    }
    for (auto& s : environment) {
        envp.push_back(s.data());
    }
    argv.push_back(nullptr);
    envp.push_back(nullptr);
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
    constexpr int kAppend = O_WRONLY | O_CREAT | O_APPEND;
    posix_spawn_file_actions_addopen(&actions, 1, outPath.c_str(), kAppend, 0644);
    if (errPath.empty()) {
        posix_spawn_file_actions_adddup2(&actions, 1, 2);
    } else {
        posix_spawn_file_actions_addopen(&actions, 2, errPath.c_str(), kAppend, 0644);
    }
    if (posix_spawn(&pid_, program.c_str(), &actions, nullptr, argv.data(), envp.data()) != 0) {
        pid_ = -1;
    }
    posix_spawn_file_actions_destroy(&actions);
}

inline SpawnedProcess::~SpawnedProcess() {
    if (running()) {
        ::kill(pid_, SIGKILL);
        waitForExit(10);
    }
}

inline std::optional<int> SpawnedProcess::waitForExit(double seconds) {
    const auto deadline = std::chrono::steady_clock::now() +
                          std::chrono::milliseconds(static_cast<long>(seconds * 1000));
    while (!status_ && pid_ > 0) {
        int status = 0;
        const pid_t r = ::waitpid(pid_, &status, WNOHANG);
        if (r != 0) {
            status_ = r == pid_ ? status : -1;
        } else if (std::chrono::steady_clock::now() >= deadline) {
            break;
        } else {
            std::this_thread::sleep_for(std::chrono::milliseconds(5));
        }
    }
    return status_;
}

inline int SpawnedProcess::stop(int signal) {
    if (!running()) {
        return status_.value_or(-1);
    }
    ::kill(pid_, signal);
    if (auto status = waitForExit(10)) {
        return *status;
    }
    ::kill(pid_, SIGKILL);
    waitForExit(10);
    return -1;
}

// The program's path on PATH, if it is there.
inline std::optional<std::string> findProgram(const std::string& name) {
    const char* path = std::getenv("PATH");
    std::istringstream dirs(path ? path : "/usr/bin:/bin");
    for (std::string dir; std::getline(dirs, dir, ':');) {
        if (!dir.empty() && ::access((dir + "/" + name).c_str(), X_OK) == 0) {
            return dir + "/" + name;
        }
    }
    return std::nullopt;
}

}  // namespace qax::test
