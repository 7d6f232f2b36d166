// A real HTTPS server on 127.0.0.1 for tests, with a CA and a server certificate made fresh
// for each instance. Register handlers on server() before start(); handlers run on the
// server's own threads. stop() (or the destructor) waits for handlers in progress.
#pragma once

#include <httplib.h>

#include <deque>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "fakes/TestPlatform.h"

namespace qax::test {

class TestHttpsServer {
  public:
    TestHttpsServer();
    ~TestHttpsServer();
    TestHttpsServer(const TestHttpsServer&) = delete;
    TestHttpsServer& operator=(const TestHttpsServer&) = delete;

    httplib::SSLServer& server() { return *server_; }

    struct Answer {
        Answer(int status = 200, std::string body = "",
               std::string contentType = "application/json", httplib::Headers headers = {})
            : status(status),
              body(std::move(body)),
              contentType(std::move(contentType)),
              headers(std::move(headers)) {}
        int status;
        std::string body, contentType;
        httplib::Headers headers;
    };
    struct Request {
        std::string method, path, body;
        httplib::Headers headers;
    };
    // Serves GET and POST on `path` (register before start()): the queued answers in order,
    // then the standing one. Either can be changed at any time.
    void answer(const std::string& path, Answer standing);
    void setAnswer(const std::string& path, Answer standing);
    // Replaces the queue of `path`.
    void queue(const std::string& path, std::deque<Answer> answers);
    // Every request to a path served by answer(), in arrival order.
    std::vector<Request> requests();
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
    struct Route {
        Answer standing;
        std::deque<Answer> queued;
    };
    std::mutex mutex_;
    std::map<std::string, Route> routes_;
    std::vector<Request> requests_;
    TempDir dir_;
    std::unique_ptr<httplib::SSLServer> server_;
    std::thread thread_;
    int port_ = -1;
};

// A port on 127.0.0.1 that nothing listens on (bound, then closed).
int unusedLocalPort();

}  // namespace qax::test
