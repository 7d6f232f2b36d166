// The agent's operations as clients reach them: names, argument checks, archived replies.
#include <gtest/gtest.h>

#include <cmath>

#include "agent/QAXAgent.h"
#include "agent/QAXAgentRemoteInterface.h"
#include "fakes/FakeAgentFactory.h"
#include "fakes/FakeServices.h"
#include "fakes/FakeWarrantyProvider.h"
#include "fakes/FixedDeviceProvider.h"
#include "fakes/TestPlatform.h"

namespace qax {
namespace {

using FixedDevices = test::FixedDeviceProvider;
constexpr const char* kInfoOp = "getDeviceInfoForSerialNumber:usingPolicy:withReply:";

class QAXAgentRemoteInterfaceTest : public ::testing::Test {
  protected:
    struct Outcome {
        int calls = 0;
        RemoteReply reply;
    };
    // Runs the agent's queued work too: joins, the blocking support check.
    Outcome invoke(const std::string& op, Value::Array args,
                   std::shared_ptr<ExportedObject> object = nullptr) {
        auto out = std::make_shared<Outcome>();
        QAXAgentRemoteInterface().invoke(object ? object : agent, op, args, [out](RemoteReply r) {
            ++out->calls;
            out->reply = std::move(r);
        });
        env.runner->runUntilIdle();
        return *out;
    }

    test::TestPlatform env;
    std::shared_ptr<FixedDevices> devices = std::make_shared<FixedDevices>();
    std::shared_ptr<test::FakeWarrantyProvider> provider =
        std::make_shared<test::FakeWarrantyProvider>();
    std::shared_ptr<QAXAgent> agent =
        QAXAgent::initWithWarrantyProvider(env.platform, provider, devices);
};

// The class name of an archived record, or the reply's own kind.
std::string shapeOf(const RemoteReply& reply) {
    if (reply.error) {
        return "error";
    }
    if (!reply.value) {
        return "none";
    }
    const Value& v = *reply.value;
    if (const Value* cls = v.find("$class")) {
        return *cls->asString();
    }
    if (v.isArray()) {
        std::string shape = "[";
        for (const auto& e : *v.asArray()) {
            const Value* cls = e.find("$class");
            shape += (cls ? *cls->asString() : std::string("?")) + ",";
        }
        return shape + "]";
    }
    return v.description();
}

TEST_F(QAXAgentRemoteInterfaceTest, EveryOperationWithGoodAndHostileArguments) {
    const std::string huge(5000, 'S');
    const std::string nul("A\0B", 3);
    const std::string maxLength(256, '/');
    const std::string wrong = "error";
    const std::string yes = Value(true).description();
    const std::string no = Value(false).description();
    const char* kInfo = kInfoOp;
    const char* kAll = "getAllDeviceInfosUsingPolicy:updateFollowUps:withReply:";
    const char* kDefaultInfo = "getDefaultDeviceInfoUsingPolicy:withReply:";
    // clang-format off
    // Operation, arguments, and the reply's shape: "error", "none", a class name, "[...]" or a
    // printed value.
    const std::tuple<const char*, Value::Array, std::string> cases[] = {
        {"scheduleOutreachWithReply:", {}, yes},
        {"scheduleOutreachAfter:withReply:", {Value(3.5)}, yes},
        {"scheduleOutreachAfter:withReply:", {Value(-30)}, yes},
        {"scheduleOutreachAfter:withReply:", {Value("3")}, wrong},
        {"scheduleOutreachAfter:withReply:", {Value(std::nan(""))}, wrong},
        {"scheduleOutreachAfter:withReply:", {Value(HUGE_VAL)}, wrong},
        {"velmoraAccountAddedWithReply:", {}, no},
        {"velmoraAccountAddedWithReply:", {Value(true)}, wrong},
        {"checkIsAvailableInStore:withReply:", {Value("com.velmora.support")}, "none"},
        {"checkIsAvailableInStore:withReply:", {}, wrong},
        {"checkIsAvailableInStore:withReply:", {Value(huge)}, wrong},
        {"appSupportAvailability:withReply:", {Value("com.velmora.support")},
         Value(Value::Dictionary{{"AppBundleID", "com.velmora.support"}}).description()},
        {"appSupportAvailability:withReply:", {Value::Array{}}, wrong},
        {"readWebURLOverride:", {}, "none"},
        {"defaultDevice:", {}, "QAXDevice"},
        {"defaultDevice:", {Value(1)}, wrong},
        {"pairedDevices:", {}, "[QAXDevice,QAXDevice,]"},
        {kDefaultInfo, {Value(0)}, "QAXDeviceInfo"},
        {kDefaultInfo, {Value(5)}, "QAXDeviceInfo"},
        {kDefaultInfo, {Value(-1)}, wrong},
        {kDefaultInfo, {Value(1.0)}, wrong},
        {kDefaultInfo, {Value("0")}, wrong},
        {kInfo, {Value("S"), Value(2)}, "QAXDeviceInfo"},
        {kInfo, {Value(maxLength), Value(1)}, "QAXDeviceInfo"},
        {kInfo, {Value(""), Value(0)}, wrong},
        {kInfo, {Value(huge), Value(0)}, wrong},
        {kInfo, {Value(nul), Value(0)}, wrong},
        {kInfo, {Value(42), Value(0)}, wrong},
        {kInfo, {Value(2), Value("S")}, wrong},
        {kAll, {Value(1), Value(true)}, "[QAXDeviceInfo,QAXDeviceInfo,QAXDeviceInfo,]"},
        {kAll, {Value(0), Value(1)}, wrong},
        {kAll, {Value(0)}, wrong},
        {"dismissFollowUpForSerialNumber:completion:", {Value("S")}, yes},
        {"dismissFollowUpForSerialNumber:completion:", {Value("")}, wrong},
        {"dismissNotificationForSerialNumber:completion:", {Value("S")}, yes},
        {"dismissNotificationForSerialNumber:completion:", {Value(true)}, wrong},
        {"dismissNotificationForSerialNumber:completion:", {Value(huge)}, wrong},
        {"noSuchOperation:", {}, wrong},
        {"defaultDevice", {}, wrong},
    };
    // clang-format on
    for (const auto& [op, args, shape] : cases) {
        SCOPED_TRACE(std::string(op) + " " + Value(args).description().substr(0, 80));
        auto out = invoke(op, args);
        EXPECT_EQ(out.calls, 1);
        EXPECT_EQ(shapeOf(out.reply), shape) << out.reply.error.value_or("");
    }
    // What reached the agent's collaborators, in order.
    EXPECT_EQ(provider->calls(),
              (std::vector<std::string>{"download PHONE1", "refreshOne PHONE1", "refreshOne PHONE1",
                                        "download S", "refreshOne S", "refreshOne " + maxLength,
                                        "refresh 3", "dismiss S", "dismissNotification S"}));
    auto schedulings =
        static_cast<test::FakeAgentFactory&>(*env.platform->agentFactory).schedulings();
    ASSERT_EQ(schedulings.size(), 3u);
    EXPECT_EQ(schedulings[1].date, env.clock->now().byAdding(3.5));
    EXPECT_EQ(schedulings[2].date, env.clock->now().byAdding(-30));
}

TEST_F(QAXAgentRemoteInterfaceTest, ErrorsNameTheExpectedArgumentsAndNoDevicesIsAnEmptyList) {
    EXPECT_EQ(invoke(kInfoOp, {Value("")}).reply.error,
              "wrong arguments: 'getDeviceInfoForSerialNumber:usingPolicy:withReply:' takes 2 "
              "arguments (serial number of 1 to 256 characters, unsigned integer)");
    EXPECT_EQ(invoke("noSuchOperation:", {}).reply.error, "unknown operation 'noSuchOperation:'");
    struct NotAnAgent : ExportedObject {};
    auto notAnAgent = invoke("defaultDevice:", {}, std::make_shared<NotAnAgent>());
    EXPECT_EQ(notAnAgent.calls, 1);
    EXPECT_TRUE(notAnAgent.reply.error);

    devices->watches.clear();
    EXPECT_EQ(invoke("pairedDevices:", {}).reply.value, Value::Array{});
}

TEST_F(QAXAgentRemoteInterfaceTest, WebURLOverrideOnlyOnInternalBuilds) {
    env.platform->preferences->setObject("WebFlowURL", "https://example.test/flow");
    auto external = invoke("readWebURLOverride:", {});
    EXPECT_FALSE(external.reply.value);
    EXPECT_FALSE(external.reply.error);

    static_cast<test::FakeDeviceProperties&>(*env.platform->deviceProperties).internal = true;
    auto internal = invoke("readWebURLOverride:", {});
    EXPECT_EQ(internal.reply.value, Value("https://example.test/flow"));
    EXPECT_TRUE(env.log->contains("readWebURLOverride = https://example.test/flow"));
}

}  // namespace
}  // namespace qax
