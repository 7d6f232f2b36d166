#include "platform/host/HostAnalyticsSink.h"

#include <filesystem>

#include "core/Log.h"
#include "platform/host/JsonLinesFile.h"

namespace qax {
namespace {

constexpr const char* kEnabledKey = "Enabled";

}  // namespace

HostAnalyticsSink::HostAnalyticsSink(const std::string& platformRoot, std::shared_ptr<Clock> clock)
    : settings_((std::filesystem::path(platformRoot) / "analytics.plist").string(),
                Value::Kind::Dictionary),
      eventsPath_(eventsPath(platformRoot)),
      clock_(std::move(clock)) {}

std::string HostAnalyticsSink::eventsPath(const std::string& platformRoot) {
    return (std::filesystem::path(platformRoot) / "state" / "analytics.jsonl").string();
}

bool HostAnalyticsSink::enabled() {
    auto settings = settings_.read();
    const Value* enabled = settings ? settings->find(kEnabledKey) : nullptr;
    // Only an explicit false turns the sink off; a mistyped value is no decision.
    return !(enabled && enabled->isBool() && !*enabled->asBool());
}

void HostAnalyticsSink::sendEventLazily(const std::string& name, std::function<Value()> payload) {
    if (!enabled() || !payload) {
        return;
    }
    Value::Dictionary line{{"time", clock_->now().iso8601()}, {"event", name}};
    line["payload"] = payload();
    std::string error;
    if (!JsonLinesFile::append(eventsPath_, Value(std::move(line)), &error)) {
        qaxLog().error("Cannot record analytics event '%@': %@", name, error);
    }
}

}  // namespace qax
