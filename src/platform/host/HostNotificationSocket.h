// The host's notification bus: the Unix datagram socket $QAX_RUNTIME_DIR/notify, one
// notification name per datagram (an empty datagram is a notification without a name).
// Receiving binds the socket on the first subscription and reads it on a HostIoThread of its
// own; subscribers are called on that thread and must hand work to their own queues. Posting
// needs no binding (qaxctl posts). Thread-safe.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "platform/host/HostIoThread.h"

namespace qax {

class HostNotificationSocket {
  public:
    using Subscriber = std::function<void(const std::optional<std::string>& name)>;

    explicit HostNotificationSocket(std::string runtimeDirectory);
    ~HostNotificationSocket();

    static std::string socketPath(const std::string& runtimeDirectory);
    // Sends one datagram; false when nobody receives at the path or the send fails.
    static bool post(const std::string& runtimeDirectory, const std::string& name);

    // Calls `subscriber` for every datagram received from now on; 0 when the socket could
    // not be bound.
    std::uint64_t subscribe(Subscriber subscriber);
    void unsubscribe(std::uint64_t id);
    const std::string& runtimeDirectory() const { return runtimeDirectory_; }

  private:
    struct Receiver;
    bool startLocked();
    void receiveNext();
    void deliver(const std::optional<std::string>& name);

    const std::string runtimeDirectory_;
    std::mutex mutex_;
    std::uint64_t nextId_ = 1;
    std::map<std::uint64_t, Subscriber> subscribers_;
    std::unique_ptr<Receiver> receiver_;
    HostIoThread io_;
};

}  // namespace qax
