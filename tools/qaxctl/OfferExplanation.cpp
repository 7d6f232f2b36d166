#include "OfferExplanation.h"

#include <algorithm>
#include <cstdlib>
#include <filesystem>
#include <mutex>

#include "agent/QAXAgentDefaultWarrantyProvider.h"
#include "core/Hash.h"
#include "core/Log.h"
#include "devices/QAXDeviceInfo.h"
#include "devices/QAXDevicesManager.h"
#include "followup/QAXFollowUpPost.h"
#include "followup/QAXFollowUpRefresh.h"
#include "platform/LocaleInfo.h"
#include "platform/PreferenceStore.h"
#include "platform/QAXSettings.h"
#include "platform/host/DryRunPlatform.h"
#include "platform/host/FilePreferenceStore.h"
#include "platform/host/HostActivityRegistry.h"
#include "platform/host/HostFollowUpCenter.h"
#include "platform/host/SimulatedClock.h"
#include "scheduling/QAXScheduler.h"
#include "scheduling/QAXSchedulerActivityDelegate.h"
#include "warranty/QAXWarranty.h"

namespace qaxctl {
namespace {

namespace fs = std::filesystem;
using qax::Date;
using qax::DryRunFollowUpCenter;
using qax::DryRunPlatform;
using qax::QAXDeviceInfo;
using qax::QAXDeviceInfoList;
using qax::QAXFollowUp;
using qax::QAXWarranty;
using qax::QAXWarrantyPolicyEvaluation;
using qax::Value;

// The calling process the dry run's warranty provider names (it never downloads).
constexpr const char* kExplainCallingProcess = "com.velmora.qaxctl.explain";

constexpr const char* kActivityIdentifiers[] = {
    qax::kQAXPostUpgradeActivityIdentifier,        qax::kQAXPostBootActivityIdentifier,
    qax::kQAXOutreachActivityIdentifier,           qax::kQAXFollowUpPostActivityIdentifier,
    qax::kQAXConversionOutreachActivityIdentifier, qax::kQAXFollowUpRefreshActivityIdentifier,
};

// The agent's log while explaining: its error lines are kept as the explanation's problems;
// with QAX_LOG_LEVEL set, everything also goes to stderr as the agent would log it.
class ExplainLogSink : public qax::LogSink {
  public:
    explicit ExplainLogSink(std::shared_ptr<qax::LogSink> forward) : forward_(std::move(forward)) {}

    void write(qax::LogLevel level, std::string_view subsystem, std::string_view category,
               std::string_view message) override {
        if (level == qax::LogLevel::Error) {
            std::lock_guard lock(mutex_);
            if (std::find(errors_.begin(), errors_.end(), message) == errors_.end()) {
                errors_.emplace_back(message);
            }
        }
        if (forward_ && forward_->isEnabled(level)) {
            forward_->write(level, subsystem, category, message);
        }
    }
    bool isEnabled(qax::LogLevel level) const override {
        return level == qax::LogLevel::Error || (forward_ && forward_->isEnabled(level));
    }
    bool showsPrivate() const override { return forward_ && forward_->showsPrivate(); }

    std::vector<std::string> errors() const {
        std::lock_guard lock(mutex_);
        return errors_;
    }

  private:
    const std::shared_ptr<qax::LogSink> forward_;
    mutable std::mutex mutex_;
    std::vector<std::string> errors_;
};

// Binds the shared log handle for the life of the object.
class LogBinding {
  public:
    explicit LogBinding(std::shared_ptr<qax::LogSink> sink) : previous_(qax::qaxLog().sink()) {
        qax::qaxLog().setSink(std::move(sink));
    }
    ~LogBinding() { qax::qaxLog().setSink(previous_); }
    LogBinding(const LogBinding&) = delete;
    LogBinding& operator=(const LogBinding&) = delete;

  private:
    std::shared_ptr<qax::LogSink> previous_;
};

// The cache file of `serialNumber`, named as the cache names it.
std::string cacheFilePath(const qax::Platform& platform, const std::string& serialNumber) {
    std::string path = QAXWarranty::_warrantyPathForSerialNumberFormat(platform);
    const auto at = path.rfind("%@");
    return at == std::string::npos ? std::string()
                                   : path.replace(at, 2, qax::sha256Hash(serialNumber));
}

const DryRunFollowUpCenter::Change* findChange(const std::vector<DryRunFollowUpCenter::Change>& all,
                                               DryRunFollowUpCenter::Change::Kind kind,
                                               const std::string& uniqueIdentifier) {
    for (const auto& change : all) {
        if (change.kind == kind && change.uniqueIdentifier == uniqueIdentifier) {
            return &change;
        }
    }
    return nullptr;
}

void noteScheduled(const DryRunPlatform& dryRun, std::vector<std::string>& problems) {
    for (const auto& s : dryRun.agentFactory().scheduled()) {
        problems.push_back("the dry run would have scheduled " + s.identifier + " for " +
                           (s.date ? s.date->description() : std::string("no date")));
    }
}

Value dateValue(const std::optional<Date>& date) {
    return date ? Value(date->iso8601()) : Value();
}

Value textValue(const std::optional<std::string>& text) {
    return text ? Value(*text) : Value();
}

Value cueValue(const qax::QAXFollowUpCue& cue, double secondsBeforeEnd) {
    return Value(Value::Dictionary{{"enabled", cue.enabled},
                                   {"date", dateValue(cue.date)},
                                   {"on", cue.on},
                                   {"secondsBeforeEnd", secondsBeforeEnd}});
}

Value itemValue(const std::optional<qax::FollowUpItem>& item, Date now) {
    return item ? qax::FollowUpRowPresentation::present(*item, now, now).toValue() : Value();
}

}  // namespace

const char* policyName(qax::QAXWarrantyPolicy policy) {
    switch (policy) {
        case qax::QAXWarrantyPolicyDefault:
            return "default";
        case qax::QAXWarrantyPolicyCachedOnly:
            return "cached only";
        case qax::QAXWarrantyPolicyForceDownload:
            return "force download";
    }
    return "cached only";
}

const char* cacheStateName(QAXWarrantyPolicyEvaluation::CacheState state) {
    using S = QAXWarrantyPolicyEvaluation::CacheState;
    switch (state) {
        case S::None:
            return "none";
        case S::OutdatedVersion:
            return "outdatedVersion";
        case S::OtherLocale:
            return "otherLocale";
        case S::SignedOut:
            return "signedOut";
        case S::Valid:
            return "valid";
    }
    return "none";
}

const char* postRuleName(qax::QAXFollowUpPostDecision decision) {
    using D = qax::QAXFollowUpPostDecision;
    switch (decision) {
        case D::NoWarranty:
            return "noWarranty";
        case D::NotDisplayed:
            return "notDisplayed";
        case D::NoLongerEligible:
            return "noLongerEligible";
        case D::Dismissed:
            return "dismissed";
        case D::Due:
            return "due";
        case D::FuturePostDate:
            return "futurePostDate";
    }
    return "noWarranty";
}

const char* refreshRuleName(qax::QAXFollowUpRefreshDecision decision) {
    using D = qax::QAXFollowUpRefreshDecision;
    switch (decision) {
        case D::NoWarranty:
            return "noWarranty";
        case D::NotDisplayed:
            return "notDisplayed";
        case D::NoLongerEligible:
            return "noLongerEligible";
        case D::Update:
            return "update";
        case D::Repost:
            return "repost";
        case D::LeaveUnposted:
            return "leaveUnposted";
    }
    return "noWarranty";
}

OfferExplanation OfferExplanation::explain(const qax::HostEnvironment& environment,
                                           const std::optional<std::string>& requested) {
    const char* logLevel = std::getenv("QAX_LOG_LEVEL");
    auto sink = std::make_shared<ExplainLogSink>(
        logLevel && *logLevel ? std::make_shared<qax::StderrLogSink>() : nullptr);
    LogBinding binding(sink);

    OfferExplanation x;
    const auto host = qax::makeHostPlatform(environment, nullptr);
    x.now = host->clock->now();
    x.simulatedClock = environment.simulatedClock;
    if (auto simulated = std::dynamic_pointer_cast<qax::SimulatedClock>(host->clock)) {
        x.clockOffsetSeconds = simulated->offsetSeconds();
    }
    // Reading a domain that does not exist yet would create its lock file: read nothing then.
    std::error_code ec;
    const auto stored =
        fs::exists(qax::FilePreferenceStore::domainPath(environment.homeDirectory), ec)
            ? host->preferences
            : nullptr;
    auto dryRun = [&] {
        auto run = std::make_unique<DryRunPlatform>(*host, stored);
        qax::qax_registerDefaults(*run->platform()->preferences);
        return run;
    };
    // One context for the facts and the rows of the rules, one for each activity run, so that
    // what one run would change does not colour another.
    const auto facts = dryRun();
    const auto& platform = facts->platform();

    const auto records = qax::HostActivityRegistry::load(environment.platformRoot);
    for (const char* identifier : kActivityIdentifiers) {
        Activity activity{identifier, std::nullopt, std::nullopt, false};
        if (auto r = records.find(identifier); r != records.end() && r->second.pending()) {
            activity.dueDate = r->second.dueDate;
            activity.requiresNetwork = r->second.requiresNetwork;
        }
        activity.targetDate =
            platform->preferences->dateForKey(qax::QAXScheduler::targetDateKey(identifier));
        if (activity.dueDate || activity.targetDate) {
            x.activities.push_back(std::move(activity));
        }
    }

    qax::QAXDevicesManager devices(platform);
    const auto defaultDevice = devices.defaultDevice();
    const qax::QAXDeviceMap all = devices.allDevices();
    for (const auto& [serialNumber, device] : all) {
        x.trackedSerialNumbers.push_back(serialNumber);
    }
    x.serialNumber = requested ? requested : defaultDevice->serialNumber();
    auto finish = [&] {
        for (auto& error : sink->errors()) {
            x.problems.push_back(std::move(error));
        }
        return x;
    };
    if (!x.serialNumber) {
        return finish();
    }
    const std::string serialNumber = *x.serialNumber;
    const std::string uniqueIdentifier = QAXFollowUp::uniqueIdentfierForSerialNumber(serialNumber);
    if (auto found = all.find(serialNumber); found != all.end()) {
        x.tracked = true;
        x.device = found->second;
    }
    x.thisDevice = defaultDevice->serialNumber() == serialNumber;

    // The cached warranty and the policies.
    qax::QAXAgentDefaultWarrantyProvider provider(platform, kExplainCallingProcess);
    for (std::size_t p = 0; p < x.policies.size(); ++p) {
        const auto policy = static_cast<qax::QAXWarrantyPolicy>(p);
        const auto e =
            qax::QAXAgent::evaluateWarrantyPolicy(*platform, provider, policy, serialNumber);
        x.policies[p] = Policy{policy, e.shouldDownload, e.answerWithoutDownload() != nullptr};
        if (policy == qax::QAXWarrantyPolicyDefault) {
            x.cache.present = e.cached != nullptr;
            x.cache.state = e.cacheState;
            x.cache.remaining = e.remaining;
        }
    }
    x.cache.version = provider.cachedWarrantyVersionForSerialNumber(serialNumber);
    x.cache.locale = provider.cachedWarrantyLocaleForSerialNumber(serialNumber);
    x.cache.systemLocale = platform->locale->preferredLocaleIdentifier();
    x.cache.signedIn = provider.isSignedInToSkyvault();
    x.cache.lastUpdated = provider.lastUpdatedDateForSerialNumber(serialNumber);
    x.cache.validitySeconds = provider.cachedWarrantyValidityDuration();
    const auto cached = provider.cachedWarrantyForSerialNumber(serialNumber);
    if (const std::string path = cacheFilePath(*platform, serialNumber);
        !cached && !path.empty() && fs::exists(path, ec)) {
        x.cache.unreadableFile = path;
    }

    // Device infos as the two activities would get them: the post downloads (the cache stands
    // in), the refresh uses the cached warranty only where the agent may.
    QAXDeviceInfoList postInfos;
    QAXDeviceInfoList refreshInfos;
    std::shared_ptr<QAXDeviceInfo> refreshInfo;
    for (const auto& [serial, device] : all) {
        postInfos.push_back(QAXDeviceInfo::deviceInfoWithDevice(
            device, provider.cachedWarrantyForSerialNumber(serial)));
        const auto answer = qax::QAXAgent::evaluateWarrantyPolicy(
                                *platform, provider, qax::QAXWarrantyPolicyCachedOnly, serial)
                                .answerWithoutDownload();
        refreshInfos.push_back(QAXDeviceInfo::deviceInfoWithDevice(device, answer));
        if (serial == serialNumber) {
            refreshInfo = refreshInfos.back();
        }
    }

    QAXFollowUp followUp(platform);
    if (cached) {
        Offer offer;
        const auto device =
            x.device ? x.device
                     : qax::QAXDevice::deviceWithName(serialNumber, serialNumber, std::nullopt,
                                                      qax::QAXDeviceTypeDefault);
        const auto info = QAXDeviceInfo::deviceInfoWithDevice(device, cached);
        offer.displayed = cached->hvOfferDisplay();
        offer.eligibleUntil = cached->hvOfferEligibleUntil();
        offer.daysEligible = cached->daysEligible();
        offer.eligible = offer.eligibleUntil && *offer.eligibleUntil > x.now;
        offer.followupDisplayDate = cached->hvOfferFollowupDisplayDate();
        offer.offerPostDate = QAXFollowUp::_offerPostDateForWarranty(*cached);
        offer.postDate = followUp.postDateForDeviceInfo(*info);
        offer.activationDate = device->activationDate();
        offer.history = followUp.historyForSerialNumber(serialNumber);
        offer.conversionReopens =
            offer.history.dismissed && followUp._checkConversionEligibilityForDevice(info);
        offer.badge = followUp._rowBadgeForWarranty(*cached);
        offer.badgeSecondsBeforeEnd = cached->hvOfferBadgeDurationBeforeEndDate();
        offer.notification = followUp._notificationForWarranty(*cached);
        offer.notificationSecondsBeforeEnd = cached->showNotificationBeforeEndDate();
        if (x.tracked) {
            offer.postRule =
                followUp._postDecisionForDeviceInfo(info, offer.history.dismissed, false, nullptr);
        }
        x.offer = std::move(offer);
    }

    // The follow-up post, as its run goes: post what is due, find the next post date, and
    // when something was posted, the date of the refresh it starts.
    {
        const auto run = dryRun();
        const auto& p = run->platform();
        PostRun post;
        post.postsAny = QAXFollowUp(p).postFollowUpWithDevicesInfo(postInfos);
        post.nextPostDate =
            qax::QAXFollowUpPost::nextFollowUpPostDateWithDevicesInfo(*p, postInfos);
        if (post.postsAny) {
            post.refreshDate = qax::QAXFollowUpRefresh::nextFollowUpRefreshDateWithDevicesInfo(
                *p, postInfos, true);
        }
        const auto changes = run->followUps().changes();
        if (auto c =
                findChange(changes, DryRunFollowUpCenter::Change::Kind::Post, uniqueIdentifier)) {
            post.postsThisDevice = true;
            post.item = c->item;
            post.deliversNotification = c->deliversNotification;
        }
        noteScheduled(*run, x.problems);
        x.post = std::move(post);
    }

    // The follow-up refresh, as its run goes: rebuild the shown items, then find the next
    // refresh over the ones it updated.
    {
        RefreshRun refresh;
        std::string listError;
        bool hasItem = false;
        for (const auto& item : platform->followUps->pendingFollowUpItems(
                 qax::kQAXFollowUpClientIdentifier, &listError)) {
            hasItem = hasItem || QAXFollowUp::serialNumberForItem(item) == serialNumber;
        }
        if (refreshInfo) {
            refresh.rule = followUp._refreshDecisionForDeviceInfo(*refreshInfo, hasItem, false);
        }
        const auto run = dryRun();
        const auto& p = run->platform();
        const QAXDeviceInfoList updated =
            QAXFollowUp(p).refreshFollowupWithDeviceInfos(refreshInfos);
        refresh.continues = !updated.empty();
        if (refresh.continues) {
            refresh.nextRefreshDate =
                qax::QAXFollowUpRefresh::nextFollowUpRefreshDateWithDevicesInfo(*p, updated, true);
        }
        const auto changes = run->followUps().changes();
        refresh.clearsThisDevice =
            findChange(changes, DryRunFollowUpCenter::Change::Kind::Clear, uniqueIdentifier);
        if (auto c =
                findChange(changes, DryRunFollowUpCenter::Change::Kind::Post, uniqueIdentifier)) {
            refresh.updatesThisDevice = true;
            refresh.item = c->item;
            refresh.deliversNotification = c->deliversNotification;
        }
        noteScheduled(*run, x.problems);
        x.refresh = std::move(refresh);
    }

    // The item as the settings application shows it now.
    if (auto center = std::dynamic_pointer_cast<qax::HostFollowUpCenter>(host->followUps)) {
        for (const auto& stored : center->storedItems(qax::kQAXFollowUpClientIdentifier)) {
            if (QAXFollowUp::serialNumberForItem(stored.item) == serialNumber ||
                stored.item.uniqueIdentifier == uniqueIdentifier) {
                x.item =
                    qax::FollowUpRowPresentation::present(stored.item, stored.postedDate, x.now);
                break;
            }
        }
    }
    noteScheduled(*facts, x.problems);
    return finish();
}

Value OfferExplanation::toValue() const {
    Value::Dictionary d;
    d["now"] = now.iso8601();
    d["clock"] = Value(
        Value::Dictionary{{"simulated", simulatedClock}, {"offsetSeconds", clockOffsetSeconds}});
    d["serialNumber"] = textValue(serialNumber);
    d["tracked"] = tracked;
    d["thisDevice"] = thisDevice;
    if (device) {
        d["device"] = Value(Value::Dictionary{
            {"name", textValue(device->name())},
            {"serialNumber", textValue(device->serialNumber())},
            {"activationDate", dateValue(device->activationDate())},
            {"deviceType", Value(static_cast<unsigned long long>(device->deviceType()))},
            {"deviceTypeString", device->deviceTypeString()}});
    } else {
        d["device"] = Value();
    }
    Value::Array tracked;
    for (const auto& s : trackedSerialNumbers) {
        tracked.emplace_back(s);
    }
    d["trackedSerialNumbers"] = Value(std::move(tracked));

    std::optional<Date> freshUntil;
    if (cache.lastUpdated) {
        freshUntil = cache.lastUpdated->byAdding(cache.validitySeconds);
    }
    d["cache"] = Value(Value::Dictionary{{"present", cache.present},
                                         {"state", cacheStateName(cache.state)},
                                         {"version", textValue(cache.version)},
                                         {"locale", textValue(cache.locale)},
                                         {"systemLocale", cache.systemLocale},
                                         {"signedIn", cache.signedIn},
                                         {"lastUpdated", dateValue(cache.lastUpdated)},
                                         {"validitySeconds", cache.validitySeconds},
                                         {"freshUntil", dateValue(freshUntil)},
                                         {"fresh", cache.remaining && *cache.remaining > 0},
                                         {"unreadableFile", textValue(cache.unreadableFile)}});

    Value::Array policyList;
    for (const auto& p : policies) {
        const char* answer = p.answersCached ? "cached" : "none";
        policyList.push_back(
            Value(Value::Dictionary{{"policy", Value(static_cast<unsigned long long>(p.policy))},
                                    {"name", policyName(p.policy)},
                                    {"downloads", p.downloads},
                                    {"answer", p.downloads ? "download" : answer},
                                    {"fallback", p.downloads ? Value(answer) : Value()}}));
    }
    d["policies"] = Value(std::move(policyList));

    if (offer) {
        const Offer& o = *offer;
        d["offer"] = Value(Value::Dictionary{
            {"displayed", o.displayed},
            {"eligibleUntil", dateValue(o.eligibleUntil)},
            {"daysEligible", Value(static_cast<long long>(o.daysEligible))},
            {"eligible", o.eligible},
            {"followupDisplayDate", dateValue(o.followupDisplayDate)},
            {"offerPostDate", dateValue(o.offerPostDate)},
            {"postDate", dateValue(o.postDate)},
            {"activationDate", dateValue(o.activationDate)},
            {"postDateMovedByActivation", o.postDate != o.offerPostDate},
            {"posted", o.history.posted},
            {"dismissed", o.history.dismissed},
            {"dismissedDate", dateValue(o.history.dismissedDate)},
            {"conversionReopens", o.conversionReopens},
            {"badge", cueValue(o.badge, o.badgeSecondsBeforeEnd)},
            {"notification", cueValue(o.notification, o.notificationSecondsBeforeEnd)},
            {"postRule", o.postRule ? Value(postRuleName(*o.postRule)) : Value()}});
    } else {
        d["offer"] = Value();
    }
    if (post) {
        d["post"] = Value(Value::Dictionary{{"postsThisDevice", post->postsThisDevice},
                                            {"postsAny", post->postsAny},
                                            {"deliversNotification", post->deliversNotification},
                                            {"item", itemValue(post->item, now)},
                                            {"nextPostDate", dateValue(post->nextPostDate)},
                                            {"refreshDate", dateValue(post->refreshDate)}});
    } else {
        d["post"] = Value();
    }
    if (refresh) {
        d["refresh"] = Value(Value::Dictionary{
            {"rule", refresh->rule ? Value(refreshRuleName(*refresh->rule)) : Value()},
            {"clearsThisDevice", refresh->clearsThisDevice},
            {"updatesThisDevice", refresh->updatesThisDevice},
            {"deliversNotification", refresh->deliversNotification},
            {"item", itemValue(refresh->item, now)},
            {"continues", refresh->continues},
            {"nextRefreshDate", dateValue(refresh->nextRefreshDate)}});
    } else {
        d["refresh"] = Value();
    }
    d["item"] = item ? item->toValue() : Value();

    Value::Array activityList;
    for (const auto& a : activities) {
        activityList.push_back(Value(Value::Dictionary{{"identifier", a.identifier},
                                                       {"dueDate", dateValue(a.dueDate)},
                                                       {"targetDate", dateValue(a.targetDate)},
                                                       {"requiresNetwork", a.requiresNetwork}}));
    }
    d["activities"] = Value(std::move(activityList));
    Value::Array problemList;
    for (const auto& p : problems) {
        problemList.emplace_back(p);
    }
    d["problems"] = Value(std::move(problemList));
    return Value(std::move(d));
}

}  // namespace qaxctl
