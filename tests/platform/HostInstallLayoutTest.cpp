// Where installed programs find their data, and where qaxctl finds the agent's socket when the
// user's service manager runs the agent.
#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include "fakes/TestPlatform.h"
#include "platform/host/HostPlatform.h"
#include "platform/host/HostServiceListenerFactory.h"

namespace qax {
namespace {

namespace fs = std::filesystem;

TEST(HostInstallLayoutTest, InstalledProgramsFindTheShareDirectoryBesideThem) {
    test::TempDir dir;
    const fs::path usr = dir.path() / "usr";
    fs::create_directories(usr / "share/qaxagent");
    const std::optional<std::string> share = (usr / "share/qaxagent").string();
    EXPECT_EQ(installedShareDirectory((usr / "bin/qaxctl").string()), share);
    EXPECT_EQ(installedShareDirectory((usr / "lib/qaxagent/qaxagent").string()), share);
    EXPECT_EQ(installedShareDirectory((usr / "lib/qaxctl").string()), std::nullopt);
    EXPECT_EQ(installedShareDirectory((dir.path() / "build/src/qaxagent").string()), std::nullopt);
    EXPECT_EQ(installedShareDirectory((dir.path() / "opt/bin/qaxctl").string()), std::nullopt);
}

// Leaves a socket file at `path`, as a listener does.
void makeSocketFile(const fs::path& path) {
    fs::create_directories(path.parent_path());
    const int fd = ::socket(AF_UNIX, SOCK_STREAM, 0);
    sockaddr_un address{.sun_family = AF_UNIX, .sun_path = {}};
    std::snprintf(address.sun_path, sizeof address.sun_path, "%s", path.c_str());
    EXPECT_EQ(::bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
    ::close(fd);
}

TEST(HostInstallLayoutTest, ClientsLookForTheServiceManagersSocketWhenTheirOwnIsMissing) {
    test::TempDir dir;
    const fs::path own = dir.path() / "run/com.velmora.qaxagent";
    const fs::path managed = dir.path() / "xdg/qaxagent/com.velmora.qaxagent";
    const char* saved = std::getenv("XDG_RUNTIME_DIR");
    const std::string previous = saved ? saved : "";
    auto lookUp = [&](const char* userRuntime) {
        userRuntime ? ::setenv("XDG_RUNTIME_DIR", userRuntime, 1) : ::unsetenv("XDG_RUNTIME_DIR");
        return HostServiceListenerFactory::clientSocketPath((dir.path() / "run").string(),
                                                            "com.velmora.qaxagent");
    };
    const std::string xdg = (dir.path() / "xdg").string();

    EXPECT_EQ(lookUp(xdg.c_str()), own.string()) << "neither: the own path, for the error";
    makeSocketFile(managed);
    EXPECT_EQ(lookUp(xdg.c_str()), managed.string());
    EXPECT_EQ(lookUp(nullptr), own.string());
    makeSocketFile(own);
    EXPECT_EQ(lookUp(xdg.c_str()), own.string()) << "the own runtime directory comes first";

    saved ? ::setenv("XDG_RUNTIME_DIR", previous.c_str(), 1) : ::unsetenv("XDG_RUNTIME_DIR");
}

}  // namespace
}  // namespace qax
