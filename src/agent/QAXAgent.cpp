#include "agent/QAXAgent.h"

#include "agent/QAXAgentDefaultWarrantyProvider.h"
#include "core/Log.h"
#include "devices/QAXDevicesManager.h"
#include "platform/AgentFactory.h"
#include "platform/LocaleInfo.h"
#include "platform/Platform.h"
#include "platform/PreferenceStore.h"
#include "platform/QAXUtilities.h"
#include "scheduling/QAXSchedulerActivityDelegate.h"
#include "support/QAXVelmoraSupportManager.h"
#include "warranty/QAXServerVersionUtilities.h"
#include "warranty/QAXWarranty.h"

namespace qax {
namespace {

constexpr const char* kPolicyQueueName = "com.velmora.kestova.qaxagent.policyqueue";
constexpr const char* kPreferencesBundleID = "com.velmora.Preferences";

// The cache layout a cached warranty must have been written with to be used.
constexpr const char* kCurrentCacheVersion = "2";
constexpr std::int32_t kCurrentMigrationVersion = 2;

constexpr const char* kPostUpgradeActivityCompletedKey = "PostUpgradeActivityCompleted";
constexpr const char* kPostUpgradeOutreachDelayKey = "PostUpgradeOutreachDelay";
constexpr const char* kInitialOutreachActivityScheduledKey = "InitialOutreachActivityScheduled";
constexpr const char* kPairedWatchesSerialNumbersKey = "PairedWatchesSerialNumbers";
constexpr const char* kPairedBluetoothDevicesSerialNumbersKey =
    "PairedBluetoothDevicesSerialNumbers";

constexpr const char* kUnknownDeviceName = "<unknown>";

// The printed form of a list of device infos in logs.

// The value a substitution dictionary holds for `serialNumber`, when it holds a string.
std::optional<std::string> substitute(const std::optional<Value::Dictionary>& dictionary,
                                      const std::string& serialNumber) {
    if (!dictionary) {
        return std::nullopt;
    }
    auto it = dictionary->find(serialNumber);
    if (it == dictionary->end() || !it->second.isString()) {
        return std::nullopt;
    }
    return *it->second.asString();
}

}  // namespace

std::shared_ptr<QAXAgent> QAXAgent::initWithCallingProcessBundleID(
    std::shared_ptr<Platform> platform, std::optional<std::string> callingProcessBundleID) {
    if (!callingProcessBundleID) {
        qaxLog().info("%s: callingProcessBundleID is nil. Falling back to Preferences Bundle ID",
                      "-[QAXAgent initWithCallingProcessBundleID:]");
        callingProcessBundleID = kPreferencesBundleID;
    }
    auto warrantyProvider = QAXAgentDefaultWarrantyProvider::initWithCallingProcessBundleID(
        platform, *callingProcessBundleID);
    auto agent = initWithWarrantyProvider(platform, std::move(warrantyProvider),
                                          QAXDevicesManager::sharedManager(platform));
    agent->callingProcessBundleID_ = std::move(*callingProcessBundleID);
    return agent;
}

std::shared_ptr<QAXAgent> QAXAgent::initWithWarrantyProvider(
    std::shared_ptr<Platform> platform, std::shared_ptr<QAXAgentWarrantyProvider> warrantyProvider,
    std::shared_ptr<QAXAgentDeviceProvider> deviceProvider) {
    return std::make_shared<QAXAgent>(std::move(platform), std::move(warrantyProvider),
                                      std::move(deviceProvider));
}

QAXAgent::QAXAgent(std::shared_ptr<Platform> platform,
                   std::shared_ptr<QAXAgentWarrantyProvider> warrantyProvider,
                   std::shared_ptr<QAXAgentDeviceProvider> deviceProvider)
    : platform_(std::move(platform)),
      policyLookupQueue_(platform_->dispatcher->makeSerialQueue(kPolicyQueueName)),
      warrantyProvider_(std::move(warrantyProvider)),
      deviceProvider_(std::move(deviceProvider)) {}

std::shared_ptr<QAXAgentWarrantyProvider> QAXAgent::warrantyProvider() const {
    std::lock_guard lock(providerMutex_);
    return warrantyProvider_;
}

void QAXAgent::setWarrantyProvider(std::shared_ptr<QAXAgentWarrantyProvider> provider) {
    std::lock_guard lock(providerMutex_);
    warrantyProvider_ = std::move(provider);
}

std::shared_ptr<QAXAgentDeviceProvider> QAXAgent::deviceProvider() const {
    std::lock_guard lock(providerMutex_);
    return deviceProvider_;
}

void QAXAgent::setDeviceProvider(std::shared_ptr<QAXAgentDeviceProvider> provider) {
    std::lock_guard lock(providerMutex_);
    deviceProvider_ = std::move(provider);
}

void QAXAgent::performMigrationIfNeeded() {
    auto provider = warrantyProvider();
    if (!provider || provider->migrationVersion() > 1) {
        return;
    }
    auto device = deviceProvider()->defaultDevice();
    std::shared_ptr<QAXWarranty> warranty;
    if (device && device->serialNumber()) {
        warranty =
            provider->migrateLegacyCachedWarrantyIfNeededForSerialNumber(*device->serialNumber());
    }
    provider->migrateLegacyFollowUpIfNeededWithDeviceInfo(
        QAXDeviceInfo::deviceInfoWithDevice(device, warranty));
    provider->setMigrationVersion(kCurrentMigrationVersion);
}

void QAXAgent::getWarrantyUsingPolicy(QAXWarrantyPolicy policy,
                                      std::function<void(std::shared_ptr<QAXWarranty>)> reply) {
    auto device = deviceProvider()->defaultDevice();
    const auto serialNumber = device ? device->serialNumber() : std::nullopt;
    if (!serialNumber) {
        reply(nullptr);
        return;
    }
    getWarrantyUsingPolicy(policy, *serialNumber, std::move(reply));
}

QAXWarrantyPolicyEvaluation QAXAgent::evaluateWarrantyPolicy(const Platform& platform,
                                                             QAXAgentWarrantyProvider& provider,
                                                             QAXWarrantyPolicy policy,
                                                             const std::string& serialNumber) {
    using CacheState = QAXWarrantyPolicyEvaluation::CacheState;
    QAXWarrantyPolicyEvaluation e;
    e.policy = policy;
    e.cached = provider.cachedWarrantyForSerialNumber(serialNumber);
    if (e.cached) {
        e.cachedVersion = provider.cachedWarrantyVersionForSerialNumber(serialNumber);
        e.cachedLocale = provider.cachedWarrantyLocaleForSerialNumber(serialNumber);
        e.currentLocale = platform.locale->preferredLocaleIdentifier();
        if (e.cachedVersion != kCurrentCacheVersion) {
            e.cacheState = CacheState::OutdatedVersion;
        } else if (e.cachedLocale != e.currentLocale) {
            e.cacheState = CacheState::OtherLocale;
        } else if (!provider.isSignedInToSkyvault()) {
            e.cacheState = CacheState::SignedOut;
        } else {
            e.cacheState = CacheState::Valid;
            e.cacheValid = true;
        }
    }

    if (policy == QAXWarrantyPolicyForceDownload) {
        e.cacheValid = false;
        e.shouldDownload = true;
    } else if (policy == QAXWarrantyPolicyDefault && !e.cacheValid) {
        e.shouldDownload = true;
    } else if (policy == QAXWarrantyPolicyDefault) {
        e.examinedExpiration = true;
        e.lastUpdated = provider.lastUpdatedDateForSerialNumber(serialNumber);
        if (e.lastUpdated) {
            e.remaining = e.lastUpdated->timeIntervalSince(platform.clock->now()) +
                          provider.cachedWarrantyValidityDuration();
        }
        // Exactly no time left counts as expired.
        e.shouldDownload = !e.remaining || *e.remaining <= 0;
    }
    return e;
}

void QAXAgent::getWarrantyUsingPolicy(QAXWarrantyPolicy policy, const std::string& serialNumber,
                                      std::function<void(std::shared_ptr<QAXWarranty>)> reply) {
    using CacheState = QAXWarrantyPolicyEvaluation::CacheState;
    static constexpr const char* kOperation =
        "-[QAXAgent getWarrantyUsingPolicy:serialNumber:withReply:]";
    qaxLog().info("getting warranty using policy %@: %lu", privateText(serialNumber),
                  static_cast<std::uint64_t>(policy));

    auto provider = warrantyProvider();
    if (!provider) {
        reply(nullptr);
        return;
    }
    const QAXWarrantyPolicyEvaluation e =
        evaluateWarrantyPolicy(*platform_, *provider, policy, serialNumber);
    if (!e.cached) {
        qaxLog().info("no cached warranty : %@", privateText(serialNumber));
    } else {
        qaxLog().info("Has cached warranty : %@", privateText(serialNumber));
        switch (e.cacheState) {
            case CacheState::OutdatedVersion:
                qaxLog().info(
                    "cached warranty is of outdated version '%@', current version is '%@', "
                    "consider it invalid",
                    e.cachedVersion, kCurrentCacheVersion);
                break;
            case CacheState::OtherLocale:
                qaxLog().info(
                    "cached warranty is for locale '%@', system is now in '%@', consider it "
                    "invalid",
                    e.cachedLocale, e.currentLocale);
                break;
            case CacheState::SignedOut:
                qaxLog().info("user is signed out of Skyvault, cached warranty not allowed");
                break;
            case CacheState::Valid:
                qaxLog().info(
                    "cached warranty is for locale ('%@') and version ('%@') match system, "
                    "consider it valid",
                    e.cachedLocale, e.cachedVersion);
                break;
            case CacheState::None:
                break;
        }
    }
    if (policy == QAXWarrantyPolicyDefault && !e.examinedExpiration) {
        qaxLog().info("Default policy query: cached warranty is invalid, refresh it");
    } else if (e.examinedExpiration) {
        qaxLog().info("Default policy query: cached warranty is valid, examine expiration date");
        if (!e.remaining) {
            qaxLog().info("warranty validity expired, refresh it");
        } else if (*e.remaining > 0) {
            qaxLog().info("warranty valid for %.02f seconds", *e.remaining);
        } else {
            // 0 - remaining rather than -remaining: exactly expired prints 0.00, not -0.00.
            qaxLog().info("warranty validity expired %.02f seconds ago, refresh it",
                          0.0 - *e.remaining);
        }
    }
    qaxLog().info("%s: shouldDownloadWarranty: %d", kOperation, e.shouldDownload ? 1 : 0);

    auto finish = [serialNumber, fallback = e.answerWithoutDownload(),
                   reply = std::move(reply)](std::shared_ptr<QAXWarranty> downloaded) {
        qaxLog().info("getWarrantyUsingPolicy completionBlock %{private}@ : %d", serialNumber,
                      downloaded ? 1 : 0);
        reply(downloaded ? std::move(downloaded) : fallback);
    };
    if (!e.shouldDownload) {
        finish(nullptr);
        return;
    }
    provider->downloadWarrantyForSerialNumber(
        serialNumber, [finish = std::move(finish)](bool, std::shared_ptr<QAXWarranty> warranty) {
            finish(std::move(warranty));
        });
}

void QAXAgent::scheduleOutreach(QAXBoolReply reply) {
    scheduleOutreachAfter(0, std::move(reply));
}

void QAXAgent::scheduleOutreachAfter(double delay, QAXBoolReply reply) {
    if (platform_->agentFactory) {
        platform_->agentFactory->scheduleActivityForDate(kQAXOutreachActivityIdentifier,
                                                         platform_->clock->now().byAdding(delay));
    } else {
        qaxLog().error("no activity scheduling in this process; outreach not scheduled");
    }
    reply(true);
}

void QAXAgent::velmoraAccountAdded(QAXBoolReply reply) {
    static constexpr const char* kOperation = "-[QAXAgent velmoraAccountAddedWithReply:]";
    PreferenceStore& preferences = *platform_->preferences;
    if (!preferences.boolForKey(kPostUpgradeActivityCompletedKey)) {
        qaxLog().info("%s: Skipped scheduling/downloading new warranty", kOperation);
        reply(false);
        return;
    }
    const double delay = preferences.doubleForKey(kPostUpgradeOutreachDelayKey);
    if (preferences.boolForKey(kInitialOutreachActivityScheduledKey)) {
        qaxLog().info("%s: New warranty to be downloaded after: %f", kOperation, delay);
        // The agent stays alive for the delay: the client is waiting for this reply.
        auto self = shared_from_this();
        platform_->dispatcher->backgroundQueue()->postDelayed(
            [self, reply = std::move(reply)]() {
                self->getAllDeviceInfosUsingPolicy(
                    QAXWarrantyPolicyForceDownload, false,
                    [reply](std::vector<std::shared_ptr<QAXDeviceInfo>>) { reply(true); });
            },
            delay);
        return;
    }
    qaxLog().info("%s: Outreach to be scheduled after: %f", kOperation, delay);
    scheduleOutreachAfter(delay, std::move(reply));
    preferences.setObject(kInitialOutreachActivityScheduledKey, Value(true));
}

void QAXAgent::checkIsAvailableInStore(
    const std::string& bundleIdentifier,
    std::function<void(std::optional<Value::Dictionary>)> reply) {
    qaxLog().info("Checking for %@ in the Marketa", bundleIdentifier);
    QAXVelmoraSupportManager(platform_).checkIsAvailableInStore(bundleIdentifier, std::move(reply));
}

void QAXAgent::appSupportAvailability(const std::string& argument,
                                      std::function<void(Value::Dictionary)> reply) {
    qaxLog().info("Availability for %@", argument);
    // The purchase check waits for the purchase history; that wait must not hold the
    // connection's queue.
    platform_->dispatcher->blockingQueue()->post(
        [platform = platform_, argument, reply = std::move(reply)]() {
            QAXVelmoraSupportManager(platform).appSupportAvailability(argument, reply);
        });
}

void QAXAgent::readWebURLOverride(std::function<void(std::optional<Value>)> reply) {
    std::optional<Value> url;
    if (QAXUtilities::isInternal(*platform_)) {
        url = QAXServerVersionUtilities::readWebURLOverride(*platform_);
        qaxLog().info("readWebURLOverride = %@", url);
    }
    if (reply) {
        reply(std::move(url));
    }
}

void QAXAgent::defaultDevice(QAXDeviceReply reply) {
    reply(deviceProvider()->defaultDevice());
}

void QAXAgent::pairedDevices(QAXDeviceListReply reply) {
    std::vector<std::shared_ptr<QAXDevice>> devices;
    for (auto& [serial, device] : deviceProvider()->pairedDevices()) {
        devices.push_back(std::move(device));
    }
    reply(std::move(devices));
}

void QAXAgent::getDefaultDeviceInfoUsingPolicy(QAXWarrantyPolicy policy, QAXDeviceInfoReply reply) {
    auto device = deviceProvider()->defaultDevice();
    auto self = shared_from_this();
    getWarrantyUsingPolicy(
        policy, [self, device, reply = std::move(reply)](std::shared_ptr<QAXWarranty> warranty) {
            auto info = QAXDeviceInfo::deviceInfoWithDevice(device, std::move(warranty));
            qaxLog().info("getDefaultDeviceInfoUsingPolicy for device: '%@'", *info);
            reply(info);
            if (auto provider = self->warrantyProvider()) {
                provider->refreshFollowupWithDeviceInfo(info);
            }
        });
}

void QAXAgent::getDeviceInfoForSerialNumber(const std::string& requestedSerialNumber,
                                            QAXWarrantyPolicy policy, QAXDeviceInfoReply reply) {
    std::string serialNumber = requestedSerialNumber;
    // Engineers point a device at another device's coverage; this holds on every build.
    PreferenceStore& preferences = *platform_->preferences;
    const auto watches = preferences.dictionaryForKey(kPairedWatchesSerialNumbersKey);
    const auto accessories = preferences.dictionaryForKey(kPairedBluetoothDevicesSerialNumbersKey);
    if (watches || accessories) {
        auto replacement = substitute(watches, serialNumber);
        if (!replacement) {
            replacement = substitute(accessories, serialNumber);
        }
        qaxLog().debug("serialNumberOverride for Serial Number: %@ with serial: %@",
                       privateText(serialNumber), privateText(replacement));
        if (replacement) {
            qaxLog().debug("Override Serial Number: %@ found for SN: %@", privateText(*replacement),
                           privateText(serialNumber));
            serialNumber = *replacement;
        }
    }
    auto self = shared_from_this();
    getWarrantyUsingPolicy(
        policy, serialNumber,
        [self, serialNumber, reply = std::move(reply)](std::shared_ptr<QAXWarranty> warranty) {
            std::shared_ptr<QAXDevice> device;
            auto devices = self->deviceProvider()->allDevices();
            if (auto it = devices.find(serialNumber); it != devices.end()) {
                device = it->second;
            }
            if (!device) {
                device = QAXDevice::deviceWithName(kUnknownDeviceName, serialNumber, std::nullopt,
                                                   QAXDeviceTypeOther);
            }
            auto info = QAXDeviceInfo::deviceInfoWithDevice(device, std::move(warranty));
            qaxLog().info("getDeviceInfoForSerialNumber for device: '%@'", *info);
            reply(info);
            if (auto provider = self->warrantyProvider()) {
                provider->refreshFollowupWithDeviceInfo(info);
            }
        });
}

void QAXAgent::getAllDeviceInfosUsingPolicy(QAXWarrantyPolicy policy, bool updateFollowUps,
                                            QAXDeviceInfoListReply reply) {
    // Answers of one call, appended from whichever threads the downloads complete on.
    struct Results {
        std::mutex mutex;
        std::vector<std::shared_ptr<QAXDeviceInfo>> infos;
    };
    auto results = std::make_shared<Results>();
    auto self = shared_from_this();
    for (const auto& entry : deviceProvider()->allDevices()) {
        const std::string& serial = entry.first;
        std::shared_ptr<QAXDevice> device = entry.second;
        group_.enter();
        getWarrantyUsingPolicy(policy, device ? device->serialNumber().value_or(serial) : serial,
                               [self, results, device](std::shared_ptr<QAXWarranty> warranty) {
                                   auto info = QAXDeviceInfo::deviceInfoWithDevice(
                                       device, std::move(warranty));
                                   {
                                       std::lock_guard lock(results->mutex);
                                       results->infos.push_back(std::move(info));
                                   }
                                   self->group_.leave();
                               });
    }
    // The counter is the agent's: overlapping calls on one agent all wait for every query.
    group_.notify(policyLookupQueue_, [self, results, updateFollowUps, reply = std::move(reply)]() {
        std::vector<std::shared_ptr<QAXDeviceInfo>> infos;
        {
            std::lock_guard lock(results->mutex);
            infos = results->infos;
        }
        qaxLog().info("getAllDeviceInfosUsingPolicy: '%@'", logDescriptionOfList(infos));
        if (updateFollowUps) {
            if (auto provider = self->warrantyProvider()) {
                provider->refreshFollowupWithDeviceInfos(infos);
            }
        }
        reply(std::move(infos));
    });
}

void QAXAgent::dismissFollowUpForSerialNumber(const std::string& serialNumber,
                                              QAXBoolReply completion) {
    if (auto provider = warrantyProvider()) {
        provider->dismissFollowUpForSerialNumber(serialNumber);
    }
    completion(true);
}

void QAXAgent::dismissNotificationForSerialNumber(const std::string& serialNumber,
                                                  QAXBoolReply completion) {
    if (auto provider = warrantyProvider()) {
        provider->dismissNotificationForSerialNumber(serialNumber);
    }
    completion(true);
}

}  // namespace qax
