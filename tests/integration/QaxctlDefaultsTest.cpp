// qaxctl defaults run as a real process against a temporary HOME, and seen by the agent's
// own preference store the way a running agent sees it.
#include <gtest/gtest.h>

#include <sys/wait.h>

#include <array>
#include <cstdio>
#include <string>

#include "core/JsonCodec.h"
#include "fakes/TestPlatform.h"
#include "platform/host/FilePreferenceStore.h"

namespace qax {
namespace {

struct Result {
    int status;
    std::string out;
};

Result qaxctl(const test::TempDir& home, const std::string& args) {
    std::string cmd = "HOME='" + home.str() + "' '" QAX_CTL_BINARY "' " + args + " 2>&1";
    Result r{-1, {}};
    FILE* p = popen(cmd.c_str(), "r");
    if (!p) {
        return r;
    }
    std::array<char, 4096> buf{};
    std::size_t n = 0;
    while ((n = fread(buf.data(), 1, buf.size(), p)) > 0) {
        r.out.append(buf.data(), n);
    }
    int status = pclose(p);
    r.status = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    return r;
}

TEST(QaxctlDefaults, WriteReadDeleteAgainstATemporaryHome) {
    test::TempDir home;
    FilePreferenceStore agentView(FilePreferenceStore::domainPath(home.str()));
    EXPECT_FALSE(agentView.objectForKey("SerialNumber"));

    struct Row {
        const char* args;
        const char* key;
        Value expected;
    } rows[] = {
        {"-string C02OVERRIDE", "SerialNumber", Value("C02OVERRIDE")},
        {"-int 2", "QAXMigrationVersion", Value(2)},
        {"-real -86400.5", "W1.activationInterval", Value(-86400.5)},
        {"-bool yes", "PostUpgradeActivityCompleted", Value(true)},
        {"-date 2023-11-14T22:13:20Z", "DefaultDeviceActivationDate", Value(Date(1700000000))},
        {"-json '{\"LowServerVersion\":2,\"HighServerVersion\":\"3\"}'", "ServerVersionOverride",
         Value(Value::Dictionary{{"LowServerVersion", 2}, {"HighServerVersion", "3"}})},
        {"-json '[\"a\",\"b\"]'", "FollowupPostedSerialNumberHashes",
         Value(Value::Array{"a", "b"})},
    };
    for (const auto& r : rows) {
        SCOPED_TRACE(r.args);
        auto w = qaxctl(home, std::string("defaults write ") + r.key + " " + r.args);
        ASSERT_EQ(w.status, 0) << w.out;
        EXPECT_EQ(agentView.objectForKey(r.key), r.expected);
    }

    auto read = qaxctl(home, "defaults read ServerVersionOverride --json");
    ASSERT_EQ(read.status, 0);
    EXPECT_EQ(parseJson(read.out),
              Value(Value::Dictionary{{"LowServerVersion", 2}, {"HighServerVersion", "3"}}));
    // A key with only a registered default reads that default.
    read = qaxctl(home, "defaults read CachedWarrantyValidityDuration");
    EXPECT_EQ(read.status, 0);
    EXPECT_EQ(read.out, "86400\n");

    auto all = qaxctl(home, "defaults read --json");
    ASSERT_EQ(all.status, 0);
    auto parsed = parseJson(all.out);
    ASSERT_TRUE(parsed && parsed->isDictionary());
    EXPECT_EQ(parsed->size(), std::size(rows));
    EXPECT_EQ(*parsed->find("DefaultDeviceActivationDate"), Value("2023-11-14T22:13:20.000Z"));

    ASSERT_EQ(qaxctl(home, "defaults delete SerialNumber").status, 0);
    EXPECT_FALSE(agentView.objectForKey("SerialNumber"));
    EXPECT_EQ(qaxctl(home, "defaults read SerialNumber").status, 1);
}

TEST(QaxctlDefaults, BadInputIsRefusedAndLosesNothing) {
    test::TempDir home;
    ASSERT_EQ(qaxctl(home, "defaults write Keep -int 1").status, 0);
    const char* bad[] = {
        "defaults write K -int 12a",   "defaults write K -bool maybe",
        "defaults write K -date soon", "defaults write K -json '{\"a\":'",
        "defaults write K -json null", "defaults write K -float 1",
    };
    for (const char* args : bad) {
        auto r = qaxctl(home, args);
        EXPECT_NE(r.status, 0) << args;
        EXPECT_FALSE(r.out.empty()) << args << ": a reason is printed";
    }
    EXPECT_EQ(qaxctl(home, "defaults").status, 64);
    FilePreferenceStore view(FilePreferenceStore::domainPath(home.str()));
    EXPECT_EQ(view.allKeys(), std::vector<std::string>{"Keep"});
}

}  // namespace
}  // namespace qax
