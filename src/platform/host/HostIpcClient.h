// The client end of the agent's IPC socket: connects, writes framed requests, reads framed
// replies. Blocking, with timeouts. Used by qaxctl, the integration tests and the load client.
// Not thread-safe: one client per thread.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "core/Value.h"
#include "platform/host/IpcFrameCodec.h"

namespace qax {

class HostIpcClient {
  public:
    // What a request got back: a value, none, or the agent's error text.
    struct Reply {
        std::optional<Value> value;
        std::optional<std::string> error;
    };

    HostIpcClient() = default;
    ~HostIpcClient();
    HostIpcClient(const HostIpcClient&) = delete;
    HostIpcClient& operator=(const HostIpcClient&) = delete;

    bool connect(const std::string& socketPath, std::string* error);
    void close();
    bool isConnected() const { return fd_ >= 0; }

    // Writes one request {"id", "op", "args"}.
    bool sendRequest(std::int64_t id, const std::string& op, const Value::Array& args,
                     std::string* error);
    // Writes bytes as they are (framing included or not).
    bool sendRaw(std::string_view bytes, std::string* error);
    // The next message from the agent; none on timeout, end of stream or a bad frame, with
    // `error` saying which ("closed" for the end of stream).
    std::optional<Value> receive(double timeoutSeconds, std::string* error);
    // One request and its reply (messages for other ids are skipped); none with `error` when
    // the transport failed.
    std::optional<Reply> call(const std::string& op, const Value::Array& args,
                              double timeoutSeconds, std::string* error);
    // True when the agent closes the connection within the time (pending messages are read
    // and dropped).
    bool waitForClose(double timeoutSeconds);

  private:
    int fd_ = -1;
    IpcFrameCodec decoder_;
    std::int64_t nextId_ = 1;
};

}  // namespace qax
