#include "core/Value.h"

#include <charconv>
#include <cmath>
#include <cstdio>
#include <limits>

namespace qax {

Value::Value(unsigned long i) {
    if (i > static_cast<unsigned long>(std::numeric_limits<std::int64_t>::max())) {
        v_ = static_cast<double>(i);
    } else {
        v_ = static_cast<std::int64_t>(i);
    }
}

Value::Value(unsigned long long i) {
    if (i > static_cast<unsigned long long>(std::numeric_limits<std::int64_t>::max())) {
        v_ = static_cast<double>(i);
    } else {
        v_ = static_cast<std::int64_t>(i);
    }
}

std::optional<qax::Date> Value::asDate() const {
    if (auto* d = std::get_if<qax::Date>(&v_)) {
        return *d;
    }
    return std::nullopt;
}

std::optional<bool> Value::asBool() const {
    if (auto* b = std::get_if<bool>(&v_)) {
        return *b;
    }
    return std::nullopt;
}

std::optional<std::int64_t> Value::asInteger() const {
    if (auto* i = std::get_if<std::int64_t>(&v_)) {
        return *i;
    }
    if (auto* d = std::get_if<double>(&v_)) {
        if (std::isnan(*d)) {
            return 0;
        }
        if (*d >= 9223372036854775807.0) {
            return std::numeric_limits<std::int64_t>::max();
        }
        if (*d <= -9223372036854775808.0) {
            return std::numeric_limits<std::int64_t>::min();
        }
        return static_cast<std::int64_t>(*d);
    }
    return std::nullopt;
}

std::optional<double> Value::asDouble() const {
    if (auto* i = std::get_if<std::int64_t>(&v_)) {
        return static_cast<double>(*i);
    }
    if (auto* d = std::get_if<double>(&v_)) {
        return *d;
    }
    return std::nullopt;
}

bool Value::truthy() const {
    switch (kind()) {
        case Kind::Bool:
            return std::get<bool>(v_);
        case Kind::Integer:
            return std::get<std::int64_t>(v_) != 0;
        case Kind::Real:
            return std::get<double>(v_) != 0.0;
        default:
            return false;
    }
}

const Value* Value::find(std::string_view key) const {
    auto* dict = asDictionary();
    if (!dict) {
        return nullptr;
    }
    auto it = dict->find(key);
    return it == dict->end() ? nullptr : &it->second;
}

Value& Value::operator[](std::string_view key) {
    if (!isDictionary()) {
        v_ = Dictionary{};
    }
    auto& dict = std::get<Dictionary>(v_);
    auto it = dict.find(key);
    if (it == dict.end()) {
        it = dict.emplace(std::string(key), Value()).first;
    }
    return it->second;
}

std::size_t Value::size() const {
    if (auto* a = asArray()) {
        return a->size();
    }
    if (auto* d = asDictionary()) {
        return d->size();
    }
    if (auto* d = asData()) {
        return d->size();
    }
    return 0;
}

bool operator==(const Value& a, const Value& b) {
    if (a.isNumber() && b.isNumber()) {
        if (a.isInteger() && b.isInteger()) {
            return *a.asInteger() == *b.asInteger();
        }
        return *a.asDouble() == *b.asDouble();
    }
    return a.v_ == b.v_;
}

const char* Value::kindName(Kind k) {
    switch (k) {
        case Kind::Null:
            return "null";
        case Kind::Bool:
            return "boolean";
        case Kind::Integer:
            return "integer";
        case Kind::Real:
            return "real";
        case Kind::String:
            return "string";
        case Kind::Date:
            return "date";
        case Kind::Data:
            return "data";
        case Kind::Array:
            return "array";
        case Kind::Dictionary:
            return "dictionary";
    }
    return "unknown";
}

namespace {

bool needsQuotes(const std::string& s) {
    if (s.empty()) {
        return true;
    }
    // ASCII letters and digits only (the process never leaves the "C" locale).
    for (unsigned char c : s) {
        const bool plain = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') ||
                           (c >= '0' && c <= '9') || c == '_' || c == '.' || c == '$' || c == '/' ||
                           c == ':';
        if (!plain) {
            return true;
        }
    }
    return false;
}

void appendQuoted(std::string& out, const std::string& s) {
    if (!needsQuotes(s)) {
        out += s;
        return;
    }
    out += '"';
    // Copied in runs between the characters that need an escape (find_first_of would call
    // memchr once per character).
    std::size_t at = 0;
    while (at < s.size()) {
        std::size_t special = at;
        while (special < s.size() && s[special] != '"' && s[special] != '\\' &&
               s[special] != '\n') {
            ++special;
        }
        if (special == s.size()) {
            out.append(s, at);
            break;
        }
        out.append(s, at, special - at);
        out += s[special] == '\n' ? "\\n" : s[special] == '"' ? "\\\"" : "\\\\";
        at = special + 1;
    }
    out += '"';
}

void appendInteger(std::string& out, std::int64_t i) {
    char buf[24];
    auto res = std::to_chars(buf, buf + sizeof buf, i);
    out.append(buf, res.ptr);
}

std::string formatDouble(double d) {
    char buf[64];
    auto res = std::to_chars(buf, buf + sizeof buf, d);
    return std::string(buf, res.ptr);
}

}  // namespace

std::string Value::description() const {
    std::string out;
    describe(out, 0, true);
    return out;
}

void Value::describe(std::string& out, int indent, bool topLevel) const {
    // Each nesting level indents by four spaces; appended in place (descriptions are built
    // for log lines on every request).
    auto newline = [&out](int level) {
        out += '\n';
        out.append(static_cast<std::size_t>(level) * 4, ' ');
    };
    switch (kind()) {
        case Kind::Null:
            out += "<null>";
            break;
        case Kind::Bool:
            out += std::get<bool>(v_) ? "1" : "0";
            break;
        case Kind::Integer:
            appendInteger(out, std::get<std::int64_t>(v_));
            break;
        case Kind::Real:
            out += formatDouble(std::get<double>(v_));
            break;
        case Kind::String:
            if (topLevel) {
                out += std::get<std::string>(v_);
            } else {
                appendQuoted(out, std::get<std::string>(v_));
            }
            break;
        case Kind::Date:
            if (topLevel) {
                out += std::get<qax::Date>(v_).description();
            } else {
                out += '"';
                out += std::get<qax::Date>(v_).description();
                out += '"';
            }
            break;
        case Kind::Data: {
            static const char* hex = "0123456789abcdef";
            out += '<';
            const auto& d = std::get<Data>(v_);
            for (std::size_t i = 0; i < d.size(); ++i) {
                if (i && i % 4 == 0) {
                    out += ' ';
                }
                out += hex[d[i] >> 4];
                out += hex[d[i] & 15];
            }
            out += '>';
            break;
        }
        case Kind::Array: {
            const auto& a = std::get<Array>(v_);
            out += "(";
            for (std::size_t i = 0; i < a.size(); ++i) {
                newline(indent + 1);
                a[i].describe(out, indent + 1, false);
                if (i + 1 < a.size()) {
                    out += ',';
                }
            }
            if (!a.empty()) {
                newline(indent);
            }
            out += ')';
            break;
        }
        case Kind::Dictionary: {
            const auto& d = std::get<Dictionary>(v_);
            out += "{";
            for (const auto& [k, v] : d) {
                newline(indent + 1);
                appendQuoted(out, k);
                out += " = ";
                v.describe(out, indent + 1, false);
                out += ';';
            }
            if (!d.empty()) {
                newline(indent);
            }
            out += '}';
            break;
        }
    }
}

}  // namespace qax
