// The preference domain of a dry run: reads go through to the real store, writes and removals
// stay in memory, so rules running on it see their own changes while the domain on disk never
// does. Registered defaults are its own. Thread-safe (one mutex).
#pragma once

#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "platform/PreferenceStore.h"

namespace qax {

class DryRunPreferenceStore : public PreferenceStore {
  public:
    // `base` is the store to read through to; none reads as a domain with nothing stored.
    explicit DryRunPreferenceStore(std::shared_ptr<PreferenceStore> base);

    void registerDefaults(const Value::Dictionary& defaults) override;
    std::optional<Value> objectForKey(std::string_view key) override;
    bool setObject(std::string_view key, const Value& value) override;
    bool removeObject(std::string_view key) override;
    std::vector<std::string> allKeys() override;

    // What the dry run would have written: key -> new value, or none for a removal.
    std::map<std::string, std::optional<Value>> changes() const;

  private:
    const std::shared_ptr<PreferenceStore> base_;
    mutable std::mutex mutex_;
    Value::Dictionary defaults_;
    std::map<std::string, std::optional<Value>, std::less<>> changes_;
};

}  // namespace qax
