// The platform's background activities on the host: one activity per identifier, whose latest
// scheduling replaces the earlier criteria and handler, persisted in state/activities.plist so
// that a pending registration fires after a restart once its handler is attached again.
// Pre-registered activities come from the launch configuration (share/activities.plist):
// "boot" fires once per boot id, "upgrade" once per new ProductVersion, "interval" every
// Interval seconds. Fires happen on the main queue when the platform clock reaches the due
// time, the network requirement holds and no run of the identifier is outstanding; a deferred
// run is retried after 5 s, doubling, at most 6 h; two fires of one identifier are at least
// 60 s apart on the platform clock. Thread-safe: one mutex guards the state; handlers are
// called on the main queue without it.
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/BackgroundActivityScheduler.h"
#include "platform/Platform.h"
#include "platform/host/HostActivityLaunchConfiguration.h"
#include "platform/host/HostActivityRegistry.h"
#include "platform/host/HostActivityTriggerRecord.h"

namespace qax {

class HostBackgroundActivityScheduler
    : public BackgroundActivityScheduler,
      public std::enable_shared_from_this<HostBackgroundActivityScheduler> {
  public:
    using Handler = std::function<void(std::function<void(ActivityResult)> completion)>;

    struct Options {
        std::string platformRoot;
        std::string shareDirectory;
        std::string bootIdPath = "/proc/sys/kernel/random/boot_id";
        // Whether an activity that requires the network may run; HostNetworkState by default.
        std::function<bool()> networkAvailable;
        // Run when the clock-changed notification arrives, before the activities are looked at
        // again (the simulated clock re-reads its offset here).
        std::function<void()> clockChanged;
    };

    // The platform's services are read through `platform` when needed (it owns this object).
    HostBackgroundActivityScheduler(std::weak_ptr<Platform> platform, Options options);
    ~HostBackgroundActivityScheduler() override;

    std::shared_ptr<BackgroundActivity> activityWithIdentifier(
        const std::string& identifier) override;

    // Looks at every activity again (after a clock jump or a network change). Any thread; the
    // work runs on the main queue.
    void reevaluate();
    bool shouldDefer() const;

    static std::string deferPath(const std::string& platformRoot);
    // Wait before the retry that follows the `deferrals`-th deferred result.
    static double retryDelay(std::int64_t deferrals);

    // Used by the activity objects this scheduler hands out.
    void attach(std::uint64_t owner, const std::string& identifier, Handler handler);
    void schedule(std::uint64_t owner, const std::string& identifier,
                  const ActivityCriteria& criteria, Handler handler);
    void invalidate(std::uint64_t owner, const std::string& identifier);

  private:
    struct Slot {
        ActivityRecord record;
        Handler handler;
        std::uint64_t handlerOwner = 0;
        // Bumped by every registration, so a run can tell whether it was scheduled again.
        std::uint64_t generation = 0;
        std::uint64_t registrationOwner = 0;
        std::optional<Date> retryAt;
        bool triggersChecked = false;
        bool running = false;
        std::uint64_t runId = 0;
        std::uint64_t runGeneration = 0;
        std::optional<ActivityResult> runResult;
        std::shared_ptr<void> transaction;
    };
    struct Fire {
        std::string identifier;
        std::uint64_t runId;
        Handler handler;
    };

    void evaluate();
    void complete(const std::string& identifier, std::uint64_t runId, ActivityResult result);
    void register_(Slot& slot, Date now, std::int64_t delay, std::int64_t gracePeriod,
                   bool requiresNetwork, bool preregistered, std::uint64_t owner);
    void checkLaunchTriggersLocked(const std::string& identifier, Slot& slot, Date now,
                                   Platform& platform);
    void saveLocked();
    void postEvaluate();
    void armTimerLocked(Platform& platform, std::optional<double> delay);
    void startWatching();

    const std::weak_ptr<Platform> platform_;
    const Options options_;
    const std::map<std::string, LaunchActivity> launch_;
    mutable std::mutex mutex_;
    std::map<std::string, Slot> slots_;
    HostActivityTriggerRecord::Records triggers_;
    std::uint64_t timerToken_ = 0;
    std::atomic<std::uint64_t> nextOwner_{1};
    std::atomic<bool> watching_{false};
    std::int32_t clockRegistration_ = 0;
};

}  // namespace qax
