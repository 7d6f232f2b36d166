// What the fuzz targets share: a minimal in-memory platform (preferences, a fixed clock and
// locale), a log that formats only errors (and drops them), and a scratch directory in memory
// for targets that read their input from a file. One fuzzing thread; nothing here locks.
#pragma once

#include <sys/stat.h>
#include <unistd.h>

#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>

#include "core/AtomicFile.h"
#include "core/Clock.h"
#include "core/Log.h"
#include "core/VirtualTimeTaskRunner.h"
#include "platform/LocaleInfo.h"
#include "platform/Platform.h"
#include "platform/PreferenceStore.h"
#include "platform/QAXSettings.h"

namespace qaxfuzz {

// Error lines are still formatted (their arguments come from the input), default and debug
// lines are not: formatting every summary into a log line would cost more than parsing it.
class QuietLogSink : public qax::LogSink {
  public:
    void write(qax::LogLevel, std::string_view, std::string_view, std::string_view) override {}
    bool isEnabled(qax::LogLevel level) const override { return level == qax::LogLevel::Error; }
    bool showsPrivate() const override { return true; }
};

inline void quietLog() {
    static bool done = [] {
        qax::qaxLog().setSink(std::make_shared<QuietLogSink>());
        return true;
    }();
    (void)done;
}

class MemoryPreferences : public qax::PreferenceStore {
  public:
    void registerDefaults(const qax::Value::Dictionary& d) override {
        for (const auto& [k, v] : d) {
            defaults_.insert_or_assign(k, v);
        }
    }
    std::optional<qax::Value> objectForKey(std::string_view key) override {
        if (auto it = stored_.find(key); it != stored_.end()) {
            return it->second;
        }
        if (auto it = defaults_.find(key); it != defaults_.end()) {
            return it->second;
        }
        return std::nullopt;
    }
    bool setObject(std::string_view key, const qax::Value& v) override {
        stored_.insert_or_assign(std::string(key), v);
        return true;
    }
    bool removeObject(std::string_view key) override {
        if (auto it = stored_.find(key); it != stored_.end()) {
            stored_.erase(it);
        }
        return true;
    }
    std::vector<std::string> allKeys() override {
        std::vector<std::string> keys;
        for (const auto& [k, v] : stored_) {
            keys.push_back(k);
        }
        return keys;
    }

  private:
    qax::Value::Dictionary defaults_, stored_;
};

class FixedLocale : public qax::LocaleInfo {
  public:
    std::string preferredLocaleIdentifier() override { return "de_DE"; }
    std::optional<std::string> preferredContentSizeCategory() override { return "Large"; }
};

// A directory in memory (/dev/shm when there is one) made once per process and removed at
// exit: file-reading targets write each input there, so a run costs no disk flushes.
inline const std::string& scratchDirectory() {
    // Never destroyed: the removal at exit runs after static destructors.
    static const std::string& dir = *new std::string([] {
        std::string base = "/dev/shm";
        struct stat st {};
        if (::stat(base.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) {
            const char* tmp = std::getenv("TMPDIR");
            base = tmp && *tmp ? tmp : "/tmp";
        }
        std::string path = base + "/qaxfuzz.XXXXXX";
        if (!::mkdtemp(path.data())) {
            std::abort();
        }
        std::atexit([] {
            std::error_code ec;
            std::filesystem::remove_all(scratchDirectory(), ec);
        });
        return path;
    }());
    return dir;
}

// Puts `data` at `path` (parents created), replacing what was there.
inline void putFile(const std::string& path, const uint8_t* data, size_t size) {
    std::error_code ec;
    std::filesystem::create_directories(std::filesystem::path(path).parent_path(), ec);
    FILE* f = std::fopen(path.c_str(), "wb");
    if (!f) {
        std::abort();
    }
    if (size) {
        std::fwrite(data, 1, size, f);
    }
    std::fclose(f);
}

inline std::shared_ptr<qax::Platform> makePlatform() {
    quietLog();
    auto p = std::make_shared<qax::Platform>();
    auto clock = std::make_shared<qax::ManualClock>();
    p->clock = clock;
    p->dispatcher = std::make_shared<qax::VirtualTimeDispatcher>(
        std::make_shared<qax::VirtualTimeTaskRunner>(clock));
    p->log = std::make_shared<QuietLogSink>();
    p->preferences = std::make_shared<MemoryPreferences>();
    p->locale = std::make_shared<FixedLocale>();
    qax::qax_registerDefaults(*p->preferences);
    return p;
}

}  // namespace qaxfuzz
