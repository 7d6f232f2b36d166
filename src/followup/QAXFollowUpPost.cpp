#include "followup/QAXFollowUpPost.h"

#include <algorithm>
#include <utility>

#include "agent/QAXAgentProtocol.h"
#include "core/Hash.h"
#include "core/Log.h"
#include "followup/QAXFollowUpRefresh.h"
#include "platform/AgentFactory.h"
#include "platform/Platform.h"
#include "platform/PreferenceStore.h"
#include "scheduling/QAXScheduler.h"
#include "warranty/QAXWarranty.h"

namespace qax {
namespace {

constexpr const char* kOperation =
    "-[QAXFollowUpPost performActivityForScheduler:withCompletionHandler:]";
constexpr const char* kPostCallingProcess = "com.velmora.qaxagent.followuppost";
constexpr const char* kFollowupPostedSerialNumberHashesKey = "FollowupPostedSerialNumberHashes";

double intervalFromNow(const std::optional<Date>& date, Date now) {
    return date ? date->timeIntervalSince(now) : 0.0;
}

bool wasPosted(PreferenceStore& preferences, const std::optional<std::string>& serialNumber) {
    if (!serialNumber) {
        return false;
    }
    const auto posted = preferences.arrayForKey(kFollowupPostedSerialNumberHashesKey);
    return posted && std::find(posted->begin(), posted->end(), Value(sha256Hash(*serialNumber))) !=
                         posted->end();
}

}  // namespace

// One run's result goes out once: `ended` is taken by whichever path reports first.
struct QAXFollowUpPost::Run {
    Completion completion;
    std::atomic<bool> ended{false};
};

QAXFollowUpPost::QAXFollowUpPost(std::shared_ptr<Platform> platform)
    : platform_(std::move(platform)) {}

std::shared_ptr<RepeatingTimer> QAXFollowUpPost::followUpPostTimer() const {
    std::lock_guard lock(timerMutex_);
    return followUpPostTimer_;
}

void QAXFollowUpPost::setFollowUpPostTimer(std::shared_ptr<RepeatingTimer> timer) {
    std::shared_ptr<RepeatingTimer> previous;
    std::lock_guard lock(timerMutex_);
    previous = std::exchange(followUpPostTimer_, std::move(timer));
}

void QAXFollowUpPost::performActivityForScheduler(const std::shared_ptr<QAXScheduler>& scheduler,
                                                  Completion completion) {
    setFollowUpPostInProgress(true);
    auto run = std::make_shared<Run>();
    run->completion = std::move(completion);

    std::weak_ptr<QAXFollowUpPost> weak = weak_from_this();
    setFollowUpPostTimer(
        RepeatingTimer::scheduledTimer(platform_->dispatcher->mainQueue(), deferralCheckInterval_,
                                       [weak, scheduler, run](RepeatingTimer& timer) {
                                           auto self = weak.lock();
                                           if (!self || !self->followUpPostInProgress() ||
                                               !scheduler || !scheduler->shouldDefer()) {
                                               return;
                                           }
                                           if (run->ended.exchange(true)) {
                                               return;
                                           }
                                           qaxLog().info("FollowUp Post activity deferred.");
                                           timer.invalidate();
                                           self->setFollowUpPostTimer(nullptr);
                                           self->setFollowUpPostInProgress(false);
                                           run->completion(QAXActivityResultDeferred);
                                       }));

    auto agent =
        platform_->agentFactory ? platform_->agentFactory->makeAgent(kPostCallingProcess) : nullptr;
    if (!agent) {
        handleDeviceInfos(run, std::nullopt);
        return;
    }
    auto self = shared_from_this();
    agent->getAllDeviceInfosUsingPolicy(QAXWarrantyPolicyForceDownload, false,
                                        [self, agent, run](QAXDeviceInfoList deviceInfos) {
                                            self->handleDeviceInfos(run, std::move(deviceInfos));
                                        });
}

void QAXFollowUpPost::handleDeviceInfos(const std::shared_ptr<Run>& run,
                                        const std::optional<QAXDeviceInfoList>& deviceInfos) {
    qaxLog().info("%s -> %@", kOperation,
                  deviceInfos ? logDescriptionOfList(*deviceInfos) : std::string("(null)"));
    if (!deviceInfos) {
        qaxLog().info("Unable to load devices info, defer");
        endRun(run, QAXActivityResultDeferred);
        return;
    }
    const bool posted = QAXFollowUp(platform_).postFollowUpWithDevicesInfo(*deviceInfos);
    if (const auto next = nextFollowUpPostDateWithDevicesInfo(*platform_, *deviceInfos)) {
        qaxLog().info("%s: Re-schedule followUp post for: %@", kOperation, *next);
        QAXScheduler::newSchedulerWithActivityDelegate(platform_, shared_from_this())
            ->scheduleActivityForDate(next);
    }
    if (posted) {
        const auto refresh = QAXFollowUpRefresh::nextFollowUpRefreshDateWithDevicesInfo(
            *platform_, *deviceInfos, true);
        qaxLog().info("%s: Schedule refresh for: %@", kOperation, refresh);
        QAXScheduler::newSchedulerWithActivityDelegate(
            platform_, std::make_shared<QAXFollowUpRefresh>(platform_))
            ->scheduleActivityForDate(refresh);
    }
    endRun(run, QAXActivityResultFinished);
}

void QAXFollowUpPost::endRun(const std::shared_ptr<Run>& run, std::int64_t result) {
    if (run->ended.exchange(true)) {
        // The deferral check ended this run already and reported it.
        return;
    }
    setFollowUpPostInProgress(false);
    if (auto timer = followUpPostTimer()) {
        timer->invalidate();
    }
    setFollowUpPostTimer(nullptr);
    run->completion(result);
}

std::optional<Date> QAXFollowUpPost::nextFollowUpPostDateWithDevicesInfo(
    const Platform& platform, const QAXDeviceInfoList& deviceInfos) {
    const Date now = platform.clock->now();
    std::optional<Date> result;
    for (const auto& info : deviceInfos) {
        const auto& device = info ? info->device() : nullptr;
        // Read afresh for each device: a post in another thread may just have added one.
        if (wasPosted(*platform.preferences, device ? device->serialNumber() : std::nullopt)) {
            continue;
        }
        const std::shared_ptr<QAXWarranty> warranty = info ? info->warranty() : nullptr;
        if (warranty && warranty->hvOfferDisplay()) {
            const std::optional<Date> until = warranty->hvOfferEligibleUntil();
            if (intervalFromNow(until, now) > 0) {
                const std::optional<Date> activation =
                    device ? device->activationDate() : std::nullopt;
                const std::optional<Date> display = warranty->hvOfferFollowupDisplayDate();
                const std::optional<Date> candidate =
                    display && !(activation.value_or(now) > *display) ? display : activation;
                if (candidate && intervalFromNow(candidate, now) > 0 &&
                    (!result || *candidate < *result)) {
                    result = candidate;
                }
            }
            if (intervalFromNow(until, now) < intervalFromNow(result, now)) {
                result = until;
            }
        }
        if (intervalFromNow(result, now) < 0) {
            break;
        }
    }
    return result;
}

}  // namespace qax
