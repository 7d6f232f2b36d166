// qaxctl defaults and inspect-summary run as real processes against a temporary HOME: what
// defaults writes is what the agent's own preference store reads, and inspect-summary prints
// the record the agent would build from a summary file, with that domain, clock and locale.
#include <gtest/gtest.h>

#include <chrono>

#include "AgentProcess.h"
#include "core/JsonCodec.h"
#include "core/PlistCodec.h"
#include "platform/host/FilePreferenceStore.h"

namespace qax {
namespace {

class QaxctlDefaultsAndInspect : public ::testing::Test {
  protected:
    test::ToolResult ctl(const std::vector<std::string>& args,
                         const std::string& lang = "en_US.UTF-8") const {
        return test::runTool(QAX_CTL_BINARY, args,
                             {"HOME=" + home.str(), "LANG=" + lang, "PATH=/usr/bin:/bin"});
    }
    std::string write(const std::string& name, const std::string& content) const {
        test::writeFile(home.path() / name, content);
        return (home.path() / name).string();
    }

    test::TempDir home;
    FilePreferenceStore agentView{FilePreferenceStore::domainPath(home.str())};
};

TEST_F(QaxctlDefaultsAndInspect, DefaultsWriteReadDeleteAndRefuseBadInput) {
    const std::tuple<const char*, const char*, const char*, Value> rows[] = {
        {"-string", "C02OVERRIDE", "SerialNumber", Value("C02OVERRIDE")},
        {"-int", "2", "QAXMigrationVersion", Value(2)},
        {"-real", "-86400.5", "W1.activationInterval", Value(-86400.5)},
        {"-bool", "yes", "PostUpgradeActivityCompleted", Value(true)},
        {"-date", "2023-11-14T22:13:20Z", "DefaultDeviceActivationDate", Value(Date(1700000000))},
        {"-json", R"({"LowServerVersion":2,"HighServerVersion":"3"})", "ServerVersionOverride",
         Value::Dictionary{{"LowServerVersion", 2}, {"HighServerVersion", "3"}}},
        {"-json", R"(["a","b"])", "FollowupPostedSerialNumberHashes", Value::Array{"a", "b"}},
    };
    for (const auto& [type, text, key, expected] : rows) {
        SCOPED_TRACE(text);
        auto w = ctl({"defaults", "write", key, type, text});
        ASSERT_EQ(w.status, 0) << w.err;
        EXPECT_EQ(agentView.objectForKey(key), expected);
    }
    auto read = ctl({"defaults", "read", "ServerVersionOverride", "--json"});
    ASSERT_EQ(read.status, 0);
    EXPECT_EQ(parseJson(read.out), std::get<3>(rows[5]));
    // A key with only a registered default reads that default.
    EXPECT_EQ(ctl({"defaults", "read", "CachedWarrantyValidityDuration"}).out, "86400\n");
    auto all = parseJson(ctl({"defaults", "read", "--json"}).out);
    ASSERT_TRUE(all && all->isDictionary());
    EXPECT_EQ(all->size(), std::size(rows));
    EXPECT_EQ(*all->find("DefaultDeviceActivationDate"), Value("2023-11-14T22:13:20.000Z"));

    const std::vector<std::string> bad[] = {
        {"-int", "12a"},       {"-bool", "maybe"}, {"-date", "soon"},
        {"-json", R"({"a":)"}, {"-json", "null"},  {"-float", "1"},
    };
    for (const auto& typed : bad) {
        auto r = ctl({"defaults", "write", "K", typed[0], typed[1]});
        EXPECT_NE(r.status, 0) << typed[1];
        EXPECT_FALSE(r.err.empty()) << typed[1] << ": a reason is printed";
    }
    EXPECT_EQ(ctl({"defaults"}).status, 64);
    EXPECT_EQ(agentView.allKeys().size(), std::size(rows)) << "bad input lost or added nothing";

    ASSERT_EQ(ctl({"defaults", "delete", "SerialNumber"}).status, 0);
    EXPECT_FALSE(agentView.objectForKey("SerialNumber"));
    EXPECT_EQ(ctl({"defaults", "read", "SerialNumber"}).status, 1);
}

TEST_F(QaxctlDefaultsAndInspect, InspectSummaryFromJsonAndPropertyListsOrAClearError) {
    // Offer open for 1,234 more days (and a bit), so the plural text shows a grouped count.
    using namespace std::chrono;
    const double now = duration<double>(system_clock::now().time_since_epoch()).count();
    Value summary(Value::Dictionary{
        {"covered", true},
        {"coverageEndDate", 1700000000},
        {"hvOfferEligibleUntil", static_cast<long long>((now + 1233.5 * 86400) * 1000)},
        {"hvLocalizedOfferPluralDescFormat", "%@ days left"},
        {"hvLocalizedOfferSingularDesc", "Last day"},
        {"hvOfferBadgeBeforeEndDate", 7},
        {"featureToggleParameters", Value::Dictionary{{"hvOfferDisplay", true}}},
    });
    const auto jsonPath = write("summary.json", toJsonString(summary));
    auto inspect = [&](const std::string& path, const std::string& lang = "en_US.UTF-8") {
        return ctl({"inspect-summary", path, "--json"}, lang);
    };
    auto fromJson = inspect(jsonPath);
    ASSERT_EQ(fromJson.status, 0) << fromJson.err;
    auto record = parseJson(fromJson.out);
    ASSERT_TRUE(record && record->isDictionary()) << fromJson.out;
    EXPECT_EQ(*record->find("covered"), Value(true));
    EXPECT_EQ(*record->find("coverageEndDate"), Value("2023-11-14T22:13:20.000Z"));
    // No "hvOfferConversionDate": the end date plus one day.
    EXPECT_EQ(*record->find("hvOfferConversionDate"), Value("2023-11-15T22:13:20.000Z"));
    EXPECT_EQ(*record->find("hvOfferDisplay"), Value(true));
    EXPECT_EQ(*record->find("hvOfferBadgeDurationBeforeEndDate"), Value(604800));
    EXPECT_EQ(*record->find("hvOfferBadgeDaysBeforeEndDate"), Value(7));
    EXPECT_TRUE(record->find("coverageValidityDate")->isNull());
    EXPECT_EQ(*record->find("daysEligible"), Value(1234));
    EXPECT_EQ(*record->find("hvLocalizedOfferDesc"), Value("1,234 days left"));
    EXPECT_EQ(parseJson(inspect(write("summary.plist", *toBinaryPlist(summary))).out), record)
        << "JSON and property-list input agree";
    // The user's locale decides the grouping.
    EXPECT_EQ(*parseJson(inspect(jsonPath, "de_DE.UTF-8").out)->find("hvLocalizedOfferDesc"),
              Value("1.234 days left"));
    // The agent's own domain: a "ConversionDate" setting overrides every record.
    ASSERT_EQ(ctl({"defaults", "write", "ConversionDate", "-int", "1800000000"}).status, 0);
    EXPECT_EQ(*parseJson(inspect(jsonPath).out)->find("hvOfferConversionDate"),
              Value("2027-01-15T08:00:00.000Z"));

    for (const auto& path : {write("array.json", "[1, 2]"), write("garbage.json", "{\"covered\": "),
                             write("html.plist", "<html><body>502 Bad Gateway</body></html>"),
                             (home.path() / "missing.json").string()}) {
        auto r = inspect(path);
        EXPECT_EQ(r.status, 1) << path;
        EXPECT_FALSE(r.err.empty()) << path;
        EXPECT_TRUE(r.out.empty()) << path;
    }
}

}  // namespace
}  // namespace qax
