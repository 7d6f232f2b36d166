// The platform clock under QAX_CLOCK=simulated: the host's time plus an offset kept in
// state/clock.plist ({OffsetSeconds: number}, absent = 0), so that days pass in seconds for a
// demo or a test. The offset is read at creation and again by reloadOffset(), which the agent
// runs when the notification kClockChangedNotification arrives (qaxctl clock posts it).
// Thread-safe: the offset is atomic; file updates are serialized by a lock file.
#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <string>

#include "core/Clock.h"
#include "platform/host/CheckedPlistFile.h"

namespace qax {

// Posted after state/clock.plist changed.
inline constexpr const char* kClockChangedNotification = "com.velmora.qax.clock.changed";

class SimulatedClock : public Clock {
  public:
    // `base` is the host's time (a SystemClock unless a test gives another).
    explicit SimulatedClock(const std::string& platformRoot, std::shared_ptr<Clock> base = nullptr);

    Date now() const override;
    int secondsFromGMT(Date at) const override;

    // Reads the offset from the file again; an unusable value leaves 0.
    void reloadOffset();
    double offsetSeconds() const { return offset_.load(); }

    static std::string clockFilePath(const std::string& platformRoot);
    // Rewrites the file under its lock with `change(current offset)`; the new offset in
    // `result`. False with `error` when the file cannot be written or the offset is not finite.
    static bool updateOffset(const std::string& platformRoot,
                             const std::function<double(double current)>& change, double* result,
                             std::string* error);

  private:
    static double offsetFrom(CheckedPlistFile& file);

    std::shared_ptr<Clock> base_;
    CheckedPlistFile file_;
    std::atomic<double> offset_{0};
};

}  // namespace qax
