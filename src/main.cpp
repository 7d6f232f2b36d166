// Process entry of qaxagent: builds the host platform from the environment, runs the
// start-up sequence and then the main event loop until SIGTERM or SIGINT, or, when the service
// manager started it on demand, until it has been idle (see HostProcessLifecycle). The main
// thread runs start-up, then the loop (socket I/O of the IPC service, signals, main-queue work).
#include <malloc.h>

#include <csignal>

#include <asio/io_context.hpp>
#include <asio/signal_set.hpp>
#include <memory>
#include <vector>

#include "agent/QAXAgent.h"
#include "agent/QAXAgentFactory.h"
#include "agent/QAXAgentRemoteInterface.h"
#include "agent/QAXLaunchEventHandler.h"
#include "agent/ServiceDelegate.h"
#include "core/AsioDispatcher.h"
#include "core/Log.h"
#include "devices/QAXLocaleMonitor.h"
#include "devices/QAXPairedDevicesMonitor.h"
#include "followup/QAXFollowUp.h"
#include "followup/QAXFollowUpPost.h"
#include "platform/LaunchEventStream.h"
#include "platform/PreferenceStore.h"
#include "platform/QAXSettings.h"
#include "platform/ServiceListener.h"
#include "platform/host/HostPlatform.h"
#include "platform/host/HostSocketActivation.h"
#include "scheduling/QAXScheduler.h"

namespace {

constexpr const char* kStartupCallingProcess = "com.velmora.Preferences";

}  // namespace

int main() {
    using namespace qax;

    // A peer that hangs up mid-reply must not end the process.
    std::signal(SIGPIPE, SIG_IGN);
    // Large blocks (an oversized answer of a service, a big reply) go back to the system when
    // freed. Left to itself glibc raises this threshold after freeing the first one and then
    // keeps tens of megabytes in its heaps for good.
    mallopt(M_MMAP_THRESHOLD, 256 * 1024);

    auto dispatcher = std::make_shared<AsioDispatcher>();
    asio::signal_set stopSignals(dispatcher->mainContext(), SIGTERM, SIGINT);
    stopSignals.async_wait([dispatcher](const asio::error_code& ec, int signalNumber) {
        if (!ec) {
            qaxLog().info("Stopping on signal %d", signalNumber);
            dispatcher->stopMainLoop();
        }
    });

    auto platform = makeHostPlatform(HostEnvironment::fromProcessEnvironment(), dispatcher);
    qaxLog().setSink(platform->log);
    // Lower layers make agents and schedule activities through the platform; the factory holds
    // the platform weakly.
    platform->agentFactory = std::make_shared<QAXAgentFactory>(platform);

    // Start-up, in order: announce the launch,
    qaxLog().info("launched");

    // register the default settings,
    qax_registerDefaults(*platform->preferences);

    // attach a scheduler to each of the six activities, in this order (they live as long as the
    // process),
    std::vector<std::shared_ptr<QAXScheduler>> schedulers;
    for (const char* identifier :
         {kQAXPostUpgradeActivityIdentifier, kQAXPostBootActivityIdentifier,
          kQAXOutreachActivityIdentifier, kQAXFollowUpPostActivityIdentifier,
          kQAXConversionOutreachActivityIdentifier, kQAXFollowUpRefreshActivityIdentifier}) {
        auto scheduler = QAXScheduler::newSchedulerWithActivityDelegate(
            platform, QAXAgentFactory::newActivityDelegate(platform, identifier));
        scheduler->monitorForScheduledActivity();
        schedulers.push_back(std::move(scheduler));
    }

    // create the start-up agent and migrate, before any client is listened to,
    auto startupAgent = QAXAgent::initWithCallingProcessBundleID(platform, kStartupCallingProcess);
    startupAgent->performMigrationIfNeeded();

    // start the locale monitor,
    auto localeMonitor = std::make_shared<QAXLocaleMonitor>(platform, startupAgent, [platform] {
        return QAXFollowUp(platform).pendingFollowUpCount();
    });
    localeMonitor->start();

    // start the paired-devices monitor,
    QAXPairedDevicesMonitor::FollowUpPostScheduling followUpPost;
    followUpPost.nextFollowUpPostDate = [platform](const auto& deviceInfos) {
        return QAXFollowUpPost::nextFollowUpPostDateWithDevicesInfo(*platform, deviceInfos);
    };
    followUpPost.scheduleFollowUpPost = [platform](Date date) {
        platform->agentFactory->scheduleActivityForDate(kQAXFollowUpPostActivityIdentifier, date);
    };
    auto pairedDevicesMonitor =
        std::make_shared<QAXPairedDevicesMonitor>(platform, startupAgent, std::move(followUpPost));
    pairedDevicesMonitor->start();

    // install the launch-event handler,
    auto launchEventHandler = std::make_shared<QAXLaunchEventHandler>(pairedDevicesMonitor);
    QAXLaunchEventHandler::install(*platform->launchEvents, launchEventHandler);

    // listen on the service name,
    auto delegate = std::make_shared<ServiceDelegate>(platform);
    auto listener = platform->ipc->makeListener(kQAXAgentServiceName);
    if (!listener) {
        return 1;
    }
    listener->setDelegate(delegate);
    if (!listener->resume()) {
        // Another agent serves the name, or the runtime directory is unusable.
        return 1;
    }
    HostSocketActivation::notifyReady();

    // and run the main event loop for the life of the process.
    dispatcher->runMainLoop();
    HostSocketActivation::notifyStopping();

    // Close every client, let the aborted socket operations finish so that connections and
    // their agents go, then stop the queues. The notification socket is released last so that
    // its file goes with it.
    listener->invalidate();
    dispatcher->mainContext().restart();
    dispatcher->mainContext().poll();
    dispatcher->shutdown();
    platform->launchEvents.reset();
    platform->notifications.reset();
    return 0;
}
