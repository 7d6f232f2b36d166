// The follow-up store on files: replacing in place, clearing, notification delivery, two
// processes posting at once, and stored files the agent did not write.
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <set>
#include <sstream>

#include "core/JsonCodec.h"
#include "core/PlistCodec.h"
#include "fakes/TestPlatform.h"
#include "platform/host/FollowUpItemCodec.h"
#include "platform/host/HostFollowUpCenter.h"

namespace qax {
namespace {

using test::readFile;
using test::writeFile;

constexpr const char* kClient = "com.velmora.Kestova";

FollowUpItem item(const std::string& id, const std::string& title, bool withNotification) {
    FollowUpItem i;
    i.uniqueIdentifier = id;
    i.groupIdentifier = "com.velmora.followup.group.qax";
    i.displayStyle = 2 | 1;
    i.title = title;
    i.expirationDate = Date(1'700'000'000.123);
    i.userInfo = {{"FollowupSerialNumber", "C02"}, {kFollowUpRelativeIsCeilingKey, true}};
    i.actions = {{"Buy", std::nullopt, "open"}};
    if (withNotification) {
        FollowUpNotification n;
        n.title = title + " now";
        n.activateAction = FollowUpAction{"Details", std::nullopt, "activate"};
        n.options = FollowUpNotification::LockScreenOption |
                    FollowUpNotification::ExtensionForNotificationOption;
        i.notification = n;
    }
    return i;
}

std::vector<std::string> deliveredIds(const std::string& root) {
    std::vector<std::string> ids;
    std::istringstream lines(readFile(HostFollowUpCenter::notificationsPath(root)));
    for (std::string line; std::getline(lines, line);) {
        auto v = parseJson(line);
        ids.push_back(v && v->find("uniqueIdentifier") ? *v->find("uniqueIdentifier")->asString()
                                                       : "?");
    }
    return ids;
}

TEST(HostFollowUpCenter, CodecKeepsEveryFieldAndWritesOptionsByName) {
    const FollowUpItem original = item("a", "Title", true);
    const Value stored = FollowUpItemCodec::encode(original, Date(5));
    const auto decoded = FollowUpItemCodec::decode(*stored.asDictionary());
    EXPECT_EQ(FollowUpItemCodec::encode(decoded.item, decoded.postedDate), stored);
    EXPECT_EQ(*stored.find("notification")->find("options"),
              (Value::Array{"LockScreen", "ExtensionForNotification"}));
    EXPECT_FALSE(stored.find("targetBundleIdentifier")) << "a missing text is a missing key";
    EXPECT_FALSE(stored.find("informativeFooterText"));
    // Milliseconds of the expiration date survive the binary store.
    auto reread = parsePlist(*toBinaryPlist(stored));
    EXPECT_EQ(reread->find("expirationDate")->asDate(), original.expirationDate);
}

TEST(HostFollowUpCenter, PostReplaceClearAndDeliverOnlyNewNotifications) {
    test::TempDir root;
    HostFollowUpCenter center(root.str(), std::make_shared<ManualClock>());
    auto joined = [](const std::vector<std::string>& ids) {
        std::string s;
        for (const auto& id : ids) {
            s += id;
        }
        return s;
    };
    struct Step {
        char op;  // p: post, n: clear the notification, c: clear the item
        const char* id;
        bool notification;
        const char* pending;    // identifiers in order
        const char* delivered;  // identifiers of the notification lines
    } steps[] = {
        {'p', "a", false, "a", ""},    {'p', "b", true, "ab", "b"},  {'p', "b", true, "ab", "b"},
        {'n', "b", false, "ab", "b"},  {'p', "b", true, "ab", "bb"}, {'p', "a", true, "ab", "bba"},
        {'c', "a", false, "b", "bba"},
    };
    for (std::size_t i = 0; i < std::size(steps); ++i) {
        const Step& s = steps[i];
        SCOPED_TRACE(i);
        std::string error;
        const FollowUpItem posted = item(s.id, "T" + std::to_string(i), s.notification);
        ASSERT_TRUE(s.op == 'p'   ? center.postFollowUpItem(kClient, posted, &error)
                    : s.op == 'n' ? center.clearNotificationForItem(kClient, posted, &error)
                                  : center.clearPendingFollowUpItemsWithUniqueIdentifiers(
                                        kClient, {s.id, "zzz"}, &error))
            << error;
        std::vector<std::string> ids;
        for (const auto& p : center.pendingFollowUpItems(kClient, &error)) {
            ids.push_back(*p.uniqueIdentifier);
        }
        EXPECT_EQ(joined(ids), s.pending);
        EXPECT_EQ(joined(deliveredIds(root.str())), s.delivered);
    }
    auto stored = center.storedItems(kClient);
    ASSERT_EQ(stored.size(), 1u);
    EXPECT_EQ(stored[0].item.title, "T4");
    EXPECT_TRUE(stored[0].item.notification) << "clearing one notification kept the item";
    EXPECT_FALSE(center.clearNotificationForItem(kClient, item("gone", "", false), nullptr));
    EXPECT_FALSE(center.postFollowUpItem("../escape", item("x", "", false), nullptr));
}

TEST(HostFollowUpCenter, TwoProcessesPostingAtOnceLoseNothing) {
    test::TempDir root;
    constexpr int kPerProcess = 40;
    auto post = [&](const std::string& prefix) {
        HostFollowUpCenter center(root.str(), std::make_shared<ManualClock>());
        bool ok = true;
        for (int i = 0; i < kPerProcess; ++i) {
            ok = center.postFollowUpItem(kClient, item(prefix + std::to_string(i), "t", i % 2),
                                         nullptr) &&
                 ok;
        }
        return ok;
    };
    const pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        _exit(post("child-") ? 0 : 1);
    }
    EXPECT_TRUE(post("parent-"));
    int status = 0;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);

    HostFollowUpCenter center(root.str(), std::make_shared<ManualClock>());
    std::set<std::string> ids;
    for (const auto& p : center.pendingFollowUpItems(kClient, nullptr)) {
        ids.insert(*p.uniqueIdentifier);
    }
    EXPECT_EQ(ids.size(), 2u * kPerProcess);
    EXPECT_EQ(deliveredIds(root.str()).size(), static_cast<std::size_t>(kPerProcess));
}

TEST(HostFollowUpCenter, StoredFilesTheAgentDidNotWrite) {
    test::TempDir root;
    HostFollowUpCenter center(root.str(), std::make_shared<ManualClock>());
    const auto path = std::filesystem::path(HostFollowUpCenter::storeDirectory(root.str())) /
                      "com.velmora.Kestova.plist";

    // An item with mistyped keys is listed with what it has; other entries are passed over.
    Value::Array odd{Value::Dictionary{{"uniqueIdentifier", "x"},
                                       {"title", 5},
                                       {"displayStyle", "3"},
                                       {"notification", "yes"},
                                       {"informativeFooterText", "Footer"}},
                     Value("not an item")};
    writeFile(path, *toXmlPlist(Value(odd)));
    auto items = center.pendingFollowUpItems(kClient, nullptr);
    ASSERT_EQ(items.size(), 1u);
    EXPECT_EQ(items[0].uniqueIdentifier, "x");
    EXPECT_FALSE(items[0].title);
    EXPECT_EQ(items[0].informativeFooterText, "Footer");
    EXPECT_EQ(items[0].displayStyle, 0u);
    EXPECT_FALSE(items[0].notification);

    // A corrupt store reads as empty and stays as it is until something is posted.
    const std::string corrupt = "bplist00\x01\x02 truncated";
    writeFile(path, corrupt);
    std::string error;
    EXPECT_TRUE(center.pendingFollowUpItems(kClient, &error).empty());
    EXPECT_EQ(readFile(path), corrupt);
    ASSERT_TRUE(center.postFollowUpItem(kClient, item("y", "Y", false), &error));
    EXPECT_EQ(center.pendingFollowUpItems(kClient, nullptr).size(), 1u);
}

}  // namespace
}  // namespace qax
