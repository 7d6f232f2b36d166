// A program started in the background with its own environment, its output appended to files;
// stopped (SIGKILL) if it still runs when the object goes. Used from one thread.
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>
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

// The program's path on PATH, if it is there.
std::optional<std::string> findProgram(const std::string& name);

}  // namespace qax::test
