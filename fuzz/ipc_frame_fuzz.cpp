// IPC frames as a client sends them, served by a real connection over a socketpair. The first
// byte seeds the delivery: the rest of the input goes out in chunks of 1 to 143 bytes, the
// connection sometimes reads several chunks at once, and the exported agent holds its replies
// for a while, so frames split anywhere and requests pile up past the in-flight limit.
// Every request that reaches the agent must be answered once with its id, a broken stream
// must close the connection (and let the process go), and the connection must be gone once the
// client is.
#include <sys/socket.h>
#include <unistd.h>

#include <asio/io_context.hpp>
#include <bitset>
#include <cerrno>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <map>
#include <set>
#include <string>

#include "FuzzPlatform.h"
#include "agent/QAXAgentProtocol.h"
#include "agent/QAXAgentRemoteInterface.h"
#include "core/PlistCodec.h"
#include "platform/host/HostClientConnection.h"
#include "platform/host/IpcFrameCodec.h"

namespace {

using qax::Value;

constexpr std::size_t kMaxChunk = 143;

// Answers every operation with a plausible value, but only when told to: replies wait in a
// queue so that the connection sees many requests outstanding. A value the input does not
// shape (a device, a list of them) is the same every time, and its archive is most of what a
// reply costs: only an operation's first request in an input gets it, later ones get the
// operation's empty answer. Values that carry the request's strings are always sent whole.
class HoldingAgent : public qax::ExportedObject, public qax::QAXAgentProtocol {
  public:
    std::deque<std::function<void()>> held;

    void release(std::size_t n) {
        while (n-- > 0 && !held.empty()) {
            auto reply = std::move(held.front());
            held.pop_front();
            reply();
        }
    }

    void scheduleOutreach(qax::QAXBoolReply reply) override { hold(reply, true); }
    void scheduleOutreachAfter(double, qax::QAXBoolReply reply) override { hold(reply, true); }
    void velmoraAccountAdded(qax::QAXBoolReply reply) override { hold(reply, false); }
    void checkIsAvailableInStore(
        const std::string& bundleIdentifier,
        std::function<void(std::optional<Value::Dictionary>)> reply) override {
        hold(reply, std::optional<Value::Dictionary>(
                        Value::Dictionary{{"AppBundleID", bundleIdentifier}}));
    }
    void appSupportAvailability(const std::string& argument,
                                std::function<void(Value::Dictionary)> reply) override {
        hold(reply, Value::Dictionary{{"AppBundleID", argument}});
    }
    void readWebURLOverride(std::function<void(std::optional<Value>)> reply) override {
        hold(reply, std::optional<Value>());
    }
    void defaultDevice(qax::QAXDeviceReply reply) override {
        hold(reply, first(Op::DefaultDevice) ? device("SN") : nullptr);
    }
    void pairedDevices(qax::QAXDeviceListReply reply) override {
        std::vector<std::shared_ptr<qax::QAXDevice>> devices;
        if (first(Op::PairedDevices)) {
            devices = {device("W1"), device("W2")};
        }
        hold(reply, std::move(devices));
    }
    void getDefaultDeviceInfoUsingPolicy(qax::QAXWarrantyPolicy,
                                         qax::QAXDeviceInfoReply reply) override {
        hold(reply, first(Op::DefaultDeviceInfo) ? info("SN") : nullptr);
    }
    void getDeviceInfoForSerialNumber(const std::string& serialNumber, qax::QAXWarrantyPolicy,
                                      qax::QAXDeviceInfoReply reply) override {
        hold(reply, info(serialNumber));
    }
    void getAllDeviceInfosUsingPolicy(qax::QAXWarrantyPolicy, bool,
                                      qax::QAXDeviceInfoListReply reply) override {
        std::vector<std::shared_ptr<qax::QAXDeviceInfo>> infos;
        if (first(Op::AllDeviceInfos)) {
            infos = {info("SN"), info("W1")};
        }
        hold(reply, std::move(infos));
    }
    void dismissFollowUpForSerialNumber(const std::string&, qax::QAXBoolReply reply) override {
        hold(reply, true);
    }
    void dismissNotificationForSerialNumber(const std::string&, qax::QAXBoolReply reply) override {
        hold(reply, true);
    }

  private:
    enum class Op { DefaultDevice, PairedDevices, DefaultDeviceInfo, AllDeviceInfos, Count };
    std::bitset<static_cast<std::size_t>(Op::Count)> answered_;

    bool first(Op op) {
        const bool was = answered_.test(static_cast<std::size_t>(op));
        answered_.set(static_cast<std::size_t>(op));
        return !was;
    }
    template <typename Reply, typename V>
    void hold(Reply reply, V value) {
        held.push_back([reply = std::move(reply), value = std::move(value)] { reply(value); });
    }
    static std::shared_ptr<qax::QAXDevice> device(const std::string& serial) {
        return qax::QAXDevice::deviceWithName("Device", serial, qax::Date(1.7e9),
                                              qax::QAXDeviceTypeDefault);
    }
    static std::shared_ptr<qax::QAXDeviceInfo> info(const std::string& serial) {
        return qax::QAXDeviceInfo::deviceInfoWithDevice(device(serial), nullptr);
    }
};

struct Harness {
    asio::io_context io;
    std::shared_ptr<const qax::RemoteInterface> interface =
        std::make_shared<qax::QAXAgentRemoteInterface>();

    // Runs everything that is ready, the socket's readiness included.
    void settle() {
        for (;;) {
            io.restart();
            if (io.poll() == 0) {
                return;
            }
        }
    }
};

// The ids of the requests the agent is given, in stream order, and whether the stream breaks
// (a bad length, a payload that does not parse, a request without an integer id) before the
// client stops sending.
struct Expected {
    std::multiset<std::int64_t> ids;
    bool broken = false;
};

Expected expectedFrom(std::string_view stream) {
    Expected out;
    qax::IpcFrameCodec codec;
    codec.append(stream);
    std::string payload;
    for (;;) {
        auto status = codec.next(payload);
        if (status == qax::IpcFrameCodec::Status::NeedMore) {
            return out;
        }
        auto message =
            status == qax::IpcFrameCodec::Status::Frame ? qax::parsePlist(payload) : std::nullopt;
        const Value* id = message ? message->find("id") : nullptr;
        if (!id || !id->isInteger()) {
            out.broken = true;
            return out;
        }
        out.ids.insert(*id->asInteger());
    }
}

// Reads what the connection wrote: how many bytes, or -1 once it has closed its end.
long drain(int fd, qax::IpcFrameCodec& replies) {
    char buf[4096];
    long total = 0;
    for (;;) {
        ssize_t n = ::read(fd, buf, sizeof buf);
        if (n > 0) {
            replies.append(std::string_view(buf, static_cast<std::size_t>(n)));
            total += n;
            continue;
        }
        if (n < 0 && errno == EINTR) {
            continue;
        }
        return n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK) ? total : -1;
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    if (size == 0) {
        return 0;
    }
    qaxfuzz::quietLog();
    static Harness h;
    std::uint32_t rng = 0x9e3779b9u ^ (std::uint32_t(data[0]) * 2654435761u);
    auto next = [&rng] {
        rng = rng * 1664525u + 1013904223u;
        return rng >> 8;
    };
    const std::string_view stream(reinterpret_cast<const char*>(data) + 1, size - 1);

    int fds[2];
    if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0, fds) != 0) {
        __builtin_trap();
    }
    qax::HostClientConnection::Socket socket(h.io);
    socket.assign(asio::local::stream_protocol(), fds[0]);
    auto agent = std::make_shared<HoldingAgent>();
    // Stands for the process's lifecycle transaction, which the connection holds until closed.
    auto transaction = std::make_shared<int>(0);
    std::weak_ptr<int> keptAlive = transaction;
    auto connection =
        std::make_shared<qax::HostClientConnection>(std::move(socket), std::move(transaction));
    std::weak_ptr<qax::HostClientConnection> weak = connection;
    connection->exportInterface(h.interface);
    connection->exportObject(agent);
    connection->resume();
    connection.reset();
    h.settle();

    qax::IpcFrameCodec replies;
    bool open = true;
    for (std::size_t off = 0; off < stream.size() && open;) {
        const std::size_t chunk =
            std::min<std::size_t>(1 + next() % kMaxChunk, stream.size() - off);
        ssize_t n = ::send(fds[1], stream.data() + off, chunk, MSG_NOSIGNAL);
        if (n < 0 && (errno == EPIPE || errno == ECONNRESET)) {
            open = false;
            break;
        }
        off += n > 0 ? static_cast<std::size_t>(n) : 0;
        // Sometimes let several chunks arrive before the connection reads.
        if (next() % 4 != 0) {
            h.settle();
        }
        if (next() % 3 == 0) {
            agent->release(next() % 8);
            h.settle();
        }
    }
    // Everything still held is answered before the client hangs up, once the connection has
    // read what was sent last (its requests are held too). Replies are read only now: the
    // socket buffer holds far more than an input's worth of them.
    h.settle();
    while (!agent->held.empty()) {
        agent->release(agent->held.size());
        h.settle();
    }
    // Until the connection has nothing more to write (or has closed).
    for (;;) {
        h.settle();
        const long n = drain(fds[1], replies);
        open = open && n >= 0;
        if (n <= 0) {
            break;
        }
    }

    const Expected expected = expectedFrom(stream);
    if (!expected.broken) {
        if (!open) {
            __builtin_trap();  // a well-formed stream must keep the connection open
        }
        std::multiset<std::int64_t> answered;
        std::string payload;
        for (;;) {
            auto status = replies.next(payload);
            if (status == qax::IpcFrameCodec::Status::NeedMore) {
                break;
            }
            auto message = status == qax::IpcFrameCodec::Status::Frame ? qax::parsePlist(payload)
                                                                       : std::nullopt;
            const Value* id = message ? message->find("id") : nullptr;
            if (!id || !id->isInteger() || (message->find("reply") && message->find("error"))) {
                __builtin_trap();  // every reply is {"id", "reply" or "error"}
            }
            answered.insert(*id->asInteger());
        }
        if (answered != expected.ids || replies.hasPartialFrame()) {
            __builtin_trap();  // each request answered exactly once
        }
    } else {
        // The connection closes on the broken frame: give it the chance, then it must be shut.
        h.settle();
        if (drain(fds[1], replies) >= 0) {
            __builtin_trap();
        }
        if (!keptAlive.expired()) {
            __builtin_trap();  // a closed connection still kept the process alive
        }
    }

    ::shutdown(fds[1], SHUT_WR);
    agent->release(agent->held.size());
    h.settle();
    ::close(fds[1]);
    h.settle();
    if (!weak.expired()) {
        __builtin_trap();  // the connection outlived its client
    }
    return 0;
}
