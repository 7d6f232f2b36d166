// coverage-sim: a local HTTPS coverage service for the demo and the integration tests.
// It serves the server version list, coverage summaries (for signed requests only, with
// the attestation headers verified when present), KF token renewal and the store's look-up
// and purchase endpoints, from fixture files or built-in answers, and appends one JSON line
// per request to <state>/requests.jsonl so tests can see what the agent sent. A scenario
// makes it misbehave on purpose (statuses, delays, broken bodies, hangs, resets).
//
// With --platform-root it writes ROOT/tls.plist so the agent trusts its CA and
// ROOT/store.plist naming its store endpoints. It prints
// "coverage-sim listening on https://127.0.0.1:PORT" once it accepts connections.
#include <httplib.h>
#include <signal.h>

#include <charconv>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <thread>

#include "Simulator.h"
#include "core/AtomicFile.h"
#include "core/JsonCodec.h"
#include "core/PlistCodec.h"
#include "platform/host/LocalTlsMaterial.h"

namespace coveragesim {
namespace {

// Enough for parallel downloads of many devices against slow or hanging answers.
constexpr std::size_t kServerThreads = 64;

constexpr const char* kUsage =
    "usage: coverage-sim --state DIR [--port N] [--fixtures DIR] [--platform-root ROOT]\n"
    "                    [--attestation-root PEM] [--delay-ms N]\n"
    "                    [--clock-offset SECONDS] [--simulated-clock]\n"
    "                    [--scenario FILE] [--answer KEY=STEP[,STEP...]]...\n"
    "\n"
    "  --state DIR          TLS material (ca.pem, ...) and the request log requests.jsonl\n"
    "  --fixtures DIR       summaries/SERIAL.LOCALE.json (the request's locale), then\n"
    "                       summaries/SERIAL.json, summaries/default.json, qaxV2.plist,\n"
    "                       store/lookup/BUNDLE_ID.json, store/purchases/ACCOUNT_ID.json\n"
    "  --platform-root ROOT writes ROOT/tls.plist and ROOT/store.plist for the agent\n"
    "  --delay-ms N         every version-list, summary and store answer waits N ms\n"
    "  --clock-offset S     \"@now\" in fixtures is the system time plus S seconds\n"
    "  --simulated-clock    also add ROOT/state/clock.plist OffsetSeconds, read per request\n"
    "                       (implied by QAX_CLOCK=simulated with --platform-root)\n"
    "  --scenario FILE      JSON {\"KEY\": [STEP, ...]}; --answer adds steps to one key\n"
    "\n"
    "KEY: a serial number, \"*\" (any serial without its own list), @versions, @token,\n"
    "@lookup, @purchases. Each request takes the next STEP of its key:\n"
    "  ok | NNN | delay MS [STEP] | garbage | html | array | deep [LEVELS] | huge [BYTES] |\n"
    "  hang | reset [BYTES]\n"
    "Admin: GET/POST/DELETE /admin/scenario, GET /admin/requests[?since=N].\n";

int usage(const std::string& problem = "") {
    if (!problem.empty()) {
        std::fprintf(stderr, "coverage-sim: %s\n", problem.c_str());
    }
    std::fputs(kUsage, stderr);
    return 64;
}

template <typename T>
bool parseNumber(const std::string& text, T& out) {
    auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), out);
    return ec == std::errc() && end == text.data() + text.size();
}

bool writePlist(const std::filesystem::path& path, const qax::Value& value) {
    std::string error;
    if (!qax::writeFileAtomically(path.string(), *qax::toXmlPlist(value), &error)) {
        std::fprintf(stderr, "coverage-sim: cannot write %s: %s\n", path.c_str(), error.c_str());
        return false;
    }
    return true;
}

}  // namespace
}  // namespace coveragesim

int main(int argc, char** argv) {
    using namespace coveragesim;
    Options opt;
    std::vector<std::string> scenarioFiles, answers;
    for (int i = 1; i < argc; ++i) {
        const std::string a = argv[i];
        auto takesValue = a != "--simulated-clock";
        if (takesValue && i + 1 >= argc) {
            return usage(a + " needs a value");
        }
        const std::string value = takesValue ? argv[++i] : "";
        if (a == "--state") {
            opt.state = value;
        } else if (a == "--fixtures") {
            opt.fixtures = value;
        } else if (a == "--platform-root") {
            opt.platformRoot = value;
        } else if (a == "--attestation-root") {
            opt.attestationRoot = value;
        } else if (a == "--port") {
            if (!parseNumber(value, opt.port) || opt.port < 0 || opt.port > 65535) {
                return usage("--port takes a port number");
            }
        } else if (a == "--delay-ms") {
            if (!parseNumber(value, opt.delayMs) || opt.delayMs < 0) {
                return usage("--delay-ms takes milliseconds");
            }
        } else if (a == "--clock-offset") {
            if (!parseNumber(value, opt.clockOffsetSeconds)) {
                return usage("--clock-offset takes seconds");
            }
        } else if (a == "--simulated-clock") {
            opt.simulatedClock = true;
        } else if (a == "--scenario") {
            scenarioFiles.push_back(value);
        } else if (a == "--answer") {
            answers.push_back(value);
        } else {
            return usage("unknown option " + a);
        }
    }
    if (opt.state.empty()) {
        return usage("--state is required");
    }
    if (const char* clock = std::getenv("QAX_CLOCK"); clock && std::string(clock) == "simulated") {
        opt.simulatedClock = true;
    }
    if (opt.simulatedClock && opt.platformRoot.empty()) {
        return usage("the simulated clock is read from --platform-root");
    }

    Simulator sim(opt);
    std::string error;
    for (const auto& file : scenarioFiles) {
        auto text = qax::readWholeFile(file);
        auto lists = text ? qax::parseJson(*text, &error) : std::nullopt;
        if (!text || !lists || !sim.scenario().set(*lists, &error)) {
            return usage("scenario " + file + ": " + (text ? error : "cannot be read"));
        }
    }
    for (const auto& answer : answers) {
        if (!sim.scenario().append(answer, &error)) {
            return usage("--answer " + error);
        }
    }

    std::filesystem::create_directories(opt.state);
    qax::TlsMaterial tls;
    if (!qax::loadOrCreateLocalTlsMaterial(opt.state, tls, error)) {
        std::fprintf(stderr, "coverage-sim: %s\n", error.c_str());
        return 1;
    }

    // Signals are taken on a thread of their own, which stops the server cleanly. A client
    // that leaves mid-answer (or a reset answer) must not kill the process.
    signal(SIGPIPE, SIG_IGN);
    sigset_t set;
    sigemptyset(&set);
    sigaddset(&set, SIGTERM);
    sigaddset(&set, SIGINT);
    pthread_sigmask(SIG_BLOCK, &set, nullptr);

    httplib::SSLServer server(tls.serverCertPath.c_str(), tls.serverKeyPath.c_str());
    if (!server.is_valid()) {
        std::fprintf(stderr, "coverage-sim: cannot load the TLS certificate\n");
        return 1;
    }
    server.new_task_queue = [] { return new httplib::ThreadPool(kServerThreads); };
    sim.install(server);
    int port = opt.port;
    if (port == 0) {
        port = server.bind_to_any_port("127.0.0.1");
    } else if (!server.bind_to_port("127.0.0.1", port)) {
        port = -1;
    }
    if (port <= 0) {
        std::fprintf(stderr, "coverage-sim: cannot listen on 127.0.0.1:%d\n", opt.port);
        return 1;
    }
    sim.setPort(port);
    const std::string base = "https://127.0.0.1:" + std::to_string(port);
    if (!opt.platformRoot.empty()) {
        const std::filesystem::path root(opt.platformRoot);
        using qax::Value;
        if (!writePlist(
                root / "tls.plist",
                Value(Value::Dictionary{
                    {"ExtraCAFile", std::filesystem::absolute(tls.caCertPath).string()}})) ||
            !writePlist(root / "store.plist",
                        Value(Value::Dictionary{{"LookupURL", base + kLookupPath},
                                                {"PurchasesURL", base + kPurchasesPath}}))) {
            return 1;
        }
    }
    std::thread signals([&] {
        int sig = 0;
        sigwait(&set, &sig);
        sim.stop();
        server.stop();
        // The server's workers wait out idle keep-alive connections (seconds) before the
        // listener returns; every request is already logged, so a stopped simulator exits now.
        std::this_thread::sleep_for(std::chrono::milliseconds(200));
        std::_Exit(0);
    });
    signals.detach();
    std::printf("coverage-sim listening on %s\n", base.c_str());
    std::fflush(stdout);
    server.listen_after_bind();
    return 0;
}
