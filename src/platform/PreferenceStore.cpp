#include "platform/PreferenceStore.h"

#include <cstdlib>
#include <string>

namespace qax {
namespace {

// Leading decimal number of a string, as the platform's typed reads take it.
double leadingNumber(const std::string& s) {
    return std::strtod(s.c_str(), nullptr);
}

}  // namespace

bool PreferenceStore::boolForKey(std::string_view key) {
    auto v = objectForKey(key);
    if (!v) {
        return false;
    }
    if (auto* s = v->asString()) {
        if (*s == "YES" || *s == "yes" || *s == "true" || *s == "TRUE") {
            return true;
        }
        return std::strtoll(s->c_str(), nullptr, 10) != 0;
    }
    return v->truthy();
}

std::int64_t PreferenceStore::integerForKey(std::string_view key) {
    auto v = objectForKey(key);
    if (!v) {
        return 0;
    }
    if (auto i = v->asInteger()) {
        return *i;
    }
    if (auto b = v->asBool()) {
        return *b ? 1 : 0;
    }
    if (auto* s = v->asString()) {
        return std::strtoll(s->c_str(), nullptr, 10);
    }
    return 0;
}

double PreferenceStore::doubleForKey(std::string_view key) {
    auto v = objectForKey(key);
    if (!v) {
        return 0;
    }
    if (auto d = v->asDouble()) {
        return *d;
    }
    if (auto b = v->asBool()) {
        return *b ? 1 : 0;
    }
    if (auto* s = v->asString()) {
        return leadingNumber(*s);
    }
    return 0;
}

std::optional<std::string> PreferenceStore::stringForKey(std::string_view key) {
    auto v = objectForKey(key);
    if (!v) {
        return std::nullopt;
    }
    if (auto* s = v->asString()) {
        return *s;
    }
    if (v->isNumber()) {
        return v->description();
    }
    return std::nullopt;
}

std::optional<Value::Dictionary> PreferenceStore::dictionaryForKey(std::string_view key) {
    auto v = objectForKey(key);
    if (v && v->isDictionary()) {
        return *v->asDictionary();
    }
    return std::nullopt;
}

std::optional<Value::Array> PreferenceStore::arrayForKey(std::string_view key) {
    auto v = objectForKey(key);
    if (v && v->isArray()) {
        return *v->asArray();
    }
    return std::nullopt;
}

std::optional<Date> PreferenceStore::dateForKey(std::string_view key) {
    auto v = objectForKey(key);
    return v ? v->asDate() : std::nullopt;
}

}  // namespace qax
