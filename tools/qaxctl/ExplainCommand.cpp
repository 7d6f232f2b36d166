// qaxctl explain: why the offer of the paid coverage plan is shown for a device, or why not,
// in sentences and dates (or as JSON). The agent's own rules decide, run on dry-run contexts
// over its files at the platform clock's "now"; no agent is needed and nothing is changed.
#include <cmath>
#include <cstdio>
#include <string>
#include <vector>

#include "Command.h"
#include "OfferExplanation.h"
#include "core/JsonCodec.h"
#include "scheduling/QAXSchedulerActivityDelegate.h"

namespace qaxctl {
namespace {

using qax::Date;
using CacheState = qax::QAXWarrantyPolicyEvaluation::CacheState;
using PostRule = qax::QAXFollowUpPostDecision;
using RefreshRule = qax::QAXFollowUpRefreshDecision;

constexpr const char* kUsage = "usage: qaxctl explain [SERIAL] [--json]\n";
constexpr double kDay = 86400;

// "2d 03:04:05".
std::string span(double seconds) {
    long long s = static_cast<long long>(std::fabs(seconds));
    char text[64];
    std::snprintf(text, sizeof text, "%lldd %02lld:%02lld:%02lld", s / 86400, s / 3600 % 24,
                  s / 60 % 60, s % 60);
    return text;
}

// "7 days" for whole days, else "2d 03:04:05".
std::string distance(double seconds) {
    const double days = seconds / kDay;
    if (days == std::floor(days) && days >= 0) {
        const long long n = static_cast<long long>(days);
        return std::to_string(n) + (n == 1 ? " day" : " days");
    }
    return span(seconds);
}

// "in 2d 03:04:05" or "2d 03:04:05 ago".
std::string relative(const Date& date, const Date& now) {
    const double seconds = date.timeIntervalSince(now);
    return seconds < 0 ? span(seconds) + " ago" : "in " + span(seconds);
}

// "2026-12-05 09:00:00 +0000 (in 2d 03:04:05)".
std::string when(const Date& date, const Date& now) {
    return date.description() + " (" + relative(date, now) + ")";
}

std::string when(const std::optional<Date>& date, const Date& now) {
    return date ? when(*date, now) : "no date";
}

std::string quoted(const std::optional<std::string>& text) {
    return text ? "\"" + *text + "\"" : "(none)";
}

const char* activityEffect(const std::string& identifier) {
    if (identifier == qax::kQAXPostUpgradeActivityIdentifier) {
        return "runs once per new system version: the first run ever records this device's "
               "activation date and schedules the outreach; later runs force a conversion "
               "outreach";
    }
    if (identifier == qax::kQAXPostBootActivityIdentifier) {
        return "re-schedules a pending outreach, conversion outreach and refresh from their "
               "target dates";
    }
    if (identifier == qax::kQAXOutreachActivityIdentifier) {
        return "downloads every device's coverage summary and schedules the follow-up post for "
               "the earliest offer";
    }
    if (identifier == qax::kQAXConversionOutreachActivityIdentifier) {
        return "downloads every device's coverage summary again and schedules the follow-up post "
               "for the earliest offer (a new offer period reopens a dismissed one)";
    }
    if (identifier == qax::kQAXFollowUpPostActivityIdentifier) {
        return "downloads fresh summaries, posts the items that are due and starts the refresh";
    }
    if (identifier == qax::kQAXFollowUpRefreshActivityIdentifier) {
        return "rebuilds the shown items from cached summaries (day count, badge, notification) "
               "and removes the ones whose offer is over";
    }
    return "";
}

void section(const char* title) {
    std::printf("\n%s\n", title);
}

void line(const std::string& text) {
    std::printf("  %s\n", text.c_str());
}

void printDevice(const OfferExplanation& x) {
    section("Device");
    const std::string& serial = *x.serialNumber;
    if (!x.tracked) {
        std::string known;
        for (const auto& s : x.trackedSerialNumbers) {
            known += (known.empty() ? "" : ", ") + s;
        }
        line("The agent tracks no device with the serial number " + serial + " (it tracks " +
             (known.empty() ? "none" : known) +
             "): no follow-up is posted for it, and a refresh removes any item it has.");
        return;
    }
    const auto& d = *x.device;
    std::string text = d.name().value_or("(no name)") + " (" + serial + "), " +
                       (x.thisDevice ? "this device" : d.deviceTypeString());
    text += d.activationDate() ? ", activated " + d.activationDate()->description() + "."
                               : ", no activation date.";
    line(text);
}

void printCache(const OfferExplanation& x) {
    section("Cached warranty");
    const auto& c = x.cache;
    if (!c.present) {
        line(c.unreadableFile ? "No usable cached warranty: " + *c.unreadableFile +
                                    " holds no coverage summary (unreadable or malformed)."
                              : std::string("No cached warranty: nothing was downloaded for it "
                                            "yet, or the cache was removed."));
    } else {
        line("A cached warranty is present, last updated " +
             (c.lastUpdated ? when(*c.lastUpdated, x.now) : std::string("at no recorded date")) +
             ".");
        switch (c.state) {
            case CacheState::OutdatedVersion:
                line("It is not valid: it was cached under version " + quoted(c.version) +
                     ", the agent uses version \"2\".");
                break;
            case CacheState::OtherLocale:
                line("It is not valid: it was cached for locale " + c.locale.value_or("(none)") +
                     ", the system is now in " + c.systemLocale + ".");
                break;
            case CacheState::SignedOut:
                line("It is not valid: the user is signed out of Skyvault.");
                break;
            case CacheState::Valid:
                line("It is valid: version \"2\", locale " + c.systemLocale +
                     " as the system's, signed in to Skyvault.");
                break;
            case CacheState::None:
                break;
        }
        if (c.lastUpdated) {
            const Date until = c.lastUpdated->byAdding(c.validitySeconds);
            line(std::string(until > x.now ? "It is fresh until " : "Its freshness ended ") +
                 when(until, x.now) + ", " + distance(c.validitySeconds) + " after the download.");
        }
    }
    for (const auto& p : x.policies) {
        std::string text =
            "Policy " + std::to_string(p.policy) + " (" + policyName(p.policy) + ") ";
        const char* answer = p.answersCached ? "the cached warranty" : "none";
        if (p.downloads) {
            text += std::string("downloads; should the download give nothing, it answers ") +
                    answer + ".";
        } else {
            text += std::string("answers ") + answer + " without downloading.";
        }
        line(text);
    }
}

void printOffer(const OfferExplanation& x) {
    section("Offer");
    if (!x.offer) {
        line(
            "Nothing is known of an offer without a cached warranty; the outreach or the "
            "follow-up post downloads one.");
    } else {
        const auto& o = *x.offer;
        std::string text = o.displayed ? "The offer is displayed" : "The offer is not displayed";
        if (o.eligibleUntil) {
            text += std::string(o.eligible ? " and eligible until " : "; its eligibility ended ") +
                    when(*o.eligibleUntil, x.now);
            if (o.eligible) {
                text += ", " + std::to_string(o.daysEligible) +
                        (o.daysEligible == 1 ? " day left" : " days left");
            }
        } else {
            text += ", with no end of eligibility";
        }
        line(text + ".");
        if (!o.postDate) {
            line("It has no post date.");
        } else if (o.postDate != o.offerPostDate) {
            line("Its post date is the activation date " + when(*o.postDate, x.now) +
                 ", which is later than the offer's own " +
                 (o.offerPostDate ? o.offerPostDate->description() : std::string("date")) + ".");
        } else {
            line("Its post date is " + when(*o.postDate, x.now) +
                 (o.followupDisplayDate ? ", the follow-up display date."
                                        : ", the end of eligibility minus the offer duration."));
        }
        line(o.history.posted ? "It was posted (the agent counted it as displayed)."
                              : "It was never posted, or a new offer period reopened it.");
        if (!o.history.dismissed) {
            line("The user did not dismiss it.");
        } else {
            std::string dismissed =
                "The user dismissed it" + (o.history.dismissedDate
                                               ? " on " + o.history.dismissedDate->description()
                                               : std::string());
            dismissed += o.conversionReopens
                             ? "; the follow-up display date " +
                                   o.followupDisplayDate->description() +
                                   " is later, so this new offer period reopens it."
                             : "; no follow-up display date after the dismissal reopens it.";
            line(dismissed);
        }
        auto cue = [&](const char* what, const qax::QAXFollowUpCue& c, double before) {
            if (!c.enabled) {
                line(std::string("The offer asks for no ") + what + ".");
                return;
            }
            std::string text = std::string("The ") + what + " turns on ";
            text += c.date ? c.date->description() + " (" + distance(before) +
                                 " before the end of eligibility, " + relative(*c.date, x.now) + ")"
                           : std::string("at no date (the offer has no end of eligibility)");
            text += c.on ? "; the rule has it on now." : "; the rule has it off now.";
            line(text);
        };
        cue("badge", o.badge, o.badgeSecondsBeforeEnd);
        cue("notification", o.notification, o.notificationSecondsBeforeEnd);
        if (o.postRule) {
            switch (*o.postRule) {
                case PostRule::NoWarranty:
                    break;
                case PostRule::NotDisplayed:
                    line("The post rule skips it: the offer is not displayed.");
                    break;
                case PostRule::NoLongerEligible:
                    line("The post rule skips it: its eligibility is over.");
                    break;
                case PostRule::Dismissed:
                    line("The post rule skips it: it was dismissed.");
                    break;
                case PostRule::Due:
                    line("The post rule finds it due: the follow-up post posts it when it runs.");
                    break;
                case PostRule::FuturePostDate:
                    line("The post rule waits for its post date.");
                    break;
            }
        }
    }
    if (x.post) {
        const auto& p = *x.post;
        std::string text =
            "A follow-up post now (the cached summaries standing in for its "
            "downloads) would ";
        text += p.postsThisDevice ? std::string("post this device's item") +
                                        (p.deliversNotification ? " with its notification" : "")
                                  : "post nothing for this device";
        text += p.nextPostDate ? ", schedule its next run for " + when(*p.nextPostDate, x.now)
                               : ", not schedule itself again";
        if (p.postsAny) {
            text += p.refreshDate
                        ? ", and schedule the refresh for " + when(*p.refreshDate, x.now)
                        : ", and schedule the refresh with no date, so that it runs at once";
        }
        line(text + ".");
    }
    if (x.refresh) {
        const auto& r = *x.refresh;
        std::string text = "A refresh now would ";
        if (r.clearsThisDevice) {
            text +=
                x.item ? "remove this device's item" : "clear this device's item (none is posted)";
            if (r.rule == RefreshRule::NoWarranty) {
                text += " (policy 1 finds no usable cached warranty)";
            } else if (r.rule == RefreshRule::NotDisplayed) {
                text += " (the offer is not displayed)";
            } else if (r.rule == RefreshRule::NoLongerEligible) {
                text += " (its eligibility is over)";
            } else if (!x.tracked) {
                text += " (the device is not tracked)";
            }
        } else if (r.updatesThisDevice) {
            text += std::string("update this device's item") +
                    (r.deliversNotification ? " and deliver its notification" : "");
        } else {
            text += "leave this device without an item";
        }
        if (!r.continues) {
            text += ", then end the refresh chain (no item was updated)";
        } else if (r.nextRefreshDate) {
            text += ", then schedule the next refresh for " + when(*r.nextRefreshDate, x.now);
        } else {
            text += ", then schedule the next refresh with no date, so that it runs again at once";
        }
        line(text + ".");
    }
}

void printPresentation(const qax::FollowUpRowPresentation& p, const Date& now,
                       const std::string& indent) {
    auto row = [&](const char* label, const std::string& value) {
        std::printf("  %s%-14s%s\n", indent.c_str(), label, value.c_str());
    };
    row("Title", quoted(p.title));
    row("Footer", quoted(p.footer));
    if (p.expired) {
        row("Days", "(expired)");
    } else if (p.remainingDays) {
        row("Days", std::to_string(*p.remainingDays) + ": " + quoted(p.dayText));
    }
    row("Badge", p.badge ? "on" : "off");
    if (p.notification) {
        row("Notification", quoted(p.notification->title) +
                                (p.notification->text ? ": " + quoted(p.notification->text) : "") +
                                " [" + p.notification->activateLabel.value_or("") + "] [" +
                                p.notification->clearLabel.value_or("") + "]");
    } else {
        row("Notification", "none");
    }
    row("Expires", when(p.expiration, now));
}

void printItem(const OfferExplanation& x) {
    section("Item");
    if (!x.item) {
        line("No item is posted for this device.");
    } else {
        line("Posted        " + when(x.item->postedDate, x.now));
        printPresentation(*x.item, x.now, "");
    }
    if (x.refresh && x.refresh->item) {
        line("After a refresh now:");
        printPresentation(qax::FollowUpRowPresentation::present(*x.refresh->item, x.now, x.now),
                          x.now, "  ");
    } else if (x.post && x.post->item) {
        line("Posted by a follow-up post now:");
        printPresentation(qax::FollowUpRowPresentation::present(*x.post->item, x.now, x.now), x.now,
                          "  ");
    }
}

void printActivities(const OfferExplanation& x) {
    section("Pending activities");
    if (x.activities.empty()) {
        line("None: nothing is scheduled that would change this.");
    }
    for (const auto& a : x.activities) {
        std::string text = a.identifier + ": ";
        if (a.dueDate) {
            text += "due " + when(*a.dueDate, x.now);
            if (*a.dueDate <= x.now) {
                text += ", so it runs as soon as the agent does";
            }
            if (a.requiresNetwork) {
                text += " (it needs the network)";
            }
        } else {
            text += "no registration with the platform";
        }
        if (a.targetDate && a.targetDate != a.dueDate) {
            text += ", target date " + a.targetDate->description();
        }
        line(text + "; it " + activityEffect(a.identifier) + ".");
    }
}

void printText(const OfferExplanation& x) {
    std::string clock = "at " + x.now.description();
    if (x.simulatedClock) {
        clock += " (simulated clock, " + span(x.clockOffsetSeconds) +
                 (x.clockOffsetSeconds < 0 ? " behind" : " ahead of") + " the system time)";
    }
    if (!x.serialNumber) {
        std::printf("Explaining this device %s.\n", clock.c_str());
        section("Device");
        line(
            "This device has no serial number, so the agent tracks no warranty and posts no "
            "follow-up for it.");
    } else {
        std::printf("Explaining %s %s.\n", x.serialNumber->c_str(), clock.c_str());
        printDevice(x);
        printCache(x);
        printOffer(x);
        printItem(x);
    }
    printActivities(x);
    if (!x.problems.empty()) {
        section("Problems");
        for (const auto& p : x.problems) {
            line("- " + p);
        }
    }
}

int run(const std::vector<std::string>& argsIn) {
    std::vector<std::string> args = argsIn;
    const bool json = takeFlag(args, "--json");
    if (args.size() > 1 || (args.size() == 1 && (args[0].empty() || args[0][0] == '-'))) {
        std::fputs(kUsage, stderr);
        return 64;
    }
    const auto explanation = OfferExplanation::explain(
        qax::HostEnvironment::fromProcessEnvironment(),
        args.empty() ? std::nullopt : std::optional<std::string>(args[0]));
    if (json) {
        std::printf("%s\n", qax::toJsonString(explanation.toValue(), 2).c_str());
    } else {
        printText(explanation);
    }
    return 0;
}

QAXCTL_COMMAND("explain", "explain [SERIAL] [--json]",
               "why the offer is shown for a device, or not: cache, policies, rules, dates", run);

}  // namespace
}  // namespace qaxctl
