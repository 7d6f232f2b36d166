// The host's HTTPS session: one libcurl multi handle driven by a thread of its own, many
// transfers at once, a small in-memory cache for GET answers that allow it, and trust of an
// extra CA (tls.plist "ExtraCAFile") next to the system CAs. Nothing starts before the first
// request: libcurl is loaded, TLS initialised and the thread started then. send() may be
// called from any thread, completions included; every completion runs once, on the completion
// queue when one is given (so that what a completion does, such as writing files, never holds
// up the transfers), else on the session's thread. Destroying the session cancels what is
// outstanding (each completion gets an error). Each outstanding request holds a transaction of
// the process lifecycle, when one is given.
#pragma once

#include <cstddef>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "core/Clock.h"
#include "core/TaskRunner.h"
#include "platform/HttpClient.h"
#include "platform/ProcessLifecycle.h"

namespace qax {

class CurlHttpClient : public HttpClient {
  public:
    struct Options {
        // PEM file of CA certificates trusted in addition to the system's.
        std::optional<std::string> extraCAFile;
        // Answers kept for reuse (GETs whose Cache-Control allows it).
        std::size_t cacheCapacity = 32;
        // Largest body kept in the cache.
        std::size_t cacheMaxBodyBytes = 1024 * 1024;
        // Larger bodies fail the transfer.
        std::size_t maxBodyBytes = 32 * 1024 * 1024;
        // Time for cache expiry; the system clock when none.
        std::shared_ptr<Clock> clock;
        // Kept from exiting while a request is outstanding; none in tools.
        std::shared_ptr<ProcessLifecycle> lifecycle;
        // Where completions run; none: on the session's thread.
        std::shared_ptr<TaskRunner> completionQueue;
    };

    // The platform root's tls.plist decides the extra CA (a relative path is taken from the
    // platform root). A missing or unreadable file means the system CAs only.
    static Options optionsForPlatformRoot(const std::string& platformRoot);

    CurlHttpClient();
    explicit CurlHttpClient(Options options);
    ~CurlHttpClient() override;
    CurlHttpClient(const CurlHttpClient&) = delete;
    CurlHttpClient& operator=(const CurlHttpClient&) = delete;

    void send(const HttpRequest& request, std::function<void(HttpResult)> completion) override;

    class Session;

  private:
    // The session, made and started on first use; none when libcurl cannot be loaded (the
    // reason in `error`) or the client is being destroyed.
    std::shared_ptr<Session> session(std::string* error);

    const Options options_;
    std::mutex mutex_;
    bool sessionTried_ = false;
    std::string sessionError_;
    std::shared_ptr<Session> session_;
};

}  // namespace qax
