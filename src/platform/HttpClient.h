// The HTTP client session: requests with headers, body and a time-out, answered
// asynchronously on the session's callback thread. Thread-safe.
#pragma once

#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace qax {

// A mutable HTTP request. Header names compare without regard to case; setting a name again
// replaces its value, and setting no value removes the field.
class HttpRequest {
  public:
    HttpRequest() = default;
    explicit HttpRequest(std::string url, double timeoutSeconds = 60)
        : url_(std::move(url)), timeout_(timeoutSeconds) {}

    const std::string& url() const { return url_; }
    void setURL(std::string url) { url_ = std::move(url); }
    const std::string& method() const { return method_; }
    void setMethod(std::string method) { method_ = std::move(method); }
    double timeoutSeconds() const { return timeout_; }
    void setTimeoutSeconds(double seconds) { timeout_ = seconds; }
    // When set, the request bypasses any locally cached answer.
    bool ignoresLocalCache() const { return ignoreLocalCache_; }
    void setIgnoresLocalCache(bool ignore) { ignoreLocalCache_ = ignore; }

    void setValue(std::string_view name, std::optional<std::string> value);
    std::optional<std::string> valueForHeader(std::string_view name) const;
    // Header fields in the order they were first set.
    const std::vector<std::pair<std::string, std::string>>& headers() const { return headers_; }

    const std::optional<std::string>& body() const { return body_; }
    void setBody(std::optional<std::string> body) { body_ = std::move(body); }

  private:
    std::string url_;
    std::string method_ = "GET";
    double timeout_ = 60;
    bool ignoreLocalCache_ = false;
    std::vector<std::pair<std::string, std::string>> headers_;
    std::optional<std::string> body_;
};

struct HttpResponse {
    long statusCode = 0;
    std::vector<std::pair<std::string, std::string>> headers;
    std::string body;
};

// Either a response (any status) or a transport error (unreachable, time-out, TLS).
struct HttpResult {
    std::optional<HttpResponse> response;
    std::string error;
};

class HttpClient {
  public:
    virtual ~HttpClient() = default;
    // Sends the request; `completion` runs exactly once, on the session's callback thread.
    virtual void send(const HttpRequest& request, std::function<void(HttpResult)> completion) = 0;
};

}  // namespace qax
