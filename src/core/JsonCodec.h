// JSON <-> Value. Parsing is bounded (depth at most kMaxValueDepth) because the text
// may come from the network. Stateless free functions; any thread.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include <nlohmann/json_fwd.hpp>

#include "core/Value.h"

namespace qax {

// Parses JSON text. On failure returns no value and, when `error` is given, a reason.
std::optional<Value> parseJson(std::string_view text, std::string* error = nullptr);

// Converts an already parsed document (unbounded: for trusted input only).
Value valueFromJson(const nlohmann::json& json);

// Dates become ISO 8601 strings with milliseconds, data becomes base64 text.
nlohmann::json jsonFromValue(const Value& value);

// Compact JSON text (no whitespace), or indented by `indent` spaces when >= 0.
std::string toJsonString(const Value& value, int indent = -1);

}  // namespace qax
