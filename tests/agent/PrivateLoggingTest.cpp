// Serial numbers reach the log only as private values: at the default privacy no line of a
// request's path shows one, whether passed as an argument or inside a device's description.
#include <gtest/gtest.h>

#include "agent/QAXAgent.h"
#include "core/Log.h"
#include "devices/QAXDevicesManager.h"
#include "fakes/FakeDevices.h"
#include "fakes/FakeServices.h"
#include "fakes/FakeWarrantyProvider.h"
#include "fakes/TestPlatform.h"
#include "platform/QAXSettings.h"

namespace qax {
namespace {

TEST(PrivateText, MarkedSpansAreRedactedOrUnmarked) {
    const std::string watch = "Watch (" + privateText("W7SERIAL") + ")";
    const std::string nested = privateText("a " + privateText("b") + " c");
    const std::tuple<std::string, const char*, const char*> rows[] = {
        {"no marks", "no marks", "no marks"},
        {watch, "Watch (<private>)", "Watch (W7SERIAL)"},
        {watch + " and " + privateText("C02"), "Watch (<private>) and <private>",
         "Watch (W7SERIAL) and C02"},
        {nested, "<private>", "a b c"},
        {privateText(""), "<private>", ""},
    };
    for (const auto& [message, redacted, shown] : rows) {
        EXPECT_EQ(resolvePrivateText(message, false), redacted);
        EXPECT_EQ(resolvePrivateText(message, true), shown);
    }
}

TEST(PrivateLogging, NoSerialNumberInTheLogOfTheAgentsRequests) {
    test::TestPlatform env;
    auto redacting = std::make_shared<CapturingLogSink>(false);
    qaxLog().setSink(redacting);

    auto registry = std::make_shared<test::FakePairedDeviceRegistry>();
    registry->setDevices({test::FakePairedDeviceRegistry::watch("Morning Watch", "W7PRIVATE01",
                                                                Date(1'700'000'000))});
    auto flags = std::make_shared<test::FakeFeatureFlags>();
    flags->set("Kestova", "Tessel_3_0", true);
    env.platform->pairedDevices = registry;
    env.platform->featureFlags = flags;
    static_cast<test::FakeDeviceProperties&>(*env.platform->deviceProperties).internal = true;
    auto& prefs = *env.platform->preferences;
    qax_registerDefaults(prefs);
    prefs.setObject("ServerVersionOverride",
                    Value::Dictionary{{"LowServerVersion", 2}, {"HighServerVersion", 3}});
    prefs.setObject("PairedWatchesSerialNumbers",
                    Value::Dictionary{{"W7PRIVATE01", "W7SUBSTITUTE"}});

    auto provider = std::make_shared<test::FakeWarrantyProvider>();
    auto agent = QAXAgent::initWithWarrantyProvider(
        env.platform, provider, std::make_shared<QAXDevicesManager>(env.platform));
    agent->getAllDeviceInfosUsingPolicy(QAXWarrantyPolicyDefault, true, [](auto) {});
    agent->getDeviceInfoForSerialNumber("W7PRIVATE01", QAXWarrantyPolicyCachedOnly, [](auto) {});
    env.runner->runUntilIdle();

    const auto lines = redacting->messages();
    ASSERT_GT(redacting->countContaining("<private>"), 3);
    for (const auto& line : lines) {
        for (const char* serial : {"C02TESTSERIAL", "W7PRIVATE01", "W7SUBSTITUTE"}) {
            EXPECT_EQ(line.find(serial), std::string::npos) << line;
        }
        EXPECT_EQ(line.find_first_of("\x1e\x1f"), std::string::npos) << line;
    }
}

}  // namespace
}  // namespace qax
