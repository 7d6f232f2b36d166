// Process to bundle on the host: a process's executable is the target of /proc/PID/exe, and
// its bundle is the registered application whose executable is that same file. Thread-safe.
#pragma once

#include <memory>

#include "platform/ApplicationRegistry.h"
#include "platform/ProcessBundleLookup.h"

namespace qax {

class HostProcessBundleLookup : public ProcessBundleLookup {
  public:
    explicit HostProcessBundleLookup(std::shared_ptr<ApplicationRegistry> applications)
        : applications_(std::move(applications)) {}

    int executablePathForProcess(pid_t pid, char* buffer, std::size_t size) override;
    std::optional<std::string> bundleIdentifierForExecutablePath(const std::string& path) override;

  private:
    std::shared_ptr<ApplicationRegistry> applications_;
};

}  // namespace qax
