// A platform context for unit tests: virtual time, a capturing log, a temporary home
// directory, and in-memory services. Tests replace single services as they need.
#pragma once

#include <filesystem>
#include <memory>
#include <string>

#include "core/Log.h"
#include "core/VirtualTimeTaskRunner.h"
#include "platform/Platform.h"

namespace qax::test {

// A directory under the system's temporary directory, removed with the object.
class TempDir {
  public:
    TempDir();
    ~TempDir();
    TempDir(const TempDir&) = delete;
    TempDir& operator=(const TempDir&) = delete;
    const std::filesystem::path& path() const { return path_; }
    std::string str() const { return path_.string(); }

  private:
    std::filesystem::path path_;
};

void writeFile(const std::filesystem::path& path, std::string_view content);
std::string readFile(const std::filesystem::path& path);

class TestPlatform {
  public:
    TestPlatform();
    ~TestPlatform();

    std::shared_ptr<Platform> platform;
    std::shared_ptr<ManualClock> clock;
    std::shared_ptr<VirtualTimeTaskRunner> runner;
    std::shared_ptr<CapturingLogSink> log;
    TempDir home;

  private:
    std::shared_ptr<LogSink> previousSink_;
};

}  // namespace qax::test
