// Device and device-info records: their archives (what crosses IPC), printed forms and
// equality.
#include <gtest/gtest.h>

#include "core/PlistCodec.h"
#include "devices/QAXDevice.h"
#include "devices/QAXDeviceInfo.h"
#include "fakes/TestPlatform.h"
#include "warranty/QAXWarranty.h"

namespace qax {
namespace {

// Archives go through a binary property list, as they do on the wire.
Value overTheWire(const Value& archive) {
    auto bytes = toBinaryPlist(archive);
    EXPECT_TRUE(bytes.has_value());
    auto back = parsePlist(bytes.value_or(""));
    EXPECT_TRUE(back.has_value());
    return back.value_or(Value());
}

TEST(QAXDeviceTest, ArchiveRoundTripKeepsEveryField) {
    const std::tuple<std::optional<std::string>, std::optional<std::string>, std::optional<Date>,
                     QAXDeviceType, const char*>
        cases[] = {
            {"Default Device", "C02SERIAL", Date(1'700'000'000), QAXDeviceTypeDefault, "Default"},
            {"Morning Watch", "W1", Date(1'600'000'000.5), QAXDeviceTypeWatch, "Watch"},
            {"<unknown>", "X9", std::nullopt, QAXDeviceTypeOther, "Other"},
            {std::nullopt, std::nullopt, std::nullopt, static_cast<QAXDeviceType>(7), "Default"},
        };
    for (const auto& [name, serial, activated, type, typeString] : cases) {
        auto device = QAXDevice::deviceWithName(name, serial, activated, type);
        auto decoded = QAXDevice::decode(overTheWire(device->encode()));
        ASSERT_NE(decoded, nullptr) << device->description();
        EXPECT_EQ(decoded->name(), name);
        EXPECT_EQ(decoded->serialNumber(), serial);
        EXPECT_EQ(decoded->activationDate(), activated);
        EXPECT_EQ(decoded->deviceType(), type);
        EXPECT_EQ(decoded->deviceTypeString(), typeString);
    }
}

TEST(QAXDeviceTest, DecodingRefusesWrongClassesAndKinds) {
    const Value good = QAXDevice::deviceWithName("n", "s", Date(1), QAXDeviceTypeWatch)->encode();
    auto with = [&](const char* key, Value v) {
        Value archive = good;
        archive[key] = std::move(v);
        return archive;
    };
    auto without = [&](const char* key) {
        Value archive = good;
        archive.asDictionary()->erase(key);
        return archive;
    };
    const std::pair<const char*, Value> refused[] = {
        {"class of another record", with("$class", "QAXDeviceInfo")},
        {"no class", without("$class")},
        {"name is a number", with("name", 5)},
        {"serial number is data", with("serialNumber", Value(Value::Data{1, 2}))},
        {"activation date is a string", with("activationDate", "2024-01-01")},
        {"device type is a string", with("deviceType", "1")},
        {"device type is a real", with("deviceType", 1.5)},
        {"not a dictionary", Value::Array{good}},
    };
    for (const auto& [what, archive] : refused) {
        EXPECT_EQ(QAXDevice::decode(archive), nullptr) << what;
    }
    // Missing keys are none, and a missing type is the default one.
    auto sparse = QAXDevice::decode(Value::Dictionary{{"$class", Value("QAXDevice")}});
    ASSERT_NE(sparse, nullptr);
    EXPECT_FALSE(sparse->name());
    EXPECT_FALSE(sparse->activationDate());
    EXPECT_EQ(sparse->deviceType(), QAXDeviceTypeDefault);
}

class QAXDeviceInfoTest : public ::testing::Test {
  protected:
    std::shared_ptr<QAXWarranty> warranty(const char* offerId) {
        return QAXWarranty::initWithDictionary(
            env.platform, Value::Dictionary{{"hvOfferIdentifier", Value(offerId)}});
    }
    test::TestPlatform env;
};

TEST_F(QAXDeviceInfoTest, EqualityNeedsTheSameDeviceObjectAndEqualWarranties) {
    auto device = QAXDevice::deviceWithName("W", "S1", Date(5), QAXDeviceTypeWatch);
    auto twin = QAXDevice::deviceWithName("W", "S1", Date(5), QAXDeviceTypeWatch);
    auto a = warranty("offer-1");
    auto sameSummary = warranty("offer-1");
    auto other = warranty("offer-2");

    const std::tuple<const char*, std::shared_ptr<QAXDeviceInfo>, std::shared_ptr<QAXDeviceInfo>,
                     bool>
        cases[] = {
            {"shared device, equal warranties", QAXDeviceInfo::deviceInfoWithDevice(device, a),
             QAXDeviceInfo::deviceInfoWithDevice(device, sameSummary), true},
            {"shared device, different warranties", QAXDeviceInfo::deviceInfoWithDevice(device, a),
             QAXDeviceInfo::deviceInfoWithDevice(device, other), false},
            {"equal-looking devices built separately",
             QAXDeviceInfo::deviceInfoWithDevice(device, a),
             QAXDeviceInfo::deviceInfoWithDevice(twin, a), false},
            {"both warranties none", QAXDeviceInfo::deviceInfoWithDevice(device, nullptr),
             QAXDeviceInfo::deviceInfoWithDevice(device, nullptr), false},
            {"no devices", QAXDeviceInfo::deviceInfoWithDevice(nullptr, a),
             QAXDeviceInfo::deviceInfoWithDevice(nullptr, a), false},
        };
    for (const auto& [what, lhs, rhs, equal] : cases) {
        EXPECT_EQ(lhs->isEqual(rhs.get()), equal) << what;
    }
    auto info = QAXDeviceInfo::deviceInfoWithDevice(device, a);
    EXPECT_FALSE(info->isEqual(nullptr));
    auto decoded = QAXDeviceInfo::decode(env.platform, overTheWire(info->encode()));
    ASSERT_NE(decoded, nullptr);
    EXPECT_FALSE(info->isEqual(decoded.get())) << "a decoded record has a device of its own";
}

TEST_F(QAXDeviceInfoTest, ArchiveRoundTripAndClassChecks) {
    auto device = QAXDevice::deviceWithName("<unknown>", "S9", std::nullopt, QAXDeviceTypeOther);
    auto info = QAXDeviceInfo::deviceInfoWithDevice(device, warranty("offer-9"));
    auto decoded = QAXDeviceInfo::decode(env.platform, overTheWire(info->encode()));
    ASSERT_NE(decoded, nullptr);
    ASSERT_NE(decoded->device(), nullptr);
    EXPECT_EQ(decoded->device()->serialNumber(), "S9");
    ASSERT_NE(decoded->warranty(), nullptr);
    EXPECT_TRUE(decoded->warranty()->isEqual(info->warranty().get()));

    auto bare = QAXDeviceInfo::decode(
        env.platform, overTheWire(QAXDeviceInfo::deviceInfoWithDevice(device, nullptr)->encode()));
    ASSERT_NE(bare, nullptr);
    EXPECT_EQ(bare->warranty(), nullptr);

    Value archive = info->encode();
    Value swapped = archive;
    swapped["device"] = info->warranty()->encode();
    Value wrongWarranty = archive;
    wrongWarranty["warranty"] = device->encode();
    Value wrongClass = archive;
    wrongClass["$class"] = "QAXDevice";
    for (const Value* bad : {&swapped, &wrongWarranty, &wrongClass}) {
        EXPECT_EQ(QAXDeviceInfo::decode(env.platform, *bad), nullptr) << bad->description();
    }
}

TEST_F(QAXDeviceInfoTest, DescriptionShowsTheDeviceAndTheOffer) {
    EXPECT_EQ(QAXDevice::deviceWithName("Default Device", "SN1", Date(1'700'000'000),
                                        QAXDeviceTypeDefault)
                  ->description(),
              "Default Device (SN1) (2023-11-14 22:13:20 +0000) - Default");
    auto device = QAXDevice::deviceWithName("W", "S1", std::nullopt, QAXDeviceTypeWatch);
    EXPECT_EQ(QAXDeviceInfo::deviceInfoWithDevice(device, nullptr)->description(),
              "W (S1) ((null)) - Watch: No offer");
    auto offered = warranty("offer");
    offered->setHvOfferDisplay(true);
    offered->setHvOfferEligibleUntil(Date(1'700'000'000));
    EXPECT_EQ(QAXDeviceInfo::deviceInfoWithDevice(device, offered)->description(),
              "W (S1) ((null)) - Watch: Eligible until 2023-11-14 22:13:20 +0000");
    offered->setHvOfferDisplay(false);
    EXPECT_EQ(QAXDeviceInfo::deviceInfoWithDevice(device, offered)->description(),
              "W (S1) ((null)) - Watch: No offer");
}

}  // namespace
}  // namespace qax
