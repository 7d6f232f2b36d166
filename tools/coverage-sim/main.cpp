// coverage-sim: a local HTTPS coverage service for the demo and the integration tests.
// It serves the server version list, coverage summaries (for signed requests only, with
// the attestation headers verified when present) and KF token renewal, from fixture files,
// and appends one JSON line per request to <state>/requests.jsonl so tests can see what
// the agent sent.
//
//   coverage-sim --state DIR [--port N] [--fixtures DIR] [--platform-root ROOT]
//                [--attestation-root PEM] [--delay-ms N]
//
// With --platform-root it writes ROOT/tls.plist so the agent trusts its CA. It prints
// "coverage-sim listening on https://127.0.0.1:PORT" once it accepts connections.
#include <httplib.h>
#include <signal.h>

#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <mutex>
#include <random>
#include <string>
#include <thread>

#include "AttestationCheck.h"
#include "core/AtomicFile.h"
#include "core/JsonCodec.h"
#include "core/PlistCodec.h"
#include "platform/host/LocalTlsMaterial.h"

namespace coveragesim {
namespace {

using qax::Value;

struct Options {
    std::string state;
    std::string fixtures;
    std::string platformRoot;
    std::string attestationRoot;
    int port = 0;
    int delayMs = 0;
};

constexpr const char* kVersionListPath = "/library/VELMORA/asset/qaxV2.plist";
constexpr const char* kDefaultSummaryPath = "/api/v3/coverage/summary";
constexpr const char* kWearablesSummaryPath = "/api/v2/coverage/summary";
constexpr const char* kTokenPath = "/token";

std::string randomHex(std::size_t bytes) {
    static std::mutex m;
    static std::mt19937_64 rng(std::random_device{}());
    std::lock_guard lock(m);
    std::string out;
    for (std::size_t i = 0; i < bytes; ++i) {
        char b[3];
        std::snprintf(b, sizeof b, "%02x", static_cast<unsigned>(rng() & 0xff));
        out += b;
    }
    return out;
}

double nowSeconds() {
    using namespace std::chrono;
    return duration<double>(system_clock::now().time_since_epoch()).count();
}

// Fixture strings "@now", "@now+30d", "@now-2h" become epoch milliseconds, so fixtures
// describe offers relative to the moment they are served.
void expandRelativeDates(Value& v, double now) {
    if (auto* s = v.asString()) {
        if (s->rfind("@now", 0) != 0) {
            return;
        }
        double offset = 0;
        if (s->size() > 4) {
            char* end = nullptr;
            double n = std::strtod(s->c_str() + 4, &end);
            const double unit = *end == 'd' ? 86400 : *end == 'h' ? 3600 : *end == 'm' ? 60 : 1;
            offset = n * unit;
        }
        v = Value(static_cast<long long>((now + offset) * 1000.0));
    } else if (auto* a = v.asArray()) {
        for (auto& e : *a) {
            expandRelativeDates(e, now);
        }
    } else if (auto* d = v.asDictionary()) {
        for (auto& [k, e] : *d) {
            expandRelativeDates(e, now);
        }
    }
}

// The summary served when no fixture names the serial number: covered, with an offer of
// the plan open for another 30 days.
Value builtInSummary() {
    auto v = qax::parseJson(R"({
      "covered": true,
      "coverageEndDate": "@now+60d",
      "coverageLocalizedLabel": "Limited Warranty",
      "coverageLocalizedDesc": "Your device is covered by the limited warranty.",
      "hvOfferEligible": true,
      "hvOfferEligibleUntil": "@now+30d",
      "hvOfferDisplayDate": "@now-1d",
      "hvOfferFollowupDisplayDate": "@now-1d",
      "hvOfferIdentifier": "HV-OFFER-1",
      "hvLocalizedOfferLabel": "Add the Haverly plan",
      "hvLocalizedOfferPluralDescFormat": "%@ days left to add coverage",
      "hvLocalizedOfferSingularDesc": "Last day to add coverage",
      "hvNotificationLocalizedOfferLabel": "Coverage is ending soon",
      "hvNotificationLocalizedOfferPluralDescFormat": "%@ days left to add the Haverly plan",
      "hvNotificationLocalizedOfferSingularDesc": "Last day to add the Haverly plan",
      "hvLocalizedOfferCTA": "Add Coverage",
      "hvLocalizedOfferDetailsPluralEligibilityFormat": "Eligible for %@ more days.",
      "hvLocalizedOfferDetailsSingularEligibility": "Eligible until the end of today.",
      "featureToggleParameters": {
        "hvOfferDisplay": true, "hvOfferSettingsAppBadge": true, "hvOfferSettingsRowBadge": true,
        "hvOfferDurationDaysBeforeEndDate": 60, "hvOfferToggle": []
      },
      "hvOfferBadgeBeforeEndDate": 7,
      "showNotificationToggle": true,
      "showNotificationBeforeEndDate": 3
    })");
    return *v;
}

class Simulator {
  public:
    explicit Simulator(Options o) : opt_(std::move(o)) {}

    void install(httplib::Server& server) {
        server.Get(kVersionListPath, [this](const httplib::Request& req, httplib::Response& res) {
            delay();
            auto list = qax::readWholeFile(fixture("qaxV2.plist"));
            std::string body = list ? *list
                                    : *qax::toXmlPlist(Value(Value::Dictionary{
                                          {"LowServerVersion", 2}, {"HighServerVersion", 3}}));
            res.set_content(body, "application/x-plist");
            record(req, res.status, Value::Dictionary{});
        });
        for (const char* path : {kDefaultSummaryPath, kWearablesSummaryPath}) {
            server.Post(path, [this](const httplib::Request& req, httplib::Response& res) {
                delay();
                summary(req, res);
            });
        }
        server.Post(kTokenPath, [this](const httplib::Request& req, httplib::Response& res) {
            auto body = qax::parseJson(req.body);
            if (!body || !body->find("altDSID")) {
                res.status = 400;
                res.set_content(R"({"error":"altDSID missing"})", "application/json");
            } else {
                res.set_content(
                    qax::toJsonString(Value(Value::Dictionary{{"token", "kf-" + randomHex(16)}})),
                    "application/json");
            }
            record(req, res.status, Value::Dictionary{});
        });
    }

  private:
    std::string fixture(const std::string& name) const {
        return (std::filesystem::path(opt_.fixtures) / name).string();
    }

    void delay() const {
        if (opt_.delayMs > 0) {
            std::this_thread::sleep_for(std::chrono::milliseconds(opt_.delayMs));
        }
    }

    void summary(const httplib::Request& req, httplib::Response& res) {
        Value::Dictionary notes;
        auto fail = [&](int status, const std::string& why) {
            res.status = status;
            res.set_content(qax::toJsonString(Value(Value::Dictionary{{"error", why}})),
                            "application/json");
            notes["error"] = why;
            record(req, status, notes);
        };
        auto body = qax::parseJson(req.body);
        const Value* serial = body ? body->find("serialNumber") : nullptr;
        if (!serial || !serial->isString() || !body->find("locale") ||
            !body->find("requestTimestamp") || !body->find("requestTimezone")) {
            return fail(400,
                        "body must hold serialNumber, locale, requestTimestamp, requestTimezone");
        }
        if (!req.has_header("X-Velmora-KF-Token") ||
            req.get_header_value("X-Velmora-KF-Token").empty()) {
            return fail(401, "missing X-Velmora-KF-Token");
        }
        auto header = [&](const char* name) -> std::optional<std::string> {
            return req.has_header(name) ? std::optional(req.get_header_value(name)) : std::nullopt;
        };
        // Read per request: the device creates its attestation CA on first use, possibly
        // after the simulator started.
        const std::string rootPem = opt_.attestationRoot.empty()
                                        ? ""
                                        : qax::readWholeFile(opt_.attestationRoot).value_or("");
        auto verdict =
            checkAttestation(header("X-Velmora-Kva-S"), header("X-Velmora-Kva"), req.body, rootPem);
        notes["attestation"] =
            verdict.present ? (verdict.valid ? "valid" : "invalid: " + verdict.reason) : "absent";
        if (verdict.present && !verdict.valid) {
            return fail(403, "attestation rejected: " + verdict.reason);
        }
        std::optional<Value> summary;
        for (const std::string& name :
             {*serial->asString() + ".json", std::string("default.json")}) {
            if (auto text = qax::readWholeFile(fixture("summaries/" + name))) {
                summary = qax::parseJson(*text);
                break;
            }
        }
        Value out = summary ? *summary : builtInSummary();
        expandRelativeDates(out, nowSeconds());
        res.set_content(qax::toJsonString(out), "application/json");
        record(req, res.status, notes);
    }

    void record(const httplib::Request& req, int status, Value::Dictionary notes) {
        Value::Dictionary headers;
        for (const auto& [k, v] : req.headers) {
            headers[k] = v;
        }
        notes["method"] = req.method;
        notes["path"] = req.path;
        notes["status"] = status;
        notes["headers"] = Value(std::move(headers));
        notes["body"] = req.body;
        std::string line = qax::toJsonString(Value(std::move(notes))) + "\n";
        std::lock_guard lock(logMutex_);
        if (FILE* f =
                std::fopen((std::filesystem::path(opt_.state) / "requests.jsonl").c_str(), "a")) {
            std::fwrite(line.data(), 1, line.size(), f);
            std::fclose(f);
        }
    }

    Options opt_;
    std::mutex logMutex_;
};

int usage() {
    std::fprintf(stderr,
                 "usage: coverage-sim --state DIR [--port N] [--fixtures DIR] "
                 "[--platform-root ROOT] [--attestation-root PEM] [--delay-ms N]\n");
    return 64;
}

}  // namespace
}  // namespace coveragesim

int main(int argc, char** argv) {
    using namespace coveragesim;
    Options opt;
    for (int i = 1; i < argc; ++i) {
        std::string a = argv[i];
        auto next = [&]() -> std::string { return i + 1 < argc ? argv[++i] : ""; };
        if (a == "--state") {
            opt.state = next();
        } else if (a == "--fixtures") {
            opt.fixtures = next();
        } else if (a == "--platform-root") {
            opt.platformRoot = next();
        } else if (a == "--attestation-root") {
            opt.attestationRoot = next();
        } else if (a == "--port") {
            opt.port = std::atoi(next().c_str());
        } else if (a == "--delay-ms") {
            opt.delayMs = std::atoi(next().c_str());
        } else {
            return usage();
        }
    }
    if (opt.state.empty()) {
        return usage();
    }
    std::filesystem::create_directories(opt.state);
    qax::TlsMaterial tls;
    std::string error;
    if (!qax::loadOrCreateLocalTlsMaterial(opt.state, tls, error)) {
        std::fprintf(stderr, "coverage-sim: %s\n", error.c_str());
        return 1;
    }
    if (!opt.platformRoot.empty()) {
        auto plist = qax::toXmlPlist(qax::Value(qax::Value::Dictionary{
            {"ExtraCAFile", std::filesystem::absolute(tls.caCertPath).string()}}));
        if (!qax::writeFileAtomically(
                (std::filesystem::path(opt.platformRoot) / "tls.plist").string(), *plist, &error)) {
            std::fprintf(stderr, "coverage-sim: cannot write tls.plist: %s\n", error.c_str());
            return 1;
        }
    }

    // Signals are taken on a thread of their own, which stops the server cleanly.
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
    Simulator sim(opt);
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
    std::thread signals([&] {
        int sig = 0;
        sigwait(&set, &sig);
        server.stop();
    });
    signals.detach();
    std::printf("coverage-sim listening on https://127.0.0.1:%d\n", port);
    std::fflush(stdout);
    server.listen_after_bind();
    return 0;
}
