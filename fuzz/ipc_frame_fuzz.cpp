// IPC frames as a client might send them, in arbitrary chunks.
#include <cstddef>
#include <cstdint>
#include <string>

#include "core/PlistCodec.h"
#include "platform/host/IpcFrameCodec.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    qax::IpcFrameCodec codec;
    const char* bytes = reinterpret_cast<const char*>(data);
    // The first byte picks the chunk size, so frames arrive split at many places.
    const std::size_t chunk = size ? 1 + data[0] % 64 : 1;
    for (std::size_t off = 0; off < size; off += chunk) {
        codec.append(std::string_view(bytes + off, std::min(chunk, size - off)));
        std::string payload;
        for (;;) {
            auto status = codec.next(payload);
            if (status == qax::IpcFrameCodec::Status::Frame) {
                if (auto message = qax::parsePlist(payload)) {
                    (void)qax::IpcFrameCodec::encode(*message);
                }
                continue;
            }
            if (status == qax::IpcFrameCodec::Status::Error) {
                return 0;
            }
            break;
        }
    }
    return 0;
}
