// User-interface strings from a table a test fills: key -> text, for every table alike; a key
// not in it gives the default value. Thread-safe.
#pragma once

#include <map>
#include <mutex>
#include <string>

#include "platform/UserInterfaceStrings.h"

namespace qax::test {

class FakeUserInterfaceStrings : public UserInterfaceStrings {
  public:
    std::string localizedString(std::string_view key, std::string_view defaultValue,
                                std::string_view) override {
        std::lock_guard lock(mutex_);
        auto it = texts_.find(key);
        return it == texts_.end() ? std::string(defaultValue) : it->second;
    }
    void set(const std::string& key, const std::string& text) {
        std::lock_guard lock(mutex_);
        texts_.insert_or_assign(key, text);
    }

  private:
    mutable std::mutex mutex_;
    std::map<std::string, std::string, std::less<>> texts_{
        {"DETAILS", "Details"},
        {"CLEAR_NOTIFICATION", "Clear"},
        {"INSTALLED", "Installed"},
    };
};

}  // namespace qax::test
