#include "platform/host/HostDeviceProperties.h"

#include <gtest/gtest.h>

#include "core/PlistCodec.h"
#include "fakes/TestPlatform.h"

namespace qax {
namespace {

using test::TempDir;
using test::writeFile;

constexpr const char* kMissing = nullptr;

TEST(HostDevicePropertiesTest, WithoutDevicePlistTheMachineDescribesItself) {
    // The DMI files (kMissing: no such file), the serial number read, whether its absence is
    // logged.
    const std::tuple<const char*, const char*, const char*, std::optional<std::string>, bool>
        rows[] = {
            {"PF2ABCDE\n", "BOARD1\n", "ThinkBox X1\n", "PF2ABCDE", false},
            {kMissing, " BOARD1 \n", "ThinkBox X1\n", "BOARD1", false},
            {"To be filled by O.E.M.\n", "BOARD1\n", "ThinkBox X1\n", "BOARD1", false},
            {"\n", kMissing, "ThinkBox X1\n", std::nullopt, true},
            {"0000000000\n", "00000000-0000-0000-0000-000000000000\n", "ThinkBox X1\n",
             std::nullopt, true},
            {"Default String\n", "TO BE FILLED BY O.E.M.\n", "ThinkBox X1\n", std::nullopt, true},
            {kMissing, kMissing, kMissing, std::nullopt, true},
        };
    for (const auto& [productSerial, boardSerial, productName, expected, logsNoSerial] : rows) {
        SCOPED_TRACE(productSerial ? productSerial : "(no product_serial)");
        test::TestPlatform env;  // captures the log
        TempDir dir;
        const auto dmi = dir.path() / "dmi";
        std::filesystem::create_directories(dmi);
        if (productSerial) {
            writeFile(dmi / "product_serial", productSerial);
        }
        if (boardSerial) {
            writeFile(dmi / "board_serial", boardSerial);
        }
        if (productName) {
            writeFile(dmi / "product_name", productName);
        }
        writeFile(dir.path() / "os-release", "NAME=\"Debian GNU/Linux\"\nVERSION_ID=\"12\"\n");
        HostDeviceProperties props((dir.path() / "root").string(),
                                   (dir.path() / "os-release").string(), dmi.string());

        auto serial = props.copyDeviceProperty("SerialNumber");
        EXPECT_EQ(serial && serial->asString() ? std::optional(*serial->asString()) : std::nullopt,
                  expected);
        EXPECT_EQ(env.log->countContaining("This machine has no serial number"),
                  logsNoSerial ? 1 : 0);
        auto type = props.copyDeviceProperty("ProductType");
        ASSERT_TRUE(type && type->asString());
        if (productName) {
            EXPECT_EQ(*type->asString(), "ThinkBox X1");
        }
        EXPECT_EQ(props.copyDeviceProperty("ProductVersion"), Value("12"));
        EXPECT_FALSE(props.isInternalBuild());
    }
}

TEST(HostDevicePropertiesTest, DevicePlistDescribesTheSimulatedDevice) {
    TempDir dir;
    writeFile(dir.path() / "dmi" / "product_serial", "MACHINE-SERIAL\n");
    writeFile(dir.path() / "dmi" / "product_name", "ThinkBox X1\n");
    writeFile(dir.path() / "os-release", "VERSION_ID=12\n");
    HostDeviceProperties props(dir.str(), (dir.path() / "os-release").string(),
                               (dir.path() / "dmi").string());

    auto device = toXmlPlist(Value::Dictionary{
        {"SerialNumber", "C02DEMO"}, {"ProductType", "Model9,1"}, {"InternalBuild", true}});
    writeFile(dir.path() / "device.plist", *device);
    EXPECT_EQ(props.copyDeviceProperty("SerialNumber"), Value("C02DEMO"));
    EXPECT_EQ(props.copyDeviceProperty("ProductType"), Value("Model9,1"));
    EXPECT_EQ(props.copyDeviceProperty("ProductVersion"), Value("12")) << "the machine's";
    EXPECT_TRUE(props.isInternalBuild());

    writeFile(dir.path() / "device.plist", *toXmlPlist(Value::Dictionary{}));
    EXPECT_FALSE(props.copyDeviceProperty("SerialNumber")) << "never the machine's serial";
    EXPECT_EQ(props.copyDeviceProperty("ProductType"), Value("ThinkBox X1"));

    writeFile(dir.path() / "device.plist", "not a plist");
    EXPECT_FALSE(props.copyDeviceProperty("SerialNumber"));
    EXPECT_FALSE(props.isInternalBuild());

    std::filesystem::remove(dir.path() / "device.plist");
    EXPECT_EQ(props.copyDeviceProperty("SerialNumber"), Value("MACHINE-SERIAL"));
}

}  // namespace
}  // namespace qax
