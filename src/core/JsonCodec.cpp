#include "core/JsonCodec.h"

#include <nlohmann/json.hpp>

#include "core/Base64.h"

namespace qax {
namespace {

// Builds a Value straight from parser events, refusing documents nested too deeply.
class ValueSax : public nlohmann::json_sax<nlohmann::json> {
  public:
    std::optional<Value> result;
    std::string error;

    bool null() override { return add(Value()); }
    bool boolean(bool b) override { return add(Value(b)); }
    bool number_integer(number_integer_t i) override {
        return add(Value(static_cast<long long>(i)));
    }
    bool number_unsigned(number_unsigned_t u) override {
        return add(Value(static_cast<unsigned long long>(u)));
    }
    bool number_float(number_float_t d, const string_t&) override { return add(Value(d)); }
    bool string(string_t& s) override { return add(Value(std::move(s))); }
    bool binary(binary_t& b) override { return add(Value(Value::Data(b.begin(), b.end()))); }
    bool start_object(std::size_t) override { return open(Value(Value::Dictionary{})); }
    bool key(string_t& k) override {
        keys_.back() = std::move(k);
        return true;
    }
    bool end_object() override { return close(); }
    bool start_array(std::size_t) override { return open(Value(Value::Array{})); }
    bool end_array() override { return close(); }
    bool parse_error(std::size_t position, const std::string&,
                     const nlohmann::detail::exception& ex) override {
        error = ex.what();
        (void)position;
        return false;
    }

  private:
    bool add(Value v) {
        if (stack_.empty()) {
            result = std::move(v);
            return true;
        }
        Value& top = stack_.back();
        if (auto* a = top.asArray()) {
            a->push_back(std::move(v));
        } else {
            (*top.asDictionary())[keys_.back()] = std::move(v);
        }
        return true;
    }
    bool open(Value container) {
        if (static_cast<int>(stack_.size()) >= kMaxValueDepth) {
            error = "document nested deeper than " + std::to_string(kMaxValueDepth) + " levels";
            return false;
        }
        stack_.push_back(std::move(container));
        keys_.emplace_back();
        return true;
    }
    bool close() {
        Value done = std::move(stack_.back());
        stack_.pop_back();
        keys_.pop_back();
        return add(std::move(done));
    }

    std::vector<Value> stack_;
    std::vector<std::string> keys_;
};

}  // namespace

std::optional<Value> parseJson(std::string_view text, std::string* error) {
    ValueSax sax;
    bool ok = false;
    try {
        ok = nlohmann::json::sax_parse(text.begin(), text.end(), &sax);
    } catch (const std::exception& ex) {
        sax.error = ex.what();
        ok = false;
    }
    if (!ok || !sax.result) {
        if (error) {
            *error = sax.error.empty() ? "not a JSON document" : sax.error;
        }
        return std::nullopt;
    }
    return std::move(sax.result);
}

Value valueFromJson(const nlohmann::json& json) {
    switch (json.type()) {
        case nlohmann::json::value_t::null:
        case nlohmann::json::value_t::discarded:
            return Value();
        case nlohmann::json::value_t::boolean:
            return Value(json.get<bool>());
        case nlohmann::json::value_t::number_integer:
            return Value(json.get<long long>());
        case nlohmann::json::value_t::number_unsigned:
            return Value(json.get<unsigned long long>());
        case nlohmann::json::value_t::number_float:
            return Value(json.get<double>());
        case nlohmann::json::value_t::string:
            return Value(json.get<std::string>());
        case nlohmann::json::value_t::binary: {
            const auto& b = json.get_binary();
            return Value(Value::Data(b.begin(), b.end()));
        }
        case nlohmann::json::value_t::array: {
            Value::Array a;
            a.reserve(json.size());
            for (const auto& e : json) {
                a.push_back(valueFromJson(e));
            }
            return Value(std::move(a));
        }
        case nlohmann::json::value_t::object: {
            Value::Dictionary d;
            for (const auto& [k, v] : json.items()) {
                d.emplace(k, valueFromJson(v));
            }
            return Value(std::move(d));
        }
    }
    return Value();
}

nlohmann::json jsonFromValue(const Value& value) {
    switch (value.kind()) {
        case Value::Kind::Null:
            return nullptr;
        case Value::Kind::Bool:
            return *value.asBool();
        case Value::Kind::Integer:
            return *value.asInteger();
        case Value::Kind::Real:
            return *value.asDouble();
        case Value::Kind::String:
            return *value.asString();
        case Value::Kind::Date:
            return value.asDate()->iso8601();
        case Value::Kind::Data:
            return base64Encode(*value.asData());
        case Value::Kind::Array: {
            nlohmann::json a = nlohmann::json::array();
            for (const auto& e : *value.asArray()) {
                a.push_back(jsonFromValue(e));
            }
            return a;
        }
        case Value::Kind::Dictionary: {
            nlohmann::json o = nlohmann::json::object();
            for (const auto& [k, v] : *value.asDictionary()) {
                o[k] = jsonFromValue(v);
            }
            return o;
        }
    }
    return nullptr;
}

std::string toJsonString(const Value& value, int indent) {
    // Invalid UTF-8 is replaced rather than thrown on: this output is for people and peers.
    return jsonFromValue(value).dump(indent, ' ', false, nlohmann::json::error_handler_t::replace);
}

}  // namespace qax
