// The platform's feature flags, by domain and flag name. Thread-safe; every call reads the
// flags afresh.
#pragma once

#include <string_view>

namespace qax {

class FeatureFlags {
  public:
    virtual ~FeatureFlags() = default;
    // False for a flag that is not listed.
    virtual bool isFeatureEnabled(std::string_view domain, std::string_view flag) = 0;
};

}  // namespace qax
