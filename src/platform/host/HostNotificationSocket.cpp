#include "platform/host/HostNotificationSocket.h"

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <array>
#include <asio/local/datagram_protocol.hpp>
#include <cstring>
#include <filesystem>
#include <vector>

#include "core/Log.h"
#include "platform/host/HostUnixSocketPath.h"

namespace qax {
namespace {

constexpr const char* kNotifySocketName = "notify";
// Notification names are short; longer datagrams are cut to this size.
constexpr std::size_t kMaxNameBytes = 1024;

}  // namespace

struct HostNotificationSocket::Receiver {
    explicit Receiver(asio::io_context& io) : socket(io) {}
    asio::local::datagram_protocol::socket socket;
    std::array<char, kMaxNameBytes> buffer{};
    std::string path;
};

HostNotificationSocket::HostNotificationSocket(std::string runtimeDirectory)
    : runtimeDirectory_(std::move(runtimeDirectory)) {}

HostNotificationSocket::~HostNotificationSocket() {
    io_.stop();
    std::lock_guard lock(mutex_);
    if (receiver_) {
        asio::error_code ec;
        receiver_->socket.close(ec);
        ::unlink(receiver_->path.c_str());
        // The socket must go before the io_context it belongs to, which is a later member.
        receiver_.reset();
    }
}

std::string HostNotificationSocket::socketPath(const std::string& runtimeDirectory) {
    return (std::filesystem::path(runtimeDirectory) / kNotifySocketName).string();
}

bool HostNotificationSocket::post(const std::string& runtimeDirectory, const std::string& name) {
    const std::string path = socketPath(runtimeDirectory);
    if (path.size() > HostUnixSocketPath::maxLength()) {
        return false;
    }
    const int fd = ::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    if (fd < 0) {
        return false;
    }
    sockaddr_un addr{};
    addr.sun_family = AF_UNIX;
    std::memcpy(addr.sun_path, path.c_str(), path.size());
    const ssize_t sent = ::sendto(fd, name.data(), name.size(), 0,
                                  reinterpret_cast<const sockaddr*>(&addr), sizeof(addr));
    ::close(fd);
    return sent == static_cast<ssize_t>(name.size());
}

std::uint64_t HostNotificationSocket::subscribe(Subscriber subscriber) {
    std::lock_guard lock(mutex_);
    if (!receiver_ && !startLocked()) {
        return 0;
    }
    const std::uint64_t id = nextId_++;
    subscribers_[id] = std::move(subscriber);
    return id;
}

void HostNotificationSocket::unsubscribe(std::uint64_t id) {
    std::lock_guard lock(mutex_);
    subscribers_.erase(id);
}

bool HostNotificationSocket::startLocked() {
    const std::string path = socketPath(runtimeDirectory_);
    std::string error;
    if (!HostUnixSocketPath::claim(path, SOCK_DGRAM, &error)) {
        qaxLog().error("Cannot receive notifications: %@", error);
        return false;
    }
    auto receiver = std::make_unique<Receiver>(io_.context());
    receiver->path = path;
    asio::error_code ec;
    receiver->socket.open(asio::local::datagram_protocol(), ec);
    if (!ec) {
        receiver->socket.bind(asio::local::datagram_protocol::endpoint(path), ec);
    }
    if (ec) {
        qaxLog().error("Cannot receive notifications on %@: %@", path, ec.message());
        return false;
    }
    receiver_ = std::move(receiver);
    io_.start();
    asio::post(io_.context(), [this] { receiveNext(); });
    return true;
}

void HostNotificationSocket::receiveNext() {
    // Only the I/O thread touches the receiver once it is bound; the destructor joins that
    // thread before closing it.
    Receiver* r = receiver_.get();
    r->socket.async_receive(
        asio::buffer(r->buffer), [this, r](const asio::error_code& ec, std::size_t n) {
            if (ec) {
                if (ec != asio::error::operation_aborted) {
                    qaxLog().error("Notification socket failed: %@", ec.message());
                }
                return;
            }
            deliver(n == 0 ? std::nullopt
                           : std::optional<std::string>(std::string(r->buffer.data(), n)));
            receiveNext();
        });
}

void HostNotificationSocket::deliver(const std::optional<std::string>& name) {
    std::vector<Subscriber> subscribers;
    {
        std::lock_guard lock(mutex_);
        for (const auto& [id, s] : subscribers_) {
            subscribers.push_back(s);
        }
    }
    for (const auto& s : subscribers) {
        s(name);
    }
}

}  // namespace qax
