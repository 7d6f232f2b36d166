#include "platform/host/CurlHttpClient.h"

#include <openssl/err.h>
#include <openssl/pem.h>
#include <openssl/ssl.h>
#include <openssl/x509.h>
#include <strings.h>

#include <algorithm>
#include <cmath>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <map>
#include <mutex>
#include <thread>
#include <unordered_map>
#include <vector>

#include "core/Log.h"
#include "core/PlistCodec.h"
#include "platform/host/CurlLibrary.h"

namespace qax {
namespace {

constexpr const char* kTlsPlist = "tls.plist";
constexpr const char* kExtraCAFileKey = "ExtraCAFile";
constexpr std::size_t kMaxTlsPlistBytes = 64 * 1024;
constexpr double kDefaultTimeoutSeconds = 60;
constexpr long kMaxRedirects = 10;
// How long the session thread sleeps when nothing happens; new work wakes it at once.
constexpr int kIdlePollMilliseconds = 1000;

constexpr const char* kCancelledError = "The session was invalidated before the request completed";
constexpr const char* kTooLargeError = "The response body exceeds the session's size limit";
constexpr const char* kRequestTransaction = "HTTP request";

bool sameName(std::string_view a, std::string_view b) {
    return a.size() == b.size() && strncasecmp(a.data(), b.data(), a.size()) == 0;
}

std::string_view trim(std::string_view s) {
    while (!s.empty() && (s.front() == ' ' || s.front() == '\t')) {
        s.remove_prefix(1);
    }
    while (!s.empty() &&
           (s.back() == ' ' || s.back() == '\t' || s.back() == '\r' || s.back() == '\n')) {
        s.remove_suffix(1);
    }
    return s;
}

std::optional<std::string> headerValue(const HttpResponse& response, std::string_view name) {
    for (const auto& [n, v] : response.headers) {
        if (sameName(n, name)) {
            return v;
        }
    }
    return std::nullopt;
}

// How long an answer may be reused: the max-age of its Cache-Control, none when it may not
// be stored at all.
std::optional<double> freshnessLifetime(const HttpResponse& response) {
    auto control = headerValue(response, "Cache-Control");
    if (!control) {
        return std::nullopt;
    }
    std::optional<double> maxAge;
    std::string_view rest = *control;
    while (!rest.empty()) {
        const auto comma = rest.find(',');
        std::string_view directive = trim(rest.substr(0, comma));
        rest = comma == std::string_view::npos ? std::string_view{} : rest.substr(comma + 1);
        if (sameName(directive, "no-store") || sameName(directive, "no-cache") ||
            sameName(directive, "private")) {
            return std::nullopt;
        }
        constexpr std::string_view kMaxAge = "max-age=";
        if (directive.size() > kMaxAge.size() &&
            sameName(directive.substr(0, kMaxAge.size()), kMaxAge)) {
            const std::string number(directive.substr(kMaxAge.size()));
            char* end = nullptr;
            const long long seconds = std::strtoll(number.c_str(), &end, 10);
            if (end != number.c_str() && seconds > 0) {
                maxAge = static_cast<double>(seconds);
            }
        }
    }
    return maxAge;
}

std::vector<X509*> readCertificates(const std::string& path) {
    std::vector<X509*> certificates;
    BIO* bio = BIO_new_file(path.c_str(), "r");
    if (!bio) {
        ERR_clear_error();
        return certificates;
    }
    while (X509* cert = PEM_read_bio_X509(bio, nullptr, nullptr, nullptr)) {
        certificates.push_back(cert);
    }
    ERR_clear_error();  // the end of the file reads as an error
    BIO_free(bio);
    return certificates;
}

}  // namespace

// Everything the session thread touches. The thread holds a reference of its own, so a
// completion may drop the last reference to the client without pulling the state away
// from under the running loop.
class CurlHttpClient::Session : public std::enable_shared_from_this<Session> {
  public:
    Session(const CurlLibrary& curl, Options options);
    ~Session();

    void start();
    void shutdown();
    void send(const HttpRequest& request, std::function<void(HttpResult)> completion);

  private:
    struct Transfer {
        const CurlLibrary* curl = nullptr;
        CURL* easy = nullptr;
        curl_slist* headerList = nullptr;
        HttpRequest request;
        std::function<void(HttpResult)> completion;
        HttpResponse response;
        bool tooLarge = false;
        std::size_t maxBodyBytes = 0;
        char errorBuffer[CURL_ERROR_SIZE] = {};

        ~Transfer() {
            if (easy) {
                curl->easy_cleanup(easy);
            }
            if (headerList) {
                curl->slist_free_all(headerList);
            }
        }
    };
    struct Ready {
        std::function<void(HttpResult)> completion;
        HttpResult result;
    };
    struct CacheEntry {
        HttpResponse response;
        double expires = 0;
    };

    void run();
    // Runs `completion` where completions run.
    void complete(std::function<void(HttpResult)> completion, HttpResult result);
    bool begin(Transfer& transfer);
    void finishCompleted();
    void finish(std::unique_ptr<Transfer> transfer, CURLcode code);
    double now() const;
    std::optional<HttpResponse> cachedResponse(const HttpRequest& request);
    void storeInCache(const HttpRequest& request, const HttpResponse& response);

    static std::size_t onBody(char* data, std::size_t size, std::size_t count, void* user);
    static std::size_t onHeader(char* data, std::size_t size, std::size_t count, void* user);
    static CURLcode onSslContext(CURL* easy, void* sslContext, void* user);

    const CurlLibrary& curl_;
    const Options options_;
    std::vector<X509*> extraCAs_;
    CURLM* multi_ = nullptr;
    std::thread thread_;

    std::mutex mutex_;  // guards the members below
    bool stopping_ = false;
    std::vector<std::unique_ptr<Transfer>> pending_;
    std::vector<Ready> ready_;
    std::map<std::string, CacheEntry, std::less<>> cache_;

    // Session thread only.
    std::unordered_map<CURL*, std::unique_ptr<Transfer>> active_;
};

CurlHttpClient::Session::Session(const CurlLibrary& curl, Options options)
    : curl_(curl), options_(std::move(options)) {
    if (options_.extraCAFile) {
        extraCAs_ = readCertificates(*options_.extraCAFile);
        if (extraCAs_.empty()) {
            qaxLog().error("No CA certificate could be read from '%@'", *options_.extraCAFile);
        }
    }
    multi_ = curl_.multi_init();
}

CurlHttpClient::Session::~Session() {
    if (multi_) {
        curl_.multi_cleanup(multi_);
    }
    for (X509* cert : extraCAs_) {
        X509_free(cert);
    }
}

void CurlHttpClient::Session::start() {
    thread_ = std::thread([self = shared_from_this()] { self->run(); });
}

void CurlHttpClient::Session::shutdown() {
    {
        std::lock_guard<std::mutex> lock(mutex_);
        stopping_ = true;
    }
    if (multi_) {
        curl_.multi_wakeup(multi_);
    }
    if (!thread_.joinable()) {
        return;
    }
    // A completion that releases the client runs on the session thread, which cannot wait
    // for itself: it finishes the loop on its own and then lets go of the session.
    if (thread_.get_id() == std::this_thread::get_id()) {
        thread_.detach();
    } else {
        thread_.join();
    }
}

double CurlHttpClient::Session::now() const {
    if (options_.clock) {
        return options_.clock->now().secondsSince1970();
    }
    return std::chrono::duration<double>(std::chrono::steady_clock::now().time_since_epoch())
        .count();
}

std::optional<HttpResponse> CurlHttpClient::Session::cachedResponse(const HttpRequest& request) {
    if (request.method() != "GET" || request.ignoresLocalCache()) {
        return std::nullopt;
    }
    auto it = cache_.find(request.url());
    if (it == cache_.end()) {
        return std::nullopt;
    }
    if (it->second.expires <= now()) {
        cache_.erase(it);
        return std::nullopt;
    }
    return it->second.response;
}

void CurlHttpClient::Session::storeInCache(const HttpRequest& request,
                                           const HttpResponse& response) {
    if (request.method() != "GET" || options_.cacheCapacity == 0) {
        return;
    }
    std::lock_guard<std::mutex> lock(mutex_);
    auto lifetime = freshnessLifetime(response);
    if (!lifetime || response.statusCode != 200 ||
        response.body.size() > options_.cacheMaxBodyBytes) {
        cache_.erase(request.url());
        return;
    }
    const double t = now();
    std::erase_if(cache_, [t](const auto& entry) { return entry.second.expires <= t; });
    if (cache_.size() >= options_.cacheCapacity && !cache_.contains(request.url())) {
        auto soonest = std::min_element(cache_.begin(), cache_.end(), [](auto& a, auto& b) {
            return a.second.expires < b.second.expires;
        });
        cache_.erase(soonest);
    }
    cache_[request.url()] = CacheEntry{response, t + *lifetime};
}

void CurlHttpClient::Session::send(const HttpRequest& request,
                                   std::function<void(HttpResult)> completion) {
    // The transfer may finish, and its completion release the client, before this call
    // returns: hold the session until the wake-up below is done.
    auto self = shared_from_this();
    {
        std::lock_guard<std::mutex> lock(mutex_);
        if (!stopping_) {
            if (auto hit = cachedResponse(request)) {
                ready_.push_back(Ready{std::move(completion), HttpResult{std::move(hit), {}}});
            } else {
                auto transfer = std::make_unique<Transfer>();
                transfer->request = request;
                transfer->completion = std::move(completion);
                pending_.push_back(std::move(transfer));
            }
            completion = nullptr;
        }
    }
    if (completion) {
        // The session is gone: there is no session thread left to answer on.
        complete(std::move(completion), HttpResult{std::nullopt, kCancelledError});
        return;
    }
    curl_.multi_wakeup(multi_);
}

void CurlHttpClient::Session::complete(std::function<void(HttpResult)> completion,
                                       HttpResult result) {
    if (options_.completionQueue) {
        options_.completionQueue->post(
            [completion = std::move(completion), result = std::move(result)]() mutable {
                completion(std::move(result));
            });
        return;
    }
    completion(std::move(result));
}

void CurlHttpClient::Session::run() {
    for (;;) {
        std::vector<std::unique_ptr<Transfer>> toStart;
        std::vector<Ready> ready;
        bool stopping = false;
        {
            std::lock_guard<std::mutex> lock(mutex_);
            toStart.swap(pending_);
            ready.swap(ready_);
            stopping = stopping_;
        }
        for (auto& r : ready) {
            complete(std::move(r.completion), std::move(r.result));
        }
        if (stopping) {
            for (auto& t : toStart) {
                complete(std::move(t->completion), HttpResult{std::nullopt, kCancelledError});
            }
            break;
        }
        for (auto& t : toStart) {
            if (begin(*t)) {
                CURL* easy = t->easy;
                active_.emplace(easy, std::move(t));
            } else {
                complete(std::move(t->completion),
                         HttpResult{std::nullopt, "The request could not be set up"});
            }
        }
        int running = 0;
        curl_.multi_perform(multi_, &running);
        finishCompleted();
        curl_.multi_poll(multi_, nullptr, 0, kIdlePollMilliseconds, nullptr);
    }
    for (auto& [easy, transfer] : active_) {
        curl_.multi_remove_handle(multi_, easy);
        complete(std::move(transfer->completion), HttpResult{std::nullopt, kCancelledError});
    }
    active_.clear();
}

bool CurlHttpClient::Session::begin(Transfer& t) {
    t.curl = &curl_;
    t.easy = curl_.easy_init();
    if (!t.easy) {
        return false;
    }
    CURL* e = t.easy;
    const HttpRequest& r = t.request;
    t.maxBodyBytes = options_.maxBodyBytes;
    double timeout = r.timeoutSeconds();
    if (!(timeout > 0)) {
        timeout = kDefaultTimeoutSeconds;
    }
    curl_.easy_setopt(e, CURLOPT_URL, r.url().c_str());
    curl_.easy_setopt(e, CURLOPT_PRIVATE, &t);
    curl_.easy_setopt(e, CURLOPT_NOSIGNAL, 1L);
    curl_.easy_setopt(e, CURLOPT_ERRORBUFFER, t.errorBuffer);
    curl_.easy_setopt(e, CURLOPT_PROTOCOLS_STR, "http,https");
    curl_.easy_setopt(e, CURLOPT_REDIR_PROTOCOLS_STR, "http,https");
    curl_.easy_setopt(e, CURLOPT_FOLLOWLOCATION, 1L);
    curl_.easy_setopt(e, CURLOPT_MAXREDIRS, kMaxRedirects);
    curl_.easy_setopt(e, CURLOPT_TIMEOUT_MS, static_cast<long>(std::ceil(timeout * 1000)));
    curl_.easy_setopt(e, CURLOPT_ACCEPT_ENCODING, "");
    curl_.easy_setopt(e, CURLOPT_WRITEFUNCTION, &Session::onBody);
    curl_.easy_setopt(e, CURLOPT_WRITEDATA, &t);
    curl_.easy_setopt(e, CURLOPT_HEADERFUNCTION, &Session::onHeader);
    curl_.easy_setopt(e, CURLOPT_HEADERDATA, &t);
    if (!extraCAs_.empty()) {
        curl_.easy_setopt(e, CURLOPT_SSL_CTX_FUNCTION, &Session::onSslContext);
        curl_.easy_setopt(e, CURLOPT_SSL_CTX_DATA, this);
        // The store the callback adds them to is the session's cached one (libcurl keeps the
        // system CAs it read, per multi handle): reading the system bundle again for every
        // connection costs milliseconds each, and every request of the session trusts the
        // extra CAs anyway.
    }

    for (const auto& [name, value] : r.headers()) {
        t.headerList = curl_.slist_append(t.headerList, (name + ": " + value).c_str());
    }
    if (!r.valueForHeader("Expect")) {
        // Bodies go out at once rather than after a second's wait for "100 Continue".
        t.headerList = curl_.slist_append(t.headerList, "Expect:");
    }
    curl_.easy_setopt(e, CURLOPT_HTTPHEADER, t.headerList);

    const std::string& method = r.method();
    if (method == "GET" || method.empty()) {
        curl_.easy_setopt(e, CURLOPT_HTTPGET, 1L);
    } else if (method == "HEAD") {
        curl_.easy_setopt(e, CURLOPT_NOBODY, 1L);
    } else {
        if (method == "POST") {
            curl_.easy_setopt(e, CURLOPT_POST, 1L);
        } else {
            curl_.easy_setopt(e, CURLOPT_CUSTOMREQUEST, method.c_str());
        }
        const std::string body = r.body().value_or(std::string());
        if (r.body() || method == "POST") {
            curl_.easy_setopt(e, CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(body.size()));
            curl_.easy_setopt(e, CURLOPT_COPYPOSTFIELDS, body.c_str());
        }
    }
    return curl_.multi_add_handle(multi_, e) == CURLM_OK;
}

void CurlHttpClient::Session::finishCompleted() {
    int left = 0;
    while (CURLMsg* message = curl_.multi_info_read(multi_, &left)) {
        if (message->msg != CURLMSG_DONE) {
            continue;
        }
        CURL* easy = message->easy_handle;
        const CURLcode code = message->data.result;
        curl_.multi_remove_handle(multi_, easy);
        auto it = active_.find(easy);
        if (it == active_.end()) {
            continue;
        }
        auto transfer = std::move(it->second);
        active_.erase(it);
        finish(std::move(transfer), code);
    }
}

void CurlHttpClient::Session::finish(std::unique_ptr<Transfer> t, CURLcode code) {
    HttpResult result;
    if (code == CURLE_OK) {
        long status = 0;
        curl_.easy_getinfo(t->easy, CURLINFO_RESPONSE_CODE, &status);
        t->response.statusCode = status;
        storeInCache(t->request, t->response);
        result.response = std::move(t->response);
    } else if (t->tooLarge) {
        result.error = kTooLargeError;
    } else {
        result.error = curl_.easy_strerror(code);
        if (t->errorBuffer[0]) {
            result.error += std::string(": ") + t->errorBuffer;
        }
    }
    auto completion = std::move(t->completion);
    t.reset();
    complete(std::move(completion), std::move(result));
}

std::size_t CurlHttpClient::Session::onBody(char* data, std::size_t size, std::size_t count,
                                            void* user) {
    auto* t = static_cast<Transfer*>(user);
    const std::size_t n = size * count;
    if (t->response.body.size() + n > t->maxBodyBytes) {
        t->tooLarge = true;
        return 0;  // fails the transfer
    }
    t->response.body.append(data, n);
    return n;
}

std::size_t CurlHttpClient::Session::onHeader(char* data, std::size_t size, std::size_t count,
                                              void* user) {
    auto* t = static_cast<Transfer*>(user);
    const std::size_t n = size * count;
    std::string_view line(data, n);
    if (line.starts_with("HTTP/")) {
        // A new response begins (after a redirect or an interim answer): only the last
        // one's fields count.
        t->response.headers.clear();
        return n;
    }
    const auto colon = line.find(':');
    if (colon != std::string_view::npos) {
        t->response.headers.emplace_back(std::string(trim(line.substr(0, colon))),
                                         std::string(trim(line.substr(colon + 1))));
    }
    return n;
}

CURLcode CurlHttpClient::Session::onSslContext(CURL*, void* sslContext, void* user) {
    auto* session = static_cast<Session*>(user);
    X509_STORE* store = SSL_CTX_get_cert_store(static_cast<SSL_CTX*>(sslContext));
    if (!store) {
        return CURLE_SSL_CERTPROBLEM;
    }
    for (X509* cert : session->extraCAs_) {
        // A certificate already there (from an earlier connection) is not an error.
        X509_STORE_add_cert(store, cert);
    }
    ERR_clear_error();
    return CURLE_OK;
}

CurlHttpClient::Options CurlHttpClient::optionsForPlatformRoot(const std::string& platformRoot) {
    Options options;
    const std::filesystem::path root(platformRoot);
    std::ifstream in(root / kTlsPlist, std::ios::binary);
    if (!in) {
        return options;
    }
    std::string bytes(kMaxTlsPlistBytes + 1, '\0');
    in.read(bytes.data(), static_cast<std::streamsize>(bytes.size()));
    bytes.resize(static_cast<std::size_t>(in.gcount()));
    if (bytes.size() > kMaxTlsPlistBytes) {
        qaxLog().error("Ignoring '%@': the file is too large", (root / kTlsPlist).string());
        return options;
    }
    std::string error;
    auto plist = parsePlist(bytes, &error);
    if (!plist) {
        qaxLog().error("Ignoring '%@': %@", (root / kTlsPlist).string(), error);
        return options;
    }
    if (const Value* file = plist->find(kExtraCAFileKey); file && file->asString()) {
        std::filesystem::path path(*file->asString());
        options.extraCAFile = (path.is_relative() ? root / path : path).string();
    }
    return options;
}

CurlHttpClient::CurlHttpClient() : CurlHttpClient(Options{}) {}

CurlHttpClient::CurlHttpClient(Options options) : options_(std::move(options)) {}

CurlHttpClient::~CurlHttpClient() {
    std::shared_ptr<Session> session;
    {
        std::lock_guard lock(mutex_);
        sessionTried_ = true;
        sessionError_ = kCancelledError;
        session = std::move(session_);
    }
    if (session) {
        session->shutdown();
    }
}

std::shared_ptr<CurlHttpClient::Session> CurlHttpClient::session(std::string* error) {
    std::lock_guard lock(mutex_);
    if (!sessionTried_) {
        sessionTried_ = true;
        if (const CurlLibrary* curl = CurlLibrary::get(&sessionError_)) {
            session_ = std::make_shared<Session>(*curl, options_);
            session_->start();
        }
    }
    if (!session_) {
        *error = sessionError_;
    }
    return session_;
}

void CurlHttpClient::send(const HttpRequest& request, std::function<void(HttpResult)> completion) {
    if (options_.lifecycle) {
        // Let go once the completion has run and been dropped.
        completion = [completion = std::move(completion),
                      transaction = options_.lifecycle->beginTransaction(kRequestTransaction)](
                         HttpResult result) { completion(std::move(result)); };
    }
    std::string error;
    if (auto s = session(&error)) {
        s->send(request, std::move(completion));
        return;
    }
    qaxLog().error("No HTTP session: %@", error);
    if (options_.completionQueue) {
        options_.completionQueue->post([completion = std::move(completion), error]() {
            completion(HttpResult{std::nullopt, error});
        });
        return;
    }
    completion(HttpResult{std::nullopt, error});
}

}  // namespace qax
