#include "fakes/FakeAnalyticsSink.h"

namespace qax::test {

void RecordingAnalyticsSink::sendEventLazily(const std::string& name,
                                             std::function<Value()> payload) {
    if (!enabled) {
        return;
    }
    // Built outside the lock: the payload callback logs.
    Value built = payload();
    std::lock_guard lock(mutex_);
    events_.push_back({name, std::move(built)});
}

std::vector<RecordingAnalyticsSink::Event> RecordingAnalyticsSink::events() const {
    std::lock_guard lock(mutex_);
    return events_;
}

}  // namespace qax::test
