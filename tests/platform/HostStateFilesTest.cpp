// The host's smaller file-backed bindings (simulated clock, analytics, telephony, interface
// strings, network override) and what every one of them does with a file it cannot use.
#include <gtest/gtest.h>

#include <cmath>
#include <filesystem>
#include <functional>

#include "core/JsonCodec.h"
#include "core/PlistCodec.h"
#include "fakes/FakeServices.h"
#include "fakes/TestPlatform.h"
#include "platform/host/HostActivityLaunchConfiguration.h"
#include "platform/host/HostActivityRegistry.h"
#include "platform/host/HostAnalyticsSink.h"
#include "platform/host/HostFollowUpCenter.h"
#include "platform/host/HostNetworkState.h"
#include "platform/host/HostTelephonyInfo.h"
#include "platform/host/HostUserInterfaceStrings.h"
#include "platform/host/SimulatedClock.h"

namespace qax {
namespace {

namespace fs = std::filesystem;
using test::readFile;
using test::writeFile;

std::string xmlPlist(const std::string& body) {
    return R"(<?xml version="1.0" encoding="UTF-8"?><plist version="1.0">)" + body + "</plist>";
}

int errorCount(const test::TestPlatform& env) {
    int n = 0;
    for (const auto& e : env.log->entries()) {
        n += e.level == LogLevel::Error;
    }
    return n;
}

TEST(SimulatedClock, OffsetFromTheClockFile) {
    const std::tuple<const char*, std::optional<std::string>, double, bool> rows[] = {
        {"absent", std::nullopt, 0, false},
        {"no key", xmlPlist("<dict/>"), 0, false},
        {"integer", xmlPlist("<dict><key>OffsetSeconds</key><integer>86400</integer></dict>"),
         86400, false},
        {"negative real", xmlPlist("<dict><key>OffsetSeconds</key><real>-90.5</real></dict>"),
         -90.5, false},
        {"text", xmlPlist("<dict><key>OffsetSeconds</key><string>3d</string></dict>"), 0, true},
        {"not a number", xmlPlist("<dict><key>OffsetSeconds</key><real>nan</real></dict>"), 0,
         true},
        {"infinite", xmlPlist("<dict><key>OffsetSeconds</key><real>inf</real></dict>"), 0, true},
        {"root is an array", xmlPlist("<array><real>5</real></array>"), 0, true},
        {"empty", std::string(), 0, true},
    };
    for (const auto& [name, file, offset, logged] : rows) {
        SCOPED_TRACE(name);
        test::TestPlatform env;
        const std::string root = env.platform->platformRoot;
        if (file) {
            writeFile(SimulatedClock::clockFilePath(root), *file);
        }
        SimulatedClock clock(root, env.clock);
        EXPECT_EQ(clock.offsetSeconds(), offset);
        EXPECT_EQ(clock.now(), env.clock->now().byAdding(offset));
        EXPECT_EQ(errorCount(env), logged ? 1 : 0);
    }

    test::TestPlatform env;
    const std::string root = env.platform->platformRoot;
    SimulatedClock clock(root, env.clock);
    double offset = 0;
    ASSERT_TRUE(SimulatedClock::updateOffset(
        root, [](double c) { return c + 7200; }, &offset, nullptr));
    ASSERT_TRUE(SimulatedClock::updateOffset(
        root, [](double c) { return c + 60; }, &offset, nullptr));
    EXPECT_EQ(offset, 7260);
    EXPECT_EQ(clock.offsetSeconds(), 0) << "read again only when told";
    clock.reloadOffset();
    EXPECT_EQ(clock.offsetSeconds(), 7260);
    EXPECT_FALSE(SimulatedClock::updateOffset(
        root, [](double) { return std::nan(""); }, nullptr, nullptr));
    clock.reloadOffset();
    EXPECT_EQ(clock.offsetSeconds(), 7260);
}

TEST(HostStateFiles, UnusableFilesReadAsEmptyLoggedOnceAndLeftAlone) {
    std::string nested;
    for (int i = 0; i < 100; ++i) {
        nested.insert(0, "<array>").append("</array>");
    }
    const std::string deep = xmlPlist(nested);
    const std::string bad[] = {
        "",
        "bplist00\xd1\x01\x02",                        // truncated binary
        xmlPlist("<dict><key>a</key><string>b</str"),  // truncated XML
        xmlPlist("<string>wrong kind</string>"),
        deep,
        "\x01\xff garbage",
    };
    struct Reader {
        const char* name;
        const char* file;  // under the platform root, or the share directory for "share/"
        // Reads twice through one object where the binding keeps one; true when both reads
        // found nothing.
        std::function<bool(const std::string& root, const std::string& share)> readsEmpty;
        int errorsForTwoReads;
    } readers[] = {
        {"carriers", "carriers.plist",
         [](const std::string& root, const std::string&) {
             HostTelephonyInfo t(root);
             return t.subscriberCarriers().empty() && t.subscriberCarriers().empty();
         },
         1},
        {"analytics settings", "analytics.plist",
         [](const std::string& root, const std::string&) {
             HostAnalyticsSink sink(root, std::make_shared<ManualClock>());
             int built = 0;
             sink.sendEventLazily("e", [&] { return Value(++built); });
             sink.sendEventLazily("e", [&] { return Value(++built); });
             return built == 2;  // an unusable file turns nothing off
         },
         1},
        {"follow-up store", "state/followups/com.velmora.Kestova.plist",
         [](const std::string& root, const std::string&) {
             HostFollowUpCenter c(root, std::make_shared<ManualClock>());
             return c.pendingFollowUpItems("com.velmora.Kestova", nullptr).empty() &&
                    c.pendingFollowUpItems("com.velmora.Kestova", nullptr).empty();
         },
         1},
        {"activity registry", "state/activities.plist",
         [](const std::string& root, const std::string&) {
             return HostActivityRegistry::load(root).empty() &&
                    HostActivityRegistry::load(root).empty();
         },
         2},
        {"launch configuration", "share/activities.plist",
         [](const std::string&, const std::string& share) {
             return HostActivityLaunchConfiguration::load(share).empty() &&
                    HostActivityLaunchConfiguration::load(share).empty();
         },
         2},
        {"clock", "state/clock.plist",
         [](const std::string& root, const std::string&) {
             SimulatedClock clock(root, std::make_shared<ManualClock>());
             clock.reloadOffset();
             return clock.offsetSeconds() == 0;
         },
         1},
    };
    for (const auto& reader : readers) {
        for (const auto& content : bad) {
            SCOPED_TRACE(std::string(reader.name) + " <- " + toJsonString(Value(content)));
            test::TestPlatform env;
            test::TempDir share;
            const std::string root = env.platform->platformRoot;
            const std::string file = reader.file;
            const fs::path path = file.rfind("share/", 0) == 0 ? share.path() / file.substr(6)
                                                               : fs::path(root) / file;
            writeFile(path, content);
            EXPECT_TRUE(reader.readsEmpty(root, share.str()));
            EXPECT_EQ(errorCount(env), reader.errorsForTwoReads);
            EXPECT_EQ(readFile(path), content) << "a read never rewrites the file";
        }
    }
}

TEST(HostAnalyticsSink, AppendsEventsUnlessTurnedOff) {
    test::TempDir root;
    auto clock = std::make_shared<ManualClock>(Date(1'700'000'000));
    HostAnalyticsSink sink(root.str(), clock);
    int built = 0;
    auto payload = [&] {
        ++built;
        return Value::Dictionary{{"devicetype", "Watch"}};
    };
    sink.sendEventLazily("com.velmora.kestova.followupDisplayCount", payload);
    EXPECT_EQ(parseJson(readFile(HostAnalyticsSink::eventsPath(root.str()))),
              (Value::Dictionary{{"time", "2023-11-14T22:13:20.000Z"},
                                 {"event", "com.velmora.kestova.followupDisplayCount"},
                                 {"payload", Value::Dictionary{{"devicetype", "Watch"}}}}));
    writeFile(root.path() / "analytics.plist", xmlPlist("<dict><key>Enabled</key><false/></dict>"));
    sink.sendEventLazily("e", payload);
    EXPECT_EQ(built, 1) << "the payload is never built while the sink is off";
}

TEST(HostTelephonyInfo, CarriersKeepWhatTheyHave) {
    test::TempDir root;
    HostTelephonyInfo telephony(root.str());
    EXPECT_TRUE(telephony.subscriberCarriers().empty());
    writeFile(root.path() / "carriers.plist",
              xmlPlist("<array>"
                       "<dict><key>mobileCountryCode</key><string>310</string>"
                       "<key>mobileNetworkCode</key><string>026</string></dict>"
                       "<dict><key>mobileCountryCode</key><string>208</string></dict>"
                       "<string>not a carrier</string>"
                       "<dict><key>mobileCountryCode</key><integer>310</integer></dict>"
                       "</array>"));
    auto carriers = telephony.subscriberCarriers();
    ASSERT_EQ(carriers.size(), 3u);
    EXPECT_EQ(carriers[0].mobileCountryCode, "310");
    EXPECT_EQ(carriers[0].mobileNetworkCode, "026");
    EXPECT_EQ(carriers[1].mobileCountryCode, "208");
    EXPECT_FALSE(carriers[1].mobileNetworkCode);
    EXPECT_FALSE(carriers[2].mobileCountryCode);
}

TEST(HostUserInterfaceStrings, LanguageFallbacks) {
    test::TempDir share;
    auto table = [&](const char* language, const std::string& entries) {
        writeFile(
            share.path() / "KestovaUI" / (std::string(language) + ".lproj") / "Localizable.plist",
            xmlPlist("<dict>" + entries + "</dict>"));
    };
    table("en",
          "<key>DETAILS</key><string>Details</string>"
          "<key>ONLY_EN</key><string>English only</string>");
    table("fr", "<key>DETAILS</key><string>Détails</string>");
    table("fr_CA", "<key>DETAILS</key><string>Détails (CA)</string>");
    table("de", "not a table");
    auto locale = std::make_shared<test::FakeLocaleInfo>();
    HostUserInterfaceStrings strings(share.str(), locale);
    const std::tuple<const char*, const char*, const char*, const char*> rows[] = {
        {"fr_FR", "DETAILS", "Localizable", "Détails"},
        {"fr_CA", "DETAILS", "Localizable", "Détails (CA)"},
        {"fr_FR", "ONLY_EN", "Localizable", "English only"},
        {"de_DE", "DETAILS", "Localizable", "Details"},
        {"ja_JP", "DETAILS", "Localizable", "Details"},
        {"en_US", "MISSING", "Localizable", "default"},
        {"../../x", "DETAILS", "Localizable", "Details"},
        {"fr_FR", "DETAILS", "Other", "default"},
        {"fr_FR", "DETAILS", "../fr.lproj/Localizable", "default"},
    };
    for (const auto& [language, key, tableName, expected] : rows) {
        locale->identifier = language;
        EXPECT_EQ(strings.localizedString(key, "default", tableName), expected)
            << language << " " << key << " " << tableName;
    }
}

TEST(HostNetworkState, EnvironmentOverride) {
    EXPECT_EQ(HostNetworkState::overrideFromEnvironment("up"), true);
    EXPECT_EQ(HostNetworkState::overrideFromEnvironment("down"), false);
    EXPECT_EQ(HostNetworkState::overrideFromEnvironment("maybe"), std::nullopt);
    EXPECT_EQ(HostNetworkState::overrideFromEnvironment(nullptr), std::nullopt);
}

}  // namespace
}  // namespace qax
