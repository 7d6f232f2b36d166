#include "agent/QAXLaunchEventHandler.h"

#include <cstdint>
#include <string>

#include "core/Log.h"
#include "platform/PairedDeviceRegistry.h"

namespace qax {
namespace {

constexpr const char* kLaunchEventStream = "com.velmora.notifyd.matching";

}  // namespace

void QAXLaunchEventHandler::install(LaunchEventStream& stream,
                                    std::shared_ptr<QAXLaunchEventHandler> handler) {
    stream.installStreamHandler(kLaunchEventStream, nullptr, [handler](const LaunchEvent& event) {
        handler->handleEvent(event);
    });
}

void QAXLaunchEventHandler::handleEvent(const LaunchEvent& event) {
    const auto& raw = event.eventName();
    qaxLog().info("entered stream for test");
    if (!raw) {
        return;
    }
    if (!isValidUTF8(*raw)) {
        qaxLog().error("notificationName is nil");
        return;
    }
    const std::string& name = *raw;
    qaxLog().info("got launched with notificationName: %@", name);
    if (name == kPairedDeviceDidPairNotification || name == kPairedDeviceDidUnpairNotification) {
        if (pairedDevicesMonitor_) {
            pairedDevicesMonitor_->updatePariedDevicesFollowUp();
        }
    }
}

bool QAXLaunchEventHandler::isValidUTF8(std::string_view bytes) {
    std::size_t i = 0;
    const std::size_t n = bytes.size();
    while (i < n) {
        const auto c = static_cast<std::uint8_t>(bytes[i]);
        std::size_t extra;
        std::uint32_t cp;
        if (c < 0x80) {
            ++i;
            continue;
        } else if (c >= 0xC2 && c <= 0xDF) {
            extra = 1;
            cp = c & 0x1F;
        } else if (c >= 0xE0 && c <= 0xEF) {
            extra = 2;
            cp = c & 0x0F;
        } else if (c >= 0xF0 && c <= 0xF4) {
            extra = 3;
            cp = c & 0x07;
        } else {
            return false;
        }
        if (i + extra >= n) {
            return false;
        }
        for (std::size_t k = 1; k <= extra; ++k) {
            const auto cc = static_cast<std::uint8_t>(bytes[i + k]);
            if ((cc & 0xC0) != 0x80) {
                return false;
            }
            cp = (cp << 6) | (cc & 0x3F);
        }
        // Overlong forms, surrogates and code points past U+10FFFF.
        if ((extra == 2 && cp < 0x800) || (extra == 3 && cp < 0x10000) || cp > 0x10FFFF ||
            (cp >= 0xD800 && cp <= 0xDFFF)) {
            return false;
        }
        i += extra + 1;
    }
    return true;
}

}  // namespace qax
