#include "followup/QAXFollowUpRefresh.h"

#include <utility>

#include "agent/QAXAgentProtocol.h"
#include "core/Log.h"
#include "platform/AgentFactory.h"
#include "platform/Platform.h"
#include "platform/PreferenceStore.h"
#include "platform/QAXSettings.h"
#include "scheduling/QAXScheduler.h"
#include "warranty/QAXWarranty.h"

namespace qax {
namespace {

constexpr const char* kRefreshCallingProcess = "com.velmora.qaxagent.followuprefresh";

// Seconds from now to `date`; a missing date counts as now.
double intervalFromNow(const std::optional<Date>& date, Date now) {
    return date ? date->timeIntervalSince(now) : 0.0;
}

}  // namespace

QAXFollowUpRefresh::QAXFollowUpRefresh(std::shared_ptr<Platform> platform)
    : platform_(std::move(platform)) {}

void QAXFollowUpRefresh::performActivityForScheduler(const std::shared_ptr<QAXScheduler>&,
                                                     Completion completion) {
    auto agent = platform_->agentFactory
                     ? platform_->agentFactory->makeAgent(kRefreshCallingProcess)
                     : nullptr;
    if (!agent) {
        qaxLog().info("Unable to load device info for followup refresh, defer");
        completion(QAXActivityResultDeferred);
        return;
    }
    auto self = shared_from_this();
    agent->getAllDeviceInfosUsingPolicy(
        QAXWarrantyPolicyCachedOnly, false,
        [self, agent, completion = std::move(completion)](QAXDeviceInfoList deviceInfos) {
            const Platform& platform = *self->platform_;
            QAXDeviceInfoList updated =
                QAXFollowUp(self->platform_).refreshFollowupWithDeviceInfos(deviceInfos);
            if (!updated.empty()) {
                qaxLog().info("Followup present, schedule refresh for %@",
                              logDescriptionOfList(updated));
                // Over the shown items only: an offer still to be posted is the post
                // activity's to schedule.
                const auto next = nextFollowUpRefreshDateWithDevicesInfo(platform, updated, true);
                qaxLog().info("Schedule next refresh for %@", next);
                QAXScheduler::newSchedulerWithActivityDelegate(self->platform_, self)
                    ->scheduleActivityForDate(next);
            } else {
                qaxLog().info("No followups present, don't schedule another refresh");
            }
            completion(QAXActivityResultFinished);
        });
}

std::optional<Date> QAXFollowUpRefresh::nextFollowUpRefreshDateWithDevicesInfo(
    const Platform& platform, const QAXDeviceInfoList& deviceInfos, bool isInitialCall) {
    const Date now = platform.clock->now();
    const double oneDay = platform.preferences->doubleForKey(settings::kOneDayInterval);
    std::optional<Date> result;
    if (!isInitialCall) {
        result = now.byAdding(oneDay);
    }
    for (const auto& info : deviceInfos) {
        const std::shared_ptr<QAXWarranty> warranty = info ? info->warranty() : nullptr;
        if (warranty && warranty->hvOfferDisplay()) {
            // The day count left after the next drop; an ended offer (0 days) wraps around to
            // the largest count, which puts the candidate far in the past.
            const std::uint32_t stepDays = warranty->daysEligible() - 1u;
            const double offset = oneDay * static_cast<double>(stepDays);
            const std::optional<Date> until = warranty->hvOfferEligibleUntil();
            if (offset > 0) {
                const auto& device = info->device();
                const std::optional<Date> activation =
                    device ? device->activationDate() : std::nullopt;
                std::optional<Date> start = activation;
                if (const auto display = warranty->hvOfferFollowupDisplayDate()) {
                    start = activation.value_or(now) > *display ? activation : display;
                }
                std::optional<Date> candidate;
                if (until) {
                    candidate = until->byAdding(-offset);
                }
                if (intervalFromNow(candidate, now) < intervalFromNow(result, now) ||
                    (!result && start && intervalFromNow(start, now) < 0)) {
                    result = candidate;
                }
                if (start && intervalFromNow(start, now) > 0 && (!result || *start < *result)) {
                    result = start;
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
