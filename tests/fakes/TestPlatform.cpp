#include "fakes/TestPlatform.h"

#include <unistd.h>

#include <fstream>
#include <random>
#include <sstream>

#include "fakes/FakeAgentFactory.h"
#include "fakes/FakeAnalyticsSink.h"
#include "fakes/FakeBackgroundActivities.h"
#include "fakes/FakeFollowUpCenter.h"
#include "fakes/FakeServices.h"
#include "fakes/FakeUserInterfaceStrings.h"

namespace qax::test {

TempDir::TempDir() {
    std::random_device rd;
    auto base = std::filesystem::temp_directory_path();
    for (;;) {
        path_ = base / ("qax-test-" + std::to_string(getpid()) + "-" + std::to_string(rd()));
        if (std::filesystem::create_directory(path_)) {
            break;
        }
    }
}

TempDir::~TempDir() {
    std::error_code ec;
    std::filesystem::remove_all(path_, ec);
}

void writeFile(const std::filesystem::path& path, std::string_view content) {
    std::filesystem::create_directories(path.parent_path());
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    out.write(content.data(), static_cast<std::streamsize>(content.size()));
}

std::string readFile(const std::filesystem::path& path) {
    std::ifstream in(path, std::ios::binary);
    std::ostringstream ss;
    ss << in.rdbuf();
    return ss.str();
}

TestPlatform::TestPlatform() {
    clock = std::make_shared<ManualClock>();
    runner = std::make_shared<VirtualTimeTaskRunner>(clock);
    log = std::make_shared<CapturingLogSink>();
    previousSink_ = qaxLog().sink();
    qaxLog().setSink(log);

    platform = std::make_shared<Platform>();
    platform->homeDirectory = home.str();
    platform->platformRoot = (home.path() / ".qaxplatform").string();
    platform->runtimeDirectory = (home.path() / ".qaxplatform" / "run").string();
    platform->clock = clock;
    platform->dispatcher = std::make_shared<VirtualTimeDispatcher>(runner);
    platform->log = log;
    platform->preferences = std::make_shared<InMemoryPreferenceStore>();
    platform->deviceProperties = std::make_shared<FakeDeviceProperties>();
    platform->locale = std::make_shared<FakeLocaleInfo>();
    platform->lifecycle = std::make_shared<FakeProcessLifecycle>();
    platform->agentFactory = std::make_shared<FakeAgentFactory>();
    platform->activities = std::make_shared<FakeBackgroundActivityScheduler>();
    platform->followUps = std::make_shared<InMemoryFollowUpCenter>();
    platform->analytics = std::make_shared<RecordingAnalyticsSink>();
    platform->uiStrings = std::make_shared<FakeUserInterfaceStrings>();
}

TestPlatform::~TestPlatform() {
    // A registered activity keeps its handler, the handler its scheduler, and the scheduler the
    // activity and this platform (in the agent they all live as long as the process): they go
    // with the test.
    if (auto fake =
            std::dynamic_pointer_cast<FakeBackgroundActivityScheduler>(platform->activities)) {
        fake->invalidateAll();
    }
    qaxLog().setSink(previousSink_);
}

}  // namespace qax::test
