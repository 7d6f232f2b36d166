// Store answers from the network: the input is the body of every store request (look-up and
// purchase history, through the host bindings and store.plist), taken all the way to the
// support-availability dictionary a client receives. The reply must come exactly once and
// must be sendable over IPC.
#include <cstddef>
#include <cstdint>
#include <string>

#include "FuzzPlatform.h"
#include "core/PlistCodec.h"
#include "platform/HttpClient.h"
#include "platform/host/HostPurchaseHistory.h"
#include "platform/host/HostStoreLookup.h"
#include "support/QAXVelmoraSupportManager.h"

namespace {

// Answers at once, on the caller's thread, with the current input.
class InputHttpClient : public qax::HttpClient {
  public:
    std::string body;
    void send(const qax::HttpRequest&, std::function<void(qax::HttpResult)> completion) override {
        qax::HttpResult result;
        result.response = qax::HttpResponse{200, {{"Content-Type", "application/json"}}, body};
        completion(std::move(result));
    }
};

struct Harness {
    std::shared_ptr<qax::Platform> platform = qaxfuzz::makePlatform();
    std::shared_ptr<InputHttpClient> http = std::make_shared<InputHttpClient>();

    Harness() {
        const std::string root = qaxfuzz::scratchDirectory() + "/store-root";
        const std::string config = R"(<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0"><dict>
<key>LookupURL</key><string>https://store.invalid/lookup</string>
<key>PurchasesURL</key><string>https://store.invalid/purchases</string>
</dict></plist>)";
        qaxfuzz::putFile(root + "/store.plist", reinterpret_cast<const uint8_t*>(config.data()),
                         config.size());
        platform->platformRoot = root;
        platform->store = std::make_shared<qax::HostStoreLookup>(root, http, nullptr);
        platform->purchases = std::make_shared<qax::HostPurchaseHistory>(root, http, nullptr);
    }
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    static Harness h;
    h.http->body.assign(reinterpret_cast<const char*>(data), size);
    qax::QAXVelmoraSupportManager manager(h.platform, 0);
    int replies = 0;
    std::optional<qax::Value::Dictionary> answer;
    manager.appSupportAvailability("com.velmora.support", [&](qax::Value::Dictionary d) {
        ++replies;
        answer = std::move(d);
    });
    if (replies != 1 || !qax::toBinaryPlist(qax::Value(*answer))) {
        __builtin_trap();
    }
    replies = 0;
    manager.checkIsAvailableInStore("com.velmora.support",
                                    [&](std::optional<qax::Value::Dictionary> d) {
                                        ++replies;
                                        if (d && !qax::toBinaryPlist(qax::Value(*d))) {
                                            __builtin_trap();
                                        }
                                    });
    if (replies != 1) {
        __builtin_trap();
    }
    return 0;
}
