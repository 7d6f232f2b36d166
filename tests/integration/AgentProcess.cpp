#include "AgentProcess.h"

#include <sys/wait.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <thread>

#include "core/PlistCodec.h"

namespace qax::test {

AgentProcess::AgentProcess() {
    std::filesystem::create_directories(platformRoot());
}

void AgentProcess::writeRootFile(const std::string& relativePath, const Value& plist) {
    writeFile(std::filesystem::path(platformRoot()) / relativePath, toXmlPlist(plist).value());
}

void AgentProcess::writeDevices(const std::string& serialNumber,
                                const std::optional<std::string>& watchSerialNumber,
                                const std::string& systemVersion) {
    writeRootFile("device.plist", Value::Dictionary{{"SerialNumber", serialNumber},
                                                    {"ProductType", "Phone1,1"},
                                                    {"ProductVersion", systemVersion}});
    if (!watchSerialNumber) {
        return;
    }
    writeRootFile("paired-devices.plist",
                  Value::Array{Value::Dictionary{{"name", "Watch"},
                                                 {"serialNumber", *watchSerialNumber},
                                                 {"pairedDate", Date(1700000000)},
                                                 {"isPaired", true},
                                                 {"isArchived", false}}});
    writeRootFile("features.plist",
                  Value::Dictionary{{"Kestova", Value::Dictionary{{"Tessel_3_0", true}}}});
}

void AgentProcess::writeAccounts(const std::optional<std::string>& tokenServiceURL,
                                 const Value::Dictionary& tokens) {
    Value::Dictionary accounts{{"PrimaryCloudAccount", Value::Dictionary{{"altDSID", "primary"}}}};
    if (tokenServiceURL) {
        accounts["KFAccount"] = Value::Dictionary{
            {"altDSID", "kf"}, {"TokenServiceURL", *tokenServiceURL}, {"Tokens", tokens}};
        accounts["StoreAccount"] = Value::Dictionary{{"storefront", "143441-1,29"}};
    }
    writeRootFile("accounts.plist", accounts);
}

void AgentProcess::registerApplication(const std::string& name, const std::string& executablePath,
                                       std::optional<std::string> bundleIdentifier,
                                       std::optional<Value> entitlement) {
    Value::Dictionary app{{"ExecutablePath", Value(executablePath)},
                          {"Installed", Value(true)},
                          {"Entitlements", Value::Dictionary{}}};
    if (bundleIdentifier) {
        app["BundleIdentifier"] = *bundleIdentifier;
    }
    if (entitlement) {
        app["Entitlements"] = Value::Dictionary{{"com.velmora.private.qaxagent", *entitlement}};
    }
    writeRootFile("apps/" + name + ".plist", Value(std::move(app)));
}

std::vector<std::string> AgentProcess::environment() const {
    const char* path = std::getenv("PATH");
    std::vector<std::string> env = {"HOME=" + home(), "QAX_PLATFORM_ROOT=" + platformRoot(),
                                    "QAX_RUNTIME_DIR=" + runtimeDirectory(),
                                    std::string("PATH=") + (path ? path : "/usr/bin:/bin")};
    env.insert(env.end(), extraEnvironment.begin(), extraEnvironment.end());
    return env;
}

bool AgentProcess::start(const std::string& program) {
    std::filesystem::remove(logPath());
    process_ = std::make_unique<SpawnedProcess>(program, std::vector<std::string>{}, environment(),
                                                "/dev/null", logPath());
    for (int i = 0; i < 2000 && running(); ++i) {
        if (std::filesystem::is_socket(socketPath())) {
            return true;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    return false;
}

int AgentProcess::stop(int signal) {
    const int status = process_ ? process_->stop(signal) : -1;
    process_.reset();
    return status;
}

int AgentProcess::countInLog(const std::string& text) const {
    const std::string all = log();
    int n = 0;
    for (auto at = all.find(text); at != std::string::npos; at = all.find(text, at + 1)) {
        ++n;
    }
    return n;
}

bool AgentProcess::waitForLog(const std::string& text, int times, double seconds) const {
    const auto deadline = std::chrono::steady_clock::now() +
                          std::chrono::milliseconds(static_cast<long>(seconds * 1000));
    while (countInLog(text) < times) {
        if (std::chrono::steady_clock::now() >= deadline) {
            return false;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    return true;
}

ToolResult runTool(const std::string& program, const std::vector<std::string>& args,
                   const std::vector<std::string>& environment, double seconds) {
    TempDir out;
    ToolResult result;
    auto status = SpawnedProcess(program, args, environment, out.str() + "/out", out.str() + "/err")
                      .waitForExit(seconds);
    if (status && WIFEXITED(*status)) {
        result.status = WEXITSTATUS(*status);
    }
    result.out = readFile(out.path() / "out");
    result.err = readFile(out.path() / "err");
    return result;
}

std::string selfExecutable() {
    return std::filesystem::canonical("/proc/self/exe").string();
}

}  // namespace qax::test
