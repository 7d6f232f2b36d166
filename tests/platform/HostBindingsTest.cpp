#include <gtest/gtest.h>

#include "core/PlistCodec.h"
#include "fakes/FakeServices.h"
#include "fakes/TestPlatform.h"
#include "platform/QAXUtilities.h"
#include "platform/host/HostDeviceProperties.h"
#include "platform/host/HostLocaleInfo.h"
#include "platform/host/SystemClock.h"

namespace qax {
namespace {

using test::TempDir;
using test::writeFile;

TEST(HostLocaleInfoTest, IdentifierFromEnvironment) {
    struct Row {
        const char* lcAll;
        const char* lcMessages;
        const char* lang;
        const char* expected;
    } rows[] = {
        {nullptr, nullptr, "fr_FR.UTF-8", "fr_FR"},
        {"de_DE.UTF-8", "fr_FR.UTF-8", "en_GB.UTF-8", "de_DE"},
        {"", "ja_JP.eucJP", "en_GB", "ja_JP"},
        {nullptr, nullptr, "sr_RS@latin", "sr_RS"},
        {nullptr, nullptr, "C", "en_US"},
        {"POSIX", nullptr, nullptr, "en_US"},
        {"C.UTF-8", nullptr, nullptr, "en_US"},
        {nullptr, nullptr, nullptr, "en_US"},
    };
    for (const auto& r : rows) {
        EXPECT_EQ(HostLocaleInfo::identifierFromEnvironment(r.lcAll, r.lcMessages, r.lang),
                  r.expected);
    }
}

TEST(HostDevicePropertiesTest, DevicePlistWithHostFallbacks) {
    TempDir root;
    writeFile(root.path() / "os-release", "NAME=\"Debian GNU/Linux\"\nVERSION_ID=\"12\"\n");
    HostDeviceProperties props(root.str(), (root.path() / "os-release").string());

    // No device.plist: the host's own facts, and no serial number.
    EXPECT_EQ(props.copyDeviceProperty("ProductVersion"), Value("12"));
    EXPECT_TRUE(props.copyDeviceProperty("ProductType").has_value());
    EXPECT_FALSE(props.copyDeviceProperty("SerialNumber"));
    EXPECT_FALSE(props.isInternalBuild());

    auto device = toXmlPlist(Value(Value::Dictionary{
        {"SerialNumber", "C02DEMO"}, {"ProductType", "Model9,1"}, {"InternalBuild", true}}));
    writeFile(root.path() / "device.plist", *device);
    EXPECT_EQ(props.copyDeviceProperty("SerialNumber"), Value("C02DEMO"));
    EXPECT_EQ(props.copyDeviceProperty("ProductType"), Value("Model9,1"));
    EXPECT_EQ(props.copyDeviceProperty("ProductVersion"), Value("12")) << "per-key fallback";
    EXPECT_TRUE(props.isInternalBuild());

    writeFile(root.path() / "device.plist", "not a plist");
    EXPECT_FALSE(props.copyDeviceProperty("SerialNumber"));
    EXPECT_FALSE(props.isInternalBuild());
}

TEST(SystemClockTest, ReportsNowAndTheLocalOffset) {
    SystemClock clock;
    const double before = static_cast<double>(std::time(nullptr));
    EXPECT_NEAR(clock.now().secondsSince1970(), before, 5);
    const int offset = clock.secondsFromGMT(clock.now());
    EXPECT_LE(std::abs(offset), 14 * 3600);
}

TEST(QAXUtilitiesTest, OverridesTakeEffectOnInternalBuildsOnly) {
    test::TestPlatform env;
    auto& props = static_cast<test::FakeDeviceProperties&>(*env.platform->deviceProperties);
    env.platform->preferences->setObject("SerialNumber", Value("C02OVERRIDE"));

    props.internal = false;
    EXPECT_FALSE(QAXUtilities::isInternal(*env.platform));
    EXPECT_FALSE(QAXUtilities::internalOverride(*env.platform, "SerialNumber"));

    props.internal = true;  // evaluated on every call, nothing cached
    EXPECT_TRUE(QAXUtilities::isInternal(*env.platform));
    EXPECT_EQ(QAXUtilities::internalOverride(*env.platform, "SerialNumber"), Value("C02OVERRIDE"));
    EXPECT_FALSE(QAXUtilities::internalOverride(*env.platform, "WebFlowURL"));
}

}  // namespace
}  // namespace qax
