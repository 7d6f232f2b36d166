#include "support/QAXVelmoraSupportManager.h"

#include <chrono>
#include <condition_variable>
#include <mutex>

#include "core/Log.h"
#include "core/OnceCallback.h"
#include "platform/AccountStore.h"
#include "platform/ApplicationRegistry.h"
#include "platform/Platform.h"
#include "platform/PreferenceStore.h"
#include "platform/PurchaseHistory.h"
#include "platform/StoreLookup.h"
#include "platform/UserInterfaceStrings.h"

namespace qax {
namespace {

constexpr const char* kBundleIDKey = "AppBundleID";
constexpr const char* kTitleKey = "AppTitleKey";
constexpr const char* kVendorKey = "AppVendorName";
// The settings application reads the key with this spelling.
constexpr const char* kTextKey = "AppAvailablityText";
constexpr const char* kTypeKey = "AppAvailabilityType";
constexpr const char* kLinkKey = "AppLinkURL";
constexpr const char* kIconKey = "AppIconURL";

constexpr std::uint64_t kNotAvailable = 0;
constexpr std::uint64_t kInstalled = 1;
constexpr std::uint64_t kPurchased = 2;
constexpr std::uint64_t kInStore = 3;

constexpr const char* kCampaignQuery = "?pt=2003&ct=coverage.settings&mt=8";
constexpr const char* kPurchaseTitleFallback = "== Velmora Support ==";
constexpr const char* kPurchaseVendorFallback = "== Velmora ==";
constexpr const char* kDownloadText = "DOWNLOAD";
constexpr const char* kInStoreText = "Free – On the Marketa";
constexpr const char* kInstalledStringKey = "INSTALLED";
constexpr const char* kStringsTable = "Localizable";

constexpr const char* kForcedAvailabilityKey = "AppSupportAvailability";
constexpr const char* kForcedTitle = "Velmora Support";
constexpr const char* kForcedVendor = "Velmora";
constexpr const char* kForcedText = "OVERRIDE";

std::string withCampaign(const std::optional<std::string>& url) {
    const std::string link = url.value_or("");
    return link.empty() ? link : link + kCampaignQuery;
}

bool typeIsNotAvailable(const Value::Dictionary& d) {
    auto it = d.find(kTypeKey);
    return it == d.end() || it->second.asInteger().value_or(0) == 0;
}

// The store account of the primary cloud account; 0 without one.
std::int64_t storeAccountID(AccountStore* accounts) {
    if (!accounts) {
        return 0;
    }
    auto primary = accounts->primaryCloudAccount();
    if (!primary) {
        return 0;
    }
    auto store = accounts->ostaraAccountForCloudAccount(*primary);
    return store ? store->storeAccountID.value_or(0) : 0;
}

}  // namespace

QAXVelmoraSupportManager::QAXVelmoraSupportManager(std::shared_ptr<Platform> platform,
                                                   double purchaseWaitSeconds)
    : platform_(std::move(platform)), purchaseWaitSeconds_(purchaseWaitSeconds) {}

void QAXVelmoraSupportManager::appSupportAvailability(
    const std::string& bundleIdentifier, std::function<void(Value::Dictionary)> reply) {
    Value::Dictionary answer{{kBundleIDKey, Value(bundleIdentifier)}};

    std::optional<ApplicationRecord> app;
    if (platform_->applications) {
        app = platform_->applications->applicationForBundleIdentifier(bundleIdentifier);
    }
    if (app && app->installed) {
        qaxLog().info("appSupportAvailability %@ %@ is installed.", bundleIdentifier,
                      app->localizedName);
        const std::string installed =
            platform_->uiStrings
                ? platform_->uiStrings->localizedString(kInstalledStringKey, "", kStringsTable)
                : std::string();
        answer[kTitleKey] = Value(app->localizedName.value_or(""));
        answer[kVendorKey] = Value(app->vendorName.value_or(""));
        answer[kTextKey] = Value(installed);
        answer[kTypeKey] = Value(kInstalled);
        reply(std::move(answer));
        return;
    }

    Value::Dictionary purchased = checkAppIsPurchased(bundleIdentifier);
    if (!typeIsNotAvailable(purchased)) {
        qaxLog().info("appSupportAvailability %@ is purchased.", bundleIdentifier);
        for (auto& [key, value] : purchased) {
            answer[key] = std::move(value);
        }
        reply(std::move(answer));
        return;
    }

    checkIsAvailableInStore(
        bundleIdentifier, [answer = std::move(answer), reply = std::move(reply)](
                              std::optional<Value::Dictionary> store) mutable {
            qaxLog().info("Marketa --> appSupportAvailability %@.",
                          store ? std::optional<Value>(Value(*store)) : std::nullopt);
            if (store) {
                for (auto& [key, value] : *store) {
                    answer[key] = std::move(value);
                }
            }
            reply(std::move(answer));
        });
}

Value::Dictionary QAXVelmoraSupportManager::checkAppIsPurchased(
    const std::string& bundleIdentifier) {
    struct Wait {
        std::mutex mutex;
        std::condition_variable answered;
        bool done = false;
        bool returned = false;
        Value::Dictionary result{{kTypeKey, Value(kNotAvailable)}};
    };
    auto wait = std::make_shared<Wait>();
    if (!platform_->purchases) {
        return wait->result;
    }
    platform_->purchases->purchasesForAccount(
        storeAccountID(platform_->accounts.get()), {bundleIdentifier},
        [wait, bundleIdentifier](std::vector<PurchaseRecord> records, std::optional<std::string>) {
            std::lock_guard lock(wait->mutex);
            if (wait->returned) {
                return;  // too late: the caller has answered already
            }
            for (const auto& record : records) {
                if (record.bundleIdentifier != bundleIdentifier) {
                    continue;
                }
                wait->result[kLinkKey] = Value(withCampaign(record.productURL));
                wait->result[kTitleKey] = Value(record.title.value_or(kPurchaseTitleFallback));
                wait->result[kVendorKey] =
                    Value(record.developerName.value_or(kPurchaseVendorFallback));
                wait->result[kTextKey] = Value(kDownloadText);
                wait->result[kTypeKey] = Value(kPurchased);
                break;
            }
            wait->done = true;
            wait->answered.notify_all();
        });
    std::unique_lock lock(wait->mutex);
    wait->answered.wait_for(lock, std::chrono::duration<double>(purchaseWaitSeconds_),
                            [&wait] { return wait->done; });
    wait->returned = true;
    return wait->result;
}

void QAXVelmoraSupportManager::checkIsAvailableInStore(
    const std::string& bundleIdentifier,
    std::function<void(std::optional<Value::Dictionary>)> reply) {
    qaxLog().info("Checking for %@ in the Marketa", bundleIdentifier);
    if (platform_->preferences->boolForKey(kForcedAvailabilityKey)) {
        reply(Value::Dictionary{{kTitleKey, Value(kForcedTitle)},
                                {kVendorKey, Value(kForcedVendor)},
                                {kTextKey, Value(kForcedText)},
                                {kTypeKey, Value(kInstalled)}});
        return;
    }
    if (!platform_->store) {
        qaxLog().info("Lookup for %@ in the Marketa failed with error %@", bundleIdentifier,
                      "no store");
        reply(std::nullopt);
        return;
    }
    reply = onceCallback(std::move(reply), "checkIsAvailableInStore");
    platform_->store->lookUpBundleIdentifier(
        bundleIdentifier,
        [bundleIdentifier, reply](std::vector<StoreItem> items, std::optional<std::string> error) {
            if (error || items.empty()) {
                qaxLog().info("Lookup for %@ in the Marketa failed with error %@", bundleIdentifier,
                              error);
                reply(std::nullopt);
                return;
            }
            if (items.size() != 1) {
                reply(Value::Dictionary{{kTypeKey, Value(kNotAvailable)}});
                return;
            }
            const StoreItem& item = items.front();
            reply(Value::Dictionary{
                {kLinkKey, Value(withCampaign(item.productPageURL))},
                {kIconKey, Value(item.artworkURLs.empty() ? std::string() : item.artworkURLs[0])},
                {kTitleKey, Value(item.displayName.value_or(""))},
                {kVendorKey, Value(item.artistName.value_or(""))},
                {kTextKey, Value(kInStoreText)},
                {kTypeKey, Value(kInStore)},
            });
        });
}

}  // namespace qax
