#include "platform/host/HostUserInterfaceStrings.h"

#include <algorithm>
#include <cctype>
#include <filesystem>

namespace qax {
namespace {

constexpr const char* kBundleName = "KestovaUI";
constexpr const char* kFallbackLanguage = "en";

// A locale or table name comes from the environment or the caller: never let it walk out of
// the bundle.
bool isPlainName(std::string_view name) {
    return !name.empty() && std::all_of(name.begin(), name.end(), [](char c) {
        return std::isalnum(static_cast<unsigned char>(c)) || c == '_' || c == '-';
    });
}

}  // namespace

HostUserInterfaceStrings::HostUserInterfaceStrings(std::string shareDirectory,
                                                   std::shared_ptr<LocaleInfo> locale)
    : shareDirectory_(std::move(shareDirectory)), locale_(std::move(locale)) {}

std::vector<std::string> HostUserInterfaceStrings::languagesForLocale(
    const std::string& localeIdentifier) {
    std::vector<std::string> languages;
    auto add = [&](std::string name) {
        if (isPlainName(name) &&
            std::find(languages.begin(), languages.end(), name) == languages.end()) {
            languages.push_back(std::move(name));
        }
    };
    add(localeIdentifier);
    add(localeIdentifier.substr(0, localeIdentifier.find_first_of("_-")));
    add(kFallbackLanguage);
    return languages;
}

CheckedPlistFile& HostUserInterfaceStrings::tableFile(const std::string& language,
                                                      std::string_view table) {
    const std::string path = (std::filesystem::path(shareDirectory_) / kBundleName /
                              (language + ".lproj") / (std::string(table) + ".plist"))
                                 .string();
    std::lock_guard lock(mutex_);
    auto& file = files_[path];
    if (!file) {
        file = std::make_unique<CheckedPlistFile>(path, Value::Kind::Dictionary);
    }
    return *file;
}

std::string HostUserInterfaceStrings::localizedString(std::string_view key,
                                                      std::string_view defaultValue,
                                                      std::string_view table) {
    if (!isPlainName(table)) {
        return std::string(defaultValue);
    }
    const std::string localeIdentifier = locale_ ? locale_->preferredLocaleIdentifier() : "";
    for (const auto& language : languagesForLocale(localeIdentifier)) {
        auto strings = tableFile(language, table).read();
        const Value* text = strings ? strings->find(key) : nullptr;
        if (text && text->isString()) {
            return *text->asString();
        }
    }
    return std::string(defaultValue);
}

}  // namespace qax
