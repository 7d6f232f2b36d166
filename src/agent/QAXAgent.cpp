#include "agent/QAXAgent.h"

#include "core/Log.h"
#include "devices/QAXDevicesManager.h"
#include "platform/Platform.h"
#include "platform/QAXUtilities.h"
#include "warranty/QAXServerVersionUtilities.h"

namespace qax {
namespace {

constexpr const char* kPolicyQueueName = "com.velmora.kestova.qaxagent.policyqueue";
constexpr const char* kPreferencesBundleID = "com.velmora.Preferences";

}  // namespace

std::shared_ptr<QAXAgent> QAXAgent::initWithCallingProcessBundleID(
    std::shared_ptr<Platform> platform, std::optional<std::string> callingProcessBundleID) {
    if (!callingProcessBundleID) {
        qaxLog().info("%s: callingProcessBundleID is nil. Falling back to Preferences Bundle ID",
                      "-[QAXAgent initWithCallingProcessBundleID:]");
        callingProcessBundleID = kPreferencesBundleID;
    }
    // The default warranty provider, made with the calling process's identifier, joins here.
    // Until then the agent has no warranty provider and serves devices only.
    std::shared_ptr<QAXAgentWarrantyProvider> warrantyProvider;
    auto agent = initWithWarrantyProvider(platform, std::move(warrantyProvider),
                                          QAXDevicesManager::sharedManager(platform));
    agent->callingProcessBundleID_ = std::move(*callingProcessBundleID);
    return agent;
}

std::shared_ptr<QAXAgent> QAXAgent::initWithWarrantyProvider(
    std::shared_ptr<Platform> platform, std::shared_ptr<QAXAgentWarrantyProvider> warrantyProvider,
    std::shared_ptr<QAXAgentDeviceProvider> deviceProvider) {
    return std::make_shared<QAXAgent>(std::move(platform), std::move(warrantyProvider),
                                      std::move(deviceProvider));
}

QAXAgent::QAXAgent(std::shared_ptr<Platform> platform,
                   std::shared_ptr<QAXAgentWarrantyProvider> warrantyProvider,
                   std::shared_ptr<QAXAgentDeviceProvider> deviceProvider)
    : platform_(std::move(platform)),
      policyLookupQueue_(platform_->dispatcher->makeSerialQueue(kPolicyQueueName)),
      warrantyProvider_(std::move(warrantyProvider)),
      deviceProvider_(std::move(deviceProvider)) {}

std::shared_ptr<QAXAgentWarrantyProvider> QAXAgent::warrantyProvider() const {
    std::lock_guard lock(providerMutex_);
    return warrantyProvider_;
}

void QAXAgent::setWarrantyProvider(std::shared_ptr<QAXAgentWarrantyProvider> provider) {
    std::lock_guard lock(providerMutex_);
    warrantyProvider_ = std::move(provider);
}

std::shared_ptr<QAXAgentDeviceProvider> QAXAgent::deviceProvider() const {
    std::lock_guard lock(providerMutex_);
    return deviceProvider_;
}

void QAXAgent::setDeviceProvider(std::shared_ptr<QAXAgentDeviceProvider> provider) {
    std::lock_guard lock(providerMutex_);
    deviceProvider_ = std::move(provider);
}

void QAXAgent::logUnavailable(const char* operation) {
    qaxLog().error("%s is not available in this build", operation);
}

// Operations 1-5 and 9-11 need the scheduler, outreach activity, support-application
// manager and warranty policy rules, which join the agent later. Until then each answers the
// empty result the protocol uses for failure and logs why; the IPC interface does not route
// them here and tells clients "unsupported operation" instead.

void QAXAgent::scheduleOutreach(QAXBoolReply reply) {
    logUnavailable("-[QAXAgent scheduleOutreachWithReply:]");
    reply(false);
}

void QAXAgent::scheduleOutreachAfter(double, QAXBoolReply reply) {
    logUnavailable("-[QAXAgent scheduleOutreachAfter:withReply:]");
    reply(false);
}

void QAXAgent::velmoraAccountAdded(QAXBoolReply reply) {
    logUnavailable("-[QAXAgent velmoraAccountAddedWithReply:]");
    reply(false);
}

void QAXAgent::checkIsAvailableInStore(
    const std::string&, std::function<void(std::optional<Value::Dictionary>)> reply) {
    logUnavailable("-[QAXAgent checkIsAvailableInStore:withReply:]");
    reply(std::nullopt);
}

void QAXAgent::appSupportAvailability(const std::string&,
                                      std::function<void(Value::Dictionary)> reply) {
    logUnavailable("-[QAXAgent appSupportAvailability:withReply:]");
    reply({});
}

void QAXAgent::readWebURLOverride(std::function<void(std::optional<Value>)> reply) {
    std::optional<Value> url;
    if (QAXUtilities::isInternal(*platform_)) {
        url = QAXServerVersionUtilities::readWebURLOverride(*platform_);
        qaxLog().info("readWebURLOverride = %@", url);
    }
    if (reply) {
        reply(std::move(url));
    }
}

void QAXAgent::defaultDevice(QAXDeviceReply reply) {
    reply(deviceProvider()->defaultDevice());
}

void QAXAgent::pairedDevices(QAXDeviceListReply reply) {
    std::vector<std::shared_ptr<QAXDevice>> devices;
    for (auto& [serial, device] : deviceProvider()->pairedDevices()) {
        devices.push_back(std::move(device));
    }
    reply(std::move(devices));
}

void QAXAgent::getDefaultDeviceInfoUsingPolicy(QAXWarrantyPolicy, QAXDeviceInfoReply reply) {
    logUnavailable("-[QAXAgent getDefaultDeviceInfoUsingPolicy:withReply:]");
    reply(nullptr);
}

void QAXAgent::getDeviceInfoForSerialNumber(const std::string&, QAXWarrantyPolicy,
                                            QAXDeviceInfoReply reply) {
    logUnavailable("-[QAXAgent getDeviceInfoForSerialNumber:usingPolicy:withReply:]");
    reply(nullptr);
}

void QAXAgent::getAllDeviceInfosUsingPolicy(QAXWarrantyPolicy, bool, QAXDeviceInfoListReply reply) {
    logUnavailable("-[QAXAgent getAllDeviceInfosUsingPolicy:updateFollowUps:withReply:]");
    reply({});
}

void QAXAgent::dismissFollowUpForSerialNumber(const std::string& serialNumber,
                                              QAXBoolReply completion) {
    if (auto provider = warrantyProvider()) {
        provider->dismissFollowUpForSerialNumber(serialNumber);
    } else {
        logUnavailable("-[QAXAgent dismissFollowUpForSerialNumber:completion:]");
    }
    completion(true);
}

void QAXAgent::dismissNotificationForSerialNumber(const std::string& serialNumber,
                                                  QAXBoolReply completion) {
    if (auto provider = warrantyProvider()) {
        provider->dismissNotificationForSerialNumber(serialNumber);
    } else {
        logUnavailable("-[QAXAgent dismissNotificationForSerialNumber:completion:]");
    }
    completion(true);
}

}  // namespace qax
