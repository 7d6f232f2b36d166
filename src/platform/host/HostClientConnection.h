// One client of the agent's Unix socket. The socket is bound to the connection's own strand,
// which is also its request queue: reads, requests (one at a time, in arrival order, where the
// exported interface calls the exported object) and writes run there, so a request answered
// at once never changes threads. Replies may come from any thread and in any order; they are
// encoded on the replying thread and written from the strand. The peer facts and the exported
// interface and object are set by the listener before resume() and guarded by a mutex. The
// connection keeps the process alive (its lifecycle transaction) until it is closed.
#pragma once

#include <sys/types.h>

#include <asio/local/stream_protocol.hpp>
#include <asio/steady_timer.hpp>
#include <cstdint>
#include <deque>
#include <memory>
#include <mutex>
#include <string>

#include "core/TaskRunner.h"
#include "platform/ServiceListener.h"
#include "platform/host/IpcFrameCodec.h"

namespace qax {

class HostClientConnection : public ClientConnection,
                             public std::enable_shared_from_this<HostClientConnection> {
  public:
    using Socket = asio::local::stream_protocol::socket;

    // `requestQueue` runs on the socket's strand. `transaction` is let go when the connection
    // closes.
    HostClientConnection(Socket socket, std::shared_ptr<TaskRunner> requestQueue,
                         std::shared_ptr<void> transaction = nullptr);
    ~HostClientConnection() override;

    pid_t peerProcessIdentifier() const override;
    std::optional<Value> entitlementValue(const std::string& name) const override;
    void exportInterface(std::shared_ptr<const RemoteInterface> interface) override;
    void exportObject(std::shared_ptr<ExportedObject> object) override;
    void resume() override;

    // Set by the listener after checking the peer, before the delegate is asked.
    void setPeer(pid_t pid, Value::Dictionary entitlements);
    int nativeHandle() { return socket_.native_handle(); }
    // Closes the socket from any thread; requests still running reply into the void.
    void close();
    // The same, on the connection's strand.
    void closeNow();

  private:
    void readMore();
    void handleBytes(std::size_t n);
    // False when the connection had to be closed.
    bool handleFrame(const std::string& payload);
    void armIdleTimer();
    void sendReply(std::int64_t id, RemoteReply reply);
    void enqueueWrite(std::string frame);
    void writeNext();
    void closeWithError(const std::string& reason);

    Socket socket_;
    asio::steady_timer idleTimer_;
    std::shared_ptr<TaskRunner> requestQueue_;

    mutable std::mutex mutex_;
    pid_t pid_ = 0;
    Value::Dictionary entitlements_;
    std::shared_ptr<const RemoteInterface> interface_;
    std::shared_ptr<ExportedObject> object_;

    // On the strand only.
    std::shared_ptr<void> transaction_;
    IpcFrameCodec decoder_;
    std::string readBuffer_;
    std::deque<std::string> writeQueue_;
    bool reading_ = false;
    bool writing_ = false;
    bool closed_ = false;
    bool resumed_ = false;
    int inFlight_ = 0;
};

}  // namespace qax
