#include "agent/QAXAgentFactory.h"

#include <utility>

#include "agent/QAXAgent.h"
#include "core/Log.h"
#include "followup/QAXFollowUpPost.h"
#include "followup/QAXFollowUpRefresh.h"
#include "scheduling/QAXConversionOutreachActivity.h"
#include "scheduling/QAXOutreachActivity.h"
#include "scheduling/QAXPostBootActivity.h"
#include "scheduling/QAXPostUpgradeActivity.h"
#include "scheduling/QAXScheduler.h"

namespace qax {

QAXAgentFactory::QAXAgentFactory(std::weak_ptr<Platform> platform)
    : platform_(std::move(platform)) {}

std::shared_ptr<QAXAgentProtocol> QAXAgentFactory::makeAgent(
    const std::string& callingProcessBundleID) {
    auto platform = platform_.lock();
    if (!platform) {
        return nullptr;
    }
    return QAXAgent::initWithCallingProcessBundleID(std::move(platform), callingProcessBundleID);
}

void QAXAgentFactory::scheduleActivityForDate(const std::string& identifier,
                                              std::optional<Date> date) {
    auto platform = platform_.lock();
    if (!platform) {
        return;
    }
    auto delegate = newActivityDelegate(platform, identifier);
    if (!delegate) {
        qaxLog().error("No activity '%@' to schedule", identifier);
        return;
    }
    QAXScheduler::newSchedulerWithActivityDelegate(std::move(platform), std::move(delegate))
        ->scheduleActivityForDate(date);
}

std::shared_ptr<QAXSchedulerActivityDelegate> QAXAgentFactory::newActivityDelegate(
    const std::shared_ptr<Platform>& platform, const std::string& identifier) {
    if (identifier == kQAXPostUpgradeActivityIdentifier) {
        return std::make_shared<QAXPostUpgradeActivity>(platform);
    }
    if (identifier == kQAXPostBootActivityIdentifier) {
        return std::make_shared<QAXPostBootActivity>(platform);
    }
    if (identifier == kQAXOutreachActivityIdentifier) {
        return std::make_shared<QAXOutreachActivity>(platform);
    }
    if (identifier == kQAXFollowUpPostActivityIdentifier) {
        return std::make_shared<QAXFollowUpPost>(platform);
    }
    if (identifier == kQAXConversionOutreachActivityIdentifier) {
        return std::make_shared<QAXConversionOutreachActivity>(platform);
    }
    if (identifier == kQAXFollowUpRefreshActivityIdentifier) {
        return std::make_shared<QAXFollowUpRefresh>(platform);
    }
    return nullptr;
}

}  // namespace qax
