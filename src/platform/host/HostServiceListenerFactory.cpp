#include "platform/host/HostServiceListenerFactory.h"

#include <sys/stat.h>

#include <cstdlib>
#include <filesystem>

#include "core/AsioDispatcher.h"
#include "core/Log.h"
#include "platform/host/HostServiceListener.h"

namespace qax {
namespace {

// The runtime directory the user units give the agent, below the user's runtime directory.
constexpr const char* kServiceManagerRuntimeSubdirectory = "qaxagent";

bool isSocket(const std::string& path) {
    struct stat st {};
    return ::stat(path.c_str(), &st) == 0 && S_ISSOCK(st.st_mode);
}

}  // namespace

std::string HostServiceListenerFactory::socketPath(const std::string& runtimeDirectory,
                                                   const std::string& serviceName) {
    return (std::filesystem::path(runtimeDirectory) / serviceName).string();
}

std::string HostServiceListenerFactory::clientSocketPath(const std::string& runtimeDirectory,
                                                         const std::string& serviceName) {
    const std::string own = socketPath(runtimeDirectory, serviceName);
    if (isSocket(own)) {
        return own;
    }
    const char* userRuntime = std::getenv("XDG_RUNTIME_DIR");
    if (userRuntime && *userRuntime) {
        const std::string managed = socketPath(
            (std::filesystem::path(userRuntime) / kServiceManagerRuntimeSubdirectory).string(),
            serviceName);
        if (isSocket(managed)) {
            return managed;
        }
    }
    return own;
}

std::shared_ptr<ServiceListener> HostServiceListenerFactory::makeListener(
    const std::string& serviceName) {
    auto asio = std::dynamic_pointer_cast<AsioDispatcher>(dispatcher_);
    if (!asio) {
        qaxLog().error("Cannot serve %@ without the main event loop", serviceName);
        return nullptr;
    }
    std::optional<int> passed;
    {
        std::lock_guard lock(mutex_);
        passed.swap(passedSocket_);
    }
    return std::make_shared<HostServiceListener>(
        serviceName, socketPath(runtimeDirectory_, serviceName), std::move(asio), applications_,
        lifecycle_, passed);
}

}  // namespace qax
