// The one tree type of the agent: coverage summaries, preference values, cache files
// and IPC payloads are all Values. A Value is a plain value type (copyable, no shared
// state); it is safe to use from any thread as long as one object is not written and
// read at once.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "core/Date.h"

namespace qax {

class Value {
  public:
    enum class Kind { Null, Bool, Integer, Real, String, Date, Data, Array, Dictionary };

    using Array = std::vector<Value>;
    using Dictionary = std::map<std::string, Value, std::less<>>;
    using Data = std::vector<std::uint8_t>;

    Value() = default;
    Value(std::nullptr_t) {}
    Value(bool b) : v_(b) {}
    Value(int i) : v_(static_cast<std::int64_t>(i)) {}
    Value(long i) : v_(static_cast<std::int64_t>(i)) {}
    Value(long long i) : v_(static_cast<std::int64_t>(i)) {}
    Value(unsigned i) : v_(static_cast<std::int64_t>(i)) {}
    // Integers above INT64_MAX have no integer form here and become reals.
    Value(unsigned long i);
    Value(unsigned long long i);
    Value(double d) : v_(d) {}
    Value(const char* s) : v_(std::string(s)) {}
    Value(std::string s) : v_(std::move(s)) {}
    Value(std::string_view s) : v_(std::string(s)) {}
    Value(qax::Date d) : v_(d) {}
    Value(Data d) : v_(std::move(d)) {}
    Value(Array a) : v_(std::move(a)) {}
    Value(Dictionary d) : v_(std::move(d)) {}

    Kind kind() const { return static_cast<Kind>(v_.index()); }
    bool isNull() const { return kind() == Kind::Null; }
    bool isBool() const { return kind() == Kind::Bool; }
    bool isInteger() const { return kind() == Kind::Integer; }
    bool isReal() const { return kind() == Kind::Real; }
    bool isNumber() const { return isInteger() || isReal(); }
    bool isString() const { return kind() == Kind::String; }
    bool isDate() const { return kind() == Kind::Date; }
    bool isData() const { return kind() == Kind::Data; }
    bool isArray() const { return kind() == Kind::Array; }
    bool isDictionary() const { return kind() == Kind::Dictionary; }

    // Typed access: the pointer or optional is empty when the kind differs.
    const std::string* asString() const { return std::get_if<std::string>(&v_); }
    const Array* asArray() const { return std::get_if<Array>(&v_); }
    Array* asArray() { return std::get_if<Array>(&v_); }
    const Dictionary* asDictionary() const { return std::get_if<Dictionary>(&v_); }
    Dictionary* asDictionary() { return std::get_if<Dictionary>(&v_); }
    const Data* asData() const { return std::get_if<Data>(&v_); }
    std::optional<qax::Date> asDate() const;
    std::optional<bool> asBool() const;
    // Numbers only (a bool is not a number here); a real is truncated toward zero and
    // clamped to the 64-bit range.
    std::optional<std::int64_t> asInteger() const;
    std::optional<double> asDouble() const;

    // The boolean reading of a value: a bool as is, a number when non-zero; anything
    // else is false.
    bool truthy() const;

    // Dictionary lookup; nullptr when this is not a dictionary or the key is absent.
    const Value* find(std::string_view key) const;
    // Dictionary insert; a Value that is not a dictionary becomes an empty one first.
    Value& operator[](std::string_view key);
    std::size_t size() const;  // elements of an array or dictionary, bytes of data

    // Numbers compare by value (1 == 1.0); containers compare element-wise.
    friend bool operator==(const Value& a, const Value& b);

    // Human-readable text: strings as they are at the top level, containers in the
    // bracketed form used by logs ("{\n    key = value;\n}").
    std::string description() const;

    static const char* kindName(Kind k);

  private:
    void describe(std::string& out, int indent, bool topLevel) const;

    std::variant<std::monostate, bool, std::int64_t, double, std::string, qax::Date, Data, Array,
                 Dictionary>
        v_;
};

// Bound on the nesting depth of any tree that comes from outside the process.
inline constexpr int kMaxValueDepth = 64;

}  // namespace qax
