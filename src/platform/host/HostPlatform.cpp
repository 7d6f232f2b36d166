#include "platform/host/HostPlatform.h"

#include <pwd.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <string_view>

#include "core/AsioDispatcher.h"
#include "platform/host/CurlHttpClient.h"
#include "platform/host/FilePreferenceStore.h"
#include "platform/host/HostAccountStore.h"
#include "platform/host/HostAnalyticsSink.h"
#include "platform/host/HostApplicationRegistry.h"
#include "platform/host/HostAttestationService.h"
#include "platform/host/HostBackgroundActivityScheduler.h"
#include "platform/host/HostDeviceProperties.h"
#include "platform/host/HostFeatureFlags.h"
#include "platform/host/HostFollowUpCenter.h"
#include "platform/host/HostIdentityAccountManager.h"
#include "platform/host/HostLaunchEventStream.h"
#include "platform/host/HostLocaleInfo.h"
#include "platform/host/HostNotificationSocket.h"
#include "platform/host/HostPairedDeviceRegistry.h"
#include "platform/host/HostProcessBundleLookup.h"
#include "platform/host/HostProcessLifecycle.h"
#include "platform/host/HostPurchaseHistory.h"
#include "platform/host/HostServiceListenerFactory.h"
#include "platform/host/HostSocketActivation.h"
#include "platform/host/HostStoreLookup.h"
#include "platform/host/HostSystemNotificationCenter.h"
#include "platform/host/HostTelephonyInfo.h"
#include "platform/host/HostUserInterfaceStrings.h"
#include "platform/host/SimulatedClock.h"
#include "platform/host/SystemClock.h"

namespace qax {

std::optional<std::string> installedShareDirectory(const std::string& executablePath) {
    namespace fs = std::filesystem;
    const fs::path directory = fs::path(executablePath).parent_path();
    fs::path prefix;
    if (directory.filename() == "bin") {
        prefix = directory.parent_path();
    } else if (directory.filename() == "qaxagent" && directory.parent_path().filename() == "lib") {
        prefix = directory.parent_path().parent_path();
    } else {
        return std::nullopt;
    }
    std::error_code ec;
    const fs::path share = prefix / "share" / "qaxagent";
    if (!fs::is_directory(share, ec)) {
        return std::nullopt;
    }
    return share.string();
}

HostEnvironment HostEnvironment::fromProcessEnvironment() {
    HostEnvironment env;
    const char* home = std::getenv("HOME");
    if (home && *home) {
        env.homeDirectory = home;
    } else if (const passwd* pw = getpwuid(getuid())) {
        env.homeDirectory = pw->pw_dir;
    } else {
        env.homeDirectory = "/";
    }
    const char* root = std::getenv("QAX_PLATFORM_ROOT");
    env.platformRoot = root && *root
                           ? std::string(root)
                           : (std::filesystem::path(env.homeDirectory) / ".qaxplatform").string();
    const char* run = std::getenv("QAX_RUNTIME_DIR");
    env.runtimeDirectory =
        run && *run ? std::string(run) : (std::filesystem::path(env.platformRoot) / "run").string();
    const char* share = std::getenv("QAX_SHARE_DIR");
    if (share && *share) {
        env.shareDirectory = share;
    } else {
        std::error_code ec;
        const auto self = std::filesystem::read_symlink("/proc/self/exe", ec);
        env.shareDirectory = (ec ? std::nullopt : installedShareDirectory(self.string()))
                                 .value_or(QAX_SOURCE_SHARE_DIR);
    }
    const char* clock = std::getenv("QAX_CLOCK");
    env.simulatedClock = clock && std::string_view(clock) == "simulated";
    return env;
}

std::shared_ptr<Clock> makeHostClock(const HostEnvironment& environment) {
    if (environment.simulatedClock) {
        return std::make_shared<SimulatedClock>(environment.platformRoot);
    }
    return std::make_shared<SystemClock>();
}

std::shared_ptr<Platform> makeHostPlatform(const HostEnvironment& environment,
                                           std::shared_ptr<Dispatcher> dispatcher) {
    auto p = std::make_shared<Platform>();
    p->homeDirectory = environment.homeDirectory;
    p->platformRoot = environment.platformRoot;
    p->runtimeDirectory = environment.runtimeDirectory;
    p->shareDirectory = environment.shareDirectory;
    p->dispatcher = std::move(dispatcher);
    p->clock = makeHostClock(environment);
    p->log = std::make_shared<StderrLogSink>();
    p->preferences = std::make_shared<FilePreferenceStore>(
        FilePreferenceStore::domainPath(environment.homeDirectory));
    p->deviceProperties = std::make_shared<HostDeviceProperties>(environment.platformRoot);
    p->locale = std::make_shared<HostLocaleInfo>(p->platformRoot);

    std::optional<int> passedSocket;
    auto asio = std::dynamic_pointer_cast<AsioDispatcher>(p->dispatcher);
    if (asio) {
        passedSocket = HostSocketActivation::takeListeningSocket();
    }
    auto lifecycle = std::make_shared<HostProcessLifecycle>(
        passedSocket.has_value(), HostProcessLifecycle::idleExitSecondsFromEnvironment(),
        asio ? asio->mainQueue() : nullptr, [weak = std::weak_ptr<AsioDispatcher>(asio)] {
            if (auto dispatcher = weak.lock()) {
                dispatcher->stopMainLoop();
            }
        });
    lifecycle->start();
    p->lifecycle = lifecycle;

    auto httpOptions = CurlHttpClient::optionsForPlatformRoot(p->platformRoot);
    httpOptions.lifecycle = p->lifecycle;
    // What completions do (writing preferences and caches) must not hold up the transfers.
    // Tools have no dispatcher: their completions run on the session's thread.
    if (p->dispatcher) {
        httpOptions.completionQueue = p->dispatcher->backgroundQueue();
    }
    p->http = std::make_shared<CurlHttpClient>(std::move(httpOptions));
    // Further host bindings are installed here, one line each.
    p->pairedDevices = std::make_shared<HostPairedDeviceRegistry>(p->platformRoot);
    p->featureFlags = std::make_shared<HostFeatureFlags>(p->platformRoot);
    p->accounts = std::make_shared<HostAccountStore>(p->platformRoot, p->http, p->dispatcher);
    p->identity =
        std::make_shared<HostIdentityAccountManager>(p->platformRoot, p->deviceProperties);
    p->attestation =
        std::make_shared<HostAttestationService>(p->platformRoot, p->deviceProperties, p->clock);
    p->applications = std::make_shared<HostApplicationRegistry>(p->platformRoot);
    p->processes = std::make_shared<HostProcessBundleLookup>(p->applications);
    p->ipc = std::make_shared<HostServiceListenerFactory>(p->runtimeDirectory, p->dispatcher,
                                                          p->applications, lifecycle, passedSocket);
    auto notificationSocket = std::make_shared<HostNotificationSocket>(p->runtimeDirectory);
    p->notifications = std::make_shared<HostSystemNotificationCenter>(notificationSocket);
    p->launchEvents = std::make_shared<HostLaunchEventStream>(notificationSocket, p->dispatcher);
    p->store = std::make_shared<HostStoreLookup>(p->platformRoot, p->http, p->dispatcher);
    p->purchases = std::make_shared<HostPurchaseHistory>(p->platformRoot, p->http, p->dispatcher);

    // Activities, follow-ups, analytics, user-interface strings, telephony. The activity
    // scheduler subscribes to the clock-changed notification only once the agent attaches or
    // schedules an activity, so that qaxctl never binds the notification socket.
    HostBackgroundActivityScheduler::Options activityOptions;
    activityOptions.platformRoot = p->platformRoot;
    activityOptions.shareDirectory = p->shareDirectory;
    if (auto simulatedClock = std::dynamic_pointer_cast<SimulatedClock>(p->clock)) {
        activityOptions.clockChanged = [simulatedClock] { simulatedClock->reloadOffset(); };
    }
    p->activities = std::make_shared<HostBackgroundActivityScheduler>(p, activityOptions);
    p->followUps = std::make_shared<HostFollowUpCenter>(p->platformRoot, p->clock);
    p->analytics = std::make_shared<HostAnalyticsSink>(p->platformRoot, p->clock);
    p->uiStrings = std::make_shared<HostUserInterfaceStrings>(p->shareDirectory, p->locale);
    p->telephony = std::make_shared<HostTelephonyInfo>(p->platformRoot);
    return p;
}

}  // namespace qax
