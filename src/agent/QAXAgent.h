// The object behind every request: each accepted connection gets its own, start-up keeps one
// for the monitors, and activities make their own. It reaches warranties and follow-ups only
// through its warranty provider and devices only through its device provider. Requests run on
// the caller's thread; the providers may be swapped while requests run (each step uses the
// provider it reads then, under a small lock). The all-devices join delivers on the agent's
// own serial queue (appends to its result are serialised by a lock of the call), the
// account-added download on the background queue, the support-application check on the
// blocking queue.
#pragma once

#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "agent/QAXAgentProtocol.h"
#include "agent/QAXAgentWarrantyProvider.h"
#include "core/JoinCounter.h"
#include "core/TaskRunner.h"
#include "devices/QAXAgentDeviceProvider.h"
#include "platform/ServiceListener.h"

namespace qax {

struct Platform;

// What one evaluation of a warranty policy finds, before any download: the cached warranty and
// whether it may be used (or why not), its freshness when the default policy examines it, and
// whether the policy downloads. getWarrantyUsingPolicy acts on it; qaxctl explain shows it.
struct QAXWarrantyPolicyEvaluation {
    enum class CacheState { None, OutdatedVersion, OtherLocale, SignedOut, Valid };

    QAXWarrantyPolicy policy = QAXWarrantyPolicyDefault;
    std::shared_ptr<QAXWarranty> cached;
    CacheState cacheState = CacheState::None;
    // Read whenever a cached warranty exists.
    std::optional<std::string> cachedVersion;
    std::optional<std::string> cachedLocale;
    std::string currentLocale;
    // Whether the cached warranty may be the answer; a forced download never uses it.
    bool cacheValid = false;
    // The default policy with a valid cache looks at its age: the last-updated date and the
    // seconds of freshness left (negative once expired; none without a date).
    bool examinedExpiration = false;
    std::optional<Date> lastUpdated;
    std::optional<double> remaining;
    bool shouldDownload = false;

    // The answer when no download is made or the download gives nothing.
    std::shared_ptr<QAXWarranty> answerWithoutDownload() const {
        return cacheValid ? cached : nullptr;
    }
};

class QAXAgent : public QAXAgentProtocol,
                 public ExportedObject,
                 public std::enable_shared_from_this<QAXAgent> {
  public:
    // The agent of a client or activity. Without an identifier the settings application's is
    // used. The device provider is the process's shared devices manager.
    static std::shared_ptr<QAXAgent> initWithCallingProcessBundleID(
        std::shared_ptr<Platform> platform, std::optional<std::string> callingProcessBundleID);
    static std::shared_ptr<QAXAgent> initWithWarrantyProvider(
        std::shared_ptr<Platform> platform,
        std::shared_ptr<QAXAgentWarrantyProvider> warrantyProvider,
        std::shared_ptr<QAXAgentDeviceProvider> deviceProvider);

    QAXAgent(std::shared_ptr<Platform> platform,
             std::shared_ptr<QAXAgentWarrantyProvider> warrantyProvider,
             std::shared_ptr<QAXAgentDeviceProvider> deviceProvider);

    std::shared_ptr<QAXAgentWarrantyProvider> warrantyProvider() const;
    void setWarrantyProvider(std::shared_ptr<QAXAgentWarrantyProvider> provider);
    std::shared_ptr<QAXAgentDeviceProvider> deviceProvider() const;
    void setDeviceProvider(std::shared_ptr<QAXAgentDeviceProvider> provider);
    // The process on whose behalf this agent works (set by initWithCallingProcessBundleID).
    const std::string& callingProcessBundleID() const { return callingProcessBundleID_; }

    // Moves the legacy single cached warranty and follow-up of the default device into the
    // current layout, once (skipped once "QAXMigrationVersion" is past 1). Synchronous.
    void performMigrationIfNeeded();
    // The warranty of `serialNumber` under `policy`: cache, download or none, by the policy
    // rules. Without a download the reply runs before this returns; with one, on the
    // download's completion thread.
    void getWarrantyUsingPolicy(QAXWarrantyPolicy policy, const std::string& serialNumber,
                                std::function<void(std::shared_ptr<QAXWarranty>)> reply);
    // The same for the default device.
    void getWarrantyUsingPolicy(QAXWarrantyPolicy policy,
                                std::function<void(std::shared_ptr<QAXWarranty>)> reply);
    // The decisions of getWarrantyUsingPolicy for `serialNumber`, from the provider's cache
    // facts, the platform's locale and clock. Reads only, logs nothing.
    static QAXWarrantyPolicyEvaluation evaluateWarrantyPolicy(const Platform& platform,
                                                              QAXAgentWarrantyProvider& provider,
                                                              QAXWarrantyPolicy policy,
                                                              const std::string& serialNumber);

    // QAXAgentProtocol.
    void scheduleOutreach(QAXBoolReply reply) override;
    void scheduleOutreachAfter(double delay, QAXBoolReply reply) override;
    void velmoraAccountAdded(QAXBoolReply reply) override;
    void checkIsAvailableInStore(
        const std::string& bundleIdentifier,
        std::function<void(std::optional<Value::Dictionary>)> reply) override;
    void appSupportAvailability(const std::string& argument,
                                std::function<void(Value::Dictionary)> reply) override;
    void readWebURLOverride(std::function<void(std::optional<Value>)> reply) override;
    void defaultDevice(QAXDeviceReply reply) override;
    void pairedDevices(QAXDeviceListReply reply) override;
    void getDefaultDeviceInfoUsingPolicy(QAXWarrantyPolicy policy,
                                         QAXDeviceInfoReply reply) override;
    void getDeviceInfoForSerialNumber(const std::string& serialNumber, QAXWarrantyPolicy policy,
                                      QAXDeviceInfoReply reply) override;
    void getAllDeviceInfosUsingPolicy(QAXWarrantyPolicy policy, bool updateFollowUps,
                                      QAXDeviceInfoListReply reply) override;
    void dismissFollowUpForSerialNumber(const std::string& serialNumber,
                                        QAXBoolReply completion) override;
    void dismissNotificationForSerialNumber(const std::string& serialNumber,
                                            QAXBoolReply completion) override;

  private:
    const std::shared_ptr<Platform> platform_;
    std::shared_ptr<TaskRunner> policyLookupQueue_;
    JoinCounter group_;
    mutable std::mutex providerMutex_;
    std::shared_ptr<QAXAgentWarrantyProvider> warrantyProvider_;
    std::shared_ptr<QAXAgentDeviceProvider> deviceProvider_;
    std::string callingProcessBundleID_;
};

}  // namespace qax
