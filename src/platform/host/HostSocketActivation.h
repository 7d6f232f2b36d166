// The agent under the service manager: the listening socket it passes when a client's
// connection starts the agent, and the readiness and stopping notices it waits for. Outside
// the service manager there is no socket and the notices go nowhere. Main thread, at start-up
// and at exit.
#pragma once

#include <optional>

namespace qax {

class HostSocketActivation {
  public:
    // The listening Unix stream socket passed to this process, taken once (the variables that
    // pass it are cleared so that no child inherits them); none when the agent was started by
    // hand or what was passed is not such a socket.
    static std::optional<int> takeListeningSocket();
    // The agent serves its clients now.
    static void notifyReady();
    // The agent is on its way out.
    static void notifyStopping();
};

}  // namespace qax
