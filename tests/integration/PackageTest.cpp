// The Debian package as a user gets it: built with CPack from this build tree, unpacked into a
// temporary root, and its agent and qaxctl run from there against a temporary home.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>

#include <chrono>
#include <filesystem>
#include <thread>

#include "AgentProcess.h"
#include "SpawnedProcess.h"

namespace qax {
namespace {

namespace fs = std::filesystem;

constexpr double kPackageSeconds = 120;

TEST(PackageTest, UnpackedDebRunsTheAgentAndQaxctlAgainstATemporaryHome) {
    const auto dpkg = test::findProgram("dpkg");
    const auto dpkgDeb = test::findProgram("dpkg-deb");
    if (!dpkg || !dpkgDeb || !test::findProgram("dpkg-shlibdeps")) {
        GTEST_SKIP() << "dpkg, dpkg-deb or dpkg-shlibdeps (Debian packages dpkg, dpkg-dev) is "
                        "not installed";
    }
    test::TempDir dir;
    test::AgentProcess home;  // only its home, platform root and environment: nothing started
    const auto environment = home.environment();

    auto built = test::runTool(QAX_CPACK_COMMAND,
                               {"--config", std::string(QAX_BINARY_DIR) + "/CPackConfig.cmake",
                                "-B", (dir.path() / "out").string()},
                               environment, kPackageSeconds);
    ASSERT_EQ(built.status, 0) << built.out << built.err;
    fs::path deb;
    for (const auto& entry : fs::directory_iterator(dir.path() / "out")) {
        if (entry.path().extension() == ".deb") {
            deb = entry.path();
        }
    }
    ASSERT_FALSE(deb.empty()) << built.out;

    auto depends = test::runTool(*dpkgDeb, {"--field", deb.string(), "Depends"}, environment);
    for (const char* package : {"libsystemd0", "libplist", "libcurl", "libssl", "libicu"}) {
        EXPECT_NE(depends.out.find(package), std::string::npos) << depends.out;
    }

    const fs::path root = dir.path() / "root";
    auto unpacked = test::runTool(*dpkg, {"-x", deb.string(), root.string()}, environment);
    ASSERT_EQ(unpacked.status, 0) << unpacked.err;
    for (const char* file :
         {"usr/lib/qaxagent/qaxagent", "usr/bin/qaxctl", "usr/bin/coverage-sim",
          "usr/lib/systemd/user/qaxagent.socket", "usr/lib/systemd/user/qaxagent-wake.timer",
          "usr/share/man/man1/qaxctl.1", "usr/share/man/man8/qaxagent.8",
          "usr/share/qaxagent/demo/device.plist"}) {
        EXPECT_TRUE(fs::exists(root / file)) << file;
    }
    EXPECT_NE(test::readFile(root / "usr/lib/systemd/user/qaxagent.service")
                  .find("ExecStart=/usr/lib/qaxagent/qaxagent\n"),
              std::string::npos);

    // A bare machine: no device.plist, so the agent describes the machine it runs on.
    const std::string qaxctl = (root / "usr/bin/qaxctl").string();
    home.registerApplication("qaxctl", qaxctl, "com.velmora.Preferences", Value(true));
    test::SpawnedProcess agent((root / "usr/lib/qaxagent/qaxagent").string(), {}, environment,
                               home.home() + "/agent.log");
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    struct stat st {};
    while (::stat(home.socketPath().c_str(), &st) != 0 && agent.running() &&
           std::chrono::steady_clock::now() < deadline) {
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    ASSERT_TRUE(agent.running()) << home.log();

    auto shown = test::runTool(qaxctl, {"default-device"}, environment);
    EXPECT_EQ(shown.status, 0) << shown.err << home.log();
    EXPECT_NE(shown.out.find("Default Device"), std::string::npos) << shown.out;
    auto status = agent.stop();
    EXPECT_TRUE(status && WIFEXITED(*status) && WEXITSTATUS(*status) == 0) << home.log();
}

}  // namespace
}  // namespace qax
