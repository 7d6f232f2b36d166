#include "platform/host/SimulatedClock.h"

#include <cmath>
#include <filesystem>

#include "core/AtomicFile.h"
#include "core/Log.h"
#include "core/PlistCodec.h"
#include "platform/host/HostFileLock.h"
#include "platform/host/SystemClock.h"

namespace qax {
namespace {

constexpr const char* kOffsetSecondsKey = "OffsetSeconds";

}  // namespace

SimulatedClock::SimulatedClock(const std::string& platformRoot, std::shared_ptr<Clock> base)
    : base_(base ? std::move(base) : std::make_shared<SystemClock>()),
      file_(clockFilePath(platformRoot), Value::Kind::Dictionary) {
    reloadOffset();
}

Date SimulatedClock::now() const {
    return base_->now().byAdding(offset_.load());
}

int SimulatedClock::secondsFromGMT(Date at) const {
    return base_->secondsFromGMT(at);
}

void SimulatedClock::reloadOffset() {
    offset_.store(offsetFrom(file_));
}

std::string SimulatedClock::clockFilePath(const std::string& platformRoot) {
    return (std::filesystem::path(platformRoot) / "state" / "clock.plist").string();
}

double SimulatedClock::offsetFrom(CheckedPlistFile& file) {
    auto root = file.read();
    const Value* offset = root ? root->find(kOffsetSecondsKey) : nullptr;
    if (!offset) {
        return 0;
    }
    auto seconds = offset->asDouble();
    if (!seconds || !std::isfinite(*seconds)) {
        qaxLog().error("Ignoring %@ in '%@': %@ is not a finite number of seconds",
                       kOffsetSecondsKey, file.path(), offset->description());
        return 0;
    }
    return *seconds;
}

bool SimulatedClock::updateOffset(const std::string& platformRoot,
                                  const std::function<double(double current)>& change,
                                  double* result, std::string* error) {
    const std::string path = clockFilePath(platformRoot);
    HostFileLock lock(path + ".lock");
    CheckedPlistFile file(path, Value::Kind::Dictionary);
    const double next = change(offsetFrom(file));
    if (!std::isfinite(next)) {
        if (error) {
            *error = "the new offset is not a finite number";
        }
        return false;
    }
    auto xml = toXmlPlist(Value(Value::Dictionary{{kOffsetSecondsKey, next}}));
    if (!xml || !writeFileAtomically(path, *xml, error)) {
        return false;
    }
    if (result) {
        *result = next;
    }
    return true;
}

}  // namespace qax
