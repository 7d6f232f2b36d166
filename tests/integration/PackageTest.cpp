// The Debian package as a user gets it: built with CPack from this build tree, unpacked into a
// temporary root, its agent and qaxctl run from there against a temporary home.
#include <gtest/gtest.h>
#include <sys/wait.h>

#include <filesystem>
#include <thread>

#include "AgentProcess.h"
#include "SpawnedProcess.h"

namespace qax {
namespace {

namespace fs = std::filesystem;

TEST(PackageTest, UnpackedDebRunsTheAgentAndQaxctlAgainstATemporaryHome) {
    const auto dpkg = test::findProgram("dpkg");
    const auto dpkgDeb = test::findProgram("dpkg-deb");
    if (!dpkg || !dpkgDeb || !test::findProgram("dpkg-shlibdeps")) {
        GTEST_SKIP() << "dpkg, dpkg-deb or dpkg-shlibdeps (packages dpkg, dpkg-dev) is missing";
    }
    test::TempDir dir;
    test::AgentProcess home;  // its home, platform root and environment; nothing started
    const auto environment = home.environment();

    const fs::path out = dir.path() / "out";
    auto built = test::runTool(
        QAX_CPACK_COMMAND,
        {"--config", std::string(QAX_BINARY_DIR) + "/CPackConfig.cmake", "-B", out.string()},
        environment, 120);
    ASSERT_EQ(built.status, 0) << built.out << built.err;
    fs::path deb;
    for (const auto& entry : fs::directory_iterator(out)) {
        deb = entry.path().extension() == ".deb" ? entry.path() : deb;
    }
    auto depends = test::runTool(*dpkgDeb, {"--field", deb.string(), "Depends"}, environment);
    for (const char* package : {"libsystemd0", "libplist", "libcurl", "libssl", "libicu"}) {
        EXPECT_NE(depends.out.find(package), std::string::npos) << depends.out;
    }

    const fs::path root = dir.path() / "root";
    ASSERT_EQ(test::runTool(*dpkg, {"-x", deb.string(), root.string()}, environment).status, 0);
    for (const char* file :
         {"usr/lib/systemd/user/qaxagent.socket", "usr/lib/systemd/user/qaxagent-wake.timer",
          "usr/share/man/man1/qaxctl.1", "usr/share/man/man8/qaxagent.8",
          "usr/share/qaxagent/demo/device.plist", "usr/bin/coverage-sim"}) {
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
    for (int i = 0; i < 2000 && !fs::is_socket(home.socketPath()) && agent.running(); ++i) {
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    auto shown = test::runTool(qaxctl, {"default-device"}, environment);
    EXPECT_EQ(shown.status, 0) << shown.err << home.log();
    EXPECT_NE(shown.out.find("Default Device"), std::string::npos) << shown.out;
    agent.terminate();
    auto status = agent.waitForExit(10);
    EXPECT_TRUE(status && WIFEXITED(*status) && WEXITSTATUS(*status) == 0) << home.log();
}

}  // namespace
}  // namespace qax
