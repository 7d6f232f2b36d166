// Handles the launch-event stream that starts the agent when a watch is paired or unpaired,
// handing pairing events to the paired-devices monitor it holds. Runs on the stream's default
// queue, concurrently with the main thread; the monitor protects itself.
#pragma once

#include <memory>
#include <string_view>

#include "devices/QAXPairedDevicesMonitor.h"
#include "platform/LaunchEventStream.h"

namespace qax {

class QAXLaunchEventHandler {
  public:
    explicit QAXLaunchEventHandler(std::shared_ptr<QAXPairedDevicesMonitor> monitor = nullptr)
        : pairedDevicesMonitor_(std::move(monitor)) {}

    // Installs `handler` on the agent's launch-event stream, on the stream's default queue.
    static void install(LaunchEventStream& stream, std::shared_ptr<QAXLaunchEventHandler> handler);

    void handleEvent(const LaunchEvent& event);

    // Whether `bytes` are well-formed UTF-8.
    static bool isValidUTF8(std::string_view bytes);

  private:
    const std::shared_ptr<QAXPairedDevicesMonitor> pairedDevicesMonitor_;
};

}  // namespace qax
