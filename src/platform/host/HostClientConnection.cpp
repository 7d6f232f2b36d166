#include "platform/host/HostClientConnection.h"

#include <asio/dispatch.hpp>
#include <asio/post.hpp>
#include <asio/write.hpp>
#include <chrono>
#include <vector>

#include "core/FileSnapshotScope.h"
#include "core/Log.h"
#include "core/OnceCallback.h"
#include "core/PlistCodec.h"

namespace qax {
namespace {

// A client that stops halfway through a request for this long is dropped.
constexpr auto kIncompleteRequestTimeout = std::chrono::seconds(60);
// Beyond this many unanswered requests the connection stops reading until replies go out.
constexpr int kMaxRequestsInFlight = 64;
// Beyond what the connection's own small buffer takes, bytes are read into a buffer of the
// reading thread, shared by all its connections; a large frame accumulates in the
// connection's decoder over several reads.
constexpr std::size_t kReadChunkBytes = 64 * 1024;

constexpr const char* kIdKey = "id";
constexpr const char* kOpKey = "op";
constexpr const char* kArgsKey = "args";
constexpr const char* kReplyKey = "reply";
constexpr const char* kErrorKey = "error";

}  // namespace

HostClientConnection::HostClientConnection(Socket socket, std::shared_ptr<void> transaction)
    : socket_(std::move(socket)),
      idleTimer_(socket_.get_executor()),
      transaction_(std::move(transaction)) {
    // Replies are written at once when the socket takes them; a full socket says so rather
    // than blocking the strand.
    asio::error_code ignored;
    socket_.non_blocking(true, ignored);
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
        decoder_.release();
    }
    // Reading as the socket becomes readable (rather than waiting for readability and then
    // reading) costs no re-registration with the reactor per request.
    socket_.async_read_some(
        asio::buffer(readBuffer_),
        [self = shared_from_this()](const asio::error_code& ec, std::size_t n) {
            self->reading_ = false;
            if (ec) {
                // The end of the stream, a reset, or cancelled: nothing more to read.
                self->closeNow();
                return;
            }
            // The request's log lines go out together, after its reply, and it sees each file
            // it reads as it was at its first look.
            LogBatch batch;
            FileSnapshotScope snapshot;
            if (n < self->readBuffer_.size()) {
                self->handleBytes(std::string_view(self->readBuffer_.data(), n));
                return;
            }
            self->decoder_.append(std::string_view(self->readBuffer_.data(), n));
            self->readAvailable();
        });
}

void HostClientConnection::readAvailable() {
    thread_local std::vector<char> buffer(kReadChunkBytes);
    asio::error_code ec;
    const std::size_t n = socket_.read_some(asio::buffer(buffer), ec);
    // Nothing more yet, the end of the stream or a reset: what has arrived is handled first,
    // and the next read meets the end again.
    handleBytes(ec ? std::string_view() : std::string_view(buffer.data(), n));
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

void HostClientConnection::handleBytes(std::string_view bytes) {
    if (closed_) {
        return;
    }
    decoder_.append(bytes);
    handling_ = true;
    for (;;) {
        std::string_view payload;
        std::string error;
        auto status = decoder_.next(payload, &error);
        if (status == IpcFrameCodec::Status::NeedMore) {
            break;
        }
        if (status == IpcFrameCodec::Status::Error) {
            handling_ = false;
            closeWithError(error);
            return;
        }
        if (!handleFrame(payload)) {
            handling_ = false;
            return;
        }
    }
    handling_ = false;
    readMore();
}

bool HostClientConnection::handleFrame(std::string_view payload) {
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
        return !closed_;
    }
    if (args && !args->isArray()) {
        sendReply(requestId, RemoteReply::failure("malformed request: args is not an array"));
        return !closed_;
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
        return !closed_;
    }
    // A request keeps its connection alive until it has replied: while reading is paused no
    // socket operation may be pending, and the connection must not go with them.
    std::function<void(RemoteReply)> reply = [self = shared_from_this(), requestId](RemoteReply r) {
        self->sendReply(requestId, std::move(r));
    };
    // This strand is the connection's request queue: the request runs here and now, and an
    // answer given at once is written before the next frame is looked at.
    static const Value::Array kNoArguments;
    interface->invoke(object, *op->asString(), args ? *args->asArray() : kNoArguments,
                      onceCallback(std::move(reply), "IPC reply"));
    return !closed_;
}

void HostClientConnection::sendReply(std::int64_t id, RemoteReply reply) {
    // The reply is moved into the message, never copied: it may hold whole coverage summaries.
    Value message{Value::Dictionary{{kIdKey, Value(id)}}};
    if (reply.error) {
        message[kErrorKey] = *reply.error;
    } else if (reply.value) {
        message[kReplyKey] = std::move(*reply.value);
    }
    auto frame = IpcFrameCodec::encode(message);
    if (!frame) {
        frame = IpcFrameCodec::encode(Value(
            Value::Dictionary{{kIdKey, Value(id)}, {kErrorKey, Value("reply cannot be encoded")}}));
    }
    // On the strand already (a request answered at once) this runs now; from another thread
    // it is queued there.
    asio::dispatch(socket_.get_executor(),
                   [self = shared_from_this(), frame = std::move(frame)]() mutable {
                       --self->inFlight_;
                       if (self->closed_ || !frame) {
                           return;
                       }
                       self->enqueueWrite(std::move(*frame));
                       if (!self->handling_) {
                           self->readMore();
                       }
                   });
}

void HostClientConnection::enqueueWrite(std::string frame) {
    if (writing_ || !writeQueue_.empty()) {
        writeQueue_.push_back(std::move(frame));
        return;
    }
    // Usually the whole reply fits in the socket: one write, and no completion to wait for.
    asio::error_code ec;
    const std::size_t written = socket_.write_some(asio::buffer(frame), ec);
    if (ec && ec != asio::error::would_block && ec != asio::error::try_again) {
        closeNow();
        return;
    }
    if (written == frame.size()) {
        return;
    }
    frame.erase(0, written);
    writeQueue_.push_back(std::move(frame));
    writeNext();
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
