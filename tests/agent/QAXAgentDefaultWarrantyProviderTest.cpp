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

TEST(QAXAgentDefaultWarrantyProviderTest, MigratesTheLegacyCacheOnceAndReadsItsKeys) {
    test::TestPlatform tp;
    qax_registerDefaults(*tp.platform->preferences);
    auto accounts = std::make_shared<test::FakeAccountStore>();
    tp.platform->accounts = accounts;
    auto provider = QAXAgentDefaultWarrantyProvider::initWithCallingProcessBundleID(
        tp.platform, "com.example.app");
    const std::string serial = "C02TESTSERIAL";  // the test platform's device
    EXPECT_FALSE(provider->lastUpdatedDateForSerialNumber(serial));

    const auto legacy = std::filesystem::path(QAXWarranty::_legacyWarrantyPath(*tp.platform));
    const Value summary(Value::Dictionary{{"covered", true}, {"tag", "legacy"}});
    test::writeFile(legacy, *toXmlPlist(summary));
    tp.platform->preferences->setObject("CachedWarrantyVersion", "2");
    tp.platform->preferences->setObject("CachedWarrantyLastUpdatedDate", Value(Date(1234)));
    auto agent = QAXAgent::initWithWarrantyProvider(
        tp.platform, provider, std::make_shared<QAXDevicesManager>(tp.platform));
    agent->performMigrationIfNeeded();

    EXPECT_EQ(provider->cachedWarrantyForSerialNumber(serial)->dictionaryRepresentation(), summary);
    EXPECT_EQ(provider->cachedWarrantyVersionForSerialNumber(serial), "2");
    EXPECT_EQ(provider->lastUpdatedDateForSerialNumber(serial), Date(1234));
    EXPECT_FALSE(std::filesystem::exists(legacy));
    EXPECT_EQ(tp.platform->preferences->objectForKey("QAXMigrationVersion"), Value(2));

    // A legacy file appearing later is left alone: the migration has run.
    test::writeFile(legacy, *toXmlPlist(summary));
    agent->performMigrationIfNeeded();
    EXPECT_TRUE(std::filesystem::exists(legacy));

    // Signing out is seen at the next call.
    EXPECT_TRUE(provider->isSignedInToSkyvault());
    accounts->primary = nullptr;
    EXPECT_FALSE(provider->isSignedInToSkyvault());
}

}  // namespace
}  // namespace qax
