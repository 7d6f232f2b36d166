// Analytics events as lines {"time", "event", "payload"} of state/analytics.jsonl. The sink
// is on unless analytics.plist in the platform root says {Enabled: false}; while it is off a
// payload is never built. Thread-safe.
#pragma once

#include <memory>
#include <string>

#include "core/Clock.h"
#include "platform/AnalyticsSink.h"
#include "platform/host/CheckedPlistFile.h"

namespace qax {

class HostAnalyticsSink : public AnalyticsSink {
  public:
    HostAnalyticsSink(const std::string& platformRoot, std::shared_ptr<Clock> clock);

    void sendEventLazily(const std::string& name, std::function<Value()> payload) override;

    static std::string eventsPath(const std::string& platformRoot);

  private:
    bool enabled();

    CheckedPlistFile settings_;
    const std::string eventsPath_;
    const std::shared_ptr<Clock> clock_;
};

}  // namespace qax
