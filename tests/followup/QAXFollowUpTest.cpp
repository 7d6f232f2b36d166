#include <gtest/gtest.h>

#include <latch>

#include "core/AsioDispatcher.h"
#include "core/Hash.h"
#include "fakes/FakeAnalyticsSink.h"
#include "fakes/FakeFollowUpCenter.h"
#include "fakes/FakeUserInterfaceStrings.h"
#include "fakes/TestPlatform.h"
#include "followup/QAXDefaultFolllowUpProvider.h"
#include "followup/QAXFollowUp.h"
#include "platform/PreferenceStore.h"
#include "warranty/QAXWarranty.h"

namespace qax {
namespace {

constexpr const char* kClient = "com.velmora.Kestova";
constexpr const char* kPostRule = "-[QAXFollowUp _postFollowUpWithDevicesInfo:repostAllowed:]";
constexpr const char* kRefresh =
    "-[QAXFollowUp refreshFollowupWithDeviceInfos:clearUntrackedDeviceFollowups:allowForcePost:]";
constexpr double kDay = 86400;

class QAXFollowUpTest : public ::testing::Test {
  protected:
    // Epoch seconds `days` from now (the summary's own date form).
    std::int64_t epoch(double days) const {
        return static_cast<std::int64_t>(tp.clock->now().secondsSince1970() + days * kDay);
    }
    Date at(double days) const { return Date(static_cast<double>(epoch(days))); }

    // A displayed offer eligible for `untilDays` more days, opened 45 days before its end.
    Value::Dictionary offer(double untilDays) const {
        return {
            {"hvOfferEligibleUntil", Value(epoch(untilDays))},
            {"hvLocalizedOfferLabel", "Haverly for your phone"},
            {"hvLocalizedOfferCTA", "Get Haverly"},
            {"hvLocalizedOfferSingularDesc", "Last day to buy"},
            {"hvLocalizedOfferPluralDescFormat", "%@ days left to buy"},
            {"featureToggleParameters",
             Value::Dictionary{{"hvOfferDisplay", true}, {"hvOfferDurationDaysBeforeEndDate", 45}}},
        };
    }
    std::shared_ptr<QAXDeviceInfo> info(const std::optional<std::string>& serial,
                                        std::optional<Value::Dictionary> summary,
                                        QAXDeviceType type = QAXDeviceTypeDefault,
                                        std::optional<Date> activation = std::nullopt) {
        auto warranty =
            summary ? QAXWarranty::initWithDictionary(tp.platform, Value(*summary)) : nullptr;
        return QAXDeviceInfo::deviceInfoWithDevice(
            QAXDevice::deviceWithName("Phone", serial, activation, type), warranty);
    }
    std::optional<FollowUpItem> pending(const std::string& serial) {
        return center->item(kClient, QAXFollowUp::uniqueIdentfierForSerialNumber(serial));
    }
    FollowUpItem pendingItemFor(const std::string& serial, std::optional<std::string> id = {}) {
        FollowUpItem item;
        item.uniqueIdentifier = id.value_or(QAXFollowUp::uniqueIdentfierForSerialNumber(serial));
        item.groupIdentifier = "group.kept";
        item.displayStyle = 2;
        item.userInfo = {{"FollowupSerialNumber", Value(serial)}};
        return item;
    }
    std::vector<std::string> array(const char* key) {
        std::vector<std::string> out;
        for (const auto& v : prefs.arrayForKey(key).value_or(Value::Array{})) {
            out.push_back(*v.asString());
        }
        return out;
    }
    bool logged(const std::string& text) { return tp.log->contains(text); }

    test::TestPlatform tp;
    PreferenceStore& prefs = *tp.platform->preferences;
    std::shared_ptr<test::InMemoryFollowUpCenter> center =
        std::static_pointer_cast<test::InMemoryFollowUpCenter>(tp.platform->followUps);
    std::shared_ptr<test::RecordingAnalyticsSink> analytics =
        std::static_pointer_cast<test::RecordingAnalyticsSink>(tp.platform->analytics);
    QAXFollowUp followUp{tp.platform};
};

TEST_F(QAXFollowUpTest, PostedItemIdentifiesAndTargetsTheDevice) {
    EXPECT_EQ(QAXFollowUp::uniqueIdentfierForSerialNumber(std::nullopt), kClient);

    const std::tuple<QAXDeviceType, std::optional<std::string>, const char*> rows[] = {
        {QAXDeviceTypeDefault, "com.velmora.Preferences", "Default"},
        {QAXDeviceTypeWatch, "com.velmora.Bridge", "Watch"},
        {QAXDeviceTypeOther, std::nullopt, "Other"}};
    for (const auto& [type, target, typeText] : rows) {
        SCOPED_TRACE(typeText);
        const std::string serial = std::string("SN-") + typeText;
        followUp.postFollowUpWithDeviceInfo(info(serial, offer(30), type));
        auto item = pending(serial);
        ASSERT_TRUE(item);
        EXPECT_EQ(item->uniqueIdentifier, std::string(kClient) + "." + sha256Hash(serial));
        EXPECT_EQ(item->targetBundleIdentifier, target);
        EXPECT_EQ(item->groupIdentifier, "com.velmora.followup.group.qax");
        EXPECT_EQ(item->extensionIdentifier, "com.velmora.Kestova.Extension");
        EXPECT_EQ(item->title, "Haverly for your phone");
        EXPECT_EQ(item->informativeFooterText, "30 days left to buy");
        EXPECT_EQ(item->expirationDate, at(30).byAdding(-0.001));
        EXPECT_EQ(item->userInfo,
                  (Value::Dictionary{{"FollowupSerialNumber", Value(serial)},
                                     {"RelativeIsCeiling", true},
                                     {"RelativeSingleDay", "Last day to buy"},
                                     {"RelativePluralDaysFormat", "%@ days left to buy"}}));
        ASSERT_EQ(item->actions.size(), 1u);
        EXPECT_EQ(item->actions[0].label, "Get Haverly");
        EXPECT_EQ(item->actions[0].identifier, "com.followup.qax_followup_open_action");
        EXPECT_FALSE(item->actions[0].url);
        EXPECT_TRUE(logged("Posted follow-up: serialNumber:" + serial + " -> success"));
        EXPECT_EQ(analytics->events().back().payload,
                  (Value::Dictionary{{"devicetype", typeText}}));
    }
    EXPECT_EQ(analytics->events().size(), 3u);

    // A missing warranty, a hidden offer or a missing serial number is refused.
    auto hidden = offer(30);
    hidden["featureToggleParameters"] = Value::Dictionary{{"hvOfferDisplay", false}};
    followUp.postFollowUpWithDeviceInfo(info("X", std::nullopt));
    followUp.postFollowUpWithDeviceInfo(info("Y", hidden));
    followUp.postFollowUpWithDeviceInfo(info(std::nullopt, std::nullopt));
    EXPECT_TRUE(logged("Failed to post follow-up:<Missing warranty><Missing serial number>"));
    EXPECT_EQ(center->items(kClient).size(), 3u);
}

TEST_F(QAXFollowUpTest, BadgeAndNotificationFollowTheServerDurations) {
    struct Row {
        const char* name;
        double untilDays;
        bool rowBadge;
        double badgeDays;
        bool notifyToggle;
        double notifyDays;
        std::uint64_t displayStyle;
        bool notification;
    };
    const Row rows[] = {
        {"badge window open", 10, true, 14, false, 0, 3, false},
        {"badge window not yet open", 10, true, 7, false, 0, 18, false},
        {"badge flag off", 10, false, 14, false, 0, 18, false},
        {"badge date equal to now", 10, true, 10, false, 0, 18, false},
        {"eligibility over", -1, true, 14, true, 3, 18, false},
        {"notification window open", 2, false, 0, true, 3, 18, true},
        {"notification window not yet open", 2, false, 0, true, 1, 18, false},
        {"notification date equal to now", 2, false, 0, true, 2, 18, false},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        auto summary = offer(row.untilDays);
        summary["featureToggleParameters"] = Value(
            Value::Dictionary{{"hvOfferDisplay", true}, {"hvOfferSettingsRowBadge", row.rowBadge}});
        summary["hvOfferBadgeBeforeEndDate"] = Value(row.badgeDays);
        summary["showNotificationToggle"] = Value(row.notifyToggle);
        summary["showNotificationBeforeEndDate"] = Value(row.notifyDays);
        FollowUpItem item;
        item.displayStyle = 2;
        followUp._setupFollowUpItem(item, *info("SN", summary));
        EXPECT_EQ(item.displayStyle, row.displayStyle);
        EXPECT_EQ(item.notification.has_value(), row.notification);
    }
}

TEST_F(QAXFollowUpTest, SetUpAgainAccumulatesBitsAndKeepsANotification) {
    auto summary = offer(10);
    summary["featureToggleParameters"] =
        Value::Dictionary{{"hvOfferDisplay", true}, {"hvOfferSettingsRowBadge", true}};
    summary["hvOfferBadgeBeforeEndDate"] = Value(14);
    summary["showNotificationToggle"] = Value(true);
    summary["showNotificationBeforeEndDate"] = Value(11);
    summary["hvNotificationLocalizedOfferLabel"] = "Don't miss Haverly";
    summary["hvNotificationLocalizedOfferPluralDescFormat"] = "Only %@ days";
    auto fakeStrings =
        std::static_pointer_cast<test::FakeUserInterfaceStrings>(tp.platform->uiStrings);
    fakeStrings->set("DETAILS", "100%% Details");

    FollowUpItem item;
    item.displayStyle = 2;
    followUp._setupFollowUpItem(item, *info("SN", summary));
    EXPECT_EQ(item.displayStyle, 3u);
    ASSERT_TRUE(item.notification);
    const FollowUpNotification& n = *item.notification;
    EXPECT_EQ(n.title, "Don't miss Haverly");
    EXPECT_EQ(n.informativeText, "Only 10 days");
    EXPECT_EQ(n.activateAction->label, "100% Details");
    EXPECT_EQ(n.activateAction->identifier, "com.followup.qax_notification_open_action");
    EXPECT_EQ(n.clearAction->label, "Clear");
    EXPECT_EQ(n.clearAction->identifier, "com.followup.qax_notification_clear_action");
    EXPECT_EQ(n.frequency, 0.0);
    EXPECT_EQ(n.options, 15u);

    // Later the badge and the notification windows close (the server shortened them); texts
    // gone: the style gains 16 without losing 1, the notification stays, userInfo shrinks.
    summary["hvOfferBadgeBeforeEndDate"] = Value(1);
    summary["showNotificationBeforeEndDate"] = Value(1);
    summary.erase("hvNotificationLocalizedOfferLabel");
    summary.erase("hvLocalizedOfferSingularDesc");
    summary.erase("hvLocalizedOfferPluralDescFormat");
    followUp._setupFollowUpItem(item, *info("SN", summary));
    EXPECT_EQ(item.displayStyle, 19u);
    EXPECT_EQ(item.notification->title, "Don't miss Haverly");
    EXPECT_EQ(item.userInfo,
              (Value::Dictionary{{"FollowupSerialNumber", "SN"}, {"RelativeIsCeiling", true}}));
    EXPECT_EQ(tp.log->count("Missing hvLocalizedOfferSingularDesc value"), 1);
    EXPECT_EQ(tp.log->count("Missing hvLocalizedOfferPluralDescFormat value"), 1);

    // Without a notification label the notification falls back to the offer label.
    summary["showNotificationBeforeEndDate"] = Value(11);
    EXPECT_EQ(followUp._setupFollowUpNotificationWithDeviceInfo(*info("SN", summary)).title,
              "Haverly for your phone");
}

TEST_F(QAXFollowUpTest, PostRuleDecidesEachDevice) {
    auto noDisplay = offer(30);
    noDisplay["featureToggleParameters"] = Value::Dictionary{{"hvOfferDisplay", false}};
    auto noEnd = offer(30);
    noEnd.erase("hvOfferEligibleUntil");
    auto displayNow = offer(30);
    displayNow["hvOfferFollowupDisplayDate"] = Value(epoch(0));
    auto displayTomorrow = offer(30);
    displayTomorrow["hvOfferFollowupDisplayDate"] = Value(epoch(1));

    const std::string notPosted = "Device eligible with future post date. Cannot post followup";
    // clang-format off
    const std::tuple<const char*, std::optional<Value::Dictionary>, std::optional<Date>, bool,
                     std::string> rows[] = {
        {"A", std::nullopt, {}, false, "No warranty downloaded for device. Don't post a followup"},
        {"B", noDisplay, {}, false, "Device NOT eligible. Don't post a followup"},
        {"C", noEnd, {}, false, "Device no longer eligible. Don't post a followup"},
        {"D", offer(-1), {}, false, "Device no longer eligible. Don't post a followup"},
        {"E", offer(30), {}, true, "Device eligible. Post new  followup"},
        {"F", offer(30), at(2), false, notPosted},
        {"G", displayNow, {}, true, "Device eligible. Post new  followup"},
        {"H", displayTomorrow, {}, false, notPosted},
    };
    // clang-format on
    for (const auto& [serial, summary, activation, due, message] : rows) {
        SCOPED_TRACE(serial);
        auto deviceInfo = info(serial, summary, QAXDeviceTypeDefault, activation);
        EXPECT_EQ(followUp.postFollowUpWithDevicesInfo({deviceInfo}), due);
        EXPECT_EQ(pending(serial).has_value(), due);
        EXPECT_TRUE(logged(std::string(kPostRule) + ": " + message + " for " +
                           deviceInfo->device()->description() +
                           (due || message.find("future") == std::string::npos
                                ? ""
                                : " on: " + (activation ? *activation : at(1)).description())));
    }
    EXPECT_EQ(tp.log->count(std::string(kPostRule) +
                            ": Using initial postdate as it is later than FollowupDisplay Date"),
              1);
    EXPECT_EQ(followUp.postDateForDeviceInfo(*info("I", offer(30))), at(-15));
}

TEST_F(QAXFollowUpTest, DismissalKeepsTheOfferAwayUntilANewOfferPeriod) {
    auto summary = offer(30);
    summary["hvOfferFollowupDisplayDate"] = Value(epoch(-1));
    auto device = info("SN", summary);
    const std::string hash = sha256Hash("SN");

    ASSERT_TRUE(followUp.postFollowUpWithDevicesInfo({device}));
    ASSERT_TRUE(followUp.postFollowUpWithDevicesInfo({device}));
    EXPECT_EQ(analytics->events().size(), 1u);  // the second post is no new display
    EXPECT_EQ(array("FollowupPostedSerialNumberHashes"), std::vector<std::string>{hash});

    // A failed removal records nothing.
    center->failClear("service unavailable");
    followUp.dismissFollowUpForSerialNumber("SN");
    EXPECT_TRUE(logged("Dismissed follow-up: service unavailable"));
    EXPECT_TRUE(array("FollowupDismissedSerialNumberHashes").empty());
    EXPECT_FALSE(prefs.objectForKey(hash + ".dismissed"));
    center->failClear(std::nullopt);

    followUp.dismissFollowUpForSerialNumber("SN");
    EXPECT_TRUE(logged("Dismissed follow-up: success"));
    EXPECT_FALSE(pending("SN"));
    EXPECT_EQ(prefs.dateForKey(hash + ".dismissed"), tp.clock->now());
    EXPECT_FALSE(followUp.postFollowUpWithDevicesInfo({device}));
    EXPECT_TRUE(logged(std::string(kPostRule) + ": Followup already dismissed for " +
                       device->device()->description() + ", leaving unposted"));

    // Conversion: dismissal date against the current display date.
    tp.clock->advanceBy(5 * kDay);
    const Date dismissedAt = at(-5);
    const std::pair<double, bool> rows[] = {{0, false}, {-1, false}, {1, true}};
    for (const auto& [displayDaysFromDismissal, converts] : rows) {
        SCOPED_TRACE(displayDaysFromDismissal);
        summary["hvOfferFollowupDisplayDate"] = Value(static_cast<std::int64_t>(
            dismissedAt.secondsSince1970() + displayDaysFromDismissal * kDay));
        auto converted = info("SN", summary);
        EXPECT_EQ(followUp.postFollowUpWithDevicesInfo({converted}), converts);
        EXPECT_EQ(pending("SN").has_value(), converts);
    }
    EXPECT_TRUE(logged("Device not eligible for conversion. " + device->device()->description() +
                       ", followup dismissed date: " + dismissedAt.description() +
                       ", fup display date: " + dismissedAt.description()));
    // The posted hash was removed and added again, so the display counted again.
    EXPECT_EQ(array("FollowupPostedSerialNumberHashes"), std::vector<std::string>{hash});
    EXPECT_EQ(analytics->events().size(), 2u);

    // Dismissed again: the hash is appended again and the date overwritten.
    followUp.dismissFollowUpForSerialNumber("SN");
    EXPECT_EQ(array("FollowupDismissedSerialNumberHashes"), (std::vector<std::string>{hash, hash}));
    EXPECT_EQ(prefs.dateForKey(hash + ".dismissed"), tp.clock->now());
    EXPECT_FALSE(followUp.postFollowUpWithDevicesInfo({info("SN", summary)}));

    // No serial number: refused, the legacy item is not touched.
    center->setItems(kClient, {pendingItemFor("L", std::string(kClient))});
    followUp.dismissFollowUpForSerialNumber(std::nullopt);
    EXPECT_EQ(center->items(kClient).size(), 1u);
}

TEST_F(QAXFollowUpTest, RefreshUpdatesClearsAndReposts) {
    auto noDisplay = offer(30);
    noDisplay["featureToggleParameters"] = Value::Dictionary{{"hvOfferDisplay", false}};
    center->setItems(kClient, {pendingItemFor("A"), pendingItemFor("B"), pendingItemFor("C"),
                               pendingItemFor("D")});
    auto a = info("A", offer(30));
    auto infos = QAXDeviceInfoList{a,
                                   info("C", offer(-1)),     // expired
                                   info("D", noDisplay),     // no longer displayed
                                   info("E", std::nullopt),  // no item, no warranty
                                   info("F", offer(30)),     // eligible, never posted
                                   info(std::nullopt, offer(30))};
    auto result = followUp.refreshFollowupWithDeviceInfos(infos);

    EXPECT_EQ(result, QAXDeviceInfoList{a});
    ASSERT_EQ(center->items(kClient).size(), 1u);
    const FollowUpItem updated = *pending("A");
    EXPECT_EQ(updated.title, "Haverly for your phone");
    EXPECT_EQ(updated.groupIdentifier, "group.kept");
    EXPECT_EQ(updated.displayStyle, 18u);
    EXPECT_FALSE(pending("F"));
    EXPECT_EQ(center->clearCount(), 1);  // B, C, D and E in one call
    EXPECT_TRUE(logged("No longer tracking device B (B) ((null)) - Default, clearing"));
    EXPECT_TRUE(logged(std::string(kRefresh) + ": Serial number is nil"));

    // A single-device refresh leaves other items alone; forced posting brings a dismissed
    // device back despite the dismissed array.
    center->setItems(kClient, {pendingItemFor("B")});
    prefs.setObject("FollowupDismissedSerialNumberHashes", Value::Array{sha256Hash("F")});
    result = followUp.refreshFollowupWithDeviceInfo(infos[4], true);
    EXPECT_EQ(result, QAXDeviceInfoList{infos[4]});
    EXPECT_TRUE(pending("F") && pending("B"));
    result = followUp.refreshFollowupWithDeviceInfo(info("C", offer(-1)), true);
    EXPECT_TRUE(result.empty());

    // A listing failure: no update, no untracked clearing, eligible devices left unposted.
    tp.log->clear();
    center->failList("listing failed");
    result = followUp.refreshFollowupWithDeviceInfos({info("F", offer(30))});
    EXPECT_TRUE(result.empty());
    EXPECT_TRUE(logged("Error loading pending follow-ups: listing failed"));
    EXPECT_TRUE(pending("B"));
    EXPECT_EQ(tp.log->countContaining("Followup already dismissed/not present"), 1);
}

TEST_F(QAXFollowUpTest, NotificationDismissalStripsEveryMatchingItem) {
    // Through the follow-up service itself, whatever provider the object was given.
    auto other = std::make_shared<test::InMemoryFollowUpCenter>();
    QAXFollowUp elsewhere(tp.platform, std::make_shared<QAXDefaultFolllowUpProvider>(other));
    FollowUpItem a = pendingItemFor("A"), b = pendingItemFor("B");
    a.notification = b.notification = FollowUpNotification{};
    center->setItems(kClient, {a, b, a});

    elsewhere.dismissNotificationForSerialNumber("A");
    auto items = center->items(kClient);
    ASSERT_EQ(items.size(), 3u);
    EXPECT_FALSE(items[0].notification || items[2].notification);
    EXPECT_TRUE(items[1].notification);
    EXPECT_EQ(tp.log->countContaining("Cleared follow-up notification: success for item: "), 2);

    center->failClearNotification("denied");
    elsewhere.dismissNotificationForSerialNumber("B");
    EXPECT_TRUE(center->items(kClient)[1].notification);
    EXPECT_EQ(tp.log->countContaining("Cleared follow-up notification: denied for item: "), 1);
}

TEST_F(QAXFollowUpTest, LegacyItemIsMigratedOrCleared) {
    const std::string device = QAXFollowUp::uniqueIdentfierForSerialNumber("SN");
    const std::string other = QAXFollowUp::uniqueIdentfierForSerialNumber("OTHER");
    // clang-format off
    // The pending identifiers ("" stands for the legacy one), a warranty, failures of the post
    // and the clear, the identifiers after, and the message logged.
    const std::tuple<const char*, std::vector<std::string>, bool, const char*, const char*,
                     std::vector<std::string>, std::string> rows[] = {
        {"migrated", {""}, true, nullptr, nullptr, {device}, "Migrating legacy followup.."},
        {"no warranty", {""}, false, nullptr, nullptr, {},
         "Clearing legacy followup, no legacy warranty was found.."},
        {"post fails", {""}, true, "full", nullptr, {}, "Error posting migrated follow-up: full"},
        {"clear fails", {""}, false, nullptr, "locked", {kClient},
         "Error clearing legacy follow-up: locked"},
        {"two items", {"", other}, true, nullptr, nullptr, {kClient, other}, ""},
        {"not legacy", {other}, true, nullptr, nullptr, {other}, ""},
    };
    // clang-format on
    for (const auto& [name, pendingIds, warranty, postError, clearError, left, message] : rows) {
        SCOPED_TRACE(name);
        tp.log->clear();
        std::vector<FollowUpItem> seeded;
        for (const auto& id : pendingIds) {
            seeded.push_back(pendingItemFor("SN", id.empty() ? std::string(kClient) : id));
        }
        center->setItems(kClient, seeded);
        auto error = [](const char* e) { return e ? std::optional<std::string>(e) : std::nullopt; };
        center->failPost(error(postError));
        center->failClear(error(clearError));
        followUp.migrateLegacyFollowUpIfNeededWithDeviceInfo(
            info("SN", warranty ? std::optional(offer(30)) : std::nullopt));
        std::vector<std::string> after;
        for (const auto& item : center->items(kClient)) {
            after.push_back(*item.uniqueIdentifier);
        }
        EXPECT_EQ(after, left);
        if (!message.empty()) {
            EXPECT_TRUE(logged(message));
        } else {
            EXPECT_TRUE(tp.log->messages().empty());
        }
    }
    // The migrated item keeps its identifiers but for the unique one, and gains content.
    center->failPost(std::nullopt);
    center->failClear(std::nullopt);
    center->setItems(kClient, {pendingItemFor("SN", std::string(kClient))});
    followUp.migrateLegacyFollowUpIfNeededWithDeviceInfo(info("SN", offer(30)));
    EXPECT_EQ(pending("SN")->groupIdentifier, "group.kept");
    EXPECT_EQ(pending("SN")->displayStyle, 18u);
}

TEST_F(QAXFollowUpTest, PendingCountAndLazyAnalytics) {
    center->setItems(kClient, {pendingItemFor("A"), pendingItemFor("B")});
    EXPECT_EQ(followUp.pendingFollowUpCount(), 2u);
    center->failList("gone");
    EXPECT_EQ(followUp.pendingFollowUpCount(), 0u);
    EXPECT_EQ(tp.log->count("Error loading pending follow-ups: gone"), 1);

    // A sink that does not want the event never has the payload built.
    analytics->enabled = false;
    followUp.postFollowUpWithDeviceInfo(info("SN", offer(30)));
    EXPECT_TRUE(array("FollowupPostedSerialNumberHashes").size() == 1);
    EXPECT_EQ(tp.log->countContaining("Posting for event:"), 0);
    analytics->enabled = true;
    followUp.postFollowUpWithDeviceInfo(info("SN2", offer(30), QAXDeviceTypeWatch));
    EXPECT_TRUE(
        logged("Posting for event: com.velmora.kestova.followupDisplayCount with value: {\n    "
               "devicetype = Watch;\n}"));
}

TEST_F(QAXFollowUpTest, ConcurrentOperationsLoseNoPreferenceEntry) {
    constexpr int kTasks = 400;
    auto dispatcher = std::make_shared<AsioDispatcher>(4, 1);
    std::latch done(kTasks);
    for (int i = 0; i < kTasks; ++i) {
        auto deviceInfo = info("SN-" + std::to_string(i), offer(30));
        dispatcher->backgroundQueue()->post([this, i, deviceInfo, &done] {
            // Each task uses its own object, as callers do.
            QAXFollowUp worker(tp.platform);
            if (i % 2 == 0) {
                worker.postFollowUpWithDevicesInfo({deviceInfo});
            } else {
                worker.postFollowUpWithDeviceInfo(deviceInfo);
                worker.dismissFollowUpForSerialNumber(deviceInfo->device()->serialNumber());
            }
            done.count_down();
        });
    }
    done.wait();
    dispatcher->shutdown();

    EXPECT_EQ(array("FollowupPostedSerialNumberHashes").size(), static_cast<std::size_t>(kTasks));
    EXPECT_EQ(array("FollowupDismissedSerialNumberHashes").size(),
              static_cast<std::size_t>(kTasks / 2));
    EXPECT_EQ(center->items(kClient).size(), static_cast<std::size_t>(kTasks / 2));
    EXPECT_EQ(analytics->events().size(), static_cast<std::size_t>(kTasks));
}

}  // namespace
}  // namespace qax
