// Process entry of qaxagent: builds the host platform from the environment, runs the
// start-up sequence and then the main event loop until SIGTERM or SIGINT, or, when the service
// manager started it on demand, until it has been idle (see HostProcessLifecycle). The main
// thread runs start-up, then the loop (socket I/O of the IPC service, signals, main-queue work).
#include <malloc.h>

#include <csignal>

#include <asio/io_context.hpp>
#include <asio/signal_set.hpp>
#include <memory>

#include "agent/QAXAgent.h"
#include "agent/QAXAgentRemoteInterface.h"
#include "agent/QAXLaunchEventHandler.h"
#include "agent/ServiceDelegate.h"
#include "core/AsioDispatcher.h"
#include "core/Log.h"
#include "platform/LaunchEventStream.h"
#include "platform/PreferenceStore.h"
#include "platform/QAXSettings.h"
#include "platform/ServiceListener.h"
#include "platform/host/HostPlatform.h"
#include "platform/host/HostSocketActivation.h"

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

    // Start-up, in order: announce the launch,
    qaxLog().info("launched");

    // register the default settings,
    qax_registerDefaults(*platform->preferences);

    // (the six activity schedulers join here. In this order, each made with
    // newSchedulerWithActivityDelegate: for a new activity and told
    // monitorForScheduledActivity before the next is made: QAXPostUpgradeActivity,
    // QAXPostBootActivity, QAXOutreachActivity, QAXFollowUpPost,
    // QAXConversionOutreachActivity, QAXFollowUpRefresh. They live as long as the process.)

    // create the start-up agent,
    auto startupAgent = QAXAgent::initWithCallingProcessBundleID(platform, kStartupCallingProcess);
    // The start-up migration joins here: startupAgent->performMigrationIfNeeded(), run
    // synchronously before any client is listened to.

    // (the locale monitor joins here: QAXLocaleMonitor initWithAgent: startupAgent, start.)

    // (the paired-devices monitor joins here: QAXPairedDevicesMonitor initWithAgent:
    // startupAgent, start. The launch-event handler below will hold it.)

    // install the launch-event handler,
    auto launchEventHandler = std::make_shared<QAXLaunchEventHandler>();
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
