// Named event streams that start the agent on demand (a watch paired or unpaired). A
// handler runs on the queue given at installation, or on the stream's own default queue,
// concurrently with the main thread. Thread-safe.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "core/TaskRunner.h"

namespace qax {

// One delivered event.
class LaunchEvent {
  public:
    explicit LaunchEvent(std::optional<std::string> name) : name_(std::move(name)) {}
    // The event's name as raw bytes (expected UTF-8, not checked); none when it has none.
    const std::optional<std::string>& eventName() const { return name_; }

  private:
    std::optional<std::string> name_;
};

class LaunchEventStream {
  public:
    virtual ~LaunchEventStream() = default;
    // Installs the handler of the named stream; a null `queue` means the stream's default
    // queue. Events start being delivered at once.
    virtual void installStreamHandler(const std::string& streamName,
                                      std::shared_ptr<TaskRunner> queue,
                                      std::function<void(const LaunchEvent&)> handler) = 0;
};

}  // namespace qax
