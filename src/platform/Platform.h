// The platform context: every platform service the agent reaches, gathered in one place
// built at start-up (host bindings) or by a test (fakes). Passed by shared pointer; the
// services themselves are thread-safe, the context is not modified after it is built.
#pragma once

#include <memory>
#include <string>

#include "core/Clock.h"
#include "core/Log.h"
#include "core/TaskRunner.h"

namespace qax {

class PreferenceStore;
class DeviceProperties;
class LocaleInfo;
class HttpClient;
class PairedDeviceRegistry;
class FeatureFlags;
class AccountStore;
class IdentityAccountManager;
class AttestationService;
class FollowUpCenter;
class BackgroundActivityScheduler;
class ServiceListenerFactory;
class ApplicationRegistry;
class ProcessBundleLookup;
class LaunchEventStream;
class SystemNotificationCenter;
class StoreLookup;
class PurchaseHistory;
class TelephonyInfo;
class AnalyticsSink;
class UserInterfaceStrings;
class ProcessLifecycle;
class AgentFactory;

// The log sink is the platform's log service.
using SystemLog = LogSink;

struct Platform {
    // Home directory: the warranty cache and the preference domain live below it.
    std::string homeDirectory;
    // The simulated device's configuration and platform state.
    std::string platformRoot;
    // Where the service and notification sockets live.
    std::string runtimeDirectory;
    // Installed read-only data: the launch configuration of the activities, the localized
    // user-interface strings.
    std::string shareDirectory;

    std::shared_ptr<Clock> clock;
    std::shared_ptr<Dispatcher> dispatcher;
    std::shared_ptr<SystemLog> log;
    std::shared_ptr<PreferenceStore> preferences;
    std::shared_ptr<DeviceProperties> deviceProperties;
    std::shared_ptr<LocaleInfo> locale;
    std::shared_ptr<HttpClient> http;
    std::shared_ptr<PairedDeviceRegistry> pairedDevices;
    std::shared_ptr<FeatureFlags> featureFlags;
    std::shared_ptr<AccountStore> accounts;
    std::shared_ptr<IdentityAccountManager> identity;
    std::shared_ptr<AttestationService> attestation;
    std::shared_ptr<FollowUpCenter> followUps;
    std::shared_ptr<BackgroundActivityScheduler> activities;
    std::shared_ptr<ServiceListenerFactory> ipc;
    std::shared_ptr<ApplicationRegistry> applications;
    std::shared_ptr<ProcessBundleLookup> processes;
    std::shared_ptr<LaunchEventStream> launchEvents;
    std::shared_ptr<SystemNotificationCenter> notifications;
    std::shared_ptr<StoreLookup> store;
    std::shared_ptr<PurchaseHistory> purchases;
    std::shared_ptr<TelephonyInfo> telephony;
    std::shared_ptr<AnalyticsSink> analytics;
    std::shared_ptr<UserInterfaceStrings> uiStrings;
    std::shared_ptr<ProcessLifecycle> lifecycle;
    // Not a platform service: the agent's own factory, installed by main (see AgentFactory.h).
    std::shared_ptr<AgentFactory> agentFactory;
};

}  // namespace qax
