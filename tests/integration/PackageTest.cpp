// The Debian package as a user gets it: built with CPack from this build tree, unpacked into a
// temporary root, its agent and qaxctl run from there against a temporary home.
#include <gtest/gtest.h>
#include <sys/wait.h>

#include <filesystem>

#include "AgentProcess.h"

namespace qax {
namespace {

namespace fs = std::filesystem;

TEST(PackageTest, UnpackedDebRunsTheAgentAndQaxctlAgainstATemporaryHome) {
    const auto dpkg = test::findProgram("dpkg");
    const auto dpkgDeb = test::findProgram("dpkg-deb");
    if (!dpkg || !dpkgDeb || !test::findProgram("dpkg-shlibdeps")) {
        GTEST_SKIP() << "dpkg, dpkg-deb or dpkg-shlibdeps (packages dpkg, dpkg-dev) is missing";
    }
    test::AgentProcess agent;  // started from the unpacked package below
    const auto environment = agent.environment();
    const fs::path out = fs::path(agent.home()) / "out";
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

    const fs::path root = fs::path(agent.home()) / "unpacked";
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
    agent.registerApplication("qaxctl", qaxctl, "com.velmora.Preferences", Value(true));
    ASSERT_TRUE(agent.start((root / "usr/lib/qaxagent/qaxagent").string())) << agent.log();
    auto shown = test::runTool(qaxctl, {"default-device"}, environment);
    EXPECT_EQ(shown.status, 0) << shown.err << agent.log();
    EXPECT_NE(shown.out.find("Default Device"), std::string::npos) << shown.out;
    const int status = agent.stop();
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << agent.log();
}

}  // namespace
}  // namespace qax
