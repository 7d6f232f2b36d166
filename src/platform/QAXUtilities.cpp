#include "platform/QAXUtilities.h"

#include "platform/DeviceProperties.h"
#include "platform/Platform.h"
#include "platform/PreferenceStore.h"

namespace qax {

bool QAXUtilities::isInternal(const Platform& platform) {
    return platform.deviceProperties && platform.deviceProperties->isInternalBuild();
}

std::optional<Value> QAXUtilities::internalOverride(const Platform& platform,
                                                    std::string_view key) {
    if (!isInternal(platform)) {
        return std::nullopt;
    }
    return platform.preferences->objectForKey(key);
}

}  // namespace qax
