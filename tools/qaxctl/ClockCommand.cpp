// qaxctl clock: shows and moves the simulated platform clock. The offset lives in
// state/clock.plist; after a change qaxctl posts the clock-changed notification so that a
// running agent re-reads it and fires what has come due. Both the agent and qaxctl follow
// the offset only with QAX_CLOCK=simulated in their environment.
#include <cerrno>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#include "Command.h"
#include "core/JsonCodec.h"
#include "platform/host/HostNotificationSocket.h"
#include "platform/host/HostPlatform.h"
#include "platform/host/SimulatedClock.h"
#include "platform/host/SystemClock.h"

namespace qaxctl {
namespace {

using qax::Date;
using qax::Value;

constexpr const char* kUsage =
    "usage: qaxctl clock [--json]\n"
    "       qaxctl clock advance 3d|5h|15m|90s|SECONDS\n"
    "       qaxctl clock set ISO-DATE\n";

int usage() {
    std::fputs(kUsage, stderr);
    return 64;
}

// "3d", "5h", "15m", "90s" or a plain number of seconds (a sign and a fraction allowed).
std::optional<double> parseDuration(const std::string& text) {
    if (text.empty()) {
        return std::nullopt;
    }
    double unit = 1;
    std::string number = text;
    switch (text.back()) {
        case 'd':
            unit = 86400;
            break;
        case 'h':
            unit = 3600;
            break;
        case 'm':
            unit = 60;
            break;
        case 's':
            break;
        default:
            number += ' ';  // no unit: keep the whole text
    }
    number.pop_back();
    if (number.empty()) {
        return std::nullopt;
    }
    char* end = nullptr;
    errno = 0;
    const double value = std::strtod(number.c_str(), &end);
    if (*end != '\0' || errno == ERANGE || !std::isfinite(value)) {
        return std::nullopt;
    }
    return value * unit;
}

int show(const qax::HostEnvironment& env, bool json) {
    qax::SimulatedClock simulated(env.platformRoot);
    const Date system = qax::SystemClock().now();
    const double offset = simulated.offsetSeconds();
    const Date now = env.simulatedClock ? system.byAdding(offset) : system;
    if (json) {
        Value::Dictionary d{{"simulated", env.simulatedClock},
                            {"offsetSeconds", offset},
                            {"now", now.iso8601()},
                            {"systemTime", system.iso8601()}};
        std::printf("%s\n", qax::toJsonString(Value(std::move(d)), 2).c_str());
        return 0;
    }
    std::printf("now          %s\n", now.description().c_str());
    std::printf("system time  %s\n", system.description().c_str());
    std::printf("offset       %.0f s (%.2f days)%s\n", offset, offset / 86400,
                env.simulatedClock ? "" : ", not applied: QAX_CLOCK is not \"simulated\"");
    return 0;
}

int change(const qax::HostEnvironment& env, const std::function<double(double)>& next) {
    double offset = 0;
    std::string error;
    if (!qax::SimulatedClock::updateOffset(env.platformRoot, next, &offset, &error)) {
        std::fprintf(stderr, "qaxctl: cannot write %s: %s\n",
                     qax::SimulatedClock::clockFilePath(env.platformRoot).c_str(), error.c_str());
        return 1;
    }
    // Nobody listening (no agent running) is fine: the agent reads the file when it starts.
    qax::HostNotificationSocket::post(env.runtimeDirectory, qax::kClockChangedNotification);
    std::printf("simulated now %s (offset %.0f s)\n",
                qax::SystemClock().now().byAdding(offset).description().c_str(), offset);
    if (!env.simulatedClock) {
        std::fprintf(stderr,
                     "qaxctl: note: QAX_CLOCK=simulated is not set here; the agent and qaxctl "
                     "follow the offset only with it\n");
    }
    return 0;
}

int run(const std::vector<std::string>& argsIn) {
    std::vector<std::string> args = argsIn;
    const bool json = takeFlag(args, "--json");
    const auto env = qax::HostEnvironment::fromProcessEnvironment();
    if (args.empty()) {
        return show(env, json);
    }
    if (args.size() != 2 || json) {
        return usage();
    }
    if (args[0] == "advance") {
        auto seconds = parseDuration(args[1]);
        if (!seconds) {
            std::fprintf(stderr, "qaxctl: '%s' is not a duration (3d, 5h, 15m, 90s or seconds)\n",
                         args[1].c_str());
            return 64;
        }
        return change(env, [s = *seconds](double current) { return current + s; });
    }
    if (args[0] == "set") {
        auto date = Date::parseIso8601(args[1]);
        if (!date) {
            std::fprintf(stderr, "qaxctl: '%s' is not an ISO 8601 date (2026-11-22T10:00:00Z)\n",
                         args[1].c_str());
            return 64;
        }
        return change(
            env, [d = *date](double) { return d.timeIntervalSince(qax::SystemClock().now()); });
    }
    return usage();
}

QAXCTL_COMMAND("clock", "clock [--json] | clock advance 3d|5h|90s|SECONDS | clock set ISO-DATE",
               "show or move the simulated platform clock (QAX_CLOCK=simulated)", run);

}  // namespace
}  // namespace qaxctl
