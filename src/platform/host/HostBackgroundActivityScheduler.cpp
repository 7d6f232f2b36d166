#include "platform/host/HostBackgroundActivityScheduler.h"

#include <algorithm>
#include <cmath>
#include <cstdlib>
#include <filesystem>

#include "core/AtomicFile.h"
#include "core/Log.h"
#include "platform/DeviceProperties.h"
#include "platform/ProcessLifecycle.h"
#include "platform/SystemNotificationCenter.h"
#include "platform/host/HostNetworkState.h"
#include "platform/host/SimulatedClock.h"

namespace qax {
namespace {

// Two fires of one identifier are at least this far apart on the platform clock, so a run
// that keeps scheduling itself in the past cannot spin.
constexpr double kMinimumFireSpacing = 60;
constexpr double kFirstRetryDelay = 5;
constexpr double kMaximumRetryDelay = 6 * 3600;
// How often an activity that waits only for the network checks it again.
constexpr double kNetworkRecheckInterval = 10;
// Timers are real-time delays computed from platform-clock due times; looking again at least
// this often bounds the error when the host's wall clock is set.
constexpr double kMaximumTimerDelay = 300;
// A timer may come due a hair before the due time it was computed from.
constexpr double kDueTolerance = 0.001;

// One handle on an identifier's activity. Its settings apply when it schedules; the activity
// itself (criteria, handler, registration) lives in the scheduler.
class HostBackgroundActivity : public BackgroundActivity {
  public:
    HostBackgroundActivity(std::weak_ptr<HostBackgroundActivityScheduler> scheduler,
                           std::string identifier, std::uint64_t owner)
        : scheduler_(std::move(scheduler)), identifier_(std::move(identifier)), owner_(owner) {}

    const std::string& identifier() const override { return identifier_; }
    void setPreregistered(bool preregistered) override {
        std::lock_guard lock(mutex_);
        preregistered_ = preregistered;
    }
    // A one-shot activity is all the agent asks for; the quality of service changes nothing
    // on the host.
    void setRepeats(bool) override {}
    void setQualityOfService(QualityOfService) override {}
    void setCriteria(const ActivityCriteria& criteria) override {
        std::lock_guard lock(mutex_);
        criteria_ = criteria;
    }
    void scheduleWithBlock(
        std::function<void(std::function<void(ActivityResult)> completion)> handler) override {
        auto scheduler = scheduler_.lock();
        if (!scheduler || !handler) {
            return;
        }
        bool preregistered;
        ActivityCriteria criteria;
        {
            std::lock_guard lock(mutex_);
            preregistered = preregistered_;
            criteria = criteria_;
        }
        if (preregistered) {
            scheduler->attach(owner_, identifier_, std::move(handler));
        } else {
            scheduler->schedule(owner_, identifier_, criteria, std::move(handler));
        }
    }
    void invalidate() override {
        if (auto scheduler = scheduler_.lock()) {
            scheduler->invalidate(owner_, identifier_);
        }
    }
    bool shouldDefer() override {
        auto scheduler = scheduler_.lock();
        return scheduler && scheduler->shouldDefer();
    }

  private:
    const std::weak_ptr<HostBackgroundActivityScheduler> scheduler_;
    const std::string identifier_;
    const std::uint64_t owner_;
    std::mutex mutex_;
    bool preregistered_ = false;
    ActivityCriteria criteria_;
};

// QAX_BOOT_ID, when set, stands in for the kernel's boot id, so that a test or a demo can
// present a new boot to a restarted agent without rebooting the machine.
std::string readBootId(const std::string& path) {
    if (const char* presented = std::getenv("QAX_BOOT_ID"); presented && *presented) {
        return presented;
    }
    auto text = readWholeFile(path, 4096).value_or("");
    while (!text.empty() && std::isspace(static_cast<unsigned char>(text.back()))) {
        text.pop_back();
    }
    return text;
}

void clearRegistration(ActivityRecord& record) {
    record.dueDate.reset();
    record.scheduledAt.reset();
    record.delay = 0;
    record.gracePeriod = 0;
    record.deferrals = 0;
}

}  // namespace

HostBackgroundActivityScheduler::HostBackgroundActivityScheduler(std::weak_ptr<Platform> platform,
                                                                 Options options)
    : platform_(std::move(platform)),
      options_(std::move(options)),
      launch_(HostActivityLaunchConfiguration::load(options_.shareDirectory)) {
    for (auto& [identifier, record] : HostActivityRegistry::load(options_.platformRoot)) {
        Slot& slot = slots_[identifier];
        slot.record = record;
        if (record.pending() && record.deferrals > 0 && record.lastFired) {
            slot.retryAt = record.lastFired->byAdding(retryDelay(record.deferrals));
        }
    }
    triggers_ = HostActivityTriggerRecord::load(options_.platformRoot);
}

HostBackgroundActivityScheduler::~HostBackgroundActivityScheduler() {
    auto platform = platform_.lock();
    if (platform && platform->notifications && clockRegistration_ != 0) {
        platform->notifications->cancelRegistration(clockRegistration_);
    }
}

std::string HostBackgroundActivityScheduler::deferPath(const std::string& platformRoot) {
    return (std::filesystem::path(platformRoot) / "state" / "defer").string();
}

double HostBackgroundActivityScheduler::retryDelay(std::int64_t deferrals) {
    if (deferrals <= 1) {
        return kFirstRetryDelay;
    }
    return std::min(kMaximumRetryDelay,
                    kFirstRetryDelay * std::pow(2.0, static_cast<double>(deferrals - 1)));
}

std::shared_ptr<BackgroundActivity> HostBackgroundActivityScheduler::activityWithIdentifier(
    const std::string& identifier) {
    return std::make_shared<HostBackgroundActivity>(weak_from_this(), identifier, nextOwner_++);
}

bool HostBackgroundActivityScheduler::shouldDefer() const {
    std::error_code ec;
    return std::filesystem::exists(deferPath(options_.platformRoot), ec);
}

void HostBackgroundActivityScheduler::attach(std::uint64_t owner, const std::string& identifier,
                                             Handler handler) {
    auto platform = platform_.lock();
    if (!platform) {
        return;
    }
    {
        std::lock_guard lock(mutex_);
        Slot& slot = slots_[identifier];
        slot.handler = std::move(handler);
        slot.handlerOwner = owner;
        if (!slot.triggersChecked) {
            slot.triggersChecked = true;
            checkLaunchTriggersLocked(identifier, slot, platform->clock->now(), *platform);
        }
        qaxLog().debug("Activity '%@' attached to its launch configuration; pending: %@",
                       identifier, slot.record.dueDate);
    }
    startWatching();
    postEvaluate();
}

void HostBackgroundActivityScheduler::schedule(std::uint64_t owner, const std::string& identifier,
                                               const ActivityCriteria& criteria, Handler handler) {
    auto platform = platform_.lock();
    if (!platform) {
        return;
    }
    {
        std::lock_guard lock(mutex_);
        Slot& slot = slots_[identifier];
        slot.handler = std::move(handler);
        slot.handlerOwner = owner;
        // A due date the registry file cannot store would keep every other registration from
        // being persisted: such a delay ends at the last storable date.
        const Date now = platform->clock->now();
        const auto maximumDelay = std::max<std::int64_t>(
            0, static_cast<std::int64_t>(
                   std::floor(HostActivityRegistry::kLatestDate.timeIntervalSince(now))));
        register_(slot, now, std::clamp<std::int64_t>(criteria.delaySeconds, 0, maximumDelay),
                  std::clamp<std::int64_t>(criteria.gracePeriodSeconds, 0, maximumDelay),
                  criteria.requiresNetwork, false, owner);
        saveLocked();
        qaxLog().info(
            "Activity '%@' scheduled for %@ (delay %ld s, grace period %ld s, network %d)",
            identifier, slot.record.dueDate, slot.record.delay, slot.record.gracePeriod,
            slot.record.requiresNetwork);
    }
    startWatching();
    postEvaluate();
}

void HostBackgroundActivityScheduler::invalidate(std::uint64_t owner,
                                                 const std::string& identifier) {
    std::lock_guard lock(mutex_);
    auto it = slots_.find(identifier);
    if (it == slots_.end()) {
        return;
    }
    Slot& slot = it->second;
    if (slot.handlerOwner == owner) {
        slot.handler = nullptr;
        slot.handlerOwner = 0;
    }
    if (slot.registrationOwner == owner && slot.record.pending() && !slot.running) {
        clearRegistration(slot.record);
        slot.retryAt.reset();
        slot.registrationOwner = 0;
        saveLocked();
    }
}

void HostBackgroundActivityScheduler::reevaluate() {
    postEvaluate();
}

void HostBackgroundActivityScheduler::register_(Slot& slot, Date now, std::int64_t delay,
                                                std::int64_t gracePeriod, bool requiresNetwork,
                                                bool preregistered, std::uint64_t owner) {
    ActivityRecord& r = slot.record;
    r.preregistered = preregistered;
    r.delay = delay;
    r.gracePeriod = gracePeriod;
    r.requiresNetwork = requiresNetwork;
    r.scheduledAt = now;
    r.dueDate = now.byAdding(static_cast<double>(delay));
    r.deferrals = 0;
    slot.retryAt.reset();
    slot.generation++;
    slot.registrationOwner = owner;
}

void HostBackgroundActivityScheduler::checkLaunchTriggersLocked(const std::string& identifier,
                                                                Slot& slot, Date now,
                                                                Platform& platform) {
    auto config = launch_.find(identifier);
    if (config == launch_.end()) {
        return;
    }
    TriggerRecord& seen = triggers_[identifier];
    std::string reason;
    if (config->second.trigger == LaunchActivity::Trigger::Boot) {
        const std::string bootId = readBootId(options_.bootIdPath);
        if (bootId.empty()) {
            qaxLog().error("Cannot read the boot id from '%@'; activity '%@' does not fire",
                           options_.bootIdPath, identifier);
            return;
        }
        if (seen.bootId == bootId) {
            return;
        }
        seen.bootId = bootId;
        reason = "boot " + bootId;
    } else if (config->second.trigger == LaunchActivity::Trigger::Upgrade) {
        auto version = platform.deviceProperties
                           ? platform.deviceProperties->copyDeviceProperty("ProductVersion")
                           : std::nullopt;
        const std::string text =
            version ? (version->isString() ? *version->asString() : version->description()) : "";
        auto& versions = seen.productVersions;
        if (std::find(versions.begin(), versions.end(), text) != versions.end()) {
            return;
        }
        versions.push_back(text);
        reason = "system version '" + text + "'";
    } else {
        return;
    }
    register_(slot, now, 0, 0, config->second.requiresNetwork, true, 0);
    std::string error;
    if (!HostActivityTriggerRecord::save(options_.platformRoot, triggers_, &error)) {
        qaxLog().error("Cannot record the launch triggers: %@", error);
    }
    saveLocked();
    qaxLog().info("Activity '%@' triggered by %@", identifier, reason);
}

void HostBackgroundActivityScheduler::evaluate() {
    auto platform = platform_.lock();
    if (!platform) {
        return;
    }
    std::vector<Fire> fires;
    {
        std::lock_guard lock(mutex_);
        const Date now = platform->clock->now();
        std::optional<Date> wake;
        auto wakeAt = [&](Date at) { wake = wake ? std::min(*wake, at) : at; };
        std::optional<bool> network;
        bool changed = false;
        for (auto& [identifier, slot] : slots_) {
            if (!slot.handler || slot.running) {
                continue;
            }
            auto config = launch_.find(identifier);
            if (!slot.record.pending() && config != launch_.end() &&
                config->second.trigger == LaunchActivity::Trigger::Interval &&
                config->second.interval > 0) {
                const Date next = slot.record.lastFired
                                      ? slot.record.lastFired->byAdding(config->second.interval)
                                      : now;
                if (next.timeIntervalSince(now) > kDueTolerance) {
                    wakeAt(next);
                    continue;
                }
                register_(slot, now, 0, 0, config->second.requiresNetwork, true, 0);
                changed = true;
                qaxLog().info("Activity '%@' triggered by its interval of %.02f s", identifier,
                              config->second.interval);
            }
            if (!slot.record.pending()) {
                continue;
            }
            Date eligible = *slot.record.dueDate;
            if (slot.retryAt) {
                eligible = std::max(eligible, *slot.retryAt);
            }
            if (slot.record.lastFired) {
                eligible = std::max(eligible, slot.record.lastFired->byAdding(kMinimumFireSpacing));
            }
            if (eligible.timeIntervalSince(now) > kDueTolerance) {
                wakeAt(eligible);
                continue;
            }
            if (slot.record.requiresNetwork) {
                if (!network) {
                    network = options_.networkAvailable ? options_.networkAvailable()
                                                        : HostNetworkState::available();
                }
                if (!*network) {
                    wakeAt(now.byAdding(kNetworkRecheckInterval));
                    continue;
                }
            }
            slot.running = true;
            slot.runId++;
            slot.runGeneration = slot.generation;
            slot.runResult.reset();
            slot.record.lastFired = now;
            if (platform->lifecycle) {
                slot.transaction = platform->lifecycle->beginTransaction("activity " + identifier);
            }
            fires.push_back({identifier, slot.runId, slot.handler});
            changed = true;
        }
        if (changed) {
            saveLocked();
        }
        armTimerLocked(*platform, wake ? std::optional<double>(std::clamp(
                                             wake->timeIntervalSince(now), 0.0, kMaximumTimerDelay))
                                       : std::nullopt);
    }
    std::weak_ptr<HostBackgroundActivityScheduler> weak = weak_from_this();
    for (auto& fire : fires) {
        qaxLog().info("Firing activity '%@'", fire.identifier);
        fire.handler([weak, identifier = fire.identifier, runId = fire.runId](ActivityResult r) {
            if (auto self = weak.lock()) {
                self->complete(identifier, runId, r);
            }
        });
    }
}

void HostBackgroundActivityScheduler::complete(const std::string& identifier, std::uint64_t runId,
                                               ActivityResult result) {
    auto platform = platform_.lock();
    if (!platform) {
        return;
    }
    std::shared_ptr<void> transaction;
    {
        std::lock_guard lock(mutex_);
        auto it = slots_.find(identifier);
        if (it == slots_.end() || it->second.runId != runId) {
            return;
        }
        Slot& slot = it->second;
        const bool sameRegistration = slot.generation == slot.runGeneration;
        if (slot.runResult) {
            // A run that reported a deferral and then finished after all: its registration is
            // done, unless a newer one replaced it.
            if (result == ActivityResult::Finished && *slot.runResult == ActivityResult::Deferred &&
                sameRegistration && slot.record.pending()) {
                clearRegistration(slot.record);
                slot.retryAt.reset();
                slot.record.lastResult = static_cast<std::int64_t>(result);
                saveLocked();
                qaxLog().info("Activity '%@' finished after deferring; its registration is removed",
                              identifier);
            } else {
                qaxLog().info("Activity '%@' reported %ld again for one run; ignored", identifier,
                              static_cast<std::int64_t>(result));
            }
            return;
        }
        slot.runResult = result;
        slot.running = false;
        transaction = std::move(slot.transaction);
        slot.record.lastResult = static_cast<std::int64_t>(result);
        // The registry is saved before the outcome is logged, so that whoever reads the log
        // (qaxctl, a test) finds the file already saying so.
        if (!sameRegistration) {
            saveLocked();
            qaxLog().info("Activity '%@' reported %ld; it was scheduled again during the run",
                          identifier, static_cast<std::int64_t>(result));
        } else if (result == ActivityResult::Finished) {
            clearRegistration(slot.record);
            slot.retryAt.reset();
            saveLocked();
            qaxLog().info("Activity '%@' finished", identifier);
        } else if (slot.record.pending()) {
            slot.record.deferrals++;
            const double wait = retryDelay(slot.record.deferrals);
            slot.retryAt = platform->clock->now().byAdding(wait);
            saveLocked();
            qaxLog().info("Activity '%@' deferred (%ld times); retrying in %.02f s", identifier,
                          slot.record.deferrals, wait);
        } else {
            saveLocked();
        }
    }
    postEvaluate();
}

void HostBackgroundActivityScheduler::saveLocked() {
    HostActivityRegistry::Records records;
    for (const auto& [identifier, slot] : slots_) {
        const ActivityRecord& r = slot.record;
        if (r.pending() || r.lastFired || r.lastResult) {
            records[identifier] = r;
        }
    }
    std::string error;
    if (!HostActivityRegistry::save(options_.platformRoot, records, &error)) {
        qaxLog().error("Cannot write the activity registry: %@", error);
    }
}

void HostBackgroundActivityScheduler::postEvaluate() {
    auto platform = platform_.lock();
    if (!platform) {
        return;
    }
    std::weak_ptr<HostBackgroundActivityScheduler> weak = weak_from_this();
    platform->dispatcher->mainQueue()->post([weak] {
        if (auto self = weak.lock()) {
            self->evaluate();
        }
    });
}

void HostBackgroundActivityScheduler::armTimerLocked(Platform& platform,
                                                     std::optional<double> delay) {
    // A newer timer makes every earlier one a no-op.
    const std::uint64_t token = ++timerToken_;
    if (!delay) {
        return;
    }
    std::weak_ptr<HostBackgroundActivityScheduler> weak = weak_from_this();
    platform.dispatcher->mainQueue()->postDelayed(
        [weak, token] {
            auto self = weak.lock();
            if (!self) {
                return;
            }
            {
                std::lock_guard lock(self->mutex_);
                if (token != self->timerToken_) {
                    return;
                }
            }
            self->evaluate();
        },
        *delay);
}

void HostBackgroundActivityScheduler::startWatching() {
    if (watching_.exchange(true)) {
        return;
    }
    auto platform = platform_.lock();
    if (!platform || !platform->notifications) {
        return;
    }
    std::weak_ptr<HostBackgroundActivityScheduler> weak = weak_from_this();
    const std::int32_t token = platform->notifications->registerForNotification(
        kClockChangedNotification, platform->dispatcher->mainQueue(), [weak] {
            auto self = weak.lock();
            if (!self) {
                return;
            }
            if (self->options_.clockChanged) {
                self->options_.clockChanged();
            }
            if (auto p = self->platform_.lock()) {
                qaxLog().info("Platform clock changed; it is now %@", p->clock->now());
            }
            self->evaluate();
        });
    std::lock_guard lock(mutex_);
    clockRegistration_ = token;
}

}  // namespace qax
