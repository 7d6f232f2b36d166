#include "platform/host/HostIpcClient.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstring>

#include "core/PlistCodec.h"

namespace qax {
namespace {

void setError(std::string* error, std::string text) {
    if (error) {
        *error = std::move(text);
    }
}

}  // namespace

HostIpcClient::~HostIpcClient() {
    close();
}

bool HostIpcClient::connect(const std::string& socketPath, std::string* error) {
    close();
    sockaddr_un addr{};
    if (socketPath.size() >= sizeof(addr.sun_path)) {
        setError(error, "socket path too long: " + socketPath);
        return false;
    }
    fd_ = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd_ < 0) {
        setError(error, std::string("socket: ") + std::strerror(errno));
        return false;
    }
    addr.sun_family = AF_UNIX;
    std::memcpy(addr.sun_path, socketPath.c_str(), socketPath.size());
    if (::connect(fd_, reinterpret_cast<const sockaddr*>(&addr), sizeof(addr)) != 0) {
        setError(error, "cannot connect to " + socketPath + ": " + std::strerror(errno));
        close();
        return false;
    }
    decoder_ = IpcFrameCodec();
    return true;
}

void HostIpcClient::close() {
    if (fd_ >= 0) {
        ::close(fd_);
        fd_ = -1;
    }
}

bool HostIpcClient::sendRaw(std::string_view bytes, std::string* error) {
    while (!bytes.empty()) {
        const ssize_t n = ::send(fd_, bytes.data(), bytes.size(), MSG_NOSIGNAL);
        if (n < 0) {
            if (errno == EINTR) {
                continue;
            }
            setError(error, std::string("send: ") + std::strerror(errno));
            return false;
        }
        bytes.remove_prefix(static_cast<std::size_t>(n));
    }
    return true;
}

bool HostIpcClient::sendRequest(std::int64_t id, const std::string& op, const Value::Array& args,
                                std::string* error) {
    Value::Dictionary request{{"id", Value(id)}, {"op", Value(op)}, {"args", Value(args)}};
    auto frame = IpcFrameCodec::encode(Value(std::move(request)));
    if (!frame) {
        setError(error, "request cannot be encoded");
        return false;
    }
    return sendRaw(*frame, error);
}

std::optional<Value> HostIpcClient::receive(double timeoutSeconds, std::string* error) {
    if (fd_ < 0) {
        setError(error, "not connected");
        return std::nullopt;
    }
    const auto deadline = std::chrono::steady_clock::now() +
                          std::chrono::duration_cast<std::chrono::steady_clock::duration>(
                              std::chrono::duration<double>(timeoutSeconds));
    std::string payload;
    char buffer[64 * 1024];
    for (;;) {
        std::string frameError;
        switch (decoder_.next(payload, &frameError)) {
            case IpcFrameCodec::Status::Frame: {
                std::string parseError;
                auto message = parsePlist(payload, &parseError);
                if (!message) {
                    setError(error, "reply does not parse: " + parseError);
                }
                return message;
            }
            case IpcFrameCodec::Status::Error:
                setError(error, frameError);
                return std::nullopt;
            case IpcFrameCodec::Status::NeedMore:
                break;
        }
        const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
            deadline - std::chrono::steady_clock::now());
        if (left.count() <= 0) {
            setError(error, "timed out");
            return std::nullopt;
        }
        pollfd p{fd_, POLLIN, 0};
        const int ready = ::poll(&p, 1, static_cast<int>(left.count()));
        if (ready < 0 && errno == EINTR) {
            continue;
        }
        if (ready <= 0) {
            setError(error,
                     ready == 0 ? "timed out" : std::string("poll: ") + std::strerror(errno));
            return std::nullopt;
        }
        const ssize_t n = ::recv(fd_, buffer, sizeof(buffer), 0);
        if (n == 0) {
            setError(error, "closed");
            return std::nullopt;
        }
        if (n < 0) {
            if (errno == EINTR) {
                continue;
            }
            // A reset is the agent closing on us as well.
            setError(error, errno == ECONNRESET ? std::string("closed")
                                                : std::string("recv: ") + std::strerror(errno));
            return std::nullopt;
        }
        decoder_.append(std::string_view(buffer, static_cast<std::size_t>(n)));
    }
}

std::optional<HostIpcClient::Reply> HostIpcClient::call(const std::string& op,
                                                        const Value::Array& args,
                                                        double timeoutSeconds, std::string* error) {
    const std::int64_t id = nextId_++;
    if (!sendRequest(id, op, args, error)) {
        return std::nullopt;
    }
    for (;;) {
        auto message = receive(timeoutSeconds, error);
        if (!message) {
            return std::nullopt;
        }
        const Value* replyId = message->find("id");
        if (!replyId || replyId->asInteger() != id) {
            continue;
        }
        Reply reply;
        if (const Value* e = message->find("error")) {
            reply.error = e->isString() ? *e->asString() : e->description();
        } else if (const Value* v = message->find("reply")) {
            reply.value = *v;
        }
        return reply;
    }
}

bool HostIpcClient::waitForClose(double timeoutSeconds) {
    std::string error;
    while (receive(timeoutSeconds, &error)) {
    }
    return error == "closed";
}

}  // namespace qax
