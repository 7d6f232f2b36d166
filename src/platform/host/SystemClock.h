// The host's wall clock and local time zone. Thread-safe.
#pragma once

#include "core/Clock.h"

namespace qax {

class SystemClock : public Clock {
  public:
    Date now() const override;
    int secondsFromGMT(Date at) const override;
};

}  // namespace qax
