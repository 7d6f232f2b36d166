#include "followup/QAXDefaultFolllowUpProvider.h"

#include <utility>

#include "followup/QAXFollowUp.h"

namespace qax {
namespace {

// The service reports failures as text; a failed call always carries an error, even when
// the service gave none, so that callers can tell it from success.
void reportError(bool failed, std::string text, std::optional<std::string>* error) {
    if (error && (failed || !text.empty())) {
        *error = std::move(text);
    }
}

constexpr const char* kNoServiceError = "no follow-up service on this platform";

}  // namespace

QAXDefaultFolllowUpProvider::QAXDefaultFolllowUpProvider(std::shared_ptr<FollowUpCenter> center)
    : center_(std::move(center)) {}

bool QAXDefaultFolllowUpProvider::postFollowUpItem(const FollowUpItem& item,
                                                   std::optional<std::string>* error) {
    if (!center_) {
        reportError(true, kNoServiceError, error);
        return false;
    }
    std::string text;
    const bool ok = center_->postFollowUpItem(kQAXFollowUpClientIdentifier, item, &text);
    reportError(!ok, std::move(text), error);
    return ok;
}

bool QAXDefaultFolllowUpProvider::clearPendingFollowUpItemsWithUniqueIdentifiers(
    const std::vector<std::string>& uniqueIdentifiers, std::optional<std::string>* error) {
    if (!center_) {
        reportError(true, kNoServiceError, error);
        return false;
    }
    std::string text;
    const bool ok = center_->clearPendingFollowUpItemsWithUniqueIdentifiers(
        kQAXFollowUpClientIdentifier, uniqueIdentifiers, &text);
    reportError(!ok, std::move(text), error);
    return ok;
}

std::vector<FollowUpItem> QAXDefaultFolllowUpProvider::pendingFollowUpItems(
    std::optional<std::string>* error) {
    if (!center_) {
        reportError(true, kNoServiceError, error);
        return {};
    }
    std::string text;
    auto items = center_->pendingFollowUpItems(kQAXFollowUpClientIdentifier, &text);
    reportError(false, std::move(text), error);
    return items;
}

}  // namespace qax
