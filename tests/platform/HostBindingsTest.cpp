#include <gtest/gtest.h>

#include "fakes/FakeServices.h"
#include "fakes/TestPlatform.h"
#include "platform/QAXUtilities.h"
#include "platform/host/HostLocaleInfo.h"
#include "platform/host/SystemClock.h"

namespace qax {
namespace {

TEST(HostLocaleInfoTest, IdentifierFromEnvironment) {
    const std::tuple<const char*, const char*, const char*, const char*> rows[] = {
        {nullptr, nullptr, "fr_FR.UTF-8", "fr_FR"},
        {"de_DE.UTF-8", "fr_FR.UTF-8", "en_GB.UTF-8", "de_DE"},
        {"", "ja_JP.eucJP", "en_GB", "ja_JP"},
        {nullptr, nullptr, "sr_RS@latin", "sr_RS"},
        {nullptr, nullptr, "C", "en_US"},
        {"POSIX", nullptr, nullptr, "en_US"},
        {"C.UTF-8", nullptr, nullptr, "en_US"},
        {nullptr, nullptr, nullptr, "en_US"},
    };
    for (const auto& [lcAll, lcMessages, lang, expected] : rows) {
        EXPECT_EQ(HostLocaleInfo::identifierFromEnvironment(lcAll, lcMessages, lang), expected);
    }
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
