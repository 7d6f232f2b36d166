// The source of "now" and of the local time zone's offset. Every read of the current time
// in the agent goes through a Clock so that tests can pin it. Implementations are
// thread-safe.
#pragma once

#include <atomic>
#include <mutex>

#include "core/Date.h"

namespace qax {

class Clock {
  public:
    virtual ~Clock() = default;
    virtual Date now() const = 0;
    // Offset of the local time zone from GMT at `at`, in seconds (east positive).
    virtual int secondsFromGMT(Date at) const = 0;
};

// The wall clock that file systems stamp modification times with, in nanoseconds since 1970:
// for comparing with those times only. A simulated clock must not move it. (Defined with the
// host's SystemClock, the one other reader of the wall clock.)
long long fileSystemTimeNs();

// A clock that only moves when told to: tests and the virtual-time task runner.
class ManualClock : public Clock {
  public:
    explicit ManualClock(Date start = Date(1'700'000'000.0), int secondsFromGMT = 0)
        : now_(start.secondsSince1970()), offset_(secondsFromGMT) {}
    Date now() const override { return Date(now_.load()); }
    int secondsFromGMT(Date) const override { return offset_.load(); }

    void set(Date d) { now_.store(d.secondsSince1970()); }
    void advanceBy(double seconds) { now_.store(now_.load() + seconds); }
    void setSecondsFromGMT(int offset) { offset_.store(offset); }

  private:
    std::atomic<double> now_;
    std::atomic<int> offset_;
};

}  // namespace qax
