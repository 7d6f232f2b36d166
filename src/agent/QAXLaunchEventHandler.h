// Handles the launch-event stream that starts the agent when a watch is paired or unpaired.
// Runs on the stream's default queue, concurrently with the main thread; it keeps no state of
// its own.
#pragma once

#include <string_view>

#include "platform/LaunchEventStream.h"

namespace qax {

class QAXLaunchEventHandler {
  public:
    // Installs `handler` on the agent's launch-event stream, on the stream's default queue.
    static void install(LaunchEventStream& stream, std::shared_ptr<QAXLaunchEventHandler> handler);

    void handleEvent(const LaunchEvent& event);

    // Whether `bytes` are well-formed UTF-8.
    static bool isValidUTF8(std::string_view bytes);
};

}  // namespace qax
