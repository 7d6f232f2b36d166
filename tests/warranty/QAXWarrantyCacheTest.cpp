#include <gtest/gtest.h>

#include <filesystem>

#include "core/AtomicFile.h"
#include "core/Hash.h"
#include "core/PlistCodec.h"
#include "fakes/FakeServices.h"
#include "fakes/TestPlatform.h"
#include "warranty/QAXWarranty.h"

namespace qax {
namespace {

namespace fs = std::filesystem;

Value summary(const std::string& label) {
    return Value::Dictionary{
        {"covered", true},
        {"coverageEndDate", 1700000000},
        {"coverageLocalizedLabel", Value(label)},
        {"featureToggleParameters",
         Value(Value::Dictionary{{"hvOfferDisplay", true},
                                 {"hvOfferToggle", Value(Value::Array{"310-260", "311-480"})}})},
        {"price", 3.5},
        {"when", Value(Date(1700000123.0))},
    };
}

class QAXWarrantyCacheTest : public ::testing::Test {
  protected:
    std::shared_ptr<QAXWarranty> make(const Value& dictionary) {
        return QAXWarranty::initWithDictionary(tp.platform, dictionary);
    }
    fs::path cacheDirectory() const {
        return fs::path(tp.platform->homeDirectory) / "Library" / "Application Support" /
               "com.velmora.Kestova";
    }

    test::TestPlatform tp;
};

TEST_F(QAXWarrantyCacheTest, RoundTripPerSerialNumber) {
    auto first = make(summary("first"));
    auto second = make(summary("second"));
    first->cacheWarranty("SERIAL-1");
    second->cacheWarranty("SERIAL-2");

    auto read1 = QAXWarranty::cachedWarrantyForSerialNumber(tp.platform, "SERIAL-1");
    auto read2 = QAXWarranty::cachedWarrantyForSerialNumber(tp.platform, "SERIAL-2");
    ASSERT_TRUE(read1 && read2);
    EXPECT_TRUE(read1->isEqual(first.get()));
    EXPECT_TRUE(read2->isEqual(second.get()));
    EXPECT_FALSE(read1->isEqual(second.get()));
    EXPECT_FALSE(QAXWarranty::cachedWarrantyForSerialNumber(tp.platform, "NEVER-CACHED"));

    // Two files named by the digests, written as XML, and nothing else left behind.
    std::vector<std::string> names;
    for (const auto& entry : fs::directory_iterator(cacheDirectory())) {
        names.push_back(entry.path().filename().string());
    }
    std::sort(names.begin(), names.end());
    std::vector<std::string> expected{sha256Hash("SERIAL-1") + "_Warranty.plist",
                                      sha256Hash("SERIAL-2") + "_Warranty.plist"};
    std::sort(expected.begin(), expected.end());
    EXPECT_EQ(names, expected);
    for (const auto& n : names) {
        EXPECT_EQ(test::readFile(cacheDirectory() / n).rfind("<?xml", 0), 0u);
    }

    const std::string path1 =
        (cacheDirectory() / (sha256Hash("SERIAL-1") + "_Warranty.plist")).string();
    EXPECT_TRUE(tp.log->contains("-[QAXWarranty cacheWarranty:] -> " + path1));
    EXPECT_TRUE(tp.log->contains("+[QAXWarranty cachedWarrantyForSerialNumber:] : warrantyPath : " +
                                 path1));

    // A later write replaces the file.
    second->cacheWarranty("SERIAL-1");
    EXPECT_TRUE(
        QAXWarranty::cachedWarrantyForSerialNumber(tp.platform, "SERIAL-1")->isEqual(second.get()));
}

TEST_F(QAXWarrantyCacheTest, WithoutSerialNumberTheLegacyFileIsUsed) {
    auto record = make(summary("legacy"));
    record->cache();
    EXPECT_TRUE(fs::exists(QAXWarranty::_legacyWarrantyPath(*tp.platform)));
    EXPECT_EQ(QAXWarranty::_legacyWarrantyPath(*tp.platform),
              (cacheDirectory() / "Warranty.plist").string());
    EXPECT_EQ(QAXWarranty::_warrantyPathForSerialNumberFormat(*tp.platform),
              (cacheDirectory() / "%@_Warranty.plist").string());
    auto read = QAXWarranty::cachedWarrantyForSerialNumber(tp.platform, std::nullopt);
    ASSERT_TRUE(read);
    EXPECT_TRUE(read->isEqual(record.get()));
}

TEST_F(QAXWarrantyCacheTest, EachReadGetsWhatIsOnDiskThen) {
    // Each change is made right after a read; the first two keep the size, and within a clock
    // tick the file times need not move either. Content that is no record reads as none.
    const fs::path file = cacheDirectory() / (sha256Hash("S") + "_Warranty.plist");
    // Each change: in place or by a rename, and the record read after it.
    const std::tuple<const char*, std::string, bool, std::optional<Value>> rows[] = {
        {"rewritten in place", *toXmlPlist(summary("bbbb")), true, summary("bbbb")},
        {"replaced by rename", *toXmlPlist(summary("aaaa")), false, summary("aaaa")},
        {"array root", *toXmlPlist(Value::Array{Value("a")}), true, std::nullopt},
        {"string root", *toXmlPlist(Value("text")), false, std::nullopt},
        {"not a property list", "<html>oops</html>", true, std::nullopt},
        {"empty file", "", true, std::nullopt},
        {"binary dictionary", *toBinaryPlist(summary("binary")), true, summary("binary")},
    };
    ASSERT_TRUE(make(summary("aaaa"))->cacheWarranty("S"));
    auto read = [&] {
        auto w = QAXWarranty::cachedWarrantyForSerialNumber(tp.platform, "S");
        return w ? std::optional<Value>(w->dictionaryRepresentation()) : std::nullopt;
    };
    for (const auto& [name, content, inPlace, record] : rows) {
        SCOPED_TRACE(name);
        read();
        if (inPlace) {
            test::writeFile(file, content);
        } else {
            ASSERT_TRUE(writeFileAtomically(file.string(), content));
        }
        EXPECT_EQ(read(), record);
    }
}

TEST_F(QAXWarrantyCacheTest, NullsAreAbsentValuesAndAFailedWriteKeepsThePreviousFile) {
    // A null means "absent": the record leaves it out, so it caches and reads back.
    Value withNull = summary("nulls");
    withNull["coverage"] = Value::Dictionary{{"nested", Value(nullptr)}, {"kept", 1}};
    withNull["list"] = Value::Array{Value(nullptr), Value("x")};
    ASSERT_TRUE(make(withNull)->cacheWarranty("S"));
    Value expected = summary("nulls");
    expected["coverage"] = Value::Dictionary{{"kept", 1}};
    expected["list"] = Value::Array{Value("x")};
    EXPECT_EQ(
        QAXWarranty::cachedWarrantyForSerialNumber(tp.platform, "S")->dictionaryRepresentation(),
        expected);

    // A cache file that cannot be replaced (here a directory stands in its place) is reported.
    const fs::path blocked = cacheDirectory() / (sha256Hash("T") + "_Warranty.plist");
    fs::create_directories(blocked / "occupied");
    EXPECT_FALSE(make(summary("t"))->cacheWarranty("T"));
    EXPECT_TRUE(fs::is_directory(blocked / "occupied"));
    EXPECT_EQ(tp.log->countContaining("Unable to write the warranty cache"), 1);
}

TEST_F(QAXWarrantyCacheTest, LegacyMigration) {
    const std::string hash = sha256Hash("C02SERIAL");
    const Value date(Date(1690000000.0));
    const std::tuple<const char*, bool, std::optional<Value>, std::optional<Value>,
                     std::optional<Value>>
        rows[] = {
            {"no legacy file", false, date, Value("en_US"), Value("2")},
            {"file and all three keys", true, date, Value("en_US"), Value("2")},
            {"file and only the version", true, std::nullopt, std::nullopt, Value("2")},
            {"file and no keys", true, std::nullopt, std::nullopt, std::nullopt},
        };
    const char* names[] = {"CachedWarrantyLastUpdatedDate", "CachedWarrantyLocale",
                           "CachedWarrantyVersion"};
    for (const auto& [name, legacyFile, lastUpdated, locale, version] : rows) {
        SCOPED_TRACE(name);
        test::TestPlatform local;
        auto& prefs = static_cast<test::InMemoryPreferenceStore&>(*local.platform->preferences);
        const std::optional<Value>* values[] = {&lastUpdated, &locale, &version};
        for (int i = 0; i < 3; ++i) {
            if (*values[i]) {
                prefs.setObject(names[i], **values[i]);
            }
        }
        auto legacy = QAXWarranty::initWithDictionary(local.platform, summary("legacy"));
        if (legacyFile) {
            legacy->cache();
        }

        auto migrated = QAXWarranty::migrateLegacyCachedWarrantyIfNeededForSerialNumber(
            local.platform, "C02SERIAL");
        EXPECT_FALSE(fs::exists(QAXWarranty::_legacyWarrantyPath(*local.platform)));
        if (!legacyFile) {
            EXPECT_FALSE(migrated);
            EXPECT_FALSE(local.log->contains("Migrating legacy warranty.."));
            for (int i = 0; i < 3; ++i) {
                EXPECT_EQ(prefs.objectForKey(names[i]), *values[i]) << "left untouched";
                EXPECT_FALSE(prefs.hasStoredValue(hash + "_" + names[i]));
            }
            continue;
        }
        ASSERT_TRUE(migrated);
        EXPECT_TRUE(migrated->isEqual(legacy.get()));
        EXPECT_TRUE(local.log->contains("Migrating legacy warranty.."));
        auto cached = QAXWarranty::cachedWarrantyForSerialNumber(local.platform, "C02SERIAL");
        ASSERT_TRUE(cached);
        EXPECT_TRUE(cached->isEqual(legacy.get()));
        for (int i = 0; i < 3; ++i) {
            EXPECT_FALSE(prefs.hasStoredValue(names[i]));
            EXPECT_EQ(prefs.objectForKey(hash + "_" + names[i]), *values[i]);
        }
    }
}

TEST_F(QAXWarrantyCacheTest, AHomeDirectoryWithAPercentSign) {
    test::TempDir odd;
    const fs::path home = odd.path() / "100%@home";
    tp.platform->homeDirectory = home.string();
    make(summary("x"))->cacheWarranty("S");
    EXPECT_TRUE(fs::exists(home / "Library" / "Application Support" / "com.velmora.Kestova" /
                           (sha256Hash("S") + "_Warranty.plist")));
    EXPECT_TRUE(QAXWarranty::cachedWarrantyForSerialNumber(tp.platform, "S"));
}

}  // namespace
}  // namespace qax
