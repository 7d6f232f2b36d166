#include "agent/ServiceDelegate.h"

#include <vector>

#include "agent/QAXAgent.h"
#include "agent/QAXAgentRemoteInterface.h"
#include "core/Log.h"
#include "platform/Platform.h"
#include "platform/ProcessBundleLookup.h"

namespace qax {
namespace {

constexpr const char* kAgentEntitlement = "com.velmora.private.qaxagent";
constexpr std::size_t kExecutablePathBufferSize = 4096;

}  // namespace

ServiceDelegate::ServiceDelegate(std::shared_ptr<Platform> platform)
    : platform_(std::move(platform)), interface_(std::make_shared<QAXAgentRemoteInterface>()) {}

bool ServiceDelegate::entitlementGrants(const std::optional<Value>& value) {
    // Strings ("YES" included), dates and containers never grant; truthy() is false for them.
    return value && value->truthy();
}

bool ServiceDelegate::shouldAcceptNewConnection(
    ServiceListener&, const std::shared_ptr<ClientConnection>& connection) {
    if (!entitlementGrants(connection->entitlementValue(kAgentEntitlement))) {
        qaxLog().error("Rejecting connection to qaxagent: missing entitlement '%@'",
                       kAgentEntitlement);
        return false;
    }
    const pid_t pid = connection->peerProcessIdentifier();
    auto bundleIdentifier = _bundleForPID(pid);
    qaxLog().info("connection added from %d with calling process: %@", pid, bundleIdentifier);
    connection->exportInterface(interface_);
    connection->exportObject(QAXAgent::initWithCallingProcessBundleID(platform_, bundleIdentifier));
    connection->resume();
    return true;
}

std::optional<std::string> ServiceDelegate::_bundleForPID(pid_t pid) {
    if (!platform_->processes) {
        return std::nullopt;
    }
    std::vector<char> buffer(kExecutablePathBufferSize);
    const int length =
        platform_->processes->executablePathForProcess(pid, buffer.data(), buffer.size());
    if (length <= 0) {
        return std::nullopt;
    }
    const std::string path(buffer.data(), static_cast<std::size_t>(length));
    return platform_->processes->bundleIdentifierForExecutablePath(path);
}

}  // namespace qax
