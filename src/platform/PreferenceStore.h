// The agent's key-value preference domain: registered defaults (memory only) under stored
// values, with the typed reads of the platform. Implementations are thread-safe; a value
// written by another process is seen on the next read.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "core/Value.h"

namespace qax {

class PreferenceStore {
  public:
    virtual ~PreferenceStore() = default;

    // Values returned by reads while nothing is stored under their keys; never persisted.
    virtual void registerDefaults(const Value::Dictionary& defaults) = 0;
    // The stored value, else the registered default, else none.
    virtual std::optional<Value> objectForKey(std::string_view key) = 0;
    // Stores `value`; false when it could not be persisted (the old value then stays).
    virtual bool setObject(std::string_view key, const Value& value) = 0;
    virtual bool removeObject(std::string_view key) = 0;
    // Keys that hold a stored value (registered defaults are not listed).
    virtual std::vector<std::string> allKeys() = 0;

    // Typed reads. Absent keys read as false, 0 and none.
    bool boolForKey(std::string_view key);
    std::int64_t integerForKey(std::string_view key);
    double doubleForKey(std::string_view key);
    // A string, or a number in its decimal form.
    std::optional<std::string> stringForKey(std::string_view key);
    std::optional<Value::Dictionary> dictionaryForKey(std::string_view key);
    std::optional<Value::Array> arrayForKey(std::string_view key);
    std::optional<Date> dateForKey(std::string_view key);
};

}  // namespace qax
