#include "scheduling/QAXOutreachActivityUtilities.h"

#include <utility>
#include <vector>

#include "core/JoinCounter.h"
#include "core/Log.h"
#include "devices/QAXDevicesManager.h"
#include "platform/AgentFactory.h"
#include "platform/Platform.h"
#include "platform/TelephonyInfo.h"
#include "scheduling/QAXScheduler.h"
#include "warranty/QAXWarranty.h"

namespace qax {
namespace {

constexpr const char* kPerformOperation =
    "-[QAXOutreachActivityUtilities performOutreachActivityForConversion:withScheduler:"
    "andCompletion:]";
constexpr const char* kOutreachCallingProcess = "com.velmora.qaxagent.outreach";
constexpr const char* kConversionOutreachCallingProcess = "com.velmora.qaxagent.conversionoutreach";

std::string describeCarrier(const SubscriberCarrier& carrier) {
    return "<carrier mobileCountryCode: " + carrier.mobileCountryCode.value_or("(null)") +
           ", mobileNetworkCode: " + carrier.mobileNetworkCode.value_or("(null)") + ">";
}

std::string describeCarriers(const std::vector<SubscriberCarrier>& carriers) {
    std::string text = "(\n";
    for (std::size_t i = 0; i < carriers.size(); ++i) {
        text += "    " + describeCarrier(carriers[i]) + (i + 1 < carriers.size() ? ",\n" : "\n");
    }
    return text + ")";
}

bool toggleContains(const std::optional<Value>& toggle, const std::string& identifier) {
    const Value::Array* list = toggle ? toggle->asArray() : nullptr;
    if (!list) {
        return false;
    }
    for (const Value& entry : *list) {
        if (const std::string* text = entry.asString(); text && *text == identifier) {
            return true;
        }
    }
    return false;
}

}  // namespace

QAXOutreachActivityUtilities::QAXOutreachActivityUtilities(
    std::shared_ptr<Platform> platform, std::shared_ptr<QAXAgentDeviceProvider> devices,
    DownloadFactory downloads)
    : platform_(std::move(platform)),
      devices_(std::move(devices)),
      downloads_(std::move(downloads)) {
    if (!devices_) {
        // The devices manager keeps nothing between calls: one on this run's platform answers
        // as the process's shared one does.
        devices_ = std::make_shared<QAXDevicesManager>(platform_);
    }
    if (!downloads_) {
        downloads_ = [platform = platform_](const std::string& callingProcessBundleID) -> Download {
            auto downloader = QAXWarrantyDownloader::initWithCallingProcessBundleID(
                platform, callingProcessBundleID);
            return [downloader](const std::string& serialNumber,
                                QAXWarrantyDownloader::Completion completion) {
                downloader->downloadWarrantyForSerialNumber(serialNumber, std::move(completion));
            };
        };
    }
}

std::shared_ptr<RepeatingTimer> QAXOutreachActivityUtilities::outReachTimer() const {
    std::lock_guard lock(timerMutex_);
    return outReachTimer_;
}

void QAXOutreachActivityUtilities::setOutReachTimer(std::shared_ptr<RepeatingTimer> timer) {
    std::shared_ptr<RepeatingTimer> previous;
    std::lock_guard lock(timerMutex_);
    previous = std::exchange(outReachTimer_, std::move(timer));
}

void QAXOutreachActivityUtilities::performOutreachActivityForConversion(
    bool conversion, std::shared_ptr<QAXScheduler> scheduler,
    QAXSchedulerActivityDelegate::Completion completion) {
    setOutreachInProgress(true);
    auto run = std::make_shared<Run>();
    run->conversion = conversion;
    run->completion = std::move(completion);

    // The deferral check reports 2 and lets the downloads go on; the final step still
    // schedules and reports 1 for the same run.
    std::weak_ptr<QAXOutreachActivityUtilities> weak = weak_from_this();
    setOutReachTimer(RepeatingTimer::scheduledTimer(
        platform_->dispatcher->mainQueue(), deferralCheckInterval_,
        [weak, scheduler, run](RepeatingTimer& timer) {
            auto self = weak.lock();
            if (!self || !self->outreachInProgress() || !scheduler || !scheduler->shouldDefer()) {
                return;
            }
            qaxLog().info("Warranty download activity deferred. Conversion: %d",
                          run->conversion ? 1 : 0);
            timer.invalidate();
            self->setOutReachTimer(nullptr);
            run->completion(QAXActivityResultDeferred);
        }));

    const QAXDeviceMap devices = devices_->allDevices();
    std::vector<std::shared_ptr<QAXDevice>> listed;
    for (const auto& [serial, device] : devices) {
        listed.push_back(device);
    }
    qaxLog().info("%s: -- Conversion: %d -- devices: %@", kPerformOperation, conversion ? 1 : 0,
                  logDescriptionOfList(listed));

    const Download download =
        downloads_(conversion ? kConversionOutreachCallingProcess : kOutreachCallingProcess);
    // Every download counts as outstanding before the first starts, so one that completes at
    // once cannot end the run early.
    auto outstanding = std::make_shared<JoinCounter>();
    for (std::size_t i = 0; i < devices.size(); ++i) {
        outstanding->enter();
    }
    auto self = shared_from_this();
    for (const auto& [key, device] : devices) {
        const std::string serialNumber =
            device && device->serialNumber() ? *device->serialNumber() : key;
        download(serialNumber, [self, run, outstanding, serialNumber](
                                   bool success, std::shared_ptr<QAXWarranty> warranty) {
            self->handleDownload(*run, serialNumber, success, warranty);
            outstanding->leave();
        });
    }
    outstanding->notify(platform_->dispatcher->backgroundQueue(), [weak, run, outstanding,
                                                                   platform = platform_] {
        auto self = weak.lock();
        std::optional<Date> earliest;
        {
            std::lock_guard lock(run->mutex);
            earliest = run->earliestFollowUpDate;
        }
        if (earliest) {
            qaxLog().info("Conversion: %d -- Complete activity and schedule followUp post for: %@",
                          run->conversion ? 1 : 0, *earliest);
            if (platform->agentFactory) {
                platform->agentFactory->scheduleActivityForDate(kQAXFollowUpPostActivityIdentifier,
                                                                earliest);
            }
        } else {
            qaxLog().info("Conversion: %d -- No devices eligible for followUp posts",
                          run->conversion ? 1 : 0);
        }
        if (self) {
            self->setOutreachInProgress(false);
            if (auto timer = self->outReachTimer()) {
                timer->invalidate();
            }
            self->setOutReachTimer(nullptr);
        }
        run->completion(QAXActivityResultFinished);
    });
}

void QAXOutreachActivityUtilities::handleDownload(Run& run, const std::string& serialNumber,
                                                  bool success,
                                                  const std::shared_ptr<QAXWarranty>& warranty) {
    qaxLog().info("serialNumber: %@ success: %d -- Conversion: %d", privateText(serialNumber),
                  success ? 1 : 0, run.conversion ? 1 : 0);
    if (!success || !warranty) {
        qaxLog().error("Warranty failed to download");
        return;
    }
    qaxLog().info("Warranty downloaded successfully");
    if (!warranty->hvOfferDisplay()) {
        qaxLog().info(
            "Warranty shows device is ineligible, complete activity without scheduling followup");
        return;
    }
    qaxLog().info("Coverage check shows device should display HV offer, check on-device state");
    if (!currentDeviceShouldReceiveOutreachForWarranty(*warranty)) {
        qaxLog().info(
            "Configuration does not support current device. Complete activity without "
            "scheduling followup");
        return;
    }
    std::optional<Date> candidate = warranty->hvOfferFollowupDisplayDate();
    if (!candidate) {
        if (auto until = warranty->hvOfferEligibleUntil()) {
            candidate = until->byAdding(-warranty->hvOfferDurationBeforeEndDate());
        }
    }
    if (!candidate) {
        return;
    }
    std::lock_guard lock(run.mutex);
    if (!run.earliestFollowUpDate || *candidate < *run.earliestFollowUpDate) {
        run.earliestFollowUpDate = candidate;
    }
}

bool QAXOutreachActivityUtilities::currentDeviceShouldReceiveOutreachForWarranty(
    const QAXWarranty& warranty) {
    const std::vector<SubscriberCarrier> carriers = platform_->telephony
                                                        ? platform_->telephony->subscriberCarriers()
                                                        : std::vector<SubscriberCarrier>{};
    if (carriers.empty()) {
        return true;
    }
    const std::optional<Value> toggle = warranty.hvOfferToggle();
    for (const SubscriberCarrier& carrier : carriers) {
        std::optional<std::string> carrierID;
        if (!carrier.mobileCountryCode) {
            qaxLog().error("No mobileCountryCode for networkInfo: %@, carrier: %@",
                           describeCarriers(carriers), describeCarrier(carrier));
        } else {
            carrierID = *carrier.mobileCountryCode + carrier.mobileNetworkCode.value_or("");
        }
        qaxLog().info("carrierID: %@", carrierID);
        if (carrierID && toggleContains(toggle, *carrierID)) {
            qaxLog().info("carrier matched");
            return false;
        }
    }
    return true;
}

}  // namespace qax
