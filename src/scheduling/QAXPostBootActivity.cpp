#include "scheduling/QAXPostBootActivity.h"

#include <utility>

#include "core/Log.h"
#include "platform/AgentFactory.h"
#include "platform/Platform.h"
#include "platform/PreferenceStore.h"
#include "scheduling/QAXScheduler.h"

namespace qax {
namespace {

constexpr const char* kPostUpgradeActivityCompletedKey = "PostUpgradeActivityCompleted";
constexpr const char* kConversionOutreachScheduledDateKey = "ConversionOutreachScheduledDate";

}  // namespace

QAXPostBootActivity::QAXPostBootActivity(std::shared_ptr<Platform> platform)
    : platform_(std::move(platform)) {}

void QAXPostBootActivity::performActivityForScheduler(const std::shared_ptr<QAXScheduler>&,
                                                      Completion completion) {
    PreferenceStore& preferences = *platform_->preferences;
    if (!preferences.boolForKey(kPostUpgradeActivityCompletedKey)) {
        qaxLog().info("post upgrade activity hasn't yet been performed, skip boot activity");
        completion(QAXActivityResultFinished);
        return;
    }
    qaxLog().info("Running post boot activity");
    // The follow-up post is left alone: its date is computed afresh by whoever schedules it.
    for (const char* identifier :
         {kQAXOutreachActivityIdentifier, kQAXConversionOutreachActivityIdentifier,
          kQAXFollowUpRefreshActivityIdentifier}) {
        const auto date = preferences.dateForKey(QAXScheduler::targetDateKey(identifier));
        if (!date) {
            continue;
        }
        qaxLog().info("'%@' not complete, rescheduling", identifier);
        if (platform_->agentFactory) {
            platform_->agentFactory->scheduleActivityForDate(identifier, date);
        } else {
            qaxLog().error("no activity scheduling in this process; '%@' not scheduled",
                           identifier);
        }
        if (std::string_view(identifier) == kQAXConversionOutreachActivityIdentifier) {
            preferences.setObject(kConversionOutreachScheduledDateKey, Value(*date));
        }
    }
    completion(QAXActivityResultFinished);
}

}  // namespace qax
