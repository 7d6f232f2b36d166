#include "platform/host/HostClientConnection.h"

#include <asio/post.hpp>
#include <asio/write.hpp>
#include <chrono>

#include "core/Log.h"
#include "core/OnceCallback.h"
#include "core/PlistCodec.h"

namespace qax {
namespace {

// A client that stops halfway through a request for this long is dropped.
constexpr auto kIncompleteRequestTimeout = std::chrono::seconds(60);
// Beyond this many unanswered requests the connection stops reading until replies go out.
constexpr int kMaxRequestsInFlight = 64;
// Requests are small; a large frame accumulates in the decoder over several reads. A small
// chunk keeps a thousand idle connections cheap.
constexpr std::size_t kReadChunkBytes = 8 * 1024;

constexpr const char* kIdKey = "id";
constexpr const char* kOpKey = "op";
constexpr const char* kArgsKey = "args";
constexpr const char* kReplyKey = "reply";
constexpr const char* kErrorKey = "error";

}  // namespace

HostClientConnection::HostClientConnection(Socket socket, std::shared_ptr<TaskRunner> requestQueue,
                                           std::shared_ptr<void> transaction)
    : socket_(std::move(socket)),
      idleTimer_(socket_.get_executor()),
      requestQueue_(std::move(requestQueue)),
      transaction_(std::move(transaction)) {
    readBuffer_.resize(kReadChunkBytes);
}

HostClientConnection::~HostClientConnection() = default;

pid_t HostClientConnection::peerProcessIdentifier() const {
    std::lock_guard lock(mutex_);
    return pid_;
}

std::optional<Value> HostClientConnection::entitlementValue(const std::string& name) const {
    std::lock_guard lock(mutex_);
    auto it = entitlements_.find(name);
    if (it == entitlements_.end()) {
        return std::nullopt;
    }
    return it->second;
}

void HostClientConnection::exportInterface(std::shared_ptr<const RemoteInterface> interface) {
    std::lock_guard lock(mutex_);
    interface_ = std::move(interface);
}

void HostClientConnection::exportObject(std::shared_ptr<ExportedObject> object) {
    std::lock_guard lock(mutex_);
    object_ = std::move(object);
}

void HostClientConnection::setPeer(pid_t pid, Value::Dictionary entitlements) {
    std::lock_guard lock(mutex_);
    pid_ = pid;
    entitlements_ = std::move(entitlements);
}

void HostClientConnection::resume() {
    asio::post(socket_.get_executor(), [self = shared_from_this()] {
        if (self->resumed_ || self->closed_) {
            return;
        }
        self->resumed_ = true;
        self->readMore();
    });
}

void HostClientConnection::close() {
    asio::post(socket_.get_executor(), [self = shared_from_this()] { self->closeNow(); });
}

void HostClientConnection::readMore() {
    if (closed_ || !resumed_ || reading_ || inFlight_ >= kMaxRequestsInFlight) {
        return;
    }
    reading_ = true;
    if (decoder_.hasPartialFrame()) {
        armIdleTimer();
    } else {
        idleTimer_.cancel();
    }
    socket_.async_read_some(asio::buffer(readBuffer_),
                            [self = shared_from_this()](const asio::error_code& ec, std::size_t n) {
                                self->reading_ = false;
                                if (ec) {
                                    // End of stream or a reset: the client went away.
                                    self->closeNow();
                                    return;
                                }
                                self->handleBytes(n);
                            });
}

void HostClientConnection::armIdleTimer() {
    idleTimer_.expires_after(kIncompleteRequestTimeout);
    idleTimer_.async_wait([weak = weak_from_this()](const asio::error_code& ec) {
        auto self = weak.lock();
        if (ec || !self || self->closed_ || !self->decoder_.hasPartialFrame()) {
            return;
        }
        self->closeWithError("request incomplete for 60 seconds");
    });
}

void HostClientConnection::handleBytes(std::size_t n) {
    if (closed_) {
        return;
    }
    decoder_.append(std::string_view(readBuffer_.data(), n));
    std::string payload;
    for (;;) {
        std::string error;
        auto status = decoder_.next(payload, &error);
        if (status == IpcFrameCodec::Status::NeedMore) {
            break;
        }
        if (status == IpcFrameCodec::Status::Error) {
            closeWithError(error);
            return;
        }
        if (!handleFrame(payload)) {
            return;
        }
    }
    readMore();
}

bool HostClientConnection::handleFrame(const std::string& payload) {
    std::string error;
    auto message = parsePlist(payload, &error);
    if (!message) {
        closeWithError("request does not parse: " + error);
        return false;
    }
    const Value* id = message->find(kIdKey);
    if (!id || !id->isInteger()) {
        closeWithError("request has no integer id");
        return false;
    }
    const std::int64_t requestId = *id->asInteger();
    ++inFlight_;
    const Value* op = message->find(kOpKey);
    const Value* args = message->find(kArgsKey);
    if (!op || !op->isString()) {
        sendReply(requestId, RemoteReply::failure("malformed request: op is not a string"));
        return true;
    }
    if (args && !args->isArray()) {
        sendReply(requestId, RemoteReply::failure("malformed request: args is not an array"));
        return true;
    }
    std::shared_ptr<const RemoteInterface> interface;
    std::shared_ptr<ExportedObject> object;
    {
        std::lock_guard lock(mutex_);
        interface = interface_;
        object = object_;
    }
    if (!interface || !object) {
        sendReply(requestId, RemoteReply::failure("no interface is exported"));
        return true;
    }
    // A request keeps its connection alive until it has replied: while reading is paused no
    // socket operation may be pending, and the connection must not go with them.
    std::function<void(RemoteReply)> reply = [self = shared_from_this(), requestId](RemoteReply r) {
        self->sendReply(requestId, std::move(r));
    };
    requestQueue_->post([interface, object, name = *op->asString(),
                         list = args ? *args->asArray() : Value::Array{},
                         reply = onceCallback(std::move(reply), "IPC reply")]() mutable {
        interface->invoke(object, name, list, std::move(reply));
    });
    return true;
}

void HostClientConnection::sendReply(std::int64_t id, RemoteReply reply) {
    Value::Dictionary message{{kIdKey, Value(id)}};
    if (reply.error) {
        message[kErrorKey] = *reply.error;
    } else if (reply.value) {
        message[kReplyKey] = std::move(*reply.value);
    }
    auto frame = IpcFrameCodec::encode(Value(message));
    if (!frame) {
        message.erase(kReplyKey);
        message[kErrorKey] = "reply cannot be encoded";
        frame = IpcFrameCodec::encode(Value(std::move(message)));
    }
    asio::post(socket_.get_executor(),
               [self = shared_from_this(), frame = std::move(frame)]() mutable {
                   --self->inFlight_;
                   if (self->closed_ || !frame) {
                       return;
                   }
                   self->enqueueWrite(std::move(*frame));
                   self->readMore();
               });
}

void HostClientConnection::enqueueWrite(std::string frame) {
    writeQueue_.push_back(std::move(frame));
    if (!writing_) {
        writeNext();
    }
}

void HostClientConnection::writeNext() {
    writing_ = true;
    asio::async_write(socket_, asio::buffer(writeQueue_.front()),
                      [self = shared_from_this()](const asio::error_code& ec, std::size_t) {
                          self->writing_ = false;
                          if (ec) {
                              self->closeNow();
                              return;
                          }
                          self->writeQueue_.pop_front();
                          if (!self->writeQueue_.empty() && !self->closed_) {
                              self->writeNext();
                          }
                      });
}

void HostClientConnection::closeWithError(const std::string& reason) {
    qaxLog().error("Closing connection from pid %d: %@", peerProcessIdentifier(), reason);
    closeNow();
}

void HostClientConnection::closeNow() {
    if (closed_) {
        return;
    }
    closed_ = true;
    idleTimer_.cancel();
    asio::error_code ec;
    socket_.shutdown(Socket::shutdown_both, ec);
    socket_.close(ec);
    // A request still running keeps the connection object, but no longer the process: work
    // that must finish holds a transaction of its own.
    transaction_.reset();
    // The exported object goes once the requests still running have replied.
    std::lock_guard lock(mutex_);
    object_.reset();
    interface_.reset();
}

}  // namespace qax
