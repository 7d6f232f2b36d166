// A program started in the background with its own environment and its output appended to a
// file (the socket activator, installed copies of the programs); killed if it still runs when
// the object goes.
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>
#include <vector>

namespace qax::test {

class SpawnedProcess {
  public:
    SpawnedProcess(const std::string& program, std::vector<std::string> args,
                   std::vector<std::string> environment, const std::string& logPath);
    ~SpawnedProcess();

    bool running() { return pid_ > 0 && !waitForExit(0); }
    // The raw wait status, none if it still runs after `seconds`.
    std::optional<int> waitForExit(double seconds);
    void terminate();

  private:
    pid_t pid_ = -1;
    std::optional<int> status_;
};

// The program's path on PATH, if it is there.
std::optional<std::string> findProgram(const std::string& name);

}  // namespace qax::test
