// Property lists from outside the process: cache and preference files, IPC payloads and
// the server version list. Binary lists the codec reads directly must read as the library
// reads them.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "core/PlistCodec.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    const std::string_view bytes(reinterpret_cast<const char*>(data), size);
    auto v = qax::parsePlist(bytes);
    if (qax::isBinaryPlist(bytes) && v != qax::parsePlistWithLibrary(bytes)) {
        std::abort();
    }
    if (v) {
        (void)qax::toBinaryPlist(*v);
        (void)v->description();
    }
    return 0;
}
