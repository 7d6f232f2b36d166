// Codec and digest costs on a realistic coverage summary (bench/data/coverage-summary.json).
#include <benchmark/benchmark.h>

#include <cstdlib>
#include <string>

#include "core/AtomicFile.h"
#include "core/Hash.h"
#include "core/JsonCodec.h"
#include "core/PlistCodec.h"

namespace {

const std::string& summaryJson() {
    static const std::string text = [] {
        auto t = qax::readWholeFile(QAX_BENCH_DATA_DIR "/coverage-summary.json");
        if (!t) {
            std::abort();
        }
        return *t;
    }();
    return text;
}

const qax::Value& summaryValue() {
    static const qax::Value v = *qax::parseJson(summaryJson());
    return v;
}

void BM_ParseJson(benchmark::State& state) {
    for (auto _ : state) {
        benchmark::DoNotOptimize(qax::parseJson(summaryJson()));
    }
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * summaryJson().size()));
}
BENCHMARK(BM_ParseJson);

void BM_ParsePlistXml(benchmark::State& state) {
    const std::string xml = *qax::toXmlPlist(summaryValue());
    for (auto _ : state) {
        benchmark::DoNotOptimize(qax::parsePlist(xml));
    }
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * xml.size()));
    state.counters["bytes"] = static_cast<double>(xml.size());
}
BENCHMARK(BM_ParsePlistXml);

void BM_ParsePlistBinary(benchmark::State& state) {
    const std::string bin = *qax::toBinaryPlist(summaryValue());
    for (auto _ : state) {
        benchmark::DoNotOptimize(qax::parsePlist(bin));
    }
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * bin.size()));
    state.counters["bytes"] = static_cast<double>(bin.size());
}
BENCHMARK(BM_ParsePlistBinary);

void BM_PrescanOnly(benchmark::State& state) {
    const std::string xml = *qax::toXmlPlist(summaryValue());
    for (auto _ : state) {
        benchmark::DoNotOptimize(qax::plistStructureIsSafe(xml));
    }
}
BENCHMARK(BM_PrescanOnly);

void BM_ValueToXmlPlist(benchmark::State& state) {
    for (auto _ : state) {
        benchmark::DoNotOptimize(qax::toXmlPlist(summaryValue()));
    }
}
BENCHMARK(BM_ValueToXmlPlist);

void BM_ValueToBinaryPlist(benchmark::State& state) {
    for (auto _ : state) {
        benchmark::DoNotOptimize(qax::toBinaryPlist(summaryValue()));
    }
}
BENCHMARK(BM_ValueToBinaryPlist);

void BM_ValueToJsonText(benchmark::State& state) {
    for (auto _ : state) {
        benchmark::DoNotOptimize(qax::toJsonString(summaryValue()));
    }
}
BENCHMARK(BM_ValueToJsonText);

void BM_ValueCopyAndCompare(benchmark::State& state) {
    for (auto _ : state) {
        qax::Value copy = summaryValue();
        benchmark::DoNotOptimize(copy == summaryValue());
    }
}
BENCHMARK(BM_ValueCopyAndCompare);

void BM_Sha256Hash(benchmark::State& state) {
    const std::string serial = "C02ZK0ABCDEF";
    for (auto _ : state) {
        benchmark::DoNotOptimize(qax::sha256Hash(serial));
    }
}
BENCHMARK(BM_Sha256Hash);

}  // namespace
