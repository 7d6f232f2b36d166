#include "fakes/FakeUserInterfaceStrings.h"

namespace qax::test {

std::string FakeUserInterfaceStrings::localizedString(std::string_view key,
                                                      std::string_view defaultValue,
                                                      std::string_view /*table*/) {
    std::lock_guard lock(mutex_);
    auto it = texts_.find(key);
    return it == texts_.end() ? std::string(defaultValue) : it->second;
}

void FakeUserInterfaceStrings::set(const std::string& key, const std::string& text) {
    std::lock_guard lock(mutex_);
    texts_.insert_or_assign(key, text);
}

}  // namespace qax::test
