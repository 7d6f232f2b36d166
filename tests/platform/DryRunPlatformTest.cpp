// The dry-run context over real host files: the rules running on it see their own changes,
// the files never do, and everything that could reach out is left out.
#include <gtest/gtest.h>

#include "fakes/FakeAnalyticsSink.h"
#include "fakes/TestPlatform.h"
#include "platform/host/DryRunPlatform.h"
#include "platform/host/FilePreferenceStore.h"
#include "platform/host/HostFollowUpCenter.h"
#include "platform/host/SystemClock.h"

namespace qax {
namespace {

constexpr const char* kClient = "com.velmora.Kestova";

FollowUpItem item(const char* id, bool notification) {
    FollowUpItem i;
    i.uniqueIdentifier = id;
    if (notification) {
        i.notification = FollowUpNotification{};
    }
    return i;
}

std::vector<std::string> ids(const std::vector<FollowUpItem>& items) {
    std::vector<std::string> out;
    for (const auto& i : items) {
        out.push_back(i.uniqueIdentifier.value_or("?"));
    }
    return out;
}

TEST(DryRunPlatform, ReadsThroughWritesToMemoryOnly) {
    test::TempDir dir;
    auto real = std::make_shared<Platform>();
    auto stored = std::make_shared<FilePreferenceStore>(dir.str() + "/domain.plist");
    stored->setObject("a", Value(1));
    stored->setObject("b", Value(2));
    real->followUps =
        std::make_shared<HostFollowUpCenter>(dir.str(), std::make_shared<SystemClock>());
    ASSERT_TRUE(real->followUps->postFollowUpItem(kClient, item("x", false), nullptr));
    ASSERT_TRUE(real->followUps->postFollowUpItem(kClient, item("y", true), nullptr));
    real->analytics = std::make_shared<test::RecordingAnalyticsSink>();
    const std::string domainBefore = test::readFile(dir.str() + "/domain.plist");
    const std::string storeBefore =
        test::readFile(HostFollowUpCenter::storeDirectory(dir.str()) + "/" + kClient + ".plist");

    DryRunPlatform dry(*real, stored);
    PreferenceStore& prefs = *dry.platform()->preferences;
    prefs.registerDefaults({{"b", Value(9)}, {"c", Value(3)}});
    prefs.setObject("a", Value(10));
    prefs.removeObject("b");
    const std::pair<const char*, std::optional<Value>> rows[] = {
        {"a", Value(10)}, {"b", Value(9)}, {"c", Value(3)}, {"d", std::nullopt}};
    for (const auto& [key, value] : rows) {
        EXPECT_EQ(prefs.objectForKey(key), value) << key;
    }
    EXPECT_EQ(prefs.allKeys(), std::vector<std::string>{"a"});
    EXPECT_EQ(dry.preferences().changes().size(), 2u);
    EXPECT_EQ(DryRunPlatform(*real, nullptr).platform()->preferences->objectForKey("a"),
              std::nullopt);

    FollowUpCenter& center = *dry.platform()->followUps;
    EXPECT_TRUE(center.postFollowUpItem(kClient, item("x", true), nullptr));  // now notifies
    EXPECT_TRUE(center.postFollowUpItem(kClient, item("y", true), nullptr));  // notified before
    EXPECT_TRUE(center.postFollowUpItem(kClient, item("z", false), nullptr));
    EXPECT_TRUE(center.clearPendingFollowUpItemsWithUniqueIdentifiers(kClient, {"y"}, nullptr));
    EXPECT_FALSE(center.clearNotificationForItem(kClient, item("y", false), nullptr));
    EXPECT_EQ(ids(center.pendingFollowUpItems(kClient, nullptr)),
              (std::vector<std::string>{"x", "z"}));
    const auto changes = dry.followUps().changes();
    ASSERT_EQ(changes.size(), 4u);
    EXPECT_TRUE(changes[0].deliversNotification);
    EXPECT_FALSE(changes[1].deliversNotification);
    EXPECT_EQ(changes[3].kind, DryRunFollowUpCenter::Change::Kind::Clear);

    dry.platform()->agentFactory->scheduleActivityForDate("com.velmora.qaxagent.outreach", Date(5));
    EXPECT_EQ(dry.agentFactory().scheduled().size(), 1u);
    EXPECT_FALSE(dry.platform()->agentFactory->makeAgent("anyone"));
    EXPECT_FALSE(dry.platform()->analytics);
    EXPECT_TRUE(real->analytics);

    EXPECT_EQ(test::readFile(dir.str() + "/domain.plist"), domainBefore);
    EXPECT_EQ(
        test::readFile(HostFollowUpCenter::storeDirectory(dir.str()) + "/" + kClient + ".plist"),
        storeBefore);
}

}  // namespace
}  // namespace qax
