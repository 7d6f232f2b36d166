#include "platform/host/HostStoreEndpoint.h"

#include <filesystem>

#include "core/JsonCodec.h"
#include "platform/host/CurlLibrary.h"

namespace qax {
namespace {

constexpr const char* kStorePlist = "store.plist";
constexpr double kStoreRequestTimeoutSeconds = 30;

// `base` with the parameters appended to its query, percent-encoded; none when `base` is
// not an absolute http(s) URL.
std::optional<std::string> urlWithQuery(
    const std::string& base, const std::vector<std::pair<std::string, std::string>>& query) {
    const CurlLibrary* curl = CurlLibrary::get();
    if (!curl) {
        return std::nullopt;
    }
    std::unique_ptr<CURLU, decltype(curl->url_cleanup)> url(curl->url(), curl->url_cleanup);
    if (!url || curl->url_set(url.get(), CURLUPART_URL, base.c_str(), 0) != CURLUE_OK) {
        return std::nullopt;
    }
    char* scheme = nullptr;
    if (curl->url_get(url.get(), CURLUPART_SCHEME, &scheme, 0) != CURLUE_OK) {
        return std::nullopt;
    }
    const std::string schemeText = scheme;
    curl->free(scheme);
    if (schemeText != "https" && schemeText != "http") {
        return std::nullopt;
    }
    for (const auto& [name, value] : query) {
        const std::string pair = name + "=" + value;
        if (curl->url_set(url.get(), CURLUPART_QUERY, pair.c_str(),
                          CURLU_APPENDQUERY | CURLU_URLENCODE) != CURLUE_OK) {
            return std::nullopt;
        }
    }
    char* full = nullptr;
    if (curl->url_get(url.get(), CURLUPART_URL, &full, 0) != CURLUE_OK) {
        return std::nullopt;
    }
    std::string out = full;
    curl->free(full);
    return out;
}

}  // namespace

HostStoreEndpoint::HostStoreEndpoint(const std::string& platformRoot, std::string urlKey,
                                     std::string arrayKey, std::string label,
                                     std::shared_ptr<HttpClient> http,
                                     std::shared_ptr<Dispatcher> dispatcher)
    : file_((std::filesystem::path(platformRoot) / kStorePlist).string()),
      urlKey_(std::move(urlKey)),
      arrayKey_(std::move(arrayKey)),
      label_(std::move(label)),
      http_(std::move(http)),
      dispatcher_(std::move(dispatcher)) {}

void HostStoreEndpoint::failWithoutRequest(std::string error, Completion completion) {
    auto fail = [error = std::move(error), completion = std::move(completion)] {
        completion(std::nullopt, error);
    };
    if (dispatcher_) {
        dispatcher_->backgroundQueue()->post(std::move(fail));
    } else {
        fail();
    }
}

void HostStoreEndpoint::get(const std::vector<std::pair<std::string, std::string>>& query,
                            Completion completion) {
    auto config = file_.read();
    const Value* base = config ? config->find(urlKey_) : nullptr;
    if (!base || !base->asString()) {
        return failWithoutRequest(label_ + ": " + file_.path() + " names no " + urlKey_,
                                  std::move(completion));
    }
    if (!http_) {
        return failWithoutRequest(label_ + ": no HTTP session", std::move(completion));
    }
    auto url = urlWithQuery(*base->asString(), query);
    if (!url) {
        return failWithoutRequest(
            label_ + ": " + urlKey_ + " '" + *base->asString() + "' is not an http(s) URL",
            std::move(completion));
    }
    HttpRequest request(*url, kStoreRequestTimeoutSeconds);
    request.setValue("Accept", std::string("application/json"));
    http_->send(request, [label = label_, arrayKey = arrayKey_,
                          completion = std::move(completion)](HttpResult result) {
        if (!result.response) {
            return completion(std::nullopt, label + ": request failed: " + result.error);
        }
        if (result.response->statusCode != 200) {
            return completion(std::nullopt, label + ": the store answered HTTP " +
                                                std::to_string(result.response->statusCode));
        }
        std::string parseError;
        auto answer = parseJson(result.response->body, &parseError);
        if (!answer) {
            return completion(std::nullopt, label + ": the answer is not JSON: " + parseError);
        }
        const Value* items = answer->isDictionary() ? answer->find(arrayKey) : nullptr;
        if (!items || !items->isArray()) {
            return completion(std::nullopt,
                              label + ": the answer holds no \"" + arrayKey + "\" array");
        }
        completion(*items->asArray(), std::nullopt);
    });
}

bool HostStoreEndpoint::optionalString(const Value& item, const char* key,
                                       std::optional<std::string>& out) {
    const Value* v = item.find(key);
    if (!v || v->isNull()) {
        return true;
    }
    if (!v->asString()) {
        return false;
    }
    out = *v->asString();
    return true;
}

}  // namespace qax
