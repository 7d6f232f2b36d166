// The default provider over real preferences, cache files and accounts, and the start-up
// migration through it.
#include "agent/QAXAgentDefaultWarrantyProvider.h"

#include <gtest/gtest.h>

#include <filesystem>

#include "agent/QAXAgent.h"
#include "core/Hash.h"
#include "core/PlistCodec.h"
#include "devices/QAXDevicesManager.h"
#include "fakes/FakeAccounts.h"
#include "fakes/TestPlatform.h"
#include "platform/PreferenceStore.h"
#include "platform/QAXSettings.h"
#include "warranty/QAXWarranty.h"

namespace qax {
namespace {

class QAXAgentDefaultWarrantyProviderTest : public ::testing::Test {
  protected:
    QAXAgentDefaultWarrantyProviderTest() {
        qax_registerDefaults(prefs());
        tp.platform->accounts = accounts;
    }
    PreferenceStore& prefs() { return *tp.platform->preferences; }

    test::TestPlatform tp;
    std::shared_ptr<test::FakeAccountStore> accounts = std::make_shared<test::FakeAccountStore>();
    std::shared_ptr<QAXAgentDefaultWarrantyProvider> provider =
        QAXAgentDefaultWarrantyProvider::initWithCallingProcessBundleID(tp.platform,
                                                                        "com.example.app");
};

TEST_F(QAXAgentDefaultWarrantyProviderTest, CacheFactsComeFromTheSerialNumbersKeys) {
    const std::string h = sha256Hash("S1");
    EXPECT_FALSE(provider->lastUpdatedDateForSerialNumber("S1"));
    EXPECT_FALSE(provider->cachedWarrantyVersionForSerialNumber("S1"));
    EXPECT_FALSE(provider->cachedWarrantyLocaleForSerialNumber("S1"));

    prefs().setObject(h + "_CachedWarrantyLastUpdatedDate", Value(Date(1234)));
    prefs().setObject(h + "_CachedWarrantyVersion", "2");
    prefs().setObject(h + "_CachedWarrantyLocale", "de_DE");
    EXPECT_EQ(provider->lastUpdatedDateForSerialNumber("S1"), Date(1234));
    EXPECT_EQ(provider->cachedWarrantyVersionForSerialNumber("S1"), "2");
    EXPECT_EQ(provider->cachedWarrantyLocaleForSerialNumber("S1"), "de_DE");
    EXPECT_FALSE(provider->lastUpdatedDateForSerialNumber("S2"));

    EXPECT_EQ(provider->cachedWarrantyValidityDuration(), 86400);
    prefs().setObject("CachedWarrantyValidityDuration", 60);
    EXPECT_EQ(provider->cachedWarrantyValidityDuration(), 60);

    EXPECT_TRUE(provider->isSignedInToSkyvault());
    accounts->primary = nullptr;  // signing out is seen at the next call
    EXPECT_FALSE(provider->isSignedInToSkyvault());

    EXPECT_EQ(provider->migrationVersion(), 0);
    provider->setMigrationVersion(2);
    EXPECT_EQ(prefs().objectForKey("QAXMigrationVersion"), Value(2));
    EXPECT_EQ(provider->migrationVersion(), 2);
}

TEST_F(QAXAgentDefaultWarrantyProviderTest, StartUpMigrationMovesTheLegacyCacheOnce) {
    const auto legacy = std::filesystem::path(QAXWarranty::_legacyWarrantyPath(*tp.platform));
    const Value summary(Value::Dictionary{{"covered", true}, {"tag", "legacy"}});
    test::writeFile(legacy, *toXmlPlist(summary));
    prefs().setObject("CachedWarrantyVersion", "2");

    auto agent = QAXAgent::initWithWarrantyProvider(
        tp.platform, provider, std::make_shared<QAXDevicesManager>(tp.platform));
    agent->performMigrationIfNeeded();
    // The default device of the test platform.
    auto moved = QAXWarranty::cachedWarrantyForSerialNumber(tp.platform, "C02TESTSERIAL");
    ASSERT_TRUE(moved);
    EXPECT_EQ(moved->dictionaryRepresentation(), summary);
    EXPECT_FALSE(std::filesystem::exists(legacy));
    EXPECT_EQ(prefs().objectForKey(sha256Hash("C02TESTSERIAL") + "_CachedWarrantyVersion"),
              Value("2"));
    EXPECT_EQ(prefs().objectForKey("QAXMigrationVersion"), Value(2));

    // A legacy file appearing later is left alone: the migration has run.
    test::writeFile(legacy, *toXmlPlist(summary));
    agent->performMigrationIfNeeded();
    EXPECT_TRUE(std::filesystem::exists(legacy));
}

}  // namespace
}  // namespace qax
