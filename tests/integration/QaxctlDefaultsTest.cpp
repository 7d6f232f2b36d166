// qaxctl defaults run as a real process against a temporary HOME, and seen by the agent's
// own preference store the way a running agent sees it.
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "AgentProcess.h"
#include "core/JsonCodec.h"
#include "fakes/TestPlatform.h"
#include "platform/host/FilePreferenceStore.h"

namespace qax {
namespace {

using test::runTool;
using test::ToolResult;

// Runs qaxctl with `args` (split on blanks, no quoting) against `home`.
ToolResult qaxctl(const test::TempDir& home, const std::vector<std::string>& args) {
    return runTool(QAX_CTL_BINARY, args, {"HOME=" + home.str(), "PATH=/usr/bin:/bin"});
}

TEST(QaxctlDefaults, WriteReadDeleteAgainstATemporaryHome) {
    test::TempDir home;
    FilePreferenceStore agentView(FilePreferenceStore::domainPath(home.str()));
    EXPECT_FALSE(agentView.objectForKey("SerialNumber"));

    struct Row {
        const char* type;
        const char* text;
        const char* key;
        Value expected;
    } rows[] = {
        {"-string", "C02OVERRIDE", "SerialNumber", Value("C02OVERRIDE")},
        {"-int", "2", "QAXMigrationVersion", Value(2)},
        {"-real", "-86400.5", "W1.activationInterval", Value(-86400.5)},
        {"-bool", "yes", "PostUpgradeActivityCompleted", Value(true)},
        {"-date", "2023-11-14T22:13:20Z", "DefaultDeviceActivationDate", Value(Date(1700000000))},
        {"-json", R"({"LowServerVersion":2,"HighServerVersion":"3"})", "ServerVersionOverride",
         Value(Value::Dictionary{{"LowServerVersion", 2}, {"HighServerVersion", "3"}})},
        {"-json", R"(["a","b"])", "FollowupPostedSerialNumberHashes",
         Value(Value::Array{"a", "b"})},
    };
    for (const auto& r : rows) {
        SCOPED_TRACE(r.text);
        auto w = qaxctl(home, {"defaults", "write", r.key, r.type, r.text});
        ASSERT_EQ(w.status, 0) << w.err;
        EXPECT_EQ(agentView.objectForKey(r.key), r.expected);
    }

    auto read = qaxctl(home, {"defaults", "read", "ServerVersionOverride", "--json"});
    ASSERT_EQ(read.status, 0);
    EXPECT_EQ(parseJson(read.out),
              Value(Value::Dictionary{{"LowServerVersion", 2}, {"HighServerVersion", "3"}}));
    // A key with only a registered default reads that default.
    read = qaxctl(home, {"defaults", "read", "CachedWarrantyValidityDuration"});
    EXPECT_EQ(read.status, 0);
    EXPECT_EQ(read.out, "86400\n");

    auto all = qaxctl(home, {"defaults", "read", "--json"});
    ASSERT_EQ(all.status, 0);
    auto parsed = parseJson(all.out);
    ASSERT_TRUE(parsed && parsed->isDictionary());
    EXPECT_EQ(parsed->size(), std::size(rows));
    EXPECT_EQ(*parsed->find("DefaultDeviceActivationDate"), Value("2023-11-14T22:13:20.000Z"));

    ASSERT_EQ(qaxctl(home, {"defaults", "delete", "SerialNumber"}).status, 0);
    EXPECT_FALSE(agentView.objectForKey("SerialNumber"));
    EXPECT_EQ(qaxctl(home, {"defaults", "read", "SerialNumber"}).status, 1);
}

TEST(QaxctlDefaults, BadInputIsRefusedAndLosesNothing) {
    test::TempDir home;
    ASSERT_EQ(qaxctl(home, {"defaults", "write", "Keep", "-int", "1"}).status, 0);
    const std::vector<std::string> bad[] = {
        {"-int", "12a"},       {"-bool", "maybe"}, {"-date", "soon"},
        {"-json", R"({"a":)"}, {"-json", "null"},  {"-float", "1"},
    };
    for (const auto& typed : bad) {
        auto r = qaxctl(home, {"defaults", "write", "K", typed[0], typed[1]});
        EXPECT_NE(r.status, 0) << typed[1];
        EXPECT_FALSE(r.err.empty()) << typed[1] << ": a reason is printed";
    }
    EXPECT_EQ(qaxctl(home, {"defaults"}).status, 64);
    FilePreferenceStore view(FilePreferenceStore::domainPath(home.str()));
    EXPECT_EQ(view.allKeys(), std::vector<std::string>{"Keep"});
}

}  // namespace
}  // namespace qax
