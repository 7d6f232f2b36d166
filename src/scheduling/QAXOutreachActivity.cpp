#include "scheduling/QAXOutreachActivity.h"

#include <utility>

#include "core/Log.h"

namespace qax {

QAXOutreachActivity::QAXOutreachActivity(std::shared_ptr<Platform> platform)
    : platform_(std::move(platform)) {}

std::string QAXOutreachActivity::identifier() const {
    return kQAXOutreachActivityIdentifier;
}

void QAXOutreachActivity::performActivityForScheduler(
    const std::shared_ptr<QAXScheduler>& scheduler, Completion completion) {
    qaxLog().info("%s: for general outreach",
                  "-[QAXOutreachActivity performActivityForScheduler:withCompletionHandler:]");
    std::make_shared<QAXOutreachActivityUtilities>(platform_)->performOutreachActivityForConversion(
        false, scheduler, std::move(completion));
}

}  // namespace qax
