#include "warranty/QAXWarranty.h"

#include <gtest/gtest.h>

#include <functional>

#include "core/JsonCodec.h"
#include "core/PlistCodec.h"
#include "fakes/FakeServices.h"
#include "fakes/TestPlatform.h"
#include "platform/PreferenceStore.h"
#include "platform/QAXSettings.h"

namespace qax {
namespace {

using test::TestPlatform;

constexpr double kNow = 1'700'000'000;  // the pinned clock of the test platform
constexpr double kDay = 86400;

class QAXWarrantyTest : public ::testing::Test {
  protected:
    QAXWarrantyTest() { qax_registerDefaults(*tp.platform->preferences); }

    std::shared_ptr<QAXWarranty> fromJson(const std::string& json) {
        std::string error;
        auto value = parseJson(json, &error);
        EXPECT_TRUE(value) << error << " in " << json;
        return QAXWarranty::warrantyWithDictionary(tp.platform, value);
    }
    void setLocale(const std::string& id) {
        static_cast<test::FakeLocaleInfo&>(*tp.platform->locale).identifier = id;
    }
    PreferenceStore& preferences() { return *tp.platform->preferences; }

    TestPlatform tp;
};

std::string iso(const std::optional<Date>& d) {
    return d ? d->iso8601() : "none";
}

TEST_F(QAXWarrantyTest, EpochNumbersAreSecondsUpToTenBillionAndMillisecondsAbove) {
    const std::pair<const char*, const char*> cases[] = {
        {"1700000000", "2023-11-14T22:13:20.000Z"},
        {"1700000000000", "2023-11-14T22:13:20.000Z"},
        {"1700000000.9", "2023-11-14T22:13:20.000Z"},
        {"1700000000999", "2023-11-14T22:13:20.000Z"},
        {"10000000000", "2286-11-20T17:46:40.000Z"},
        {"10000000001", "1970-04-26T17:46:40.000Z"},
        {"0", "1970-01-01T00:00:00.000Z"},
        {"\"1700000000\"", "none"},
        {"{\"seconds\": 1700000000}", "none"},
        {"[1700000000]", "none"},
        {"null", "none"},
    };
    for (const auto& [json, expected] : cases) {
        SCOPED_TRACE(json);
        auto w = fromJson(std::string("{\"coverageEndDate\": ") + json + "}");
        ASSERT_TRUE(w);
        EXPECT_EQ(iso(w->coverageEndDate()), expected);
        EXPECT_EQ(iso(QAXWarranty::_dateWithEpochNumber(parseJson(json))), expected);
    }
    EXPECT_EQ(iso(fromJson("{}")->coverageEndDate()), "none");
    EXPECT_EQ(iso(QAXWarranty::_dateWithEpochNumber(nullptr)), "none");
}

TEST_F(QAXWarrantyTest, ConversionDateComesFromTheSettingThenTheSummaryThenTheEndDate) {
    const char* kEnd = R"({"coverageEndDate": 1700000000})";
    // clang-format off
    const std::tuple<const char*, const char*, std::optional<Value>, std::optional<Value>, std::optional<double>> cases[] = {
        {"absent: end date plus a day", kEnd, {}, {}, kNow + kDay},
        {"absent: end date plus the day length as stored", kEnd, {}, Value(3600), kNow + 3600},
        {"absent without an end date", R"({})", {}, {}, {}},
        {"zero", R"({"coverageEndDate": 1700000000, "hvOfferConversionDate": 0})", {}, {}, {}},
        {"seconds", R"({"coverageEndDate": 1, "hvOfferConversionDate": 1700500000})", {}, {},
         1700500000},
        {"milliseconds", R"({"hvOfferConversionDate": 1700500000000})", {}, {}, 1700500000},
        {"not a number", R"({"coverageEndDate": 1700000000, "hvOfferConversionDate": "soon"})", {},
         {}, {}},
        {"setting over zero", R"({"hvOfferConversionDate": 0})", Value(1800000000), {}, 1800000000},
        {"setting over a date", R"({"hvOfferConversionDate": 1700500000})", Value(1800000000000LL),
         {}, 1800000000},
        {"setting over the end date", kEnd, Value(1800000000), {}, 1800000000},
        {"setting that is not a number is ignored", R"({"hvOfferConversionDate": 1700500000})",
         Value("1800000000"), {}, 1700500000},
    };
    // clang-format on
    for (const auto& [name, summary, conversionSetting, oneDayInterval, expected] : cases) {
        SCOPED_TRACE(name);
        preferences().removeObject("ConversionDate");
        preferences().removeObject(settings::kOneDayInterval);
        if (conversionSetting) {
            preferences().setObject("ConversionDate", *conversionSetting);
        }
        if (oneDayInterval) {
            preferences().setObject(settings::kOneDayInterval, *oneDayInterval);
        }
        auto w = fromJson(summary);
        ASSERT_TRUE(w);
        EXPECT_EQ(iso(w->hvOfferConversionDate()),
                  iso(expected ? std::optional<Date>(Date(*expected)) : std::nullopt));
    }
}

TEST_F(QAXWarrantyTest, DayCountAndOfferTextFollowTheClockDayLengthAndLocale) {
    struct Case {
        const char* name;
        std::optional<double> eligibleIn;  // seconds from now; none: no end of eligibility
        std::optional<double> oneDayInterval;
        const char* locale;
        const char* pluralFormat;
        std::uint32_t days;
        const char* text;
    };
    const char* plural = "%@ days left";
    const Case cases[] = {
        {"36 hours", 36 * 3600, {}, "en_US", plural, 2, "2 days left"},
        {"exactly a day", kDay, {}, "en_US", plural, 1, "Last day"},
        {"one second", 1, {}, "en_US", plural, 1, "Last day"},
        {"ended", -3600, {}, "en_US", plural, 0, "Last day"},
        {"no end", {}, {}, "en_US", plural, 0, "Last day"},
        {"grouped in English", 1234 * kDay, {}, "en_US", plural, 1234, "1,234 days left"},
        {"grouped in German", 1234 * kDay - 10, {}, "de_DE", plural, 1234, "1.234 days left"},
        {"grouped in French", 1234 * kDay, {}, "fr_FR", plural, 1234, "1\u202f234 days left"},
        // clang-format off
        {"Arabic digits", 1234 * kDay, {}, "ar_EG", plural, 1234,
         "\u0661\u066c\u0662\u0663\u0664 days left"},
        {"numbered placeholder and a percent sign", 1234 * kDay, {}, "en_US", "%1$@ days (100%%)",
         1234, "1,234 days (100%)"},
        // clang-format on
        {"hour-long days", 36 * 3600, 3600, "en_US", plural, 36, "36 days left"},
        {"a day length of 0 means a day", 36 * 3600, 0, "en_US", plural, 2, "2 days left"},
        {"saturates", 1e7, 0.001, "en_US", "%@", 4294967295u, "4,294,967,295"},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.name);
        preferences().removeObject(settings::kOneDayInterval);
        if (c.oneDayInterval) {
            preferences().setObject(settings::kOneDayInterval, *c.oneDayInterval);
        }
        setLocale(c.locale);
        Value summary{Value::Dictionary{}};
        summary["hvLocalizedOfferPluralDescFormat"] = c.pluralFormat;
        summary["hvLocalizedOfferSingularDesc"] = "Last day";
        if (c.eligibleIn) {
            summary["hvOfferEligibleUntil"] = static_cast<long long>((kNow + *c.eligibleIn) * 1000);
        }
        auto w = QAXWarranty::warrantyWithDictionary(tp.platform, summary);
        ASSERT_TRUE(w);
        EXPECT_EQ(w->daysEligible(), c.days);
        EXPECT_EQ(w->hvLocalizedOfferDesc().value_or("none"), c.text);
    }
    EXPECT_EQ(tp.log->countContaining("is not a string"), 0);
}

TEST_F(QAXWarrantyTest, EachOfferTextUsesItsOwnFieldsAndRefusesANonStringFormat) {
    struct Case {
        const char* plural;
        const char* singular;
        std::function<std::optional<std::string>(const QAXWarranty&)> text;
        const char* error;
    };
    const Case cases[] = {
        {"hvLocalizedOfferPluralDescFormat", "hvLocalizedOfferSingularDesc",
         [](const QAXWarranty& w) { return w.hvLocalizedOfferDesc(); },
         "hvLocalizedOfferDesc: hvLocalizedOfferPluralDescFormat is not a string"},
        {"hvNotificationLocalizedOfferPluralDescFormat", "hvNotificationLocalizedOfferSingularDesc",
         [](const QAXWarranty& w) { return w.hvLocalizedNotificationOfferDesc(); },
         "hvLocalizedNotificationOfferDesc: hvNotificationLocalizedOfferPluralDescFormat is not a "
         "string"},
        {"hvLocalizedOfferDetailsPluralEligibilityFormat",
         "hvLocalizedOfferDetailsSingularEligibility",
         [](const QAXWarranty& w) { return w.hvLocalizedOfferDetailsEligibility(); },
         "hvLocalizedOfferDetailsEligibility: hvLocalizedOfferDetailsPluralEligibilityFormat is "
         "not a string"},
    };
    // Every text field is filled, so that a text reading another's field shows.
    Value texts{Value::Dictionary{}};
    for (const auto& c : cases) {
        texts[c.plural] = std::string(c.plural) + " %@";
        texts[c.singular] = c.singular;
    }
    for (const auto& c : cases) {
        SCOPED_TRACE(c.plural);
        Value summary = texts;
        summary["hvOfferEligibleUntil"] = static_cast<long long>(kNow + 3 * kDay);
        EXPECT_EQ(c.text(*QAXWarranty::warrantyWithDictionary(tp.platform, summary)),
                  std::string(c.plural) + " 3");
        summary["hvOfferEligibleUntil"] = static_cast<long long>(kNow + kDay / 2);
        EXPECT_EQ(c.text(*QAXWarranty::warrantyWithDictionary(tp.platform, summary)), c.singular);

        // A number where the plural format should be: no text, one error, and none when
        // the singular text is what is asked for.
        summary[c.plural] = 5;
        tp.log->clear();
        EXPECT_EQ(c.text(*QAXWarranty::warrantyWithDictionary(tp.platform, summary)), c.singular);
        summary["hvOfferEligibleUntil"] = static_cast<long long>(kNow + 3 * kDay);
        EXPECT_FALSE(c.text(*QAXWarranty::warrantyWithDictionary(tp.platform, summary)));
        EXPECT_EQ(tp.log->count(c.error), 1);
        EXPECT_EQ(tp.log->countContaining("is not a string"), 1);
    }
}

// A field read as is from the key of its own name, or from the containers and key given.
// clang-format off
#define FIELD(getter) {{#getter}, [](auto& w) { return w.getter(); }}
#define FIELD_AT(getter, ...) {{__VA_ARGS__}, [](auto& w) { return w.getter(); }}
// clang-format on

TEST_F(QAXWarrantyTest, FieldsAreReadFromTheirContainersAndKeys) {
    struct Field {
        std::vector<std::string> path;  // containers, then the key
        std::function<std::optional<Value>(const QAXWarranty&)> get;
    };
    // clang-format off
    const std::vector<Field> fields = {
        FIELD(localizedCoveredDeviceDateLabelFormat), FIELD(coverageLocalizedLabel),
        FIELD(coverageLocalizedDesc), FIELD(coverageLocalizedDescLong),
        FIELD(coverageLocalizedExpirationLabel), FIELD(footer1FormatString),
        FIELD(footer1LinkLabel), FIELD(footer1LinkURL), FIELD(footer2FormatString),
        FIELD(footer2LinkLabel), FIELD(footer2LinkURL), FIELD(hvOfferIdentifier),
        FIELD(hvLocalizedOfferLabel), FIELD(hvLocalizedOfferPluralDescFormat),
        FIELD(hvLocalizedOfferSingularDesc), FIELD(hvNotificationLocalizedOfferLabel),
        FIELD(hvNotificationLocalizedOfferSingularDesc),
        FIELD(hvNotificationLocalizedOfferPluralDescFormat), FIELD(hvLocalizedOfferCTA),
        FIELD(hvLocalizedOfferDetails), FIELD(hvLocalizedOfferDetailsPluralEligibilityFormat),
        FIELD(hvLocalizedOfferDetailsSingularEligibility),
        FIELD_AT(hvOfferToggle, "featureToggleParameters", "hvOfferToggle"),
        FIELD(hvOfferPromoFormat), FIELD(hvOfferPromoNew),
        FIELD_AT(localizedCoverageSubTitleForServicesPartnerString, "hvServicesPartner"),
        FIELD_AT(localizedCoverageFooterFormatString, "coverage", "localizedCoverageFooterFormatString"),
        FIELD_AT(localizedCoverageFooterLinkLabel, "coverage", "localizedCoverageFooterLinkLabel"),
        FIELD(localizedSupportAppLabel), FIELD(localizedSupportAppFooter),
        FIELD(localizedManagePlanLabel),
        FIELD_AT(localizedCoverageDetailsTitle, "coverage", "localizedCoverageTitle"),
        FIELD_AT(coverageDetailsArray, "coverage", "coverageDetails"),
        FIELD_AT(localizedBenefitsCardTitle, "coverage", "benefitsCard", "localizedBenefitsCardTitle"),
        FIELD_AT(localizedBenefitsCardSubTitle, "coverage", "benefitsCard", "localizedBenefitsCardSubTitle"),
        FIELD_AT(benefitDetailsArray, "coverage", "benefitsCard", "benefitDetails"),
        FIELD_AT(localizedBenefitsCardFooter, "coverage", "benefitsCard", "localizedBenefitsCardFooter"),
        FIELD(agsURL), FIELD(supportAppURL)};
    // clang-format on
    // Each "as is" field gets a value of its own (some of another kind than a string), so
    // a field read from the wrong key or container shows.
    Value summary{Value::Dictionary{}};
    auto place = [&summary](const std::vector<std::string>& path, Value v) {
        Value* at = &summary;
        for (std::size_t i = 0; i + 1 < path.size(); ++i) {
            at = &(*at)[path[i]];
        }
        (*at)[path.back()] = std::move(v);
    };
    auto valueFor = [](std::size_t i, const std::string& key) {
        return i % 3 == 2 ? Value(static_cast<long long>(i)) : Value("v:" + key);
    };
    for (std::size_t i = 0; i < fields.size(); ++i) {
        place(fields[i].path, valueFor(i, fields[i].path.back()));
    }
    // Flags, durations and dates, each in its own container; then keys of fields that are
    // never filled.
    const std::string toggles = "featureToggleParameters";
    // clang-format off
    const std::pair<std::vector<std::string>, Value> others[] = {
        {{"covered"}, true}, {{"hvOfferEligible"}, 1}, {{toggles, "hvOfferDisplay"}, true},
        {{toggles, "hvOfferSettingsAppBadge"}, true}, {{toggles, "hvOfferSettingsRowBadge"}, 2.5},
        {{toggles, "hvOfferDurationDaysBeforeEndDate"}, 45}, {{"hvOfferBadgeBeforeEndDate"}, 7},
        {{"hvLogoToggle"}, true}, {{"isHvSubscription"}, true}, {{"isHvServicesPartner"}, true},
        {{"displayRepairAndSupport"}, true}, {{"showNotificationToggle"}, true},
        {{"showNotificationBeforeEndDate"}, 1.5}, {{"hvOfferFollowupDisplayDate"}, 1700100000},
        {{"hvOfferDisplayDate"}, 1700200000000LL}, {{"coverageValidityDate"}, 1700000000},
        {{"localizedCoverageDetailsLabel"}, "label"}, {{"serialNumber"}, "C02SERIAL"}};
    // clang-format on
    for (const auto& [path, value] : others) {
        place(path, value);
    }

    auto w = QAXWarranty::warrantyWithDictionary(tp.platform, summary, std::string("C02SERIAL"));
    ASSERT_TRUE(w);
    for (std::size_t i = 0; i < fields.size(); ++i) {
        SCOPED_TRACE(fields[i].path.back());
        EXPECT_EQ(fields[i].get(*w), valueFor(i, fields[i].path.back()));
    }
    EXPECT_TRUE(w->covered());
    EXPECT_TRUE(w->hvOfferEligible());
    EXPECT_TRUE(w->hvOfferDisplay());
    EXPECT_TRUE(w->hvOfferSettingsAppBadge());
    EXPECT_TRUE(w->hvOfferSettingsRowBadge());
    EXPECT_EQ(w->hvOfferDurationBeforeEndDate(), 45 * kDay);
    EXPECT_EQ(w->hvOfferBadgeDurationBeforeEndDate(), 7 * kDay);
    EXPECT_EQ(w->hvOfferBadgeDaysBeforeEndDate(), Value(7));
    EXPECT_TRUE(w->coverageHasHVLogo());
    EXPECT_TRUE(w->isCoveragePlanSubscriptionType());
    EXPECT_TRUE(w->isHVServicesPartner());
    EXPECT_TRUE(w->displayRepairAndSupport());
    EXPECT_TRUE(w->showNotificationToggle());
    EXPECT_EQ(w->showNotificationBeforeEndDate(), 1.5 * kDay);
    EXPECT_EQ(iso(w->hvOfferFollowupDisplayDate()), "2023-11-16T02:00:00.000Z");
    EXPECT_EQ(iso(w->hvOfferDisplayDate()), "2023-11-17T05:46:40.000Z");
    EXPECT_EQ(w->coverageDetailsDictionary(), *summary.find("coverage"));
    EXPECT_EQ(w->coverageBenefitsDictionary(), *summary.find("coverage")->find("benefitsCard"));
    EXPECT_EQ(w->dictionaryRepresentation(), summary);
    EXPECT_FALSE(w->coverageValidityDate());
    EXPECT_FALSE(w->localizedCoverageDetailsLabel());
    EXPECT_FALSE(w->localizedCoverageDetailsValue());
    EXPECT_FALSE(w->localizedBenefitLabelKey());
    EXPECT_FALSE(w->localizedBenefitValueKey());
    EXPECT_FALSE(w->serialNumber());
    // A setter replaces what was read from the dictionary, which stays as it was.
    w->setCoverageDetailsDictionary(Value("replaced"));
    w->setFooter1LinkURL(std::nullopt);
    EXPECT_EQ(w->coverageDetailsDictionary(), Value("replaced"));
    EXPECT_FALSE(w->footer1LinkURL());
    EXPECT_EQ(w->dictionaryRepresentation(), summary);

    // Keys in the wrong container do not count, and a container of the wrong kind hides its
    // fields.
    auto misplaced = fromJson(R"({"hvOfferDisplay": true,
        "featureToggleParameters": {"showNotificationToggle": true, "hvOfferBadgeBeforeEndDate": 3},
        "coverage": ["localizedCoverageTitle"], "hvOfferDurationDaysBeforeEndDate": 9})");
    ASSERT_TRUE(misplaced);
    EXPECT_FALSE(misplaced->covered());
    EXPECT_FALSE(misplaced->hvOfferDisplay());
    EXPECT_FALSE(misplaced->showNotificationToggle());
    EXPECT_EQ(misplaced->hvOfferBadgeDurationBeforeEndDate(), 0);
    EXPECT_EQ(misplaced->hvOfferDurationBeforeEndDate(), 0);
    EXPECT_FALSE(misplaced->localizedCoverageDetailsTitle());
    EXPECT_EQ(misplaced->coverageDetailsDictionary(), parseJson(R"(["localizedCoverageTitle"])"));
    EXPECT_FALSE(misplaced->coverageBenefitsDictionary());
}
#undef FIELD
#undef FIELD_AT

TEST_F(QAXWarrantyTest, JsonAndPropertyListSummariesMakeEqualRecordsThatPrintTheirDictionary) {
    const char* json = R"({"covered": true, "hvOfferEligibleUntil": 1700500000000,
        "hvLocalizedOfferLabel": "Add the plan", "featureToggleParameters": {"hvOfferDisplay": 1}})";
    const std::string plist = R"(<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0"><dict>
  <key>covered</key><true/>
  <key>hvOfferEligibleUntil</key><integer>1700500000000</integer>
  <key>hvLocalizedOfferLabel</key><string>Add the plan</string>
  <key>featureToggleParameters</key><dict><key>hvOfferDisplay</key><integer>1</integer></dict>
</dict></plist>)";
    auto fromJsonText = fromJson(json);
    auto fromPlist = QAXWarranty::warrantyWithDictionary(tp.platform, parsePlist(plist));
    ASSERT_TRUE(fromJsonText && fromPlist);
    EXPECT_TRUE(fromJsonText->isEqual(fromPlist.get()));
    EXPECT_TRUE(fromPlist->hvOfferDisplay());
    EXPECT_EQ(iso(fromPlist->hvOfferEligibleUntil()), "2023-11-20T17:06:40.000Z");
    EXPECT_EQ(fromPlist->description(), fromPlist->dictionaryRepresentation().description());

    auto other = fromJson(R"({"covered": false})");
    EXPECT_FALSE(fromPlist->isEqual(other.get()));
    EXPECT_FALSE(fromPlist->isEqual(nullptr));
    EXPECT_TRUE(other->isEqual(other.get()));
    // Anything but a dictionary makes no record.
    EXPECT_FALSE(QAXWarranty::warrantyWithDictionary(tp.platform, std::nullopt));
    EXPECT_FALSE(QAXWarranty::warrantyWithDictionary(tp.platform, parseJson("[1, 2]")));
}

TEST_F(QAXWarrantyTest, ArchivesRoundTripAndRefuseWhatMayNotCrossIPC) {
    Value summary = *parseJson(R"({"covered": true, "hvOfferEligibleUntil": 1700500000000,
        "coverage": {"coverageDetails": [{"label": "Repairs", "ratio": 0.5, "on": false}]}})");
    summary["fetched"] = Date(1'700'000'000);  // dates may cross too
    auto w = QAXWarranty::warrantyWithDictionary(tp.platform, summary);
    ASSERT_TRUE(w);

    // Across IPC the archive travels inside a binary property list.
    auto bytes = toBinaryPlist(w->encode());
    ASSERT_TRUE(bytes);
    auto received = parsePlist(*bytes);
    ASSERT_TRUE(received);
    auto decoded = QAXWarranty::decode(tp.platform, *received);
    ASSERT_TRUE(decoded);
    EXPECT_TRUE(decoded->isEqual(w.get()));
    EXPECT_EQ(decoded->hvOfferEligibleUntil(), w->hvOfferEligibleUntil());

    auto archive = [](std::optional<Value> className, std::optional<Value> dictionary) {
        Value a{Value::Dictionary{}};
        if (className) {
            a["$class"] = *className;
        }
        if (dictionary) {
            a["DictionaryRepresentation"] = *dictionary;
        }
        return a;
    };
    Value withData = summary;
    withData["coverage"]["coverageDetails"].asArray()->at(0)["blob"] = Value::Data{1, 2, 3};
    Value withNull = summary;
    withNull["coverage"]["benefitsCard"] = *parseJson(R"({"title": null})");
    const std::pair<const char*, Value> refused[] = {
        {"no summary", archive(Value("QAXWarranty"), std::nullopt)},
        {"a summary that is an array", archive(Value("QAXWarranty"), *parseJson("[{}]"))},
        {"a summary that is a string", archive(Value("QAXWarranty"), Value("{}"))},
        {"another class", archive(Value("QAXDevice"), summary)},
        {"no class", archive(std::nullopt, summary)},
        {"data deep inside", archive(Value("QAXWarranty"), withData)},
        {"a null deep inside", archive(Value("QAXWarranty"), withNull)},
        {"not a dictionary", Value("QAXWarranty")},
    };
    for (const auto& [name, bad] : refused) {
        SCOPED_TRACE(name);
        EXPECT_FALSE(QAXWarranty::decode(tp.platform, bad));
    }
}

}  // namespace
}  // namespace qax
