// The platform's analytics events. Thread-safe.
#pragma once

#include <functional>
#include <string>

#include "core/Value.h"

namespace qax {

class AnalyticsSink {
  public:
    virtual ~AnalyticsSink() = default;
    // `payload` is called only if the event is recorded.
    virtual void sendEventLazily(const std::string& name, std::function<Value()> payload) = 0;
};

}  // namespace qax
