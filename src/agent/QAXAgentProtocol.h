// The agent's request surface: what clients reach over IPC and what the monitors and
// activities call in-process. Every reply is called exactly once, on whatever thread the
// operation finishes on; callers hop to their own queue when they care.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "agent/QAXWarrantyPolicy.h"
#include "core/Value.h"
#include "devices/QAXDevice.h"
#include "devices/QAXDeviceInfo.h"

namespace qax {

using QAXBoolReply = std::function<void(bool)>;
using QAXDeviceReply = std::function<void(std::shared_ptr<QAXDevice>)>;
using QAXDeviceListReply = std::function<void(std::vector<std::shared_ptr<QAXDevice>>)>;
using QAXDeviceInfoReply = std::function<void(std::shared_ptr<QAXDeviceInfo>)>;
using QAXDeviceInfoListReply = std::function<void(std::vector<std::shared_ptr<QAXDeviceInfo>>)>;

class QAXAgentProtocol {
  public:
    virtual ~QAXAgentProtocol() = default;

    // 1. "scheduleOutreachWithReply:": outreach with no delay; always true.
    virtual void scheduleOutreach(QAXBoolReply reply) = 0;
    // 2. "scheduleOutreachAfter:withReply:": outreach after `delay` seconds; always true.
    virtual void scheduleOutreachAfter(double delay, QAXBoolReply reply) = 0;
    // 3. "velmoraAccountAddedWithReply:": false only before the first post-upgrade run.
    virtual void velmoraAccountAdded(QAXBoolReply reply) = 0;
    // 4. "checkIsAvailableInStore:withReply:": the store listing of an application, or none.
    virtual void checkIsAvailableInStore(
        const std::string& bundleIdentifier,
        std::function<void(std::optional<Value::Dictionary>)> reply) = 0;
    // 5. "appSupportAvailability:withReply:": whether the support application is available.
    virtual void appSupportAvailability(const std::string& argument,
                                        std::function<void(Value::Dictionary)> reply) = 0;
    // 6. "readWebURLOverride:": the web flow override on internal builds, else none. A missing
    // reply is tolerated.
    virtual void readWebURLOverride(std::function<void(std::optional<Value>)> reply) = 0;
    // 7. "defaultDevice:".
    virtual void defaultDevice(QAXDeviceReply reply) = 0;
    // 8. "pairedDevices:": the paired devices in no defined order.
    virtual void pairedDevices(QAXDeviceListReply reply) = 0;
    // 9. "getDefaultDeviceInfoUsingPolicy:withReply:".
    virtual void getDefaultDeviceInfoUsingPolicy(QAXWarrantyPolicy policy,
                                                 QAXDeviceInfoReply reply) = 0;
    // 10. "getDeviceInfoForSerialNumber:usingPolicy:withReply:".
    virtual void getDeviceInfoForSerialNumber(const std::string& serialNumber,
                                              QAXWarrantyPolicy policy,
                                              QAXDeviceInfoReply reply) = 0;
    // 11. "getAllDeviceInfosUsingPolicy:updateFollowUps:withReply:".
    virtual void getAllDeviceInfosUsingPolicy(QAXWarrantyPolicy policy, bool updateFollowUps,
                                              QAXDeviceInfoListReply reply) = 0;
    // 12. "dismissFollowUpForSerialNumber:completion:": always true.
    virtual void dismissFollowUpForSerialNumber(const std::string& serialNumber,
                                                QAXBoolReply completion) = 0;
    // 13. "dismissNotificationForSerialNumber:completion:": always true.
    virtual void dismissNotificationForSerialNumber(const std::string& serialNumber,
                                                    QAXBoolReply completion) = 0;
};

}  // namespace qax
