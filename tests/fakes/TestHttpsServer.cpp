#include "fakes/TestHttpsServer.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <stdexcept>

#include "core/PlistCodec.h"
#include "platform/host/LocalTlsMaterial.h"

namespace qax::test {

TestHttpsServer::TestHttpsServer() {
    TlsMaterial tls;
    std::string error;
    if (!loadOrCreateLocalTlsMaterial(dir_.str(), tls, error)) {
        throw std::runtime_error("cannot make the test server's certificates: " + error);
    }
    server_ =
        std::make_unique<httplib::SSLServer>(tls.serverCertPath.c_str(), tls.serverKeyPath.c_str());
    if (!server_->is_valid()) {
        throw std::runtime_error("the test HTTPS server could not load its certificate");
    }
    // Enough threads for the concurrency tests to hold many requests at once.
    server_->new_task_queue = [] { return new httplib::ThreadPool(32); };
}

TestHttpsServer::~TestHttpsServer() {
    stop();
}

void TestHttpsServer::start() {
    port_ = server_->bind_to_any_port("127.0.0.1");
    if (port_ <= 0) {
        throw std::runtime_error("the test HTTPS server could not bind");
    }
    thread_ = std::thread([this] { server_->listen_after_bind(); });
    for (int i = 0; i < 500 && !server_->is_running(); ++i) {
        std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
}

void TestHttpsServer::stop() {
    if (thread_.joinable()) {
        server_->stop();
        thread_.join();
    }
}

void TestHttpsServer::answer(const std::string& path, Answer standing) {
    setAnswer(path, std::move(standing));
    auto handler = [this](const httplib::Request& req, httplib::Response& res) {
        std::lock_guard lock(mutex_);
        requests_.push_back({req.method, req.path, req.body, req.headers});
        Route& route = routes_[req.path];
        Answer answer = route.queued.empty() ? route.standing : route.queued.front();
        if (!route.queued.empty()) {
            route.queued.pop_front();
        }
        res.status = answer.status;
        res.headers = answer.headers;
        res.set_content(answer.body, answer.contentType);
    };
    server_->Get(path, handler);
    server_->Post(path, handler);
}

void TestHttpsServer::setAnswer(const std::string& path, Answer standing) {
    std::lock_guard lock(mutex_);
    routes_[path].standing = std::move(standing);
}

void TestHttpsServer::queue(const std::string& path, std::deque<Answer> answers) {
    std::lock_guard lock(mutex_);
    routes_[path].queued = std::move(answers);
}

std::vector<TestHttpsServer::Request> TestHttpsServer::requests() {
    std::lock_guard lock(mutex_);
    return requests_;
}

std::string TestHttpsServer::url(const std::string& path) const {
    return "https://127.0.0.1:" + std::to_string(port_) + path;
}

std::string TestHttpsServer::caFile() const {
    return (dir_.path() / "ca.pem").string();
}

void TestHttpsServer::trustIn(const std::string& platformRoot) const {
    Value tls{Value::Dictionary{}};
    tls["ExtraCAFile"] = caFile();
    writeFile(std::filesystem::path(platformRoot) / "tls.plist", *toXmlPlist(tls));
}

int unusedLocalPort() {
    int fd = ::socket(AF_INET, SOCK_STREAM, 0);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    ::bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof(address));
    socklen_t length = sizeof(address);
    ::getsockname(fd, reinterpret_cast<sockaddr*>(&address), &length);
    ::close(fd);
    return ntohs(address.sin_port);
}

}  // namespace qax::test
