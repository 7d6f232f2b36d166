// Property lists (XML and binary, through libplist) <-> Value. Every document is
// size-checked and pre-scanned for nesting depth before libplist sees it, because the
// library recurses without bound on deep documents. Stateless; any thread.
#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

#include "core/Value.h"

namespace qax {

inline constexpr std::size_t kMaxPlistBytes = 16 * 1024 * 1024;

// Parses an XML or binary property list. On failure returns no value and, when `error` is
// given, a reason. Binary lists of the plain kinds clients send (containers, integers,
// booleans, ASCII text) are read directly; everything else goes through the library.
std::optional<Value> parsePlist(std::string_view bytes, std::string* error = nullptr);
// The same, always through the library: what the direct reading must agree with.
std::optional<Value> parsePlistWithLibrary(std::string_view bytes, std::string* error = nullptr);

// Serialises a tree. No value when the tree holds something a property list cannot
// represent: a null anywhere, or a date outside the range the format stores.
std::optional<std::string> toXmlPlist(const Value& value);
std::optional<std::string> toBinaryPlist(const Value& value);

bool isBinaryPlist(std::string_view bytes);

// The pre-scan alone: true when the document's nesting stays within kMaxValueDepth and its
// structure can be walked safely.
bool plistStructureIsSafe(std::string_view bytes, std::string* error = nullptr);

}  // namespace qax
