// One outreach run: downloads a fresh coverage summary for every device at once, keeps the
// devices whose offer is to be shown and whose cellular carrier does not exclude it, and
// schedules the follow-up post activity for the earliest offer date among them. One object per
// run. Download completions arrive on several threads; the earliest-date update and the count
// of outstanding downloads are serialised by the run's own lock and join counter. The deferral
// check runs on the main queue, the final step on the background queue.
#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "core/Date.h"
#include "core/RepeatingTimer.h"
#include "devices/QAXAgentDeviceProvider.h"
#include "scheduling/QAXSchedulerActivityDelegate.h"
#include "warranty/QAXWarrantyDownloader.h"

namespace qax {

struct Platform;
class QAXScheduler;
class QAXWarranty;

class QAXOutreachActivityUtilities
    : public std::enable_shared_from_this<QAXOutreachActivityUtilities> {
  public:
    // Starts one device's download; the completion may run on any thread, exactly once.
    using Download = std::function<void(const std::string& serialNumber,
                                        QAXWarrantyDownloader::Completion completion)>;
    // The download step of one run, for the calling-process identifier of the run. The default
    // makes one QAXWarrantyDownloader for the run.
    using DownloadFactory = std::function<Download(const std::string& callingProcessBundleID)>;

    // The deferral check's interval: it never fires within a run in practice.
    static constexpr double kDeferralCheckInterval = 2000000000;

    // Null `devices` or `downloads` take the defaults: the platform's devices and the real
    // downloader.
    explicit QAXOutreachActivityUtilities(std::shared_ptr<Platform> platform,
                                          std::shared_ptr<QAXAgentDeviceProvider> devices = nullptr,
                                          DownloadFactory downloads = nullptr);

    // One run; returns at once. The completion gets 1 when the downloads are done; when the
    // platform asked the run to defer before that, it got 2 first.
    void performOutreachActivityForConversion(bool conversion,
                                              std::shared_ptr<QAXScheduler> scheduler,
                                              QAXSchedulerActivityDelegate::Completion completion);

    // False when one of this device's cellular subscriptions belongs to a carrier listed in the
    // warranty's hvOfferToggle.
    bool currentDeviceShouldReceiveOutreachForWarranty(const QAXWarranty& warranty);

    std::shared_ptr<RepeatingTimer> outReachTimer() const;
    void setOutReachTimer(std::shared_ptr<RepeatingTimer> timer);
    bool outreachInProgress() const { return outreachInProgress_; }
    void setOutreachInProgress(bool inProgress) { outreachInProgress_ = inProgress; }

    // Tests shorten the deferral check.
    void setDeferralCheckInterval(double seconds) { deferralCheckInterval_ = seconds; }

  private:
    // What the download completions and the final step share.
    struct Run {
        bool conversion = false;
        QAXSchedulerActivityDelegate::Completion completion;
        std::mutex mutex;
        std::optional<Date> earliestFollowUpDate;
    };

    void handleDownload(Run& run, const std::string& serialNumber, bool success,
                        const std::shared_ptr<QAXWarranty>& warranty);
    void finish(const std::shared_ptr<Run>& run);

    const std::shared_ptr<Platform> platform_;
    std::shared_ptr<QAXAgentDeviceProvider> devices_;
    DownloadFactory downloads_;
    double deferralCheckInterval_ = kDeferralCheckInterval;
    mutable std::mutex timerMutex_;
    std::shared_ptr<RepeatingTimer> outReachTimer_;
    std::atomic<bool> outreachInProgress_{false};
};

}  // namespace qax
