// qaxctl request-preview: builds and signs the coverage request that download attempt N
// would send for a serial number, on this device's platform (accounts, identity,
// attestation, preferences), and prints it instead of sending it. Signing may renew the
// account token, as the download itself would.
#include <cstdio>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "Command.h"
#include "core/AsioDispatcher.h"
#include "core/JsonCodec.h"
#include "core/Log.h"
#include "platform/DeviceProperties.h"
#include "platform/HttpClient.h"
#include "platform/Platform.h"
#include "platform/PreferenceStore.h"
#include "platform/QAXSettings.h"
#include "platform/host/HostPlatform.h"
#include "signing/AccountHeaders.h"

namespace qaxctl {
namespace {

using qax::Value;

constexpr const char* kUsage =
    "usage: qaxctl request-preview SERIAL [--bundle-id ID] [--attempt 0|1|2] [--json] "
    "[--verbose]\n";
// The download's own request time-out, and its number of attempts.
constexpr double kRequestTimeoutSeconds = 30;
constexpr int kAttempts = 3;

// Keeps the agent's log lines, to explain a refusal; passes them on to stderr when asked.
class RecordingSink : public qax::LogSink {
  public:
    explicit RecordingSink(std::shared_ptr<qax::LogSink> echo) : echo_(std::move(echo)) {}
    void write(qax::LogLevel level, std::string_view subsystem, std::string_view category,
               std::string_view message) override {
        if (echo_ && echo_->isEnabled(level)) {
            echo_->write(level, subsystem, category, message);
        }
        std::lock_guard lock(mutex_);
        if (level != qax::LogLevel::Debug) {
            messages_.emplace_back(message);
        }
    }
    bool isEnabled(qax::LogLevel) const override { return true; }
    bool showsPrivate() const override { return echo_ ? echo_->showsPrivate() : false; }
    std::vector<std::string> takeMessages() {
        std::lock_guard lock(mutex_);
        return std::exchange(messages_, {});
    }

  private:
    std::shared_ptr<qax::LogSink> echo_;
    std::mutex mutex_;
    std::vector<std::string> messages_;
};

std::optional<std::string> stringProperty(qax::Platform& platform, std::string_view name) {
    auto value = platform.deviceProperties->copyDeviceProperty(name);
    const std::string* s = value ? value->asString() : nullptr;
    return s ? std::optional<std::string>(*s) : std::nullopt;
}

void printText(const qax::HttpRequest& request) {
    std::printf("%s %s\n", request.method().c_str(), request.url().c_str());
    for (const auto& [name, value] : request.headers()) {
        std::printf("%s: %s\n", name.c_str(), value.c_str());
    }
    std::printf("\n%s\n", request.body().value_or("").c_str());
}

void printJson(const qax::HttpRequest& request) {
    Value::Dictionary headers;
    for (const auto& [name, value] : request.headers()) {
        headers[name] = Value(value);
    }
    Value out(Value::Dictionary{
        {"url", Value(request.url())},
        {"method", Value(request.method())},
        {"headers", Value(std::move(headers))},
        {"body", Value(request.body().value_or(""))},
    });
    std::printf("%s\n", qax::toJsonString(out, 2).c_str());
}

int run(std::vector<std::string> args) {
    std::optional<std::string> bundleID;
    std::string value;
    if (takeOption(args, "--bundle-id", value)) {
        bundleID = value;
    }
    int attempt = 0;
    if (takeOption(args, "--attempt", value)) {
        if (value.size() != 1 || value[0] < '0' || value[0] >= '0' + kAttempts) {
            std::fprintf(stderr, "qaxctl request-preview: the attempt is 0, 1 or 2\n");
            return 64;
        }
        attempt = value[0] - '0';
    }
    const bool json = takeFlag(args, "--json");
    const bool verbose = takeFlag(args, "--verbose");
    if (args.size() != 1 || args[0].empty() || args[0][0] == '-') {
        std::fputs(kUsage, stderr);
        return 64;
    }
    const std::string serialNumber = args[0];

    auto dispatcher = std::make_shared<qax::AsioDispatcher>(1, 2);
    auto platform =
        qax::makeHostPlatform(qax::HostEnvironment::fromProcessEnvironment(), dispatcher);
    auto sink = std::make_shared<RecordingSink>(verbose ? platform->log : nullptr);
    qax::qaxLog().setSink(sink);
    qax::qax_registerDefaults(*platform->preferences);

    // This device's serial number goes to its own endpoint and carries attestation.
    const auto deviceSerial = stringProperty(*platform, "SerialNumber");
    const bool thisDevice = deviceSerial && *deviceSerial == serialNumber;
    const auto url = platform->preferences->stringForKey(
        thisDevice ? qax::settings::kWarrantyURL : qax::settings::kWearablesWarrantyURL);

    qax::HttpRequest request(url.value_or(""), kRequestTimeoutSeconds);
    int status = 0;
    if (!qax::qax_signWithAccountHeaders(request, *platform, attempt > 0, true, bundleID)) {
        std::string reason;
        for (const auto& m : sink->takeMessages()) {
            reason += (reason.empty() ? "" : "; ") + m;
        }
        std::fprintf(stderr, "qaxctl request-preview: the request cannot be signed: %s\n",
                     reason.c_str());
        status = 1;
    } else {
        qax::qax_setCoverageRequestBodyWithSerialNumber(request, *platform, serialNumber);
        if (thisDevice) {
            qax::addKVAAuthenticationHeadersWithBody(request, *platform, *request.body());
        }
        json ? printJson(request) : printText(request);
    }
    qax::qaxLog().setSink(platform->log);
    dispatcher->shutdown();
    return status;
}

QAXCTL_COMMAND("request-preview", "request-preview SERIAL [--bundle-id ID] [--attempt N] [--json]",
               "print the signed coverage request a download would send, without sending it", run);

}  // namespace
}  // namespace qaxctl
