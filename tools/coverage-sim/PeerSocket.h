// The accepted socket behind a request, found by its ports, for the answers the HTTP server
// library cannot give by itself: resetting the connection, and hanging until the client
// gives up. Stateless; called on the handler's thread while the server owns the socket (it
// is never closed here, so the descriptor cannot be reused under the server's feet).
#pragma once

#include <atomic>

namespace coveragesim {

// The connected TCP socket whose local port is `localPort` and peer port `peerPort`, or -1.
int findAcceptedSocket(int localPort, int peerPort);

// Disconnects the socket with a TCP reset; the server's later writes on it fail.
bool resetConnection(int fd);

// Waits until the peer closes or resets the connection, `stopping` turns true, or
// `maxSeconds` pass.
void waitForPeerToLeave(int fd, const std::atomic<bool>& stopping, double maxSeconds);

}  // namespace coveragesim
