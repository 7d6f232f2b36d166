// Whether the vendor's support application is installed, already purchased (downloadable
// again) or obtainable from the Marketa, with its listing data, as the dictionary the
// settings application reads. One manager per request. appSupportAvailability blocks its
// thread for up to the purchase wait: run it only where blocking is allowed. Store answers
// arrive on the store's thread, where the reply is called.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "core/Value.h"

namespace qax {

struct Platform;

class QAXVelmoraSupportManager {
  public:
    // How long the purchase check waits for the purchase history.
    static constexpr double kPurchaseWaitSeconds = 5;

    explicit QAXVelmoraSupportManager(std::shared_ptr<Platform> platform,
                                      double purchaseWaitSeconds = kPurchaseWaitSeconds);

    // Installed, else purchased, else the store's answer; always at least {"AppBundleID"}.
    void appSupportAvailability(const std::string& bundleIdentifier,
                                std::function<void(Value::Dictionary)> reply);
    // The store listing (type 3), type 0 unless exactly one item matches, none when the
    // look-up fails; the forced answer when "AppSupportAvailability" is set.
    void checkIsAvailableInStore(const std::string& bundleIdentifier,
                                 std::function<void(std::optional<Value::Dictionary>)> reply);
    // Type 2 with the purchase's listing, else type 0. Waits at most the purchase wait; an
    // answer that comes later changes nothing.
    Value::Dictionary checkAppIsPurchased(const std::string& bundleIdentifier);

  private:
    const std::shared_ptr<Platform> platform_;
    const double purchaseWaitSeconds_;
};

}  // namespace qax
