// The IPC hot path's own costs: decoding a request frame, and encoding replies (a device, and
// three device infos with their coverage summaries) with the stream's writer and with the
// general codec's, for comparison.
#include <benchmark/benchmark.h>

#include <cstdlib>
#include <string>

#include "core/AtomicFile.h"
#include "core/JsonCodec.h"
#include "core/PlistCodec.h"
#include "platform/host/BinaryPlistWriter.h"
#include "platform/host/IpcFrameCodec.h"

namespace {

using qax::Value;

Value device(const std::string& serial) {
    return Value(Value::Dictionary{{"$class", "QAXDevice"},
                                   {"name", "Watch"},
                                   {"serialNumber", serial},
                                   {"activationDate", qax::Date(1700000000)},
                                   {"deviceType", Value(2)}});
}

const Value& deviceReply() {
    static const Value v(Value::Dictionary{{"id", Value(1)}, {"reply", device("C02LOAD00001")}});
    return v;
}

// Three device infos, each with the realistic summary of bench/data.
const Value& allDeviceInfosReply() {
    static const Value v = [] {
        auto text = qax::readWholeFile(QAX_BENCH_DATA_DIR "/coverage-summary.json");
        if (!text) {
            std::abort();
        }
        const Value summary = *qax::parseJson(*text);
        Value::Array infos;
        for (const char* serial : {"C02LOAD00001", "W7LOAD000001", "W7LOAD000002"}) {
            infos.emplace_back(Value::Dictionary{
                {"$class", "QAXDeviceInfo"},
                {"device", device(serial)},
                {"warranty", Value(Value::Dictionary{{"$class", "QAXWarranty"},
                                                     {"DictionaryRepresentation", summary}})}});
        }
        return Value(Value::Dictionary{{"id", Value(1)}, {"reply", Value(std::move(infos))}});
    }();
    return v;
}

void BM_EncodeDeviceReplyWithStreamWriter(benchmark::State& state) {
    for (auto _ : state) {
        benchmark::DoNotOptimize(qax::IpcFrameCodec::encode(deviceReply()));
    }
}
BENCHMARK(BM_EncodeDeviceReplyWithStreamWriter);

void BM_EncodeDeviceReplyWithGeneralCodec(benchmark::State& state) {
    for (auto _ : state) {
        benchmark::DoNotOptimize(qax::toBinaryPlist(deviceReply()));
    }
}
BENCHMARK(BM_EncodeDeviceReplyWithGeneralCodec);

void BM_EncodeAllDeviceInfosWithStreamWriter(benchmark::State& state) {
    for (auto _ : state) {
        benchmark::DoNotOptimize(qax::IpcFrameCodec::encode(allDeviceInfosReply()));
    }
}
BENCHMARK(BM_EncodeAllDeviceInfosWithStreamWriter);

void BM_EncodeAllDeviceInfosWithGeneralCodec(benchmark::State& state) {
    for (auto _ : state) {
        benchmark::DoNotOptimize(qax::toBinaryPlist(allDeviceInfosReply()));
    }
}
BENCHMARK(BM_EncodeAllDeviceInfosWithGeneralCodec);

void BM_DecodeRequestFrame(benchmark::State& state) {
    const std::string frame = *qax::IpcFrameCodec::encode(
        Value(Value::Dictionary{{"id", Value(1)},
                                {"op", "getAllDeviceInfosUsingPolicy:updateFollowUps:withReply:"},
                                {"args", Value(Value::Array{Value(1), Value(false)})}}));
    for (auto _ : state) {
        qax::IpcFrameCodec decoder;
        decoder.append(frame);
        std::string_view payload;
        decoder.next(payload);
        benchmark::DoNotOptimize(qax::parsePlist(payload));
    }
}
BENCHMARK(BM_DecodeRequestFrame);

}  // namespace
