#include "platform/host/HostServiceListener.h"

#include <cerrno>
#include <cstdio>

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <asio/post.hpp>
#include <asio/steady_timer.hpp>
#include <chrono>

#include "core/Log.h"
#include "platform/host/HostClientConnection.h"
#include "platform/host/HostPeerVerifier.h"
#include "platform/host/HostProcessLifecycle.h"
#include "platform/host/HostUnixSocketPath.h"

namespace qax {
namespace {

constexpr auto kAcceptRetryDelay = std::chrono::milliseconds(100);
constexpr const char* kConnectionTransaction = "client connection";

}  // namespace

HostServiceListener::HostServiceListener(std::string serviceName, std::string socketPath,
                                         std::shared_ptr<AsioDispatcher> dispatcher,
                                         std::shared_ptr<ApplicationRegistry> applications,
                                         std::shared_ptr<HostProcessLifecycle> lifecycle,
                                         std::optional<int> passedSocket)
    : serviceName_(std::move(serviceName)),
      socketPath_(std::move(socketPath)),
      dispatcher_(std::move(dispatcher)),
      applications_(std::move(applications)),
      listenerQueue_(dispatcher_->makeSerialQueue(serviceName_ + ".listener")),
      lifecycle_(std::move(lifecycle)),
      passedSocket_(passedSocket),
      acceptor_(dispatcher_->mainContext()) {}

HostServiceListener::~HostServiceListener() {
    if (listening_) {
        asio::error_code ec;
        acceptor_.close(ec);
        if (ownsPath_) {
            ::unlink(socketPath_.c_str());
        }
    } else if (passedSocket_) {
        ::close(*passedSocket_);
    }
}

void HostServiceListener::setDelegate(std::shared_ptr<ServiceListenerDelegate> delegate) {
    std::lock_guard lock(mutex_);
    delegate_ = std::move(delegate);
}

bool HostServiceListener::resume() {
    if (listening_) {
        return true;
    }
    if (passedSocket_) {
        asio::error_code ec;
        acceptor_.assign(asio::local::stream_protocol(), *passedSocket_, ec);
        if (ec) {
            qaxLog().error("Cannot serve %@ on the passed socket: %@", serviceName_, ec.message());
            return false;
        }
        passedSocket_.reset();
    } else if (!bindSocketPath()) {
        return false;
    } else {
        ownsPath_ = true;
    }
    listening_ = true;
    if (lifecycle_) {
        lifecycle_->setAcceptGate([weak = weak_from_this()](bool accepting) {
            if (auto self = weak.lock()) {
                self->setAccepting(accepting);
            }
        });
    }
    acceptNext();
    return true;
}

bool HostServiceListener::bindSocketPath() {
    std::string error;
    if (!HostUnixSocketPath::claim(socketPath_, SOCK_STREAM, &error)) {
        qaxLog().error("Cannot listen for %@: %@", serviceName_, error);
        return false;
    }
    // Bound and listening under a private name first, then renamed into place: a client that
    // sees the service's path can connect at once, never between bind and listen.
    std::string staging = socketPath_ + ".starting." + std::to_string(::getpid());
    if (staging.size() >= sizeof(sockaddr_un::sun_path)) {
        staging = socketPath_;  // no room for a private name: bind in place
    }
    ::unlink(staging.c_str());
    asio::error_code ec;
    acceptor_.open(asio::local::stream_protocol(), ec);
    if (!ec) {
        acceptor_.bind(asio::local::stream_protocol::endpoint(staging), ec);
    }
    if (!ec) {
        acceptor_.listen(asio::socket_base::max_listen_connections, ec);
    }
    if (!ec && staging != socketPath_ && std::rename(staging.c_str(), socketPath_.c_str()) != 0) {
        ec = asio::error_code(errno, asio::error::get_system_category());
    }
    if (ec) {
        qaxLog().error("Cannot listen for %@ on %@: %@", serviceName_, socketPath_, ec.message());
        acceptor_.close(ec);
        if (staging != socketPath_) {
            ::unlink(staging.c_str());
        }
        return false;
    }
    return true;
}

void HostServiceListener::setAccepting(bool accepting) {
    if (accepting_ == accepting) {
        return;
    }
    accepting_ = accepting;
    if (!accepting) {
        // An accept that has already taken a client off the socket still completes with it
        // (and that client is served); a waiting one stays queued on the socket.
        asio::error_code ec;
        acceptor_.cancel(ec);
        return;
    }
    acceptNext();
}

void HostServiceListener::acceptNext() {
    if (!listening_ || !accepting_ || acceptPending_) {
        return;
    }
    acceptPending_ = true;
    acceptor_.async_accept([self = shared_from_this()](
                               const asio::error_code& ec,
                               asio::local::stream_protocol::socket socket) {
        self->acceptPending_ = false;
        if (!self->listening_) {
            return;
        }
        if (ec == asio::error::operation_aborted) {
            // Stopped for a look before exiting; accepting may have resumed since.
            self->acceptNext();
            return;
        }
        if (!ec) {
            // The connection's socket and its request queue share one strand on an I/O
            // thread, so a request is read, served and answered without changing threads.
            auto strand = self->dispatcher_->makeIoStrand();
            asio::local::stream_protocol::socket onStrand(strand.executor);
            asio::error_code moveError;
            onStrand.assign(asio::local::stream_protocol(), socket.release(moveError), moveError);
            if (moveError) {
                qaxLog().error("Accepting a client of %@ failed: %@", self->serviceName_,
                               moveError.message());
                self->acceptNext();
                return;
            }
            auto connection = std::make_shared<HostClientConnection>(
                std::move(onStrand),
                self->lifecycle_ ? self->lifecycle_->beginTransaction(kConnectionTransaction)
                                 : nullptr);
            const auto id = self->nextConnection_++;
            self->connections_[id] = connection;
            // Forget connections that have gone, now and then, so the table stays small.
            if (id % 64 == 0) {
                std::erase_if(self->connections_,
                              [](const auto& entry) { return entry.second.expired(); });
            }
            self->offer(connection);
            self->acceptNext();
            return;
        }
        // Out of descriptors and the like: keep serving the clients already connected and
        // try again shortly rather than spinning.
        qaxLog().error("Accepting a client of %@ failed: %@", self->serviceName_, ec.message());
        auto timer = std::make_shared<asio::steady_timer>(self->dispatcher_->mainContext(),
                                                          kAcceptRetryDelay);
        timer->async_wait([self, timer](const asio::error_code& waitError) {
            if (!waitError) {
                self->acceptNext();
            }
        });
    });
}

void HostServiceListener::offer(const std::shared_ptr<HostClientConnection>& connection) {
    listenerQueue_->post([self = shared_from_this(), connection] {
        std::string error;
        auto peer =
            HostPeerVerifier::verify(connection->nativeHandle(), *self->applications_, &error);
        if (peer) {
            connection->setPeer(peer->pid, std::move(peer->entitlements));
        } else {
            // An unverifiable client holds no entitlements, so the delegate refuses it.
            auto cred = HostPeerVerifier::peerCredentials(connection->nativeHandle());
            connection->setPeer(cred ? cred->first : 0, {});
            qaxLog().error("Cannot verify a client of %@: %@", self->serviceName_, error);
        }
        std::shared_ptr<ServiceListenerDelegate> delegate;
        {
            std::lock_guard lock(self->mutex_);
            delegate = self->delegate_;
        }
        if (!delegate || !delegate->shouldAcceptNewConnection(*self, connection)) {
            connection->close();
        }
    });
}

void HostServiceListener::invalidate() {
    if (!listening_) {
        return;
    }
    listening_ = false;
    asio::error_code ec;
    acceptor_.close(ec);
    if (ownsPath_) {
        ::unlink(socketPath_.c_str());
    }
    for (auto& [id, weak] : connections_) {
        if (auto connection = weak.lock()) {
            connection->close();
        }
    }
    connections_.clear();
}

}  // namespace qax
