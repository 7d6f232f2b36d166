// A real qaxagent for integration tests: a temporary HOME with its platform root and runtime
// directory, the agent started on it with its stderr in a file, and stopped (SIGTERM, then
// SIGKILL) when the object goes. Waits poll with short steps and bounded deadlines.
#pragma once

#include <sys/types.h>

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "SpawnedProcess.h"
#include "core/Value.h"
#include "fakes/TestPlatform.h"

namespace qax::test {

struct ToolResult {
    int status = -1;  // the exit status; -1 when killed by a signal or at the deadline
    std::string out;
    std::string err;
};

// Runs a program with `environment`, waiting at most `seconds`.
ToolResult runTool(const std::string& program, const std::vector<std::string>& args,
                   const std::vector<std::string>& environment, double seconds = 30);

class AgentProcess {
  public:
    AgentProcess();
    ~AgentProcess() { stop(); }

    std::string home() const { return dir_.str(); }
    std::string platformRoot() const { return dir_.str() + "/root"; }
    std::string runtimeDirectory() const { return dir_.str() + "/run"; }
    std::string socketPath() const { return runtimeDirectory() + "/com.velmora.qaxagent"; }
    std::string logPath() const { return dir_.str() + "/agent.log"; }

    // Writes a file under the platform root ("device.plist", "apps/x.plist").
    void writeRootFile(const std::string& relativePath, const Value& plist);
    // This device (a phone with `serialNumber` on `systemVersion`) and, when given, one paired
    // watch, with the paired-watches feature on.
    void writeDevices(const std::string& serialNumber,
                      const std::optional<std::string>& watchSerialNumber = std::nullopt,
                      const std::string& systemVersion = "1.0");
    // A signed-in user; with a token service, also a KF account (with `tokens`, service ->
    // token) renewed there and a store account.
    void writeAccounts(const std::optional<std::string>& tokenServiceURL = std::nullopt,
                       const Value::Dictionary& tokens = {});
    // Registers an executable in the application registry under `name`; an entitlement value of
    // none leaves the entitlement out.
    void registerApplication(const std::string& name, const std::string& executablePath,
                             std::optional<std::string> bundleIdentifier,
                             std::optional<Value> entitlement);

    // Starts the agent (or another build of it) on a fresh log and waits until it listens;
    // false when it does not.
    bool start(const std::string& program = QAX_AGENT_BINARY);
    // Sends `signal` and waits for the exit; the raw wait status, or -1 if it had to be killed.
    int stop(int signal = 15);
    bool running() { return process_ && process_->running(); }
    pid_t pid() const { return process_ ? process_->pid() : -1; }

    // The agent's stderr so far.
    std::string log() const { return readFile(logPath()); }
    int countInLog(const std::string& text) const;
    // Polls the log until `text` has appeared `times` times.
    bool waitForLog(const std::string& text, int times = 1, double seconds = 5) const;

#ifdef QAX_CTL_BINARY
    // Runs qaxctl with this environment (in the builds that name qaxctl).
    ToolResult ctl(const std::vector<std::string>& args) const {
        return runTool(QAX_CTL_BINARY, args, environment());
    }
#endif

    // The environment the agent runs with (HOME, QAX_PLATFORM_ROOT, QAX_RUNTIME_DIR, PATH, and
    // the extra entries).
    std::vector<std::string> environment() const;
    // "NAME=value" entries added to the agent's environment from the next start on.
    std::vector<std::string> extraEnvironment;

  private:
    TempDir dir_;
    std::unique_ptr<SpawnedProcess> process_;
};

// The real path of the running test executable.
std::string selfExecutable();

}  // namespace qax::test
