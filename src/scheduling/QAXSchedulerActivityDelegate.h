// The interface of every scheduled activity of the agent: its identifier (which names both the
// platform activity and the persisted target date), whether it needs the network, and one run.
// A run may call its completion from any thread, exactly once.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

namespace qax {

class QAXScheduler;

// Activity results, as the platform reads them.
inline constexpr std::int64_t QAXActivityResultFinished = 1;
inline constexpr std::int64_t QAXActivityResultDeferred = 2;

// The six activities.
inline constexpr const char* kQAXPostUpgradeActivityIdentifier = "com.velmora.qaxagent.upgrade";
inline constexpr const char* kQAXPostBootActivityIdentifier = "com.velmora.qaxagent.boot";
inline constexpr const char* kQAXOutreachActivityIdentifier = "com.velmora.qaxagent.outreach";
inline constexpr const char* kQAXFollowUpPostActivityIdentifier =
    "com.velmora.qaxagent.followuppost";
inline constexpr const char* kQAXConversionOutreachActivityIdentifier =
    "com.velmora.qaxagent.conversionoutreach";
inline constexpr const char* kQAXFollowUpRefreshActivityIdentifier =
    "com.velmora.qaxagent.followuprefresh";

class QAXSchedulerActivityDelegate {
  public:
    using Completion = std::function<void(std::int64_t result)>;

    virtual ~QAXSchedulerActivityDelegate() = default;
    virtual std::string identifier() const = 0;
    virtual bool requiresNetwork() const = 0;
    // One run. `scheduler` is the scheduler whose activity fired (its shouldDefer() answers
    // whether the platform asks the run to stop); `completion` takes QAXActivityResultFinished
    // or QAXActivityResultDeferred.
    virtual void performActivityForScheduler(const std::shared_ptr<QAXScheduler>& scheduler,
                                             Completion completion) = 0;
};

}  // namespace qax
