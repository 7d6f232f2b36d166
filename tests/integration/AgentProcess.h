// A real qaxagent for integration tests: a temporary HOME with its platform root and runtime
// directory, the agent started on it with its stderr in a file, and stopped (SIGTERM, then
// SIGKILL) when the object goes. Waits poll with short steps and bounded deadlines.
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>
#include <vector>

#include "core/Value.h"
#include "fakes/TestPlatform.h"

namespace qax::test {

class AgentProcess {
  public:
    AgentProcess();
    ~AgentProcess();

    std::string home() const;
    std::string platformRoot() const;
    std::string runtimeDirectory() const;
    std::string socketPath() const;

    // Writes a file under the platform root ("device.plist", "apps/x.plist").
    void writeRootFile(const std::string& relativePath, const Value& plist);
    // Registers an executable in the application registry under `name`; an entitlement value of
    // none leaves the entitlement out.
    void registerApplication(const std::string& name, const std::string& executablePath,
                             std::optional<std::string> bundleIdentifier,
                             std::optional<Value> entitlement);

    // Starts the agent and waits until it listens; false (with the log) when it does not.
    bool start();
    // Sends `signal` and waits for the exit; the raw wait status, or -1 if it had to be killed.
    int stop(int signal = 15);
    bool running();
    pid_t pid() const { return pid_; }

    // The agent's stderr so far.
    std::string log() const;
    int countInLog(const std::string& text) const;
    // Polls the log until `text` has appeared `times` times.
    bool waitForLog(const std::string& text, int times = 1, double seconds = 5) const;

    // The environment the agent runs with (HOME, QAX_PLATFORM_ROOT, QAX_RUNTIME_DIR, PATH, and
    // the extra entries).
    std::vector<std::string> environment() const;
    // "NAME=value" entries added to the agent's environment from the next start on.
    std::vector<std::string> extraEnvironment;

  private:
    TempDir dir_;
    pid_t pid_ = -1;
};

struct ToolResult {
    int status = -1;
    std::string out;
    std::string err;
};

// Runs a program with `environment`, waiting at most `seconds`.
ToolResult runTool(const std::string& program, const std::vector<std::string>& args,
                   const std::vector<std::string>& environment, double seconds = 30);

// The real path of the running test executable.
std::string selfExecutable();

}  // namespace qax::test
