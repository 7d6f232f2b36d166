// qaxctl followups: what the settings application would show for each pending follow-up item,
// read straight from the follow-up store (no agent needed): title, footer, the remaining-days
// text, the badge, the notification and its buttons, the target and the expiration. Uses the
// platform clock, so under QAX_CLOCK=simulated the days follow `qaxctl clock advance`.
#include <cstdio>
#include <string>
#include <vector>

#include "Command.h"
#include "core/JsonCodec.h"
#include "platform/host/FollowUpRowPresentation.h"
#include "platform/host/HostFollowUpCenter.h"
#include "platform/host/HostPlatform.h"

namespace qaxctl {
namespace {

using qax::FollowUpRowPresentation;
using qax::Value;

constexpr const char* kUsage = "usage: qaxctl followups [--json]\n";

const char* orNone(const std::optional<std::string>& text) {
    return text ? text->c_str() : "(none)";
}

void printText(const std::string& client, const FollowUpRowPresentation& p) {
    std::printf("%s  [%s]\n", orNone(p.uniqueIdentifier), client.c_str());
    std::printf("  title         %s\n", orNone(p.title));
    std::printf("  footer        %s\n", orNone(p.footer));
    if (p.expired) {
        std::printf("  days          (expired)\n");
    } else if (p.remainingDays) {
        std::printf("  days          %lld: %s\n", static_cast<long long>(*p.remainingDays),
                    orNone(p.dayText));
    }
    std::printf("  badge         %s\n", p.badge ? "on" : "off");
    if (p.notification) {
        std::printf("  notification  %s", orNone(p.notification->title));
        if (p.notification->text) {
            std::printf(": %s", p.notification->text->c_str());
        }
        std::printf("  [%s] [%s]\n", orNone(p.notification->activateLabel),
                    orNone(p.notification->clearLabel));
    } else {
        std::printf("  notification  none\n");
    }
    std::printf("  target        %s\n", orNone(p.target));
    std::printf("  expires       %s%s\n",
                p.expiration ? p.expiration->description().c_str() : "never",
                p.expired ? " (expired)" : "");
}

int run(const std::vector<std::string>& argsIn) {
    std::vector<std::string> args = argsIn;
    const bool json = takeFlag(args, "--json");
    if (!args.empty()) {
        std::fputs(kUsage, stderr);
        return 64;
    }
    const auto env = qax::HostEnvironment::fromProcessEnvironment();
    auto clock = qax::makeHostClock(env);
    const qax::Date now = clock->now();
    qax::HostFollowUpCenter store(env.platformRoot, clock);
    Value::Array list;
    bool any = false;
    for (const auto& client : store.clientIdentifiers()) {
        for (const auto& stored : store.storedItems(client)) {
            auto p = FollowUpRowPresentation::present(stored.item, stored.postedDate, now);
            if (json) {
                Value v = p.toValue();
                v["client"] = client;
                list.push_back(std::move(v));
            } else {
                if (any) {
                    std::printf("\n");
                }
                printText(client, p);
            }
            any = true;
        }
    }
    if (json) {
        std::printf("%s\n", qax::toJsonString(Value(std::move(list)), 2).c_str());
    } else if (!any) {
        std::printf("no pending follow-ups\n");
    }
    return 0;
}

QAXCTL_COMMAND("followups", "followups [--json]",
               "show the pending follow-ups as the settings application would", run);

}  // namespace
}  // namespace qaxctl
