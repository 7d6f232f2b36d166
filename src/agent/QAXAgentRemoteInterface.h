// QAXAgentProtocol as an IPC interface: maps each operation's full keyword name to a call on
// the exported agent, checking the kind and count of the arguments (serial numbers must be
// short, non-empty strings; policies non-negative integers) and archiving the reply. Names
// outside the protocol answer "unknown operation". Stateless; called on the
// connection's request queue, replies from wherever the agent finishes; one description may
// serve every connection.
#pragma once

#include <memory>

#include "platform/ServiceListener.h"

namespace qax {

// The IPC service name under which the agent publishes this interface.
inline constexpr const char* kQAXAgentServiceName = "com.velmora.qaxagent";

class QAXAgentRemoteInterface : public RemoteInterface {
  public:
    void invoke(const std::shared_ptr<ExportedObject>& object, const std::string& op,
                const Value::Array& args, RemoteReplyHandler reply) const override;
};

}  // namespace qax
