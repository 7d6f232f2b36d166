#include <gtest/gtest.h>

#include <filesystem>
#include <thread>

#include "core/FileSnapshotScope.h"
#include "core/PlistCodec.h"
#include "fakes/TestPlatform.h"
#include "platform/QAXSettings.h"
#include "platform/host/CachedPlistFile.h"
#include "platform/host/FilePreferenceStore.h"

namespace qax {
namespace {

using test::readFile;
using test::TestPlatform;
using test::writeFile;

class FilePreferenceStoreTest : public ::testing::Test {
  protected:
    TestPlatform env;  // temporary HOME and a capturing log
    std::string path = FilePreferenceStore::domainPath(env.home.str());
};

TEST_F(FilePreferenceStoreTest, RegisteredDefaultsStoredValuesRemovalAndTypedReads) {
    FilePreferenceStore store(path);
    qax_registerDefaults(store);
    const std::string registered = settings::kDefaultWarrantyURL;

    EXPECT_EQ(store.stringForKey("WarrantyURL"), registered);
    EXPECT_FALSE(std::filesystem::exists(path)) << "defaults are never written";

    ASSERT_TRUE(store.setObject("WarrantyURL", Value("https://localhost:8443/summary")));
    EXPECT_EQ(store.stringForKey("WarrantyURL"), "https://localhost:8443/summary");
    ASSERT_TRUE(store.removeObject("WarrantyURL"));
    EXPECT_EQ(store.stringForKey("WarrantyURL"), registered);

    // The file holds stored values only.
    auto onDisk = parsePlist(readFile(path));
    ASSERT_TRUE(onDisk);
    EXPECT_EQ(onDisk->find("WarrantyURL"), nullptr);
    EXPECT_EQ(onDisk->find("CachedWarrantyValidityDuration"), nullptr);

    // Typed reads of absent, registered and stored keys.
    EXPECT_FALSE(store.boolForKey("PostUpgradeActivityCompleted"));
    EXPECT_EQ(store.integerForKey("QAXMigrationVersion"), 0);
    EXPECT_EQ(store.doubleForKey("Nothing"), 0.0);
    EXPECT_FALSE(store.objectForKey("Nothing"));
    EXPECT_FALSE(store.dictionaryForKey("PairedWatchesSerialNumbers"));
    EXPECT_FALSE(store.dateForKey("DefaultDeviceActivationDate"));

    EXPECT_EQ(settings::cachedWarrantyValidityDuration(store), 86400.0);
    EXPECT_EQ(store.doubleForKey("PostUpgradeOutreachDelay"), 3600.0);
    EXPECT_EQ(store.integerForKey("HighServerVersion"), 3);
    EXPECT_EQ(settings::migrationVersion(store), 0);

    const std::tuple<const char*, Value, bool, std::int64_t, double> rows[] = {
        {"b", Value(true), true, 1, 1.0},    {"i", Value(2), true, 2, 2.0},
        {"r", Value(2.75), true, 2, 2.75},   {"s", Value("12.5"), true, 12, 12.5},
        {"yes", Value("YES"), true, 0, 0.0}, {"zero", Value(0), false, 0, 0.0},
    };
    for (const auto& [key, stored, asBool, asInt, asDouble] : rows) {
        ASSERT_TRUE(store.setObject(key, stored));
        EXPECT_EQ(store.boolForKey(key), asBool) << key;
        EXPECT_EQ(store.integerForKey(key), asInt) << key;
        EXPECT_EQ(store.doubleForKey(key), asDouble) << key;
    }
    ASSERT_TRUE(store.setObject("QAXMigrationVersion", Value(2)));
    EXPECT_EQ(settings::migrationVersion(store), 2);
}

TEST_F(FilePreferenceStoreTest, AnotherProcessWritesAreSeenOnTheNextRead) {
    FilePreferenceStore agent(path), engineer(path);
    ASSERT_TRUE(agent.setObject("PostUpgradeActivityCompleted", Value(true)));
    EXPECT_FALSE(agent.objectForKey("SerialNumber"));

    ASSERT_TRUE(engineer.setObject("SerialNumber", Value("C02OVERRIDE")));
    EXPECT_EQ(agent.stringForKey("SerialNumber"), "C02OVERRIDE");
    // The second writer started from the file, so the agent's key survived.
    EXPECT_TRUE(engineer.boolForKey("PostUpgradeActivityCompleted"));

    ASSERT_TRUE(engineer.removeObject("SerialNumber"));
    EXPECT_FALSE(agent.objectForKey("SerialNumber"));
    EXPECT_EQ(agent.allKeys(), std::vector<std::string>{"PostUpgradeActivityCompleted"});
}

TEST_F(FilePreferenceStoreTest, WithinASnapshotScopeFilesAreLookedAtOnce) {
    // One piece of work (a request) sees each file as at its first look; the next sees edits.
    FilePreferenceStore agent(path), engineer(path);
    const std::string device = env.home.str() + "/device.plist";
    CachedPlistFile deviceFile(device);
    ASSERT_TRUE(engineer.setObject("SerialNumber", Value("FIRST")));
    writeFile(device, *toXmlPlist(Value::Dictionary{{"SerialNumber", "FIRST"}}));
    auto serials = [&] {
        auto root = deviceFile.read();
        const Value* serial = root ? root->find("SerialNumber") : nullptr;
        return std::make_pair(agent.stringForKey("SerialNumber").value_or(""),
                              serial ? *serial->asString() : "");
    };
    {
        FileSnapshotScope request;
        EXPECT_EQ(serials(), std::make_pair(std::string("FIRST"), std::string("FIRST")));
        ASSERT_TRUE(engineer.setObject("SerialNumber", Value("SECOND")));
        writeFile(device, *toXmlPlist(Value::Dictionary{{"SerialNumber", "SECOND"}}));
        EXPECT_EQ(serials(), std::make_pair(std::string("FIRST"), std::string("FIRST")));
        // The store's own writes are seen at once.
        ASSERT_TRUE(agent.setObject("SerialNumber", Value("OWN")));
        EXPECT_EQ(agent.stringForKey("SerialNumber"), "OWN");
    }
    ASSERT_TRUE(engineer.setObject("SerialNumber", Value("THIRD")));
    EXPECT_EQ(serials(), std::make_pair(std::string("THIRD"), std::string("SECOND")));
    FileSnapshotScope next;
    EXPECT_EQ(serials(), std::make_pair(std::string("THIRD"), std::string("SECOND")));
}

TEST_F(FilePreferenceStoreTest, ConcurrentWritersAndReadersLoseNoKey) {
    constexpr int kWriters = 4, kKeys = 25;
    // Threads of one store share writes; separate stores behave like separate processes.
    for (const bool shared : {true, false}) {
        std::filesystem::remove(path);
        FilePreferenceStore common(path);
        std::vector<std::thread> threads;
        for (int w = 0; w <= kWriters; ++w) {
            threads.emplace_back([&, w] {
                FilePreferenceStore own(path);
                FilePreferenceStore& store = shared ? common : own;
                for (int k = 0; k < kKeys; ++k) {
                    if (w == kWriters) {  // a reader, in the writers' way
                        store.objectForKey("w0k0");
                    } else {
                        EXPECT_TRUE(store.setObject(
                            "w" + std::to_string(w) + "k" + std::to_string(k), Value(k)));
                    }
                }
            });
        }
        for (auto& t : threads) {
            t.join();
        }
        FilePreferenceStore reader(path);
        EXPECT_EQ(reader.allKeys().size(), static_cast<std::size_t>(kWriters * kKeys)) << shared;
        EXPECT_EQ(reader.integerForKey("w3k24"), 24);
        EXPECT_EQ(common.integerForKey("w2k7"), 7);
    }
}

TEST_F(FilePreferenceStoreTest, CorruptDomainIsReportedReadAsEmptyAndKeptUntilTheNextWrite) {
    const std::string garbage = "<plist><dict><key>broken";
    for (const std::string& bad : {garbage, std::string("<plist><array/></plist>")}) {
        writeFile(path, bad);
        env.log->clear();
        FilePreferenceStore store(path);
        qax_registerDefaults(store);
        EXPECT_FALSE(store.objectForKey("SerialNumber"));
        EXPECT_EQ(store.integerForKey("HighServerVersion"), 3);
        EXPECT_EQ(env.log->countContaining("unreadable"), 1) << "reported once, not per read";
        EXPECT_EQ(readFile(path), bad) << "a read never rewrites the file";

        ASSERT_TRUE(store.setObject("SerialNumber", Value("C02NEW")));
        auto onDisk = parsePlist(readFile(path));
        ASSERT_TRUE(onDisk);
        EXPECT_EQ(*onDisk, (Value::Dictionary{{"SerialNumber", Value("C02NEW")}}));
    }
}

TEST_F(FilePreferenceStoreTest, ValuesWithoutPropertyListFormAreRefused) {
    FilePreferenceStore store(path);
    ASSERT_TRUE(store.setObject("Keep", Value(1)));
    EXPECT_FALSE(store.setObject("Bad", Value::Array{Value(), Value(1)}));
    EXPECT_FALSE(store.objectForKey("Bad"));
    EXPECT_EQ(store.integerForKey("Keep"), 1);
}

}  // namespace
}  // namespace qax
