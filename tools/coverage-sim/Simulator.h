// coverage-sim's service: the server version list, coverage summaries (signed requests only,
// attestation verified when sent), KF token renewal, the store's look-up and purchase
// endpoints, and the admin endpoints that set the scenario and show the request log.
// Handlers run on the HTTP server's threads; the scenario and the request log lock
// themselves, everything else is read-only after start.
#pragma once

#include <httplib.h>

#include <atomic>
#include <condition_variable>
#include <mutex>
#include <string>

#include "Scenario.h"
#include "core/Value.h"

namespace coveragesim {

struct Options {
    std::string state;
    std::string fixtures;
    std::string platformRoot;
    std::string attestationRoot;
    int port = 0;
    int delayMs = 0;
    // Added to the system time wherever fixtures say "@now".
    double clockOffsetSeconds = 0;
    // Also add OffsetSeconds of ROOT/state/clock.plist, read on each request, so that the
    // answers follow an agent running on the simulated clock of the same platform root.
    bool simulatedClock = false;
};

inline constexpr const char* kLookupPath = "/store/lookup";
inline constexpr const char* kPurchasesPath = "/store/purchases";

class Simulator {
  public:
    explicit Simulator(Options options);

    Scenario& scenario() { return scenario_; }
    void install(httplib::Server& server);
    // The port the server listens on (needed to find a request's socket for "reset" and
    // "hang").
    void setPort(int port) { port_ = port; }
    // Ends delays and hangs in progress so that the server can stop.
    void stop();

    // "Now" as the fixtures see it: the system time plus the configured offsets.
    double now() const;

  private:
    enum class BodyFormat { Json, Plist };

    bool play(const std::optional<ScenarioStep>& step, BodyFormat format,
              const httplib::Request& req, httplib::Response& res, qax::Value::Dictionary& notes);
    bool pause(int milliseconds);
    // Headers and `size` bytes of a body announced twice as long, then a reset of `fd`.
    void serveBrokenBody(httplib::Response& res, int fd, std::size_t size, bool plist);
    std::string fixture(const std::string& name) const;

    void versionList(httplib::Response& res);
    void summary(const httplib::Request& req, httplib::Response& res,
                 qax::Value::Dictionary& notes);
    void token(const httplib::Request& req, httplib::Response& res);
    void lookup(const httplib::Request& req, httplib::Response& res);
    void purchases(const httplib::Request& req, httplib::Response& res);
    void adminScenario(const httplib::Request& req, httplib::Response& res);
    void adminRequests(const httplib::Request& req, httplib::Response& res);

    void record(const httplib::Request& req, const httplib::Response& res,
                qax::Value::Dictionary notes);
    std::string logPath() const;

    Options opt_;
    Scenario scenario_;
    std::atomic<int> port_{0};
    std::atomic<bool> stopping_{false};
    std::mutex stopMutex_;
    std::condition_variable stopped_;
    std::mutex logMutex_;
};

}  // namespace coveragesim
