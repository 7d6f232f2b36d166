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

using test::TempDir;

TEST(HostInstallLayoutTest, InstalledProgramsFindTheShareDirectoryBesideThem) {
    TempDir dir;
    const auto prefix = dir.path() / "usr";
    std::filesystem::create_directories(prefix / "share" / "qaxagent");
    const std::string share = (prefix / "share" / "qaxagent").string();
    struct Row {
        std::string executable;
        std::optional<std::string> expected;
    } rows[] = {
        {(prefix / "bin" / "qaxctl").string(), share},
        {(prefix / "lib" / "qaxagent" / "qaxagent").string(), share},
        {(prefix / "lib" / "qaxctl").string(), std::nullopt},
        {(dir.path() / "build" / "src" / "qaxagent").string(), std::nullopt},
        {(dir.path() / "elsewhere" / "bin" / "qaxctl").string(), std::nullopt},
    };
    for (const auto& row : rows) {
        EXPECT_EQ(installedShareDirectory(row.executable), row.expected) << row.executable;
    }
}

// Binds a listening Unix socket at `path` for as long as it lives.
struct Listening {
    explicit Listening(const std::filesystem::path& path) {
        std::filesystem::create_directories(path.parent_path());
        fd = ::socket(AF_UNIX, SOCK_STREAM, 0);
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        std::snprintf(address.sun_path, sizeof address.sun_path, "%s", path.c_str());
        EXPECT_EQ(::bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
        ::listen(fd, 1);
    }
    ~Listening() { ::close(fd); }
    int fd;
};

TEST(HostInstallLayoutTest, ClientsLookForTheServiceManagersSocketWhenTheirOwnIsMissing) {
    TempDir dir;
    const auto own = dir.path() / "root" / "run";
    const auto userRuntime = dir.path() / "xdg";
    const auto managed = userRuntime / "qaxagent" / "com.velmora.qaxagent";
    const std::string ownSocket = (own / "com.velmora.qaxagent").string();
    const char* previous = std::getenv("XDG_RUNTIME_DIR");
    const std::optional<std::string> saved = previous ? std::optional(previous) : std::nullopt;

    struct Row {
        const char* name;
        bool ownExists;
        bool managedExists;
        bool xdgSet;
        std::string expected;
    } rows[] = {
        {"own socket first", true, true, true, ownSocket},
        {"the service manager's", false, true, true, managed.string()},
        {"no runtime variable", false, true, false, ownSocket},
        {"neither: own path for the error", false, false, true, ownSocket},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.name);
        std::optional<Listening> a, b;
        if (row.ownExists) {
            a.emplace(own / "com.velmora.qaxagent");
        }
        if (row.managedExists) {
            b.emplace(managed);
        }
        if (row.xdgSet) {
            ::setenv("XDG_RUNTIME_DIR", userRuntime.c_str(), 1);
        } else {
            ::unsetenv("XDG_RUNTIME_DIR");
        }
        EXPECT_EQ(
            HostServiceListenerFactory::clientSocketPath(own.string(), "com.velmora.qaxagent"),
            row.expected);
        a.reset();
        b.reset();
        std::filesystem::remove(own / "com.velmora.qaxagent");
        std::filesystem::remove(managed);
    }
    if (saved) {
        ::setenv("XDG_RUNTIME_DIR", saved->c_str(), 1);
    } else {
        ::unsetenv("XDG_RUNTIME_DIR");
    }
}

}  // namespace
}  // namespace qax
