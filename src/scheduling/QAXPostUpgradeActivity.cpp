#include "scheduling/QAXPostUpgradeActivity.h"

#include <utility>

#include "core/Log.h"
#include "core/VersionCompare.h"
#include "platform/AccountStore.h"
#include "platform/AgentFactory.h"
#include "platform/DeviceProperties.h"
#include "platform/Platform.h"
#include "platform/PreferenceStore.h"
#include "scheduling/QAXScheduler.h"

namespace qax {
namespace {

constexpr const char* kPostUpgradeActivityCompletedKey = "PostUpgradeActivityCompleted";
constexpr const char* kDefaultDeviceActivationDateKey = "DefaultDeviceActivationDate";
constexpr const char* kInitialOutreachActivityScheduledKey = "InitialOutreachActivityScheduled";
constexpr const char* kPostUpgradeOSVersionKey = "PostUpgradeOSVersionKey";
constexpr const char* kProductVersionProperty = "ProductVersion";

std::optional<std::string> productVersion(Platform& platform) {
    auto value = platform.deviceProperties
                     ? platform.deviceProperties->copyDeviceProperty(kProductVersionProperty)
                     : std::nullopt;
    if (!value || !value->isString()) {
        return std::nullopt;
    }
    return *value->asString();
}

void scheduleNow(Platform& platform, const char* identifier) {
    if (platform.agentFactory) {
        platform.agentFactory->scheduleActivityForDate(identifier, platform.clock->now());
    } else {
        qaxLog().error("no activity scheduling in this process; '%@' not scheduled", identifier);
    }
}

}  // namespace

QAXPostUpgradeActivity::QAXPostUpgradeActivity(std::shared_ptr<Platform> platform)
    : platform_(std::move(platform)) {}

void QAXPostUpgradeActivity::performActivityForScheduler(const std::shared_ptr<QAXScheduler>&,
                                                         Completion completion) {
    PreferenceStore& preferences = *platform_->preferences;
    if (preferences.boolForKey(kPostUpgradeActivityCompletedKey)) {
        if (shouldTriggerWarrantyDownload()) {
            qaxLog().info("Forcing conversion outreach on upgrade");
            scheduleNow(*platform_, kQAXConversionOutreachActivityIdentifier);
        } else {
            qaxLog().info("post upgrade activity already performed");
        }
    } else {
        qaxLog().info("post upgrade activity hasn't yet been performed, perform upgrade activity");
        auto account = platform_->accounts ? platform_->accounts->primaryCloudAccount() : nullptr;
        QAXScheduler::clearScheduledActivities(*platform_);
        preferences.setObject(kDefaultDeviceActivationDateKey, Value(platform_->clock->now()));
        if (account) {
            scheduleNow(*platform_, kQAXOutreachActivityIdentifier);
            preferences.setObject(kInitialOutreachActivityScheduledKey, Value(true));
        } else {
            qaxLog().info(
                "No primary account detected. Finishing post upgrade activity without scheduling "
                "outreach");
        }
        preferences.setObject(kPostUpgradeActivityCompletedKey, Value(true));
    }
    if (auto version = productVersion(*platform_)) {
        preferences.setObject(kPostUpgradeOSVersionKey, Value(*version));
    } else {
        qaxLog().error("Unable to get OS version");
    }
    completion(QAXActivityResultFinished);
}

bool QAXPostUpgradeActivity::shouldTriggerWarrantyDownload() {
    const auto current = productVersion(*platform_);
    if (!current) {
        return false;
    }
    PreferenceStore& preferences = *platform_->preferences;
    const auto stored = preferences.stringForKey(kPostUpgradeOSVersionKey);
    if (stored && !isVersionGreater(*current, *stored)) {
        return false;
    }
    return !preferences.dateForKey(QAXScheduler::targetDateKey(kQAXOutreachActivityIdentifier));
}

}  // namespace qax
