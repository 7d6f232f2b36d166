// Property lists from outside the process: cache and preference files, IPC payloads and
// the server version list.
#include <cstddef>
#include <cstdint>
#include <string_view>

#include "core/PlistCodec.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    auto v = qax::parsePlist(std::string_view(reinterpret_cast<const char*>(data), size));
    if (v) {
        (void)qax::toBinaryPlist(*v);
        (void)v->description();
    }
    return 0;
}
