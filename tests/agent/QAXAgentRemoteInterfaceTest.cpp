// The agent's operations as clients reach them: names, argument checks, archived replies.
#include <gtest/gtest.h>

#include <set>

#include "agent/QAXAgent.h"
#include "agent/QAXAgentRemoteInterface.h"
#include "fakes/FakeServices.h"
#include "fakes/TestPlatform.h"

namespace qax {
namespace {

class FixedDevices : public QAXAgentDeviceProvider {
  public:
    std::shared_ptr<QAXDevice> defaultDevice() override { return phone; }
    QAXDeviceMap pairedDevices() override { return watches; }
    QAXDeviceMap allDevices() override {
        QAXDeviceMap all = watches;
        all[*phone->serialNumber()] = phone;
        return all;
    }
    std::shared_ptr<QAXDevice> phone =
        QAXDevice::deviceWithName("Default Device", "PHONE1", Date(10), QAXDeviceTypeDefault);
    QAXDeviceMap watches = {
        {"W1", QAXDevice::deviceWithName("One", "W1", Date(20), QAXDeviceTypeWatch)},
        {"W2", QAXDevice::deviceWithName("Two", "W2", std::nullopt, QAXDeviceTypeWatch)},
    };
};

class QAXAgentRemoteInterfaceTest : public ::testing::Test {
  protected:
    struct Outcome {
        int calls = 0;
        RemoteReply reply;
    };
    Outcome invoke(const std::string& op, Value::Array args,
                   std::shared_ptr<ExportedObject> object = nullptr) {
        Outcome out;
        QAXAgentRemoteInterface().invoke(object ? object : agent, op, args, [&out](RemoteReply r) {
            ++out.calls;
            out.reply = std::move(r);
        });
        return out;
    }

    test::TestPlatform env;
    std::shared_ptr<FixedDevices> devices = std::make_shared<FixedDevices>();
    std::shared_ptr<QAXAgent> agent =
        QAXAgent::initWithWarrantyProvider(env.platform, nullptr, devices);
};

TEST_F(QAXAgentRemoteInterfaceTest, NamesArgumentsAndUnbuiltOperations) {
    struct Case {
        const char* op;
        Value::Array args;
        const char* error;  // nullptr: a reply
    };
    const char* wrong = "wrong arguments";
    const char* unsupported = "unsupported operation";
    const Case cases[] = {
        {"defaultDevice:", {}, nullptr},
        {"defaultDevice:", {Value(1)}, wrong},
        {"pairedDevices:", {}, nullptr},
        {"readWebURLOverride:", {}, nullptr},
        {"noSuchOperation:", {}, "unknown operation 'noSuchOperation:'"},
        {"defaultDevice", {}, "unknown operation 'defaultDevice'"},
        {"scheduleOutreachWithReply:", {}, unsupported},
        {"scheduleOutreachAfter:withReply:", {Value(3.5)}, unsupported},
        {"scheduleOutreachAfter:withReply:", {Value(3)}, unsupported},
        {"scheduleOutreachAfter:withReply:", {Value("3")}, wrong},
        {"velmoraAccountAddedWithReply:", {}, unsupported},
        {"checkIsAvailableInStore:withReply:", {Value("com.velmora.support")}, unsupported},
        {"checkIsAvailableInStore:withReply:", {}, wrong},
        {"appSupportAvailability:withReply:", {Value("x")}, unsupported},
        {"getDefaultDeviceInfoUsingPolicy:withReply:", {Value(0)}, unsupported},
        {"getDefaultDeviceInfoUsingPolicy:withReply:", {Value(-1)}, wrong},
        {"getDeviceInfoForSerialNumber:usingPolicy:withReply:",
         {Value("S"), Value(2)},
         unsupported},
        {"getDeviceInfoForSerialNumber:usingPolicy:withReply:", {Value(2), Value("S")}, wrong},
        {"getAllDeviceInfosUsingPolicy:updateFollowUps:withReply:",
         {Value(0), Value(true)},
         unsupported},
        {"getAllDeviceInfosUsingPolicy:updateFollowUps:withReply:", {Value(0), Value(1)}, wrong},
        {"getAllDeviceInfosUsingPolicy:updateFollowUps:withReply:", {Value(0)}, wrong},
        {"dismissFollowUpForSerialNumber:completion:", {Value("S")}, unsupported},
        {"dismissNotificationForSerialNumber:completion:", {Value(true)}, wrong},
    };
    for (const auto& c : cases) {
        auto out = invoke(c.op, c.args);
        EXPECT_EQ(out.calls, 1) << c.op;
        if (c.error) {
            ASSERT_TRUE(out.reply.error.has_value()) << c.op;
            EXPECT_EQ(out.reply.error->rfind(c.error, 0), 0u) << c.op << ": " << *out.reply.error;
            EXPECT_FALSE(out.reply.value) << c.op;
        } else {
            EXPECT_FALSE(out.reply.error) << c.op << ": " << out.reply.error.value_or("");
        }
    }
}

TEST_F(QAXAgentRemoteInterfaceTest, DeviceRepliesAreArchives) {
    auto one = invoke("defaultDevice:", {});
    ASSERT_TRUE(one.reply.value);
    auto device = QAXDevice::decode(*one.reply.value);
    ASSERT_NE(device, nullptr);
    EXPECT_EQ(device->serialNumber(), "PHONE1");
    EXPECT_EQ(device->activationDate(), Date(10));

    auto many = invoke("pairedDevices:", {});
    ASSERT_TRUE(many.reply.value && many.reply.value->isArray());
    std::set<std::string> serials;
    for (const auto& archived : *many.reply.value->asArray()) {
        auto d = QAXDevice::decode(archived);
        ASSERT_NE(d, nullptr);
        EXPECT_EQ(d->deviceType(), QAXDeviceTypeWatch);
        serials.insert(d->serialNumber().value_or(""));
    }
    EXPECT_EQ(serials, (std::set<std::string>{"W1", "W2"}));

    devices->watches.clear();
    auto none = invoke("pairedDevices:", {});
    ASSERT_TRUE(none.reply.value);
    EXPECT_EQ(*none.reply.value, Value(Value::Array{}));
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

TEST_F(QAXAgentRemoteInterfaceTest, ObjectThatIsNotAnAgentGetsAnError) {
    struct NotAnAgent : ExportedObject {};
    auto out = invoke("defaultDevice:", {}, std::make_shared<NotAnAgent>());
    EXPECT_EQ(out.calls, 1);
    EXPECT_TRUE(out.reply.error);
}

TEST(QAXAgentTest, CallingProcessFallsBackToTheSettingsApplication) {
    test::TestPlatform env;
    EXPECT_EQ(QAXAgent::initWithCallingProcessBundleID(env.platform, "com.example.client")
                  ->callingProcessBundleID(),
              "com.example.client");
    EXPECT_FALSE(
        env.log->contains("-[QAXAgent initWithCallingProcessBundleID:]: "
                          "callingProcessBundleID is nil. Falling back to Preferences "
                          "Bundle ID"));
    EXPECT_EQ(QAXAgent::initWithCallingProcessBundleID(env.platform, std::nullopt)
                  ->callingProcessBundleID(),
              "com.velmora.Preferences");
    EXPECT_TRUE(
        env.log->contains("-[QAXAgent initWithCallingProcessBundleID:]: "
                          "callingProcessBundleID is nil. Falling back to Preferences "
                          "Bundle ID"));
}

}  // namespace
}  // namespace qax
