#include "platform/host/SystemClock.h"

#include <chrono>
#include <cmath>
#include <ctime>

namespace qax {

long long fileSystemTimeNs() {
    timespec now{};
    clock_gettime(CLOCK_REALTIME, &now);
    return now.tv_sec * 1'000'000'000LL + now.tv_nsec;
}

Date SystemClock::now() const {
    using namespace std::chrono;
    return Date(duration<double>(system_clock::now().time_since_epoch()).count());
}

int SystemClock::secondsFromGMT(Date at) const {
    std::time_t t = static_cast<std::time_t>(std::floor(at.secondsSince1970()));
    std::tm tm{};
    if (!localtime_r(&t, &tm)) {
        return 0;
    }
    return static_cast<int>(tm.tm_gmtoff);
}

}  // namespace qax
