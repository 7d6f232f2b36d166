// The download against a real local HTTPS coverage service: endpoints, signed attempts and
// their retries, local files, the version gate, the cache and the conversion outreach rule.
#include "warranty/QAXWarrantyDownloader.h"

#include <gtest/gtest.h>

#include <deque>
#include <tuple>

#include "core/AsioDispatcher.h"
#include "core/Hash.h"
#include "core/JsonCodec.h"
#include "core/PlistCodec.h"
#include "fakes/Await.h"
#include "fakes/FakeAccounts.h"
#include "fakes/FakeAgentFactory.h"
#include "fakes/TestHttpsServer.h"
#include "fakes/TestPlatform.h"
#include "platform/PreferenceStore.h"
#include "platform/QAXSettings.h"
#include "platform/host/CurlHttpClient.h"
#include "platform/host/HostAttestationService.h"
#include "scheduling/QAXSchedulerActivityDelegate.h"
#include "warranty/QAXWarranty.h"

namespace qax {
namespace {

constexpr const char* kListPath = "/library/VELMORA/asset/qaxV2.plist";
constexpr const char* kPhonePath = "/api/v3/coverage/summary";
constexpr const char* kWearablePath = "/api/v2/coverage/summary";
constexpr const char* kThisDevice = "C02TESTSERIAL";  // the fake device's serial number
constexpr const char* kFailed = "qaxagent failed to load warranty";
constexpr const char* kCaller = "com.example.caller";

Value versionList(int low, int high) {
    return Value::Dictionary{{"LowServerVersion", low}, {"HighServerVersion", high}};
}

class QAXWarrantyDownloaderTest : public ::testing::Test {
  protected:
    using Answer = test::TestHttpsServer::Answer;
    struct Result {
        bool success = false;
        std::shared_ptr<QAXWarranty> warranty;
    };

    QAXWarrantyDownloaderTest() {
        server.answer(kListPath, {});
        serveList(versionList(2, 3));
        server.answer(kPhonePath, {200, summaryText_});
        server.answer(kWearablePath, {200, summaryText_});
        server.start();
        server.trustIn(tp.platform->platformRoot);

        dispatcher = std::make_shared<AsioDispatcher>(2, 2);
        tp.platform->dispatcher = dispatcher;
        tp.platform->http = std::make_shared<CurlHttpClient>(
            CurlHttpClient::optionsForPlatformRoot(tp.platform->platformRoot));
        accounts = std::make_shared<test::FakeAccountStore>();
        tp.platform->accounts = accounts;
        tp.platform->identity = std::make_shared<test::FakeIdentityAccountManager>();
        tp.platform->attestation = std::make_shared<HostAttestationService>(
            tp.platform->platformRoot, tp.platform->deviceProperties, tp.clock);

        qax_registerDefaults(prefs());
        prefs().setObject(settings::kServerVersionURL, server.url(kListPath));
        prefs().setObject(settings::kWarrantyURL, server.url(kPhonePath));
        prefs().setObject(settings::kWearablesWarrantyURL, server.url(kWearablePath));
    }
    ~QAXWarrantyDownloaderTest() override { dispatcher->shutdown(); }

    PreferenceStore& prefs() { return *tp.platform->preferences; }
    test::FakeAgentFactory& factory() {
        return static_cast<test::FakeAgentFactory&>(*tp.platform->agentFactory);
    }

    // The answers to this device's next summary requests.
    void script(std::deque<Answer> answers) { server.queue(kPhonePath, std::move(answers)); }
    void serveList(Value list, int status = 200) {
        server.setAnswer(kListPath,
                         {status, status == 200 ? *toXmlPlist(list) : "", "application/x-plist"});
    }
    // The summary requests.
    std::vector<test::TestHttpsServer::Request> received() {
        auto all = server.requests();
        std::erase_if(all, [](const auto& r) { return r.method != "POST"; });
        return all;
    }

    Result download(const std::string& serial) {
        return test::await<Result>(
            [&](auto done) {
                QAXWarrantyDownloader::initWithCallingProcessBundleID(tp.platform, kCaller)
                    ->downloadWarrantyForSerialNumber(serial, [done](bool ok, auto w) {
                        done({ok, std::move(w)});
                    });
            },
            30);
    }

    // A cached warranty with its three keys, as an earlier download leaves them.
    struct CacheState {
        std::optional<Value> file;
        std::optional<Value> date, locale, version;
        bool operator==(const CacheState&) const = default;
    };
    CacheState cacheState(const std::string& serial) {
        auto cached = QAXWarranty::cachedWarrantyForSerialNumber(tp.platform, serial);
        const std::string h = sha256Hash(serial);
        return {cached ? std::optional<Value>(cached->dictionaryRepresentation()) : std::nullopt,
                prefs().objectForKey(h + "_CachedWarrantyLastUpdatedDate"),
                prefs().objectForKey(h + "_CachedWarrantyLocale"),
                prefs().objectForKey(h + "_CachedWarrantyVersion")};
    }
    CacheState seedCache(const std::string& serial) {
        QAXWarranty::warrantyWithDictionary(tp.platform, Value::Dictionary{{"old", true}})
            ->cacheWarranty(serial);
        const std::string h = sha256Hash(serial);
        prefs().setObject(h + "_CachedWarrantyLastUpdatedDate", Value(Date(1000)));
        prefs().setObject(h + "_CachedWarrantyLocale", "fr_FR");
        prefs().setObject(h + "_CachedWarrantyVersion", "1");
        return cacheState(serial);
    }

  protected:
    const Value summary{Value::Dictionary{{"covered", true}, {"coverageLocalizedLabel", "Cov"}}};
    const std::string summaryText_ = toJsonString(summary);
    test::TestHttpsServer server;
    test::TestPlatform tp;
    std::shared_ptr<AsioDispatcher> dispatcher;
    std::shared_ptr<test::FakeAccountStore> accounts;
};

TEST_F(QAXWarrantyDownloaderTest, OnlyUnauthorizedIsRetriedAndFailuresKeepTheCache) {
    std::string deep = "{\"a\":";
    for (int i = 0; i < 200; ++i) {
        deep += "[";
    }
    deep += std::string(200, ']') + "}";
    const Answer unauthorized{401, "{}"};
    const std::tuple<const char*, std::deque<Answer>, std::size_t, bool> rows[] = {
        {"401, 401, 200", {unauthorized, unauthorized, {200, summaryText_}}, 3, true},
        {"three 401s", {unauthorized, unauthorized, unauthorized, {200, summaryText_}}, 3, false},
        {"500 is not retried", {{500, summaryText_}, {200, summaryText_}}, 1, false},
        {"a JSON array", {{200, "[1,2]"}}, 1, false},
        {"not JSON", {{200, "<html>busy</html>"}}, 1, false},
        {"nested too deep", {{200, deep}}, 1, false},
        {"200 without a body", {{200, ""}}, 1, false},
    };
    for (const auto& [name, answers, attempts, success] : rows) {
        SCOPED_TRACE(name);
        const CacheState before = seedCache(kThisDevice);
        const auto renewalsBefore = accounts->renewals().size();
        const auto postsBefore = received().size();
        tp.log->clear();
        script(answers);

        Result result = download(kThisDevice);
        EXPECT_EQ(result.success, success);
        EXPECT_EQ(received().size() - postsBefore, attempts);
        // Every attempt after the first is signed with a freshly provisioned token.
        EXPECT_EQ(accounts->renewals().size() - renewalsBefore, attempts - 1);
        if (success) {
            ASSERT_TRUE(result.warranty);
            EXPECT_EQ(result.warranty->dictionaryRepresentation(), summary);
            const CacheState after = cacheState(kThisDevice);
            EXPECT_EQ(after.file, summary);
            EXPECT_EQ(after.date, Value(tp.clock->now()));
            EXPECT_EQ(after.locale, Value("en_US"));
            EXPECT_EQ(after.version, Value("2"));
            EXPECT_EQ(received().back().headers.find("X-Velmora-KF-Token")->second,
                      "renewed-token");
        } else {
            EXPECT_FALSE(result.warranty);
            EXPECT_EQ(cacheState(kThisDevice), before);
            EXPECT_EQ(tp.log->count(kFailed), 1);
        }
    }
}

TEST_F(QAXWarrantyDownloaderTest, AnUnwritableCacheLeavesTheKeysAlone) {
    const CacheState before = seedCache(kThisDevice);
    // A directory where the new file would be renamed to: the write fails, the old keys must
    // not start describing a file that was never written.
    const auto path = QAXWarranty::_warrantyPathForSerialNumberFormat(*tp.platform);
    std::string file = path;
    file.replace(file.rfind("%@"), 2, sha256Hash(kThisDevice));
    std::filesystem::remove(file);
    std::filesystem::create_directories(std::filesystem::path(file) / "occupied");
    script({{200, summaryText_}});

    EXPECT_TRUE(download(kThisDevice).success);
    const CacheState after = cacheState(kThisDevice);
    EXPECT_EQ(std::tie(after.date, after.locale, after.version),
              std::tie(before.date, before.locale, before.version));
}

TEST_F(QAXWarrantyDownloaderTest, NothingIsSentForAnUnsupportedServerOrAnUnsignedRequest) {
    constexpr const char* kSkipped = "Warranty download skipped server due to server version";
    const CacheState before = seedCache("WATCH-1");

    serveList(versionList(5, 6));
    Result skipped = download("WATCH-1");
    EXPECT_FALSE(skipped.success);
    EXPECT_TRUE(received().empty());
    EXPECT_EQ(tp.log->count(kSkipped), 1);
    EXPECT_EQ(cacheState("WATCH-1"), before);

    // The stored list is dropped first: when the fetch fails, the agent's own versions decide,
    // not the unsupported list cached above.
    serveList(versionList(5, 6), 503);
    EXPECT_TRUE(download("WATCH-1").success);
    EXPECT_EQ(received().size(), 1u);
    EXPECT_EQ(tp.log->count(kSkipped), 1);

    // A request that cannot be signed is not sent.
    accounts->primary = nullptr;
    const CacheState signedOut = seedCache("WATCH-1");
    EXPECT_FALSE(download("WATCH-1").success);
    EXPECT_EQ(received().size(), 1u);
    EXPECT_EQ(tp.log->count("Unable to load sign request, failing warranty download"), 1);
    EXPECT_EQ(cacheState("WATCH-1"), signedOut);
}

TEST_F(QAXWarrantyDownloaderTest, LocalFilesPreferThePerSerialFile) {
    const auto dir = tp.home.path() / "local dir";
    const std::string base = "file://" + (dir / "w.plist").string();
    const std::string baseEscaped =
        "file://" + (tp.home.path() / "local%20dir" / "w.plist").string();
    const std::string perSerial = "file://" + (dir / "w.WATCH-1.plist").string();
    const Value fromBase(Value::Dictionary{{"source", "base"}});
    const Value fromSerial(Value::Dictionary{{"source", "serial"}});
    std::filesystem::create_directories(tp.home.path() / "a directory.plist");

    struct Row {
        const char* name;
        std::string url;
        std::optional<Value> baseFile, serialFile;
        std::string rawBase;  // written when no base value is given
        std::optional<Value> expected;
        std::string message;
    };
    const std::string aDirectory = "file://" + (tp.home.path() / "a directory.plist").string();
    // clang-format off
    const Row rows[] = {
        {"both files", base, fromBase, fromSerial, "", fromSerial,
         "loading warranty from: " + perSerial},
        {"escaped URL", baseEscaped, fromBase, fromSerial, "", fromSerial, ""},
        {"only the shared file", base, fromBase, std::nullopt, "", fromBase,
         "loading warranty from: " + base},
        {"no file", base, std::nullopt, std::nullopt, "", std::nullopt,
         "URL '" + base + "' contains no plist data"},
        {"a directory", aDirectory, std::nullopt, std::nullopt, "", std::nullopt,
         "contains no plist data"},
        {"not a property list", base, std::nullopt, std::nullopt, "{\"json\": true}", std::nullopt,
         "Error serializing plist file from URL '" + base + "': "},
        {"an array", base, Value::Array{1, 2}, std::nullopt, "", std::nullopt, kFailed},
    };
    // clang-format on
    for (const auto& row : rows) {
        SCOPED_TRACE(row.name);
        std::filesystem::remove_all(dir);
        if (row.baseFile) {
            test::writeFile(dir / "w.plist", *toXmlPlist(*row.baseFile));
        } else if (!row.rawBase.empty()) {
            test::writeFile(dir / "w.plist", row.rawBase);
        }
        if (row.serialFile) {
            test::writeFile(dir / "w.WATCH-1.plist", *toXmlPlist(*row.serialFile));
        }
        prefs().setObject(settings::kWearablesWarrantyURL, row.url);
        const CacheState before = seedCache("WATCH-1");
        tp.log->clear();

        Result result = download("WATCH-1");
        EXPECT_EQ(result.success, row.expected.has_value());
        if (!row.message.empty()) {
            EXPECT_EQ(tp.log->countContaining(row.message), 1);
        }
        if (row.expected) {
            EXPECT_EQ(cacheState("WATCH-1").file, row.expected);
        } else {
            EXPECT_EQ(cacheState("WATCH-1"), before);
            EXPECT_EQ(tp.log->count(kFailed), 1);
        }
    }
    EXPECT_TRUE(received().empty());
}

TEST_F(QAXWarrantyDownloaderTest, ConversionOutreachMovesOnlyEarlier) {
    constexpr const char* kScheduledKey = "ConversionOutreachScheduledDate";
    auto record = [this](std::optional<double> conversion) {
        Value d(Value::Dictionary{{"covered", true}});
        if (conversion) {
            d["hvOfferConversionDate"] = *conversion;
        }
        return QAXWarranty::warrantyWithDictionary(tp.platform, d);
    };
    const double D = 1'800'000'000;
    // clang-format off
    // The cached conversion date (outer none: nothing cached), the new one, the date scheduled
    // before, whether the run schedules, and its message.
    const std::tuple<const char*, std::optional<std::optional<double>>, std::optional<double>, std::optional<double>, bool, const char*> rows[] = {
        {"first date", std::nullopt, D, std::nullopt, true, "scheduling conversion outreach"},
        {"unchanged", std::optional<double>(D), D, std::nullopt, false, nullptr},
        {"previous had none", std::optional<double>(), D, std::nullopt, false, nullptr},
        {"new has none", std::nullopt, std::nullopt, std::nullopt, false, nullptr},
        {"later than scheduled", std::nullopt, D, D - 60, false, nullptr},
        {"same as scheduled", std::optional<double>(D - 5), D, D, false, nullptr},
        {"earlier than scheduled", std::optional<double>(D + 5), D, D + 60, true,
         "Re-scheduling conversion outreach"},
    };
    // clang-format on
    for (const auto& [name, previous, next, scheduled, schedules, message] : rows) {
        SCOPED_TRACE(name);
        if (scheduled) {
            prefs().setObject(kScheduledKey, Value(Date(*scheduled)));
        } else {
            prefs().removeObject(kScheduledKey);
        }
        const auto before = factory().schedulings().size();
        tp.log->clear();
        auto downloader =
            QAXWarrantyDownloader::initWithCallingProcessBundleID(tp.platform, kCaller);
        downloader->_scheduleConversionOutreachIfRequiredForWarranty(
            record(next), previous ? record(*previous) : nullptr);

        auto schedulings = factory().schedulings();
        ASSERT_EQ(schedulings.size() - before, schedules ? 1u : 0u);
        if (schedules) {
            EXPECT_EQ(schedulings.back().identifier, kQAXConversionOutreachActivityIdentifier);
            EXPECT_EQ(schedulings.back().date, Date(D));
            EXPECT_EQ(prefs().dateForKey(kScheduledKey), Date(D));
            EXPECT_EQ(tp.log->count(std::string(message) + " " + Date(D).description()), 1);
        } else {
            EXPECT_EQ(prefs().dateForKey(kScheduledKey),
                      scheduled ? std::optional<Date>(Date(*scheduled)) : std::nullopt);
        }
    }
}

}  // namespace
}  // namespace qax
