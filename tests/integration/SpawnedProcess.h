// A program the test starts with an environment of its own and its standard error in a file,
// for wrappers (the socket activator) and installed copies of the programs that AgentProcess
// does not start. Killed (SIGKILL) if still running when the object goes.
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>
#include <vector>

namespace qax::test {

class SpawnedProcess {
  public:
    SpawnedProcess(const std::string& program, const std::vector<std::string>& args,
                   const std::vector<std::string>& environment, const std::string& logPath);
    ~SpawnedProcess();
    SpawnedProcess(const SpawnedProcess&) = delete;
    SpawnedProcess& operator=(const SpawnedProcess&) = delete;

    bool started() const { return pid_ > 0; }
    bool running();
    // The raw wait status once it has exited, none if it still runs after `seconds`.
    std::optional<int> waitForExit(double seconds);
    // Sends SIGTERM and waits; the wait status, or none if it had to be killed.
    std::optional<int> stop();

  private:
    pid_t pid_ = -1;
    std::optional<int> status_;
};

// The program's path if it is found on PATH (or the usual system directories).
std::optional<std::string> findProgram(const std::string& name);

}  // namespace qax::test
