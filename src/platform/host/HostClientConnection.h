// One client of the agent's Unix socket. The socket is bound to the connection's own strand,
// which is also its request queue, on one of the dispatcher's I/O threads: reads, requests
// (one at a time, in arrival order, where the exported interface calls the exported object)
// and writes run there. A request answered at once is read, served and answered by the thread
// that saw the socket become readable, and its reply goes out in one write. Replies may come
// from any thread and in any order; they are encoded on the replying thread and written from
// the strand. The peer facts and the exported interface and object are set by the listener
// before resume() and guarded by a mutex. The connection keeps the process alive (its
// lifecycle transaction) until it is closed. An idle connection holds a small read buffer
// (a usual request fits it); more bytes are read into a buffer of the I/O thread, and only an
// incomplete frame is kept.
#pragma once

#include <sys/types.h>

#include <array>
#include <asio/local/stream_protocol.hpp>
#include <asio/steady_timer.hpp>
#include <cstdint>
#include <deque>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>

#include "platform/ServiceListener.h"
#include "platform/host/IpcFrameCodec.h"

namespace qax {

class HostClientConnection : public ClientConnection,
                             public std::enable_shared_from_this<HostClientConnection> {
  public:
    using Socket = asio::local::stream_protocol::socket;

    // `socket` is bound to the connection's strand. `transaction` is let go when the
    // connection closes.
    explicit HostClientConnection(Socket socket, std::shared_ptr<void> transaction = nullptr);
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
    // Waits for the socket to become readable (unless paused, waiting already or closed).
    void readMore();
    // After a read filled the connection's own buffer: reads what else waits, then handles it.
    void readAvailable();
    void handleBytes(std::string_view bytes);
    // False when the connection had to be closed.
    bool handleFrame(std::string_view payload);
    void armIdleTimer();
    void sendReply(std::int64_t id, RemoteReply reply);
    // On the strand: writes what it can at once, queues the rest.
    void enqueueWrite(std::string frame);
    void writeNext();
    void closeWithError(const std::string& reason);

    Socket socket_;
    asio::steady_timer idleTimer_;

    mutable std::mutex mutex_;
    pid_t pid_ = 0;
    Value::Dictionary entitlements_;
    std::shared_ptr<const RemoteInterface> interface_;
    std::shared_ptr<ExportedObject> object_;

    // On the strand only.
    std::shared_ptr<void> transaction_;
    IpcFrameCodec decoder_;
    // Where the socket is read as it becomes readable: a usual request arrives whole here,
    // a larger one goes on through the reading thread's shared buffer.
    std::array<char, 512> readBuffer_;
    std::deque<std::string> writeQueue_;
    bool reading_ = false;
    // Inside handleBytes(): a reply given there does not resume reading, the loop does.
    bool handling_ = false;
    bool writing_ = false;
    bool closed_ = false;
    bool resumed_ = false;
    int inFlight_ = 0;
};

}  // namespace qax
