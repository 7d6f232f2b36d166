#include "platform/HttpClient.h"

#include <strings.h>

namespace qax {
namespace {

bool sameName(std::string_view a, std::string_view b) {
    return a.size() == b.size() && strncasecmp(a.data(), b.data(), a.size()) == 0;
}

}  // namespace

void HttpRequest::setValue(std::string_view name, std::optional<std::string> value) {
    for (auto it = headers_.begin(); it != headers_.end(); ++it) {
        if (sameName(it->first, name)) {
            if (value) {
                it->second = std::move(*value);
            } else {
                headers_.erase(it);
            }
            return;
        }
    }
    if (value) {
        headers_.emplace_back(std::string(name), std::move(*value));
    }
}

std::optional<std::string> HttpRequest::valueForHeader(std::string_view name) const {
    for (const auto& [n, v] : headers_) {
        if (sameName(n, name)) {
            return v;
        }
    }
    return std::nullopt;
}

}  // namespace qax
