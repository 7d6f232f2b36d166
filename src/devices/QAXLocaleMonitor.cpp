#include "devices/QAXLocaleMonitor.h"

#include <utility>

#include "core/Log.h"
#include "platform/Platform.h"
#include "platform/ProcessLifecycle.h"
#include "platform/SystemNotificationCenter.h"

namespace qax {
namespace {

constexpr const char* kLanguageChangedNotification = "com.velmora.language.changed";
// Lets the rest of the system settle into the new language before the warranties follow it.
constexpr double kLocaleReactionDelaySeconds = 5;

void requestCleanExit(Platform& platform) {
    if (platform.lifecycle) {
        platform.lifecycle->requestCleanExit();
    }
}

}  // namespace

QAXLocaleMonitor::QAXLocaleMonitor(std::shared_ptr<Platform> platform,
                                   std::shared_ptr<QAXAgentProtocol> agent,
                                   PendingFollowUpCount pendingFollowUpCount)
    : platform_(std::move(platform)),
      pendingFollowUpCount_(std::move(pendingFollowUpCount)),
      agent_(std::move(agent)) {}

QAXLocaleMonitor::~QAXLocaleMonitor() {
    if (languageNotifyToken_ != 0 && platform_->notifications) {
        platform_->notifications->cancelRegistration(languageNotifyToken_);
    }
}

std::shared_ptr<QAXAgentProtocol> QAXLocaleMonitor::agent() const {
    std::lock_guard lock(mutex_);
    return agent_;
}

void QAXLocaleMonitor::setAgent(std::shared_ptr<QAXAgentProtocol> agent) {
    std::lock_guard lock(mutex_);
    agent_ = std::move(agent);
}

void QAXLocaleMonitor::start() {
    if (!platform_->notifications) {
        return;
    }
    std::weak_ptr<QAXLocaleMonitor> weak = weak_from_this();
    auto mainQueue = platform_->dispatcher->mainQueue();
    languageNotifyToken_ = platform_->notifications->registerForNotification(
        kLanguageChangedNotification, mainQueue, [weak, mainQueue] {
            mainQueue->postDelayed(
                [weak] {
                    if (auto self = weak.lock()) {
                        self->localeDidChange();
                    }
                },
                kLocaleReactionDelaySeconds);
        });
}

void QAXLocaleMonitor::localeDidChange() {
    const std::uint64_t pending = pendingFollowUpCount_ ? pendingFollowUpCount_() : 0;
    auto agent = this->agent();
    if (pending == 0 || !agent) {
        requestCleanExit(*platform_);
        return;
    }
    qaxLog().info(
        "Locale changed and one or more followups are being displayed. Refresh warranty if "
        "needed.");
    agent->getAllDeviceInfosUsingPolicy(
        QAXWarrantyPolicyDefault, true,
        [platform = platform_](std::vector<std::shared_ptr<QAXDeviceInfo>>) {
            qaxLog().info("Device infos refreshed after locale change");
            requestCleanExit(*platform);
        });
}

}  // namespace qax
