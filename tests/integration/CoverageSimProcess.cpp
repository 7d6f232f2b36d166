#include "CoverageSimProcess.h"

#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <future>
#include <thread>

#include "core/AtomicFile.h"
#include "core/JsonCodec.h"
#include "platform/host/CurlHttpClient.h"

namespace qax::test {

CoverageSimProcess::CoverageSimProcess(const std::string& state, const std::string& platformRoot,
                                       const std::vector<std::string>& extraArgs,
                                       const std::vector<std::string>& environment)
    : state_(state) {
    std::vector<std::string> args = {"--state",
                                     state,
                                     "--platform-root",
                                     platformRoot,
                                     "--attestation-root",
                                     platformRoot + "/state/attestation/ca.pem"};
    args.insert(args.end(), extraArgs.begin(), extraArgs.end());
    std::vector<std::string> env(environment);
    for (char** e = environ; *e; ++e) {
        env.push_back(*e);
    }
    std::filesystem::create_directories(state);
    const std::string out = state + "/stdout.txt";
    process_ =
        std::make_unique<SpawnedProcess>(QAX_SIM_BINARY, args, env, out, state + "/stderr.txt");
    // It prints "... listening on https://127.0.0.1:PORT" once it serves.
    for (int i = 0; i < 2000 && process_->running(); ++i) {
        const std::string text = readWholeFile(out).value_or("");
        const auto end = text.find('\n');
        const auto colon = text.rfind(':', end);
        if (end != std::string::npos && text.find("listening") < end &&
            colon != std::string::npos) {
            base_ = "https://127.0.0.1:" + text.substr(colon + 1, end - colon - 1);
            return;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
}

HttpResult CoverageSimProcess::send(const HttpRequest& request) const {
    CurlHttpClient::Options options;
    options.extraCAFile = caFile();
    CurlHttpClient http(options);
    std::promise<HttpResult> done;
    http.send(request, [&](HttpResult r) { done.set_value(std::move(r)); });
    return done.get_future().get();
}

HttpResult CoverageSimProcess::call(const std::string& method, const std::string& path,
                                    std::optional<std::string> body) const {
    HttpRequest request(base_ + path, 20);
    request.setMethod(method);
    request.setBody(std::move(body));
    return send(request);
}

std::vector<Value> CoverageSimProcess::requestLog() const {
    std::vector<Value> out;
    auto text = readWholeFile(state_ + "/requests.jsonl").value_or("");
    std::size_t start = 0, end;
    while ((end = text.find('\n', start)) != std::string::npos) {
        if (auto v = parseJson(text.substr(start, end - start))) {
            out.push_back(*v);
        }
        start = end + 1;
    }
    return out;
}

}  // namespace qax::test
