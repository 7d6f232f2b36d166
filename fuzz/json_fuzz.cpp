// Coverage summaries and other JSON from the network.
#include <cstddef>
#include <cstdint>
#include <string_view>

#include "core/JsonCodec.h"
#include "core/PlistCodec.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    auto v = qax::parseJson(std::string_view(reinterpret_cast<const char*>(data), size));
    if (v) {
        (void)qax::toXmlPlist(*v);
        (void)qax::toJsonString(*v);
    }
    return 0;
}
