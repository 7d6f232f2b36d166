#include "CoverageSimProcess.h"

#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <thread>

#include "core/AtomicFile.h"
#include "core/JsonCodec.h"

namespace qax::test {
namespace {

std::vector<std::string> argumentsFor(const std::string& state, const std::string& platformRoot,
                                      const std::vector<std::string>& extraArgs) {
    std::vector<std::string> args = {"--state",
                                     state,
                                     "--platform-root",
                                     platformRoot,
                                     "--attestation-root",
                                     platformRoot + "/state/attestation/ca.pem"};
    args.insert(args.end(), extraArgs.begin(), extraArgs.end());
    return args;
}

}  // namespace

std::string CoverageSimProcess::prepare(const std::string& state) {
    std::filesystem::create_directories(state);
    return state + "/stdout.txt";
}

std::vector<std::string> CoverageSimProcess::withEnviron(std::vector<std::string> environment) {
    for (char** e = environ; *e; ++e) {
        environment.push_back(*e);
    }
    return environment;
}

CoverageSimProcess::CoverageSimProcess(const std::string& state, const std::string& platformRoot,
                                       const std::vector<std::string>& extraArgs,
                                       const std::vector<std::string>& environment)
    : state_(state),
      process_(QAX_SIM_BINARY, argumentsFor(state, platformRoot, extraArgs),
               withEnviron(environment), prepare(state), state + "/stderr.txt") {
    // It prints "... listening on 127.0.0.1:PORT" once it serves.
    for (int i = 0; i < 2000 && process_.running(); ++i) {
        const std::string out = readWholeFile(state + "/stdout.txt").value_or("");
        const auto end = out.find('\n');
        const auto colon = out.rfind(':', end);
        if (end != std::string::npos && out.find("listening") < end && colon != std::string::npos) {
            base_ = "https://127.0.0.1:" + out.substr(colon + 1, end - colon - 1);
            return;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
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
