// The agent's IPC service on the host: a Unix stream socket named after the service in the
// runtime directory, bound here or passed in by the service manager that started the agent on
// demand (then the path is the manager's and is left alone). Each connection holds a
// transaction of the process lifecycle while it is open. Threading: accepting runs on the main
// io_context (the main thread); each accepted client is checked (HostPeerVerifier) and offered to
// the delegate on the listener's own serial queue, so the file system work of the check never holds
// up the main thread; each connection then does its socket I/O and delivers its requests on a
// strand of its own. resume() and invalidate() are called on the main thread.
#pragma once

#include <asio/local/stream_protocol.hpp>
#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "core/AsioDispatcher.h"
#include "platform/ApplicationRegistry.h"
#include "platform/ServiceListener.h"

namespace qax {

class HostClientConnection;
class HostProcessLifecycle;

class HostServiceListener : public ServiceListener,
                            public std::enable_shared_from_this<HostServiceListener> {
  public:
    // `passedSocket`: a listening socket to serve instead of binding `socketPath`; the
    // listener owns it from now on. `lifecycle` may be null.
    HostServiceListener(std::string serviceName, std::string socketPath,
                        std::shared_ptr<AsioDispatcher> dispatcher,
                        std::shared_ptr<ApplicationRegistry> applications,
                        std::shared_ptr<HostProcessLifecycle> lifecycle = nullptr,
                        std::optional<int> passedSocket = std::nullopt);
    ~HostServiceListener() override;

    void setDelegate(std::shared_ptr<ServiceListenerDelegate> delegate) override;
    bool resume() override;
    void invalidate() override;

    const std::string& socketPath() const { return socketPath_; }

  private:
    bool bindSocketPath();
    // Main thread: the lifecycle stops accepting before the process exits.
    void setAccepting(bool accepting);
    void acceptNext();
    void offer(const std::shared_ptr<HostClientConnection>& connection);

    const std::string serviceName_;
    const std::string socketPath_;
    std::shared_ptr<AsioDispatcher> dispatcher_;
    std::shared_ptr<ApplicationRegistry> applications_;
    std::shared_ptr<TaskRunner> listenerQueue_;
    std::shared_ptr<HostProcessLifecycle> lifecycle_;
    std::optional<int> passedSocket_;

    std::mutex mutex_;
    std::shared_ptr<ServiceListenerDelegate> delegate_;

    // Main thread only.
    asio::local::stream_protocol::acceptor acceptor_;
    bool listening_ = false;
    bool ownsPath_ = false;
    bool accepting_ = true;
    bool acceptPending_ = false;
    std::uint64_t nextConnection_ = 1;
    std::map<std::uint64_t, std::weak_ptr<HostClientConnection>> connections_;
};

}  // namespace qax
