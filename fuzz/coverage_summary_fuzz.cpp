// Coverage summaries from the network, all the way into a warranty record and its derived
// values and archive.
#include <cstddef>
#include <cstdint>
#include <string_view>

#include "FuzzPlatform.h"
#include "core/JsonCodec.h"
#include "warranty/QAXWarranty.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    static auto platform = qaxfuzz::makePlatform();
    auto value = qax::parseJson(std::string_view(reinterpret_cast<const char*>(data), size));
    if (!value) {
        return 0;
    }
    auto warranty = qax::QAXWarranty::warrantyWithDictionary(platform, value);
    if (!warranty) {
        return 0;
    }
    (void)warranty->daysEligible();
    (void)warranty->hvLocalizedOfferDesc();
    (void)warranty->hvLocalizedNotificationOfferDesc();
    (void)warranty->hvLocalizedOfferDetailsEligibility();
    (void)warranty->description();
    auto back = qax::QAXWarranty::decode(platform, warranty->encode());
    if (back && !back->isEqual(warranty.get())) {
        __builtin_trap();  // an archive must round-trip
    }
    return 0;
}
