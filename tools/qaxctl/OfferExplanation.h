// qaxctl explain's findings for one device: the cached warranty and what each policy would do
// with it, the offer and the decisions of the follow-up rules about it, the item as posted and
// as a refresh now would leave it, and the pending activities that will change any of it. It
// is gathered by running the agent's own rule code on dry-run platform contexts (nothing is
// written, nothing is downloaded) at the platform clock's "now". Single-threaded.
#pragma once

#include <array>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "agent/QAXAgent.h"
#include "core/Value.h"
#include "devices/QAXDevice.h"
#include "followup/QAXFollowUp.h"
#include "platform/host/FollowUpRowPresentation.h"
#include "platform/host/HostPlatform.h"

namespace qaxctl {

struct OfferExplanation {
    struct Cache {
        bool present = false;
        qax::QAXWarrantyPolicyEvaluation::CacheState state =
            qax::QAXWarrantyPolicyEvaluation::CacheState::None;
        std::optional<std::string> version;
        std::optional<std::string> locale;
        std::string systemLocale;
        bool signedIn = false;
        std::optional<qax::Date> lastUpdated;
        double validitySeconds = 0;
        // Set when the default policy looked at the age of a valid cache.
        std::optional<double> remaining;
        // A cache file exists that holds no usable summary.
        std::optional<std::string> unreadableFile;
    };

    struct Policy {
        qax::QAXWarrantyPolicy policy = qax::QAXWarrantyPolicyDefault;
        bool downloads = false;
        // The reply without a download, or when the download gives nothing.
        bool answersCached = false;
    };

    struct Offer {
        bool displayed = false;
        std::optional<qax::Date> eligibleUntil;
        std::uint32_t daysEligible = 0;
        bool eligible = false;
        std::optional<qax::Date> followupDisplayDate;
        std::optional<qax::Date> offerPostDate;
        std::optional<qax::Date> postDate;
        std::optional<qax::Date> activationDate;
        qax::QAXFollowUpHistory history;
        bool conversionReopens = false;
        qax::QAXFollowUpCue badge;
        double badgeSecondsBeforeEnd = 0;
        qax::QAXFollowUpCue notification;
        double notificationSecondsBeforeEnd = 0;
        // Untracked devices are not looked at by the post rule.
        std::optional<qax::QAXFollowUpPostDecision> postRule;
    };

    // A run of the follow-up post now, with the cached summaries standing in for downloads.
    struct PostRun {
        bool postsThisDevice = false;
        bool postsAny = false;
        bool deliversNotification = false;
        std::optional<qax::FollowUpItem> item;
        std::optional<qax::Date> nextPostDate;
        // The refresh the run starts when it posted anything.
        std::optional<qax::Date> refreshDate;
    };

    // A run of the follow-up refresh now, on the cached warranties the agent may use.
    struct RefreshRun {
        std::optional<qax::QAXFollowUpRefreshDecision> rule;
        bool clearsThisDevice = false;
        bool updatesThisDevice = false;
        bool deliversNotification = false;
        std::optional<qax::FollowUpItem> item;
        // Whether the run schedules another refresh (it updated some item), and for when.
        bool continues = false;
        std::optional<qax::Date> nextRefreshDate;
    };

    struct Activity {
        std::string identifier;
        std::optional<qax::Date> dueDate;
        std::optional<qax::Date> targetDate;
        bool requiresNetwork = false;
    };

    qax::Date now;
    bool simulatedClock = false;
    double clockOffsetSeconds = 0;

    std::optional<std::string> serialNumber;
    std::shared_ptr<qax::QAXDevice> device;
    bool tracked = false;
    bool thisDevice = false;
    std::vector<std::string> trackedSerialNumbers;

    Cache cache;
    std::array<Policy, 3> policies;
    std::optional<Offer> offer;
    std::optional<PostRun> post;
    std::optional<RefreshRun> refresh;
    std::optional<qax::FollowUpRowPresentation> item;
    std::vector<Activity> activities;
    // Errors the agent's code reported while explaining (unreadable files, missing texts), and
    // anything the dry run would have scheduled through the agent factory.
    std::vector<std::string> problems;

    // For `serialNumber`, or this device when none is given.
    static OfferExplanation explain(const qax::HostEnvironment& environment,
                                    const std::optional<std::string>& serialNumber);

    qax::Value toValue() const;
};

const char* policyName(qax::QAXWarrantyPolicy policy);
const char* cacheStateName(qax::QAXWarrantyPolicyEvaluation::CacheState state);
const char* postRuleName(qax::QAXFollowUpPostDecision decision);
const char* refreshRuleName(qax::QAXFollowUpRefreshDecision decision);

}  // namespace qaxctl
