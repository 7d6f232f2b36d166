// Refreshes all warranties and follow-ups when a watch is paired or unpaired, and schedules the
// next follow-up post when the new device set calls for one. One refresh at a time: an event
// that arrives while one runs is dropped, not queued. The notification handlers run on the main
// queue, the launch-event handler calls in from its own queue; one mutex guards the executing
// flag and is never held across a call out of the monitor.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <vector>

#include "agent/QAXAgentProtocol.h"
#include "core/Date.h"

namespace qax {

struct Platform;

class QAXPairedDevicesMonitor : public std::enable_shared_from_this<QAXPairedDevicesMonitor> {
  public:
    using DeviceInfoList = std::vector<std::shared_ptr<QAXDeviceInfo>>;
    // What the follow-up layer knows and this layer may not name: the next follow-up post date
    // for a set of device infos, and the scheduling of the post activity for a date.
    struct FollowUpPostScheduling {
        std::function<std::optional<Date>(const DeviceInfoList&)> nextFollowUpPostDate;
        std::function<void(Date)> scheduleFollowUpPost;
    };

    QAXPairedDevicesMonitor(std::shared_ptr<Platform> platform,
                            std::shared_ptr<QAXAgentProtocol> agent,
                            FollowUpPostScheduling followUpPost);
    ~QAXPairedDevicesMonitor();

    // Registers for the registry's pair and unpair notifications, delivered on the main queue.
    void start();
    // The launch-event handler's entry.
    void updatePariedDevicesFollowUp();
    void _pairedOrActiveDevicesDidChange();
    void _updatePariedDevicesFollowUp();

    std::shared_ptr<QAXAgentProtocol> agent() const;
    void setAgent(std::shared_ptr<QAXAgentProtocol> agent);
    bool isExecuting() const;

  private:
    const std::shared_ptr<Platform> platform_;
    const FollowUpPostScheduling followUpPost_;
    mutable std::mutex threadLock_;
    bool isExecuting_ = false;
    std::int32_t pairNotifyToken_ = 0;
    std::int32_t unpairNotifyToken_ = 0;
    std::shared_ptr<QAXAgentProtocol> agent_;
};

}  // namespace qax
