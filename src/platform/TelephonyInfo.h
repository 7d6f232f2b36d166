// The carriers of the device's cellular subscriptions. Thread-safe.
#pragma once

#include <optional>
#include <string>
#include <vector>

namespace qax {

struct SubscriberCarrier {
    std::optional<std::string> mobileCountryCode;
    std::optional<std::string> mobileNetworkCode;
};

class TelephonyInfo {
  public:
    virtual ~TelephonyInfo() = default;
    // One entry per subscription.
    virtual std::vector<SubscriberCarrier> subscriberCarriers() = 0;
};

}  // namespace qax
