#include "agent/QAXAgentDefaultWarrantyProvider.h"

#include "core/Hash.h"
#include "core/Log.h"
#include "followup/QAXFollowUp.h"
#include "platform/AccountStore.h"
#include "platform/Platform.h"
#include "platform/PreferenceStore.h"
#include "platform/QAXSettings.h"
#include "warranty/QAXWarranty.h"
#include "warranty/QAXWarrantyDownloader.h"

namespace qax {
namespace {

constexpr const char* kLastUpdatedDateKeyFormat = "%@_CachedWarrantyLastUpdatedDate";
constexpr const char* kVersionKeyFormat = "%@_CachedWarrantyVersion";
constexpr const char* kLocaleKeyFormat = "%@_CachedWarrantyLocale";
constexpr const char* kMigrationVersionKey = "QAXMigrationVersion";

// The per-serial key: the format's placeholder filled with the serial number's digest.
std::string keyFor(const char* format, const std::string& serialNumber) {
    std::string key = format;
    return key.replace(key.find("%@"), 2, sha256Hash(serialNumber));
}

std::optional<std::string> storedString(PreferenceStore& preferences, const std::string& key) {
    auto value = preferences.objectForKey(key);
    if (value && value->isString()) {
        return *value->asString();
    }
    return std::nullopt;
}

}  // namespace

std::shared_ptr<QAXAgentDefaultWarrantyProvider>
QAXAgentDefaultWarrantyProvider::initWithCallingProcessBundleID(
    std::shared_ptr<Platform> platform, std::string callingProcessBundleID) {
    return std::make_shared<QAXAgentDefaultWarrantyProvider>(std::move(platform),
                                                             std::move(callingProcessBundleID));
}

QAXAgentDefaultWarrantyProvider::QAXAgentDefaultWarrantyProvider(std::shared_ptr<Platform> platform,
                                                                 std::string callingProcessBundleID)
    : platform_(std::move(platform)), callingProcessBundleID_(std::move(callingProcessBundleID)) {
    qaxLog().debug("%s: callingProcess=%@",
                   "-[QAXAgentDefaultWarrantyProvider initWithCallingProcessBundleID:]",
                   callingProcessBundleID_);
}

std::vector<std::shared_ptr<QAXDeviceInfo>>
QAXAgentDefaultWarrantyProvider::refreshFollowupWithDeviceInfos(
    const std::vector<std::shared_ptr<QAXDeviceInfo>>& deviceInfos) {
    return QAXFollowUp(platform_).refreshFollowupWithDeviceInfos(deviceInfos);
}

std::vector<std::shared_ptr<QAXDeviceInfo>>
QAXAgentDefaultWarrantyProvider::refreshFollowupWithDeviceInfo(
    const std::shared_ptr<QAXDeviceInfo>& deviceInfo) {
    return QAXFollowUp(platform_).refreshFollowupWithDeviceInfo(deviceInfo, false);
}

void QAXAgentDefaultWarrantyProvider::dismissFollowUpForSerialNumber(
    const std::string& serialNumber) {
    QAXFollowUp(platform_).dismissFollowUpForSerialNumber(serialNumber);
}

void QAXAgentDefaultWarrantyProvider::dismissNotificationForSerialNumber(
    const std::string& serialNumber) {
    QAXFollowUp(platform_).dismissNotificationForSerialNumber(serialNumber);
}

void QAXAgentDefaultWarrantyProvider::downloadWarrantyForSerialNumber(
    const std::string& serialNumber,
    std::function<void(bool success, std::shared_ptr<QAXWarranty> warranty)> completion) {
    QAXWarrantyDownloader::initWithCallingProcessBundleID(platform_, callingProcessBundleID_)
        ->downloadWarrantyForSerialNumber(serialNumber, std::move(completion));
}

std::shared_ptr<QAXWarranty> QAXAgentDefaultWarrantyProvider::cachedWarrantyForSerialNumber(
    const std::string& serialNumber) {
    return QAXWarranty::cachedWarrantyForSerialNumber(platform_, serialNumber);
}

std::optional<Date> QAXAgentDefaultWarrantyProvider::lastUpdatedDateForSerialNumber(
    const std::string& serialNumber) {
    auto value =
        platform_->preferences->objectForKey(keyFor(kLastUpdatedDateKeyFormat, serialNumber));
    return value ? value->asDate() : std::nullopt;
}

std::optional<std::string> QAXAgentDefaultWarrantyProvider::cachedWarrantyVersionForSerialNumber(
    const std::string& serialNumber) {
    return storedString(*platform_->preferences, keyFor(kVersionKeyFormat, serialNumber));
}

std::optional<std::string> QAXAgentDefaultWarrantyProvider::cachedWarrantyLocaleForSerialNumber(
    const std::string& serialNumber) {
    return storedString(*platform_->preferences, keyFor(kLocaleKeyFormat, serialNumber));
}

std::shared_ptr<QAXWarranty>
QAXAgentDefaultWarrantyProvider::migrateLegacyCachedWarrantyIfNeededForSerialNumber(
    const std::string& serialNumber) {
    return QAXWarranty::migrateLegacyCachedWarrantyIfNeededForSerialNumber(platform_, serialNumber);
}

void QAXAgentDefaultWarrantyProvider::migrateLegacyFollowUpIfNeededWithDeviceInfo(
    const std::shared_ptr<QAXDeviceInfo>& deviceInfo) {
    QAXFollowUp(platform_).migrateLegacyFollowUpIfNeededWithDeviceInfo(deviceInfo);
}

double QAXAgentDefaultWarrantyProvider::cachedWarrantyValidityDuration() {
    return settings::cachedWarrantyValidityDuration(*platform_->preferences);
}

bool QAXAgentDefaultWarrantyProvider::isSignedInToSkyvault() {
    return platform_->accounts && platform_->accounts->primaryCloudAccount() != nullptr;
}

std::int32_t QAXAgentDefaultWarrantyProvider::migrationVersion() {
    return settings::migrationVersion(*platform_->preferences);
}

void QAXAgentDefaultWarrantyProvider::setMigrationVersion(std::int32_t version) {
    platform_->preferences->setObject(kMigrationVersionKey, Value(version));
}

}  // namespace qax
