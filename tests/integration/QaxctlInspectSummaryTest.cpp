// qaxctl inspect-summary as engineers run it: a summary file in, the record the agent would
// build out, with the agent's own preference domain, clock and locale.
#include <gtest/gtest.h>

#include <chrono>

#include "AgentProcess.h"
#include "core/JsonCodec.h"
#include "core/PlistCodec.h"

namespace qax::test {
namespace {

double nowSeconds() {
    using namespace std::chrono;
    return duration<double>(system_clock::now().time_since_epoch()).count();
}

class InspectSummary : public ::testing::Test {
  protected:
    TempDir home;
    std::vector<std::string> env(const std::string& lang = "en_US.UTF-8") const {
        return {"HOME=" + home.str(), "LANG=" + lang, "PATH=/usr/bin:/bin"};
    }
    ToolResult inspect(const std::string& file, const std::string& lang = "en_US.UTF-8") const {
        return runTool(QAX_CTL_BINARY, {"inspect-summary", file, "--json"}, env(lang));
    }
    std::string write(const std::string& name, const std::string& content) const {
        auto path = (home.path() / name).string();
        writeFile(path, content);
        return path;
    }
};

TEST_F(InspectSummary, PrintsFieldsAndDerivedValuesFromJsonAndPropertyLists) {
    // Offer open for 1,234 more days (and a bit), so the plural text shows a grouped count.
    const long long until = static_cast<long long>((nowSeconds() + 1233.5 * 86400) * 1000);
    Value summary(Value::Dictionary{
        {"covered", true},
        {"coverageEndDate", 1700000000},
        {"hvOfferEligibleUntil", until},
        {"hvLocalizedOfferPluralDescFormat", "%@ days left"},
        {"hvLocalizedOfferSingularDesc", "Last day"},
        {"hvOfferBadgeBeforeEndDate", 7},
        {"featureToggleParameters", Value::Dictionary{{"hvOfferDisplay", true}}},
    });
    const auto jsonPath = write("summary.json", toJsonString(summary));
    const auto plistPath = write("summary.plist", *toBinaryPlist(summary));

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

    auto fromPlist = inspect(plistPath);
    ASSERT_EQ(fromPlist.status, 0) << fromPlist.err;
    EXPECT_EQ(parseJson(fromPlist.out), record) << "JSON and property-list input agree";

    // The user's locale decides the grouping.
    auto german = inspect(jsonPath, "de_DE.UTF-8");
    ASSERT_EQ(german.status, 0);
    EXPECT_EQ(*parseJson(german.out)->find("hvLocalizedOfferDesc"), Value("1.234 days left"));

    // The agent's own domain: a "ConversionDate" setting overrides every record.
    ASSERT_EQ(runTool(QAX_CTL_BINARY, {"defaults", "write", "ConversionDate", "-int", "1800000000"},
                      env())
                  .status,
              0);
    auto converted = inspect(jsonPath);
    EXPECT_EQ(*parseJson(converted.out)->find("hvOfferConversionDate"),
              Value("2027-01-15T08:00:00.000Z"));
}

TEST_F(InspectSummary, BadInputIsReportedWithExitStatusOne) {
    const std::string cases[] = {
        write("array.json", "[1, 2]"),
        write("garbage.json", "{\"covered\": "),
        write("html.plist", "<html><body>502 Bad Gateway</body></html>"),
        (home.path() / "missing.json").string(),
    };
    for (const auto& path : cases) {
        auto r = inspect(path);
        EXPECT_EQ(r.status, 1) << path;
        EXPECT_FALSE(r.err.empty()) << path;
        EXPECT_TRUE(r.out.empty()) << path;
    }
}

}  // namespace
}  // namespace qax::test
