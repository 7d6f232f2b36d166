// Cost of building a warranty record from a realistic coverage summary, and of reading the
// values derived on every read (day count and the three localized offer texts).
#include <benchmark/benchmark.h>

#include <fstream>
#include <map>
#include <mutex>
#include <sstream>

#include "core/Clock.h"
#include "core/JsonCodec.h"
#include "core/Log.h"
#include "platform/LocaleInfo.h"
#include "platform/Platform.h"
#include "platform/PreferenceStore.h"
#include "platform/QAXSettings.h"
#include "warranty/QAXWarranty.h"

namespace {

using qax::Value;

class MemoryPreferences : public qax::PreferenceStore {
  public:
    void registerDefaults(const Value::Dictionary& defaults) override {
        std::lock_guard<std::mutex> lock(mutex_);
        defaults_ = defaults;
    }
    std::optional<Value> objectForKey(std::string_view key) override {
        std::lock_guard<std::mutex> lock(mutex_);
        if (auto it = defaults_.find(key); it != defaults_.end()) {
            return it->second;
        }
        return std::nullopt;
    }
    bool setObject(std::string_view, const Value&) override { return false; }
    bool removeObject(std::string_view) override { return false; }
    std::vector<std::string> allKeys() override { return {}; }

  private:
    std::mutex mutex_;
    Value::Dictionary defaults_;
};

class FixedLocale : public qax::LocaleInfo {
  public:
    explicit FixedLocale(std::string id) : id_(std::move(id)) {}
    std::string preferredLocaleIdentifier() override { return id_; }
    std::optional<std::string> preferredContentSizeCategory() override { return std::nullopt; }

  private:
    std::string id_;
};

class NullSink : public qax::LogSink {
  public:
    void write(qax::LogLevel, std::string_view, std::string_view, std::string_view) override {}
    bool isEnabled(qax::LogLevel) const override { return false; }
    bool showsPrivate() const override { return false; }
};

std::string summaryText() {
    std::ifstream in(QAX_BENCH_DATA_DIR "/coverage-summary.json", std::ios::binary);
    std::ostringstream ss;
    ss << in.rdbuf();
    return ss.str();
}

// The sample's offer ends on 2024-01-14: with the clock on 2023-11-14 the plural texts, and
// so the locale's number formatting, are on the path.
std::shared_ptr<qax::Platform> benchPlatform(const char* locale) {
    qax::qaxLog().setSink(std::make_shared<NullSink>());
    auto p = std::make_shared<qax::Platform>();
    p->clock = std::make_shared<qax::ManualClock>(qax::Date(1'700'000'000.0));
    p->preferences = std::make_shared<MemoryPreferences>();
    qax::qax_registerDefaults(*p->preferences);
    p->locale = std::make_shared<FixedLocale>(locale);
    return p;
}

void BM_ParseSummaryJson(benchmark::State& state) {
    const std::string text = summaryText();
    for (auto _ : state) {
        benchmark::DoNotOptimize(qax::parseJson(text));
    }
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * text.size()));
}
BENCHMARK(BM_ParseSummaryJson);

void BM_BuildWarrantyFromDictionary(benchmark::State& state) {
    auto platform = benchPlatform("en_US");
    const auto summary = qax::parseJson(summaryText());
    for (auto _ : state) {
        benchmark::DoNotOptimize(qax::QAXWarranty::warrantyWithDictionary(platform, summary));
    }
}
BENCHMARK(BM_BuildWarrantyFromDictionary);

void BM_BuildWarrantyFromJsonText(benchmark::State& state) {
    auto platform = benchPlatform("en_US");
    const std::string text = summaryText();
    for (auto _ : state) {
        benchmark::DoNotOptimize(
            qax::QAXWarranty::warrantyWithDictionary(platform, qax::parseJson(text)));
    }
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * text.size()));
}
BENCHMARK(BM_BuildWarrantyFromJsonText);

void BM_DaysEligible(benchmark::State& state) {
    auto warranty = qax::QAXWarranty::warrantyWithDictionary(benchPlatform("en_US"),
                                                             qax::parseJson(summaryText()));
    for (auto _ : state) {
        benchmark::DoNotOptimize(warranty->daysEligible());
    }
}
BENCHMARK(BM_DaysEligible);

// The three offer texts, as a follow-up is built from them.
void BM_OfferTexts(benchmark::State& state, const char* locale) {
    auto warranty = qax::QAXWarranty::warrantyWithDictionary(benchPlatform(locale),
                                                             qax::parseJson(summaryText()));
    for (auto _ : state) {
        benchmark::DoNotOptimize(warranty->hvLocalizedOfferDesc());
        benchmark::DoNotOptimize(warranty->hvLocalizedNotificationOfferDesc());
        benchmark::DoNotOptimize(warranty->hvLocalizedOfferDetailsEligibility());
    }
}
BENCHMARK_CAPTURE(BM_OfferTexts, en_US, "en_US");
BENCHMARK_CAPTURE(BM_OfferTexts, fr_FR, "fr_FR");

// Two locales in turn: every read makes a new number formatter.
void BM_OfferTextsAlternatingLocales(benchmark::State& state) {
    auto english = qax::QAXWarranty::warrantyWithDictionary(benchPlatform("en_US"),
                                                            qax::parseJson(summaryText()));
    auto german = qax::QAXWarranty::warrantyWithDictionary(benchPlatform("de_DE"),
                                                           qax::parseJson(summaryText()));
    for (auto _ : state) {
        benchmark::DoNotOptimize(english->hvLocalizedOfferDesc());
        benchmark::DoNotOptimize(german->hvLocalizedOfferDesc());
    }
}
BENCHMARK(BM_OfferTextsAlternatingLocales);

void BM_ArchiveRoundTrip(benchmark::State& state) {
    auto platform = benchPlatform("en_US");
    auto warranty =
        qax::QAXWarranty::warrantyWithDictionary(platform, qax::parseJson(summaryText()));
    for (auto _ : state) {
        benchmark::DoNotOptimize(qax::QAXWarranty::decode(platform, warranty->encode()));
    }
}
BENCHMARK(BM_ArchiveRoundTrip);

}  // namespace
