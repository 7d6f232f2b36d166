// Feature flags from features.plist under the platform root: {domain: {flag: bool}}. A flag
// that is not listed, or is listed with a value other than a true boolean or non-zero number,
// is off. Thread-safe; the file is re-read when it changes.
#pragma once

#include <string>

#include "platform/FeatureFlags.h"
#include "platform/host/CachedPlistFile.h"

namespace qax {

class HostFeatureFlags : public FeatureFlags {
  public:
    explicit HostFeatureFlags(const std::string& platformRoot);
    bool isFeatureEnabled(std::string_view domain, std::string_view flag) override;

  private:
    CachedPlistFile file_;
};

}  // namespace qax
