// Build-type checks and the engineering overrides that only internal builds honour.
// Stateless: every call asks the platform again. Any thread.
#pragma once

#include <optional>
#include <string_view>

#include "core/Value.h"

namespace qax {

struct Platform;

class QAXUtilities {
  public:
    // Whether the installed system is an internal build; evaluated on every call.
    static bool isInternal(const Platform& platform);

    // The stored value of an override that takes effect on internal builds only
    // ("SerialNumber", "PairedWatchesSerialNumbers", "WebFlowURL"); none on other builds
    // and when nothing is stored.
    static std::optional<Value> internalOverride(const Platform& platform, std::string_view key);
};

}  // namespace qax
