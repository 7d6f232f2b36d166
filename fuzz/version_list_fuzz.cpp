// Server version lists: any property list, taken through the negotiation's overlap step
// (installed as the override, which is read without any network access).
#include <cstddef>
#include <cstdint>
#include <string_view>

#include "FuzzPlatform.h"
#include "core/PlistCodec.h"
#include "warranty/QAXServerVersionUtilities.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    static auto platform = qaxfuzz::makePlatform();
    auto list = qax::parsePlist(std::string_view(reinterpret_cast<const char*>(data), size));
    if (!list) {
        return 0;
    }
    platform->preferences->setObject("ServerVersionOverride", *list);
    (void)qax::QAXServerVersionUtilities::isHighServerVersionFeaturesetEnabled(*platform);
    platform->preferences->removeObject("ServerVersionOverride");
    platform->preferences->setObject("ServerVersionCache", *list);
    (void)qax::QAXServerVersionUtilities::_getValidServerVersionCache(*platform);
    return 0;
}
