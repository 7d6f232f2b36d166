#include "scheduling/QAXConversionOutreachActivity.h"

#include <utility>

#include "core/Log.h"

namespace qax {

QAXConversionOutreachActivity::QAXConversionOutreachActivity(std::shared_ptr<Platform> platform)
    : platform_(std::move(platform)) {}

std::string QAXConversionOutreachActivity::identifier() const {
    return kQAXConversionOutreachActivityIdentifier;
}

void QAXConversionOutreachActivity::performActivityForScheduler(
    const std::shared_ptr<QAXScheduler>& scheduler, Completion completion) {
    qaxLog().info(
        "%s: for conversion outreach",
        "-[QAXConversionOutreachActivity performActivityForScheduler:withCompletionHandler:]");
    std::make_shared<QAXOutreachActivityUtilities>(platform_)->performOutreachActivityForConversion(
        true, scheduler, std::move(completion));
}

}  // namespace qax
