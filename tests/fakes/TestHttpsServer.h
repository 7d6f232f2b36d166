// A real HTTPS server on 127.0.0.1 for tests, with a CA and a server certificate made fresh
// for each instance. Register handlers on server() before start(); handlers run on the
// server's own threads. stop() (or the destructor) waits for handlers in progress.
#pragma once

#include <httplib.h>

#include <memory>
#include <string>
#include <thread>

#include "fakes/TestPlatform.h"

namespace qax::test {

class TestHttpsServer {
  public:
    TestHttpsServer();
    ~TestHttpsServer();
    TestHttpsServer(const TestHttpsServer&) = delete;
    TestHttpsServer& operator=(const TestHttpsServer&) = delete;

    httplib::SSLServer& server() { return *server_; }
    // Binds a free port and serves on a thread of its own.
    void start();
    void stop();

    int port() const { return port_; }
    // "https://127.0.0.1:PORT" + path.
    std::string url(const std::string& path) const;
    // PEM of the CA that issued the server certificate.
    std::string caFile() const;
    // Writes tls.plist into `platformRoot`, naming the CA file as the extra trusted CA.
    void trustIn(const std::string& platformRoot) const;

  private:
    TempDir dir_;
    std::unique_ptr<httplib::SSLServer> server_;
    std::thread thread_;
    int port_ = -1;
};

// A port on 127.0.0.1 that nothing listens on (bound, then closed).
int unusedLocalPort();

}  // namespace qax::test
