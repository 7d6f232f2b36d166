// The cellular subscriptions of the simulated device: carriers.plist in the platform root, an
// array of {mobileCountryCode, mobileNetworkCode: string}. A missing file means no
// subscription; an entry keeps what it has. Thread-safe.
#pragma once

#include <string>

#include "platform/TelephonyInfo.h"
#include "platform/host/CheckedPlistFile.h"

namespace qax {

class HostTelephonyInfo : public TelephonyInfo {
  public:
    explicit HostTelephonyInfo(const std::string& platformRoot);

    std::vector<SubscriberCarrier> subscriberCarriers() override;

  private:
    CheckedPlistFile file_;
};

}  // namespace qax
