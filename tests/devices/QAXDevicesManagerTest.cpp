// Device discovery: the default device, the paired watches behind the feature flag and the
// server's feature set, and the internal-build overrides.
#include <gtest/gtest.h>

#include "devices/QAXDevicesManager.h"
#include "fakes/FakeDevices.h"
#include "fakes/FakeServices.h"
#include "fakes/TestPlatform.h"
#include "platform/QAXSettings.h"

namespace qax {
namespace {

class QAXDevicesManagerTest : public ::testing::Test {
  protected:
    QAXDevicesManagerTest() {
        env.platform->pairedDevices = registry;
        env.platform->featureFlags = flags;
        qax_registerDefaults(*prefs());
        flags->set("Kestova", "Tessel_3_0", true);
        serverVersions(2, 3);
    }

    PreferenceStore* prefs() { return env.platform->preferences.get(); }
    test::FakeDeviceProperties& device() {
        return static_cast<test::FakeDeviceProperties&>(*env.platform->deviceProperties);
    }
    void serverVersions(int low, int high) {
        prefs()->setObject("ServerVersionOverride",
                           Value::Dictionary{{"LowServerVersion", Value(low)},
                                             {"HighServerVersion", Value(high)}});
    }
    std::vector<std::string> serials(const QAXDeviceMap& devices) {
        std::vector<std::string> out;
        for (const auto& [serial, d] : devices) {
            out.push_back(serial);
        }
        return out;
    }

    test::TestPlatform env;
    std::shared_ptr<test::FakePairedDeviceRegistry> registry =
        std::make_shared<test::FakePairedDeviceRegistry>();
    std::shared_ptr<test::FakeFeatureFlags> flags = std::make_shared<test::FakeFeatureFlags>();
    QAXDevicesManager manager{env.platform};
};

TEST_F(QAXDevicesManagerTest, DefaultDeviceSerialNumberAndOverride) {
    prefs()->setObject("SerialNumber", "OVERRIDE1");
    prefs()->setObject("DefaultDeviceActivationDate", Date(1'650'000'000));

    auto d = manager.defaultDevice();
    EXPECT_EQ(d->name(), "Default Device");
    EXPECT_EQ(d->serialNumber(), "C02TESTSERIAL") << "a non-internal build ignores the override";
    EXPECT_EQ(d->activationDate(), Date(1'650'000'000));
    EXPECT_EQ(d->deviceType(), QAXDeviceTypeDefault);

    device().internal = true;
    EXPECT_EQ(manager.defaultDevice()->serialNumber(), "OVERRIDE1");

    prefs()->removeObject("SerialNumber");
    device().set("SerialNumber", std::nullopt);
    auto none = manager.defaultDevice();
    EXPECT_FALSE(none->serialNumber());
    EXPECT_TRUE(manager.allDevices().empty()) << "a device without a serial number has no key";
}

TEST_F(QAXDevicesManagerTest, PairedWatchesAreGatedByFlagAndServerAndWinInAllDevices) {
    registry->setDevices({test::FakePairedDeviceRegistry::watch("W", "W1", Date(100))});
    EXPECT_EQ(serials(manager.pairedDevices()), std::vector<std::string>{"W1"});

    flags->set("Kestova", "Tessel_3_0", false);
    EXPECT_TRUE(manager.pairedDevices().empty());
    EXPECT_EQ(serials(manager.allDevices()), std::vector<std::string>{"C02TESTSERIAL"});

    flags->set("Kestova", "Tessel_3_0", true);
    serverVersions(1, 2);  // the agent's high version 3 is not offered
    EXPECT_TRUE(manager.pairedDevices().empty());

    // All devices by serial number: a paired entry wins over this device's.
    serverVersions(2, 3);
    registry->setDevices(
        {test::FakePairedDeviceRegistry::watch("W", "W1", Date(1)),
         test::FakePairedDeviceRegistry::watch("Clash", "C02TESTSERIAL", Date(2))});
    auto all = manager.allDevices();
    ASSERT_EQ(serials(all), (std::vector<std::string>{"C02TESTSERIAL", "W1"}));
    EXPECT_EQ(all["C02TESTSERIAL"]->deviceType(), QAXDeviceTypeWatch);
    EXPECT_EQ(all["C02TESTSERIAL"]->name(), "Clash");
}

TEST_F(QAXDevicesManagerTest, OnlyActivePairedWatchesWithSerialNumbersAreListed) {
    auto watch = [](std::string name, std::string serial) {
        return test::FakePairedDeviceRegistry::watch(std::move(name), std::move(serial),
                                                     Date(1'000));
    };
    PairedDevice archived = watch("Old", "ARCH");
    archived.isArchived = true;
    PairedDevice unpaired = watch("Gone", "UNPAIRED");
    unpaired.isPaired = false;
    PairedDevice nameless = watch("", "NONAME");
    nameless.name.reset();
    nameless.localizedModel = "Sport Watch";
    PairedDevice noSerial = watch("NoSerial", "");
    noSerial.serialNumber.reset();
    PairedDevice altAccount = watch("Family", "ALT");
    altAccount.isAltAccount = true;
    registry->setDevices(
        {watch("Mine", "MINE"), archived, unpaired, nameless, noSerial, altAccount});

    auto paired = manager.pairedDevices();
    EXPECT_EQ(serials(paired), (std::vector<std::string>{"ALT", "MINE", "NONAME"}));
    EXPECT_EQ(paired["NONAME"]->name(), "Sport Watch");
    EXPECT_EQ(paired["MINE"]->name(), "Mine");
    EXPECT_EQ(paired["MINE"]->activationDate(), Date(1'000));
    EXPECT_EQ(paired["MINE"]->deviceType(), QAXDeviceTypeWatch);
}

TEST_F(QAXDevicesManagerTest, InternalOverrideListReplacesTheRegistry) {
    registry->setDevices({test::FakePairedDeviceRegistry::watch("Real", "REAL", Date(1))});
    prefs()->setObject("PairedWatchesSerialNumbers",
                       Value::Dictionary{{"A", Value("W1")}, {"B", Value("W2")}});
    prefs()->setObject("W1.activationInterval", -86400);

    // Not internal: the override list is ignored.
    EXPECT_EQ(serials(manager.pairedDevices()), std::vector<std::string>{"REAL"});

    device().internal = true;
    const Date now = env.clock->now();
    auto paired = manager.pairedDevices();
    ASSERT_EQ(serials(paired), (std::vector<std::string>{"W1", "W2"}));
    EXPECT_EQ(paired["W1"]->name(), "DEBUG:W1");
    EXPECT_EQ(paired["W1"]->activationDate(), now.byAdding(-86400));
    EXPECT_EQ(paired["W2"]->activationDate(), now);
    EXPECT_EQ(paired["W1"]->deviceType(), QAXDeviceTypeWatch);

    prefs()->setObject("PairedWatchesSerialNumbers", Value::Dictionary{});
    EXPECT_TRUE(manager.pairedDevices().empty()) << "an empty override hides the real watches";
}

}  // namespace
}  // namespace qax
