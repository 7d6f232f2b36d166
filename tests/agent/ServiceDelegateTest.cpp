// Which clients the agent serves: the entitlement decision, the calling process's bundle, and
// what an accepted connection is given.
#include <gtest/gtest.h>

#include <map>

#include "agent/QAXAgent.h"
#include "agent/QAXAgentRemoteInterface.h"
#include "agent/ServiceDelegate.h"
#include "fakes/TestPlatform.h"
#include "platform/ProcessBundleLookup.h"

namespace qax {
namespace {

constexpr const char* kEntitlement = "com.velmora.private.qaxagent";
constexpr const char* kRejected =
    "Rejecting connection to qaxagent: missing entitlement 'com.velmora.private.qaxagent'";

class FakeConnection : public ClientConnection {
  public:
    pid_t peerProcessIdentifier() const override { return pid; }
    std::optional<Value> entitlementValue(const std::string& name) const override {
        auto it = entitlements.find(name);
        return it == entitlements.end() ? std::nullopt : std::optional<Value>(it->second);
    }
    void exportInterface(std::shared_ptr<const RemoteInterface> i) override { interface = i; }
    void exportObject(std::shared_ptr<ExportedObject> o) override { object = o; }
    void resume() override { ++resumed; }

    pid_t pid = 4242;
    Value::Dictionary entitlements;
    std::shared_ptr<const RemoteInterface> interface;
    std::shared_ptr<ExportedObject> object;
    int resumed = 0;
};

class FakeListener : public ServiceListener {
  public:
    void setDelegate(std::shared_ptr<ServiceListenerDelegate>) override {}
    bool resume() override { return true; }
    void invalidate() override {}
};

class FakeProcesses : public ProcessBundleLookup {
  public:
    int executablePathForProcess(pid_t pid, char* buffer, std::size_t size) override {
        auto it = paths.find(pid);
        if (it == paths.end() || it->second.size() >= size) {
            return 0;
        }
        it->second.copy(buffer, it->second.size());
        return static_cast<int>(it->second.size());
    }
    std::optional<std::string> bundleIdentifierForExecutablePath(const std::string& path) override {
        auto it = bundles.find(path);
        return it == bundles.end() ? std::nullopt : it->second;
    }
    std::map<pid_t, std::string> paths;
    std::map<std::string, std::optional<std::string>> bundles;
};

class ServiceDelegateTest : public ::testing::Test {
  protected:
    ServiceDelegateTest() { env.platform->processes = processes; }

    test::TestPlatform env;
    std::shared_ptr<FakeProcesses> processes = std::make_shared<FakeProcesses>();
    ServiceDelegate delegate{env.platform};
    FakeListener listener;
};

TEST_F(ServiceDelegateTest, OnlyATrueBooleanOrNonZeroNumberIsAnEntitlement) {
    const std::tuple<const char*, std::optional<Value>, bool> cases[] = {
        {"absent", std::nullopt, false},
        {"true", Value(true), true},
        {"false", Value(false), false},
        {"1", Value(1), true},
        {"-3", Value(-3), true},
        {"0", Value(0), false},
        {"0.5", Value(0.5), true},
        {"0.0", Value(0.0), false},
        {"string YES", Value("YES"), false},
        {"string 1", Value("1"), false},
        {"date", Value(Date(1)), false},
        {"dictionary", Value::Dictionary{{"a", Value(true)}}, false},
        {"array", Value::Array{Value(true)}, false},
    };
    for (const auto& [what, value, accepted] : cases) {
        env.log->clear();
        auto connection = std::make_shared<FakeConnection>();
        if (value) {
            connection->entitlements[kEntitlement] = *value;
        }
        EXPECT_EQ(delegate.shouldAcceptNewConnection(listener, connection), accepted) << what;
        EXPECT_EQ(env.log->count(kRejected), accepted ? 0 : 1) << what;
        // A refused connection is left exactly as it came.
        EXPECT_EQ(connection->resumed, accepted ? 1 : 0) << what;
        EXPECT_EQ(connection->object != nullptr, accepted) << what;
        EXPECT_EQ(connection->interface != nullptr, accepted) << what;
    }
}

TEST_F(ServiceDelegateTest, AcceptedClientGetsItsOwnAgentNamedAfterItsBundle) {
    processes->paths = {
        {100, "/opt/settings/bin/settings"}, {200, "/usr/local/bin/tool"}, {300, "/opt/unknown"}};
    processes->bundles = {{"/opt/settings/bin/settings", "com.velmora.Preferences.extension"},
                          {"/usr/local/bin/tool", std::nullopt}};
    const std::tuple<pid_t, std::string, const char*> cases[] = {
        {100, "com.velmora.Preferences.extension",
         "connection added from 100 with calling process: com.velmora.Preferences.extension"},
        // Registered outside any bundle, unknown to the registry, no path at all: all served as
        // the settings application.
        {200, "com.velmora.Preferences", "connection added from 200 with calling process: (null)"},
        {300, "com.velmora.Preferences", "connection added from 300 with calling process: (null)"},
        {400, "com.velmora.Preferences", "connection added from 400 with calling process: (null)"},
    };
    std::shared_ptr<ExportedObject> previous;
    for (const auto& [pid, expectedCaller, logged] : cases) {
        auto connection = std::make_shared<FakeConnection>();
        connection->pid = pid;
        connection->entitlements[kEntitlement] = Value(true);
        ASSERT_TRUE(delegate.shouldAcceptNewConnection(listener, connection));
        EXPECT_TRUE(env.log->contains(logged)) << pid;
        auto agent = std::dynamic_pointer_cast<QAXAgent>(connection->object);
        ASSERT_NE(agent, nullptr);
        EXPECT_EQ(agent->callingProcessBundleID(), expectedCaller);
        EXPECT_NE(connection->object, previous) << "agents are never shared";
        EXPECT_NE(std::dynamic_pointer_cast<const QAXAgentRemoteInterface>(connection->interface),
                  nullptr);
        previous = connection->object;
    }
}

}  // namespace
}  // namespace qax
