// What qaxctl's client verbs share: finding the agent's socket, one request with the exit
// status qaxctl reports for it, argument parsing common to the verbs, and the forms in which
// devices are printed. Single-threaded (qaxctl makes one call at a time).
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "core/Value.h"
#include "devices/QAXDevice.h"
#include "platform/Platform.h"

namespace qaxctl {

constexpr int kExitUsage = 64;
constexpr int kExitUnavailable = 69;  // agent not running, or it closed the connection
constexpr int kExitFailure = 70;      // the agent answered an error or an unexpected reply
constexpr double kDefaultReplyTimeoutSeconds = 120;

// The runtime directory that holds the agent's socket: QAX_RUNTIME_DIR (or its default), or,
// when no socket is there, $XDG_RUNTIME_DIR/qaxagent where the user units put it.
std::string agentRuntimeDirectory();

// Sends `op` with `args` and hands the reply value (none when the agent replied none) to
// `onReply`, whose result is returned. Reports on stderr and returns kExitUnavailable when
// the agent cannot be reached, closes the connection or does not answer in time, and
// kExitFailure when it answers an error.
int callAgent(const std::string& op, const qax::Value::Array& args, double timeoutSeconds,
              const std::function<int(const std::optional<qax::Value>&)>& onReply);
int badReply(const std::string& op);
// Prints "usage: qaxctl USAGE" and returns kExitUsage.
int usageError(const std::string& usage);

// Removes "--timeout SECONDS" from `args` into `seconds` (0 means no limit); false when the
// value is not a number of seconds.
bool takeTimeout(std::vector<std::string>& args, double& seconds);
// "default" | "cached" | "force" | an unsigned number, as the agent's policy value.
std::optional<qax::Value> parsePolicy(const std::string& text);
// SECONDS, or a count with the suffix s, m, h or d.
std::optional<double> parseDuration(const std::string& text);

// A host platform for reading the agent's records the way the agent does (its preference
// domain, clock and locale): the derived day counts and offer texts match the agent's.
std::shared_ptr<qax::Platform> recordPlatform();

qax::Value deviceJson(const qax::QAXDevice& device);
// Rows of text in aligned columns; the first row is the heading.
void printColumns(const std::vector<std::vector<std::string>>& rows);
void printDeviceTable(const std::vector<std::shared_ptr<qax::QAXDevice>>& devices);

}  // namespace qaxctl
