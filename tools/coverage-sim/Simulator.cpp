#include "Simulator.h"

#include <chrono>
#include <cstdio>
#include <filesystem>
#include <random>
#include <set>
#include <sstream>

#include "AttestationCheck.h"
#include "PeerSocket.h"
#include "core/AtomicFile.h"
#include "core/JsonCodec.h"
#include "core/PlistCodec.h"

namespace coveragesim {
namespace {

using qax::Value;

constexpr const char* kVersionListPath = "/library/VELMORA/asset/qaxV2.plist";
constexpr const char* kDefaultSummaryPath = "/api/v3/coverage/summary";
constexpr const char* kWearablesSummaryPath = "/api/v2/coverage/summary";
constexpr const char* kTokenPath = "/token";
constexpr const char* kAdminScenarioPath = "/admin/scenario";
constexpr const char* kAdminRequestsPath = "/admin/requests";

constexpr const char* kVersionsKey = "@versions";
constexpr const char* kTokenKey = "@token";
constexpr const char* kLookupKey = "@lookup";
constexpr const char* kPurchasesKey = "@purchases";

// The support application the built-in store answers know.
constexpr const char* kSupportBundleId = "com.velmora.support";

constexpr double kHangLimitSeconds = 600;
constexpr std::size_t kHugeChunkBytes = 64 * 1024;
constexpr int kResetAfterBodyMs = 100;

// What a captive portal or a misconfigured proxy answers in place of the service.
constexpr const char* kPortalPage =
    "<!DOCTYPE html>\n<html><head><title>Sign in to this network</title></head>\n"
    "<body><form method=\"post\" action=\"/login\"><input name=\"user\"></form></body></html>\n";
constexpr std::size_t kMaxClockFileBytes = 64 * 1024;

constexpr const char* kJson = "application/json";
constexpr const char* kPlist = "application/x-plist";
constexpr const char* kPlistHeader =
    "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\">";

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

std::string errorJson(const std::string& why) {
    return qax::toJsonString(Value(Value::Dictionary{{"error", why}}));
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

Value builtInLookup(const std::string& bundleId) {
    Value::Array results;
    if (bundleId == kSupportBundleId) {
        results.push_back(Value(Value::Dictionary{
            {"bundleId", kSupportBundleId},
            {"displayName", "Velmora Support"},
            {"artistName", "Velmora"},
            {"artworkURLs",
             Value(Value::Array{
                 "https://marketa.velmora.example/artwork/velmora-support/512x512.png"})},
            {"productPageURL", "https://marketa.velmora.example/app/velmora-support/id1130498044"},
        }));
    }
    return Value(Value::Dictionary{{"results", Value(std::move(results))}});
}

// A name that can stand in a fixture's file name without leaving the fixture directory.
bool isPlainName(const std::string& name) {
    return !name.empty() && name[0] != '.' && name.find('/') == std::string::npos &&
           name.find('\0') == std::string::npos;
}

std::string nestedBody(std::size_t levels, bool plist) {
    std::string out = plist ? kPlistHeader : "";
    out.reserve(out.size() + levels * (plist ? 15 : 2) + 16);
    for (std::size_t i = 0; i < levels; ++i) {
        out += plist ? "<array>" : "[";
    }
    for (std::size_t i = 0; i < levels; ++i) {
        out += plist ? "</array>" : "]";
    }
    return plist ? out + "</plist>" : out;
}

// A well-formed document of exactly `size` bytes (or its frame, when smaller), produced in
// chunks so that gigabytes never sit in memory.
void serveHuge(httplib::Response& res, std::size_t size, bool plist) {
    const std::string prefix = plist ? std::string(kPlistHeader) + "<dict><key>filler</key><string>"
                                     : std::string("{\"filler\":\"");
    const std::string suffix = plist ? "</string></dict></plist>" : "\"}";
    size = std::max(size, prefix.size() + suffix.size());
    res.set_content_provider(
        size, plist ? kPlist : kJson,
        [prefix, suffix, size](std::size_t offset, std::size_t length, httplib::DataSink& sink) {
            std::string chunk(std::min(length, kHugeChunkBytes), 'x');
            for (std::size_t i = 0; i < chunk.size(); ++i) {
                const std::size_t at = offset + i;
                if (at < prefix.size()) {
                    chunk[i] = prefix[at];
                } else if (at >= size - suffix.size()) {
                    chunk[i] = suffix[at - (size - suffix.size())];
                }
            }
            return sink.write(chunk.data(), chunk.size());
        });
}

std::optional<double> clockFileOffset(const std::string& platformRoot) {
    auto bytes =
        qax::readWholeFile((std::filesystem::path(platformRoot) / "state" / "clock.plist").string(),
                           kMaxClockFileBytes);
    auto plist = bytes ? qax::parsePlist(*bytes) : std::nullopt;
    const Value* offset = plist ? plist->find("OffsetSeconds") : nullptr;
    return offset ? offset->asDouble() : std::nullopt;
}

}  // namespace

Simulator::Simulator(Options options) : opt_(std::move(options)) {}

double Simulator::now() const {
    using namespace std::chrono;
    double t =
        duration<double>(system_clock::now().time_since_epoch()).count() + opt_.clockOffsetSeconds;
    if (opt_.simulatedClock && !opt_.platformRoot.empty()) {
        t += clockFileOffset(opt_.platformRoot).value_or(0);
    }
    return t;
}

void Simulator::stop() {
    {
        std::lock_guard lock(stopMutex_);
        stopping_ = true;
    }
    stopped_.notify_all();
}

bool Simulator::pause(int milliseconds) {
    if (milliseconds <= 0) {
        return !stopping_;
    }
    std::unique_lock lock(stopMutex_);
    return !stopped_.wait_for(lock, std::chrono::milliseconds(milliseconds),
                              [this] { return stopping_.load(); });
}

std::string Simulator::fixture(const std::string& name) const {
    return opt_.fixtures.empty() ? std::string()
                                 : (std::filesystem::path(opt_.fixtures) / name).string();
}

std::string Simulator::logPath() const {
    return (std::filesystem::path(opt_.state) / "requests.jsonl").string();
}

void Simulator::install(httplib::Server& server) {
    // Every service endpoint: the configured delay, then the scenario's next answer for
    // `key` or the endpoint's own, then one line in the request log.
    auto serve = [this](auto keyOf, BodyFormat format, auto handler) {
        return [this, keyOf, format, handler](const httplib::Request& req, httplib::Response& res) {
            Value::Dictionary notes;
            pause(opt_.delayMs);
            if (!play(keyOf(req), format, req, res, notes)) {
                handler(req, res, notes);
            }
            record(req, res, std::move(notes));
        };
    };
    auto fixed = [this](const char* key) {
        return [this, key](const httplib::Request&) { return scenario_.next(key); };
    };

    server.Get(kVersionListPath,
               serve(fixed(kVersionsKey), BodyFormat::Plist,
                     [this](const auto&, auto& res, auto&) { versionList(res); }));
    for (const char* path : {kDefaultSummaryPath, kWearablesSummaryPath}) {
        server.Post(path, serve(
                              [this](const httplib::Request& req) {
                                  auto body = qax::parseJson(req.body);
                                  const Value* serial = body ? body->find("serialNumber") : nullptr;
                                  return scenario_.nextForSerial(
                                      serial && serial->asString() ? *serial->asString() : "");
                              },
                              BodyFormat::Json,
                              [this](const auto& req, auto& res, auto& notes) {
                                  summary(req, res, notes);
                              }));
    }
    server.Post(kTokenPath, serve(fixed(kTokenKey), BodyFormat::Json,
                                  [this](const auto& req, auto& res, auto&) { token(req, res); }));
    server.Get(kLookupPath, serve(fixed(kLookupKey), BodyFormat::Json,
                                  [this](const auto& req, auto& res, auto&) { lookup(req, res); }));
    server.Get(kPurchasesPath,
               serve(fixed(kPurchasesKey), BodyFormat::Json,
                     [this](const auto& req, auto& res, auto&) { purchases(req, res); }));

    auto admin = [this](const httplib::Request& req, httplib::Response& res) {
        adminScenario(req, res);
    };
    server.Get(kAdminScenarioPath, admin);
    server.Post(kAdminScenarioPath, admin);
    server.Delete(kAdminScenarioPath, admin);
    server.Get(kAdminRequestsPath, [this](const httplib::Request& req, httplib::Response& res) {
        adminRequests(req, res);
    });
}

bool Simulator::play(const std::optional<ScenarioStep>& step, BodyFormat format,
                     const httplib::Request& req, httplib::Response& res,
                     Value::Dictionary& notes) {
    if (!step) {
        return false;
    }
    notes["scenario"] = step->text;
    const bool plist = format == BodyFormat::Plist;
    if (!pause(step->delayMs)) {
        res.status = 503;
        res.set_content(errorJson("coverage-sim is stopping"), kJson);
        return true;
    }
    using Kind = ScenarioStep::Kind;
    switch (step->kind) {
        case Kind::Normal:
            return false;
        case Kind::Status:
            res.status = step->status;
            res.set_content(errorJson("scenario answer " + std::to_string(step->status)), kJson);
            return true;
        case Kind::Garbage:
            res.set_content("<<< this is not a coverage answer >>>\x01\xff", "text/plain");
            return true;
        case Kind::Html:
            res.set_content(kPortalPage, "text/html; charset=utf-8");
            return true;
        case Kind::Array:
            res.set_content(plist ? *qax::toXmlPlist(Value(Value::Array{"LowServerVersion"}))
                                  : std::string(R"([{"covered":true}])"),
                            plist ? kPlist : kJson);
            return true;
        case Kind::Deep:
            res.set_content(nestedBody(step->size, plist), plist ? kPlist : kJson);
            return true;
        case Kind::Huge:
            serveHuge(res, step->size, plist);
            return true;
        case Kind::Hang:
            waitForPeerToLeave(findAcceptedSocket(port_, req.remote_port), stopping_,
                               kHangLimitSeconds);
            res.status = 504;
            notes["status"] = 0;
            return true;
        case Kind::Reset: {
            const int fd = findAcceptedSocket(port_, req.remote_port);
            if (fd >= 0 && step->size > 0) {
                serveBrokenBody(res, fd, step->size, plist);
                notes["status"] = 0;
                return true;
            }
            if (fd < 0 || !resetConnection(fd)) {
                // Without the socket, the next best thing: headers, then the body breaks off.
                res.set_content_provider(
                    1024, kJson,
                    [](std::size_t, std::size_t, httplib::DataSink&) { return false; });
            }
            notes["status"] = 0;
            return true;
        }
    }
    return false;
}

void Simulator::serveBrokenBody(httplib::Response& res, int fd, std::size_t size, bool plist) {
    const std::string start = plist ? std::string(kPlistHeader) + "<dict><key>filler</key><string>"
                                    : std::string("{\"covered\":true,\"filler\":\"");
    res.set_content_provider(
        size * 2, plist ? kPlist : kJson,
        [this, fd, size, start](std::size_t offset, std::size_t, httplib::DataSink& sink) {
            if (offset < size) {
                std::string chunk(std::min(size - offset, kHugeChunkBytes), 'x');
                for (std::size_t i = 0; i < chunk.size() && offset + i < start.size(); ++i) {
                    chunk[i] = start[offset + i];
                }
                return sink.write(chunk.data(), chunk.size());
            }
            // Give the client time to take in the headers and the start of the body.
            pause(kResetAfterBodyMs);
            resetConnection(fd);
            return false;
        });
}

void Simulator::versionList(httplib::Response& res) {
    auto list = qax::readWholeFile(fixture("qaxV2.plist"));
    std::string body = list ? *list
                            : *qax::toXmlPlist(Value(Value::Dictionary{{"LowServerVersion", 2},
                                                                       {"HighServerVersion", 3}}));
    res.set_content(body, kPlist);
}

void Simulator::summary(const httplib::Request& req, httplib::Response& res,
                        Value::Dictionary& notes) {
    auto fail = [&](int status, const std::string& why) {
        res.status = status;
        res.set_content(errorJson(why), kJson);
        notes["error"] = why;
    };
    auto body = qax::parseJson(req.body);
    const Value* serial = body ? body->find("serialNumber") : nullptr;
    if (!serial || !serial->isString() || !body->find("locale") ||
        !body->find("requestTimestamp") || !body->find("requestTimezone")) {
        return fail(400, "body must hold serialNumber, locale, requestTimestamp, requestTimezone");
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
    const std::string rootPem =
        opt_.attestationRoot.empty() ? "" : qax::readWholeFile(opt_.attestationRoot).value_or("");
    auto verdict = checkAttestation(header("X-Velmora-Kva-S"), header("X-Velmora-Kva"), req.body,
                                    rootPem, now());
    notes["attestation"] =
        verdict.present ? (verdict.valid ? "valid" : "invalid: " + verdict.reason) : "absent";
    if (verdict.present && !verdict.valid) {
        return fail(403, "attestation rejected: " + verdict.reason);
    }
    std::optional<Value> summary;
    const std::string& serialNumber = *serial->asString();
    // A summary in the request's language comes first, so a language change can be followed.
    const Value* locale = body->find("locale");
    const std::string localeSuffix =
        locale->isString() && !locale->asString()->empty() ? "." + *locale->asString() : "";
    for (const std::string& name : {serialNumber + localeSuffix + ".json", serialNumber + ".json",
                                    std::string("default.json")}) {
        if (!isPlainName(name)) {
            continue;
        }
        if (auto text = qax::readWholeFile(fixture("summaries/" + name))) {
            summary = qax::parseJson(*text);
            break;
        }
    }
    Value out = summary ? *summary : builtInSummary();
    expandRelativeDates(out, now());
    res.set_content(qax::toJsonString(out), kJson);
}

void Simulator::token(const httplib::Request& req, httplib::Response& res) {
    auto body = qax::parseJson(req.body);
    if (!body || !body->find("altDSID")) {
        res.status = 400;
        res.set_content(errorJson("altDSID missing"), kJson);
        return;
    }
    res.set_content(qax::toJsonString(Value(Value::Dictionary{{"token", "kf-" + randomHex(16)}})),
                    kJson);
}

void Simulator::lookup(const httplib::Request& req, httplib::Response& res) {
    const std::string bundleId = req.get_param_value("bundleId");
    if (bundleId.empty()) {
        res.status = 400;
        res.set_content(errorJson("bundleId missing"), kJson);
        return;
    }
    // A fixture is served exactly as written, so that broken answers can be tried as well.
    if (isPlainName(bundleId)) {
        if (auto text = qax::readWholeFile(fixture("store/lookup/" + bundleId + ".json"))) {
            res.set_content(*text, kJson);
            return;
        }
    }
    res.set_content(qax::toJsonString(builtInLookup(bundleId)), kJson);
}

void Simulator::purchases(const httplib::Request& req, httplib::Response& res) {
    const std::string account = req.get_param_value("accountId");
    long long accountId = 0;
    std::istringstream accountText(account);
    std::set<std::string> wanted;
    std::istringstream ids(req.get_param_value("bundleIds"));
    for (std::string id; std::getline(ids, id, ',');) {
        if (!id.empty()) {
            wanted.insert(id);
        }
    }
    if (!(accountText >> accountId) || !accountText.eof() || wanted.empty()) {
        res.status = 400;
        res.set_content(errorJson("accountId (an integer) and bundleIds (A,B,...) are required"),
                        kJson);
        return;
    }
    Value::Array records;
    if (auto text = qax::readWholeFile(fixture("store/purchases/" + account + ".json"))) {
        auto parsed = qax::parseJson(*text);
        const Value* list = parsed ? parsed->find("purchases") : nullptr;
        if (!list || !list->isArray()) {
            res.set_content(*text, kJson);  // served as written, like a broken service
            return;
        }
        // The service answers only for the applications asked about.
        for (const auto& record : *list->asArray()) {
            const Value* id = record.find("bundleId");
            if (id && id->asString() && wanted.count(*id->asString())) {
                records.push_back(record);
            }
        }
    }
    res.set_content(qax::toJsonString(Value(Value::Dictionary{{"purchases", Value(records)}})),
                    kJson);
}

void Simulator::adminScenario(const httplib::Request& req, httplib::Response& res) {
    if (req.method == "POST") {
        std::string error;
        auto body = qax::parseJson(req.body, &error);
        if (!body || !scenario_.set(*body, &error)) {
            res.status = 400;
            res.set_content(errorJson(error), kJson);
            return;
        }
    } else if (req.method == "DELETE") {
        scenario_.clear();
    }
    res.set_content(qax::toJsonString(scenario_.remaining()), kJson);
}

void Simulator::adminRequests(const httplib::Request& req, httplib::Response& res) {
    std::size_t since = 0;
    if (req.has_param("since")) {
        std::istringstream(req.get_param_value("since")) >> since;
    }
    std::string text;
    {
        std::lock_guard lock(logMutex_);
        text = qax::readWholeFile(logPath()).value_or("");
    }
    Value::Array entries;
    std::istringstream lines(text);
    std::size_t index = 0;
    for (std::string line; std::getline(lines, line); ++index) {
        if (index >= since) {
            entries.push_back(qax::parseJson(line).value_or(Value(line)));
        }
    }
    res.set_content(qax::toJsonString(Value(std::move(entries))), kJson);
}

void Simulator::record(const httplib::Request& req, const httplib::Response& res,
                       Value::Dictionary notes) {
    Value::Dictionary headers;
    for (const auto& [k, v] : req.headers) {
        headers[k] = v;
    }
    // The parameters of a GET are its query; a POST's would be its form body.
    Value::Dictionary query;
    for (const auto& [k, v] : req.params) {
        if (req.method == "GET") {
            query[k] = v;
        }
    }
    notes["method"] = req.method;
    notes["path"] = req.path;
    if (!query.empty()) {
        notes["query"] = Value(std::move(query));
    }
    if (!notes.count("status")) {
        // The server fills in 200 only after the handler returns.
        notes["status"] = res.status == -1 ? 200 : res.status;
    }
    notes["headers"] = Value(std::move(headers));
    notes["body"] = req.body;
    std::string line = qax::toJsonString(Value(std::move(notes))) + "\n";
    std::lock_guard lock(logMutex_);
    if (FILE* f = std::fopen(logPath().c_str(), "a")) {
        std::fwrite(line.data(), 1, line.size(), f);
        std::fclose(f);
    }
}

}  // namespace coveragesim
