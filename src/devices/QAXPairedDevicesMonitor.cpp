#include "devices/QAXPairedDevicesMonitor.h"

#include <utility>

#include "core/Log.h"
#include "platform/PairedDeviceRegistry.h"
#include "platform/Platform.h"
#include "platform/SystemNotificationCenter.h"

namespace qax {

QAXPairedDevicesMonitor::QAXPairedDevicesMonitor(std::shared_ptr<Platform> platform,
                                                 std::shared_ptr<QAXAgentProtocol> agent,
                                                 FollowUpPostScheduling followUpPost)
    : platform_(std::move(platform)),
      followUpPost_(std::move(followUpPost)),
      agent_(std::move(agent)) {}

QAXPairedDevicesMonitor::~QAXPairedDevicesMonitor() {
    if (!platform_->notifications) {
        return;
    }
    for (std::int32_t token : {pairNotifyToken_, unpairNotifyToken_}) {
        if (token != 0) {
            platform_->notifications->cancelRegistration(token);
        }
    }
}

std::shared_ptr<QAXAgentProtocol> QAXPairedDevicesMonitor::agent() const {
    std::lock_guard lock(threadLock_);
    return agent_;
}

void QAXPairedDevicesMonitor::setAgent(std::shared_ptr<QAXAgentProtocol> agent) {
    std::lock_guard lock(threadLock_);
    agent_ = std::move(agent);
}

bool QAXPairedDevicesMonitor::isExecuting() const {
    std::lock_guard lock(threadLock_);
    return isExecuting_;
}

void QAXPairedDevicesMonitor::start() {
    if (!platform_->notifications) {
        return;
    }
    std::weak_ptr<QAXPairedDevicesMonitor> weak = weak_from_this();
    auto handler = [weak] {
        if (auto self = weak.lock()) {
            self->_pairedOrActiveDevicesDidChange();
        }
    };
    auto mainQueue = platform_->dispatcher->mainQueue();
    pairNotifyToken_ = platform_->notifications->registerForNotification(
        kPairedDeviceDidPairNotification, mainQueue, handler);
    unpairNotifyToken_ = platform_->notifications->registerForNotification(
        kPairedDeviceDidUnpairNotification, mainQueue, handler);
}

void QAXPairedDevicesMonitor::updatePariedDevicesFollowUp() {
    qaxLog().info("%s: launched with a pairing event",
                  "-[QAXPairedDevicesMonitor updatePariedDevicesFollowUp]");
    _updatePariedDevicesFollowUp();
}

void QAXPairedDevicesMonitor::_pairedOrActiveDevicesDidChange() {
    qaxLog().info("%s", "-[QAXPairedDevicesMonitor _pairedOrActiveDevicesDidChange:]");
    _updatePariedDevicesFollowUp();
}

void QAXPairedDevicesMonitor::_updatePariedDevicesFollowUp() {
    std::shared_ptr<QAXAgentProtocol> agent;
    {
        // Test and set in one step: a notification and a launch event for one pairing may
        // arrive together on two threads.
        std::lock_guard lock(threadLock_);
        if (isExecuting_) {
            agent = nullptr;
        } else {
            agent = agent_;
            isExecuting_ = agent != nullptr;
            if (!agent) {
                return;
            }
        }
    }
    if (!agent) {
        qaxLog().info("Already executing with a pairing event");
        return;
    }
    std::weak_ptr<QAXPairedDevicesMonitor> weak = weak_from_this();
    auto followUpPost = followUpPost_;
    agent->getAllDeviceInfosUsingPolicy(
        QAXWarrantyPolicyDefault, true, [weak, followUpPost](DeviceInfoList deviceInfos) {
            qaxLog().info(
                "Devices followups to be posted, if required, after paired device change");
            const auto date = followUpPost.nextFollowUpPostDate
                                  ? followUpPost.nextFollowUpPostDate(deviceInfos)
                                  : std::nullopt;
            if (date) {
                qaxLog().info(
                    "Found a new followup post date trigerred after a pairing event. Schedule "
                    "followUp post for: %@",
                    *date);
                if (followUpPost.scheduleFollowUpPost) {
                    followUpPost.scheduleFollowUpPost(*date);
                }
            } else {
                qaxLog().info("No new followUp post date found after the pairing event.");
            }
            if (auto self = weak.lock()) {
                std::lock_guard lock(self->threadLock_);
                self->isExecuting_ = false;
            }
        });
}

}  // namespace qax
