// Cost of the Zem value encoding on the two shapes that dominate traffic: a typical request (about 200 bytes)
// and a discovery reply (100 plug-in forms of 15 keys). Encoding reuses one output buffer, as a connection does.

#include <benchmark/benchmark.h>

#include <string>
#include <vector>

#include "platform/zem/ZemCodec.h"
#include "platform/zem/ZemFrame.h"
#include "platform/zem/ZemFrameReader.h"

namespace {

using namespace bexil;

Value typicalRequest() {
    return Value::dictionary({
        {"request", Value::string("match")},
        {"version", Value::uint64(3)},
        {"flags", Value::uint64(0)},
        {"rules", Value::dictionary({
                      {"RZExtensionPointIdentifier", Value::string("com.example.greeting")},
                      {"RZExtensionActivationRule",
                       Value::dictionary({{"attachments", Value::array({Value::string("image/png")})}})},
                      {"BDBundleIdentifier", Value::string("com.example.greeter.*")},
                  })},
        {"uuids", Value::array({Value::uuid(Uuid::random()), Value::uuid(Uuid::random())})},
    });
}

Value discoveryReply() {
    std::vector<Value> forms;
    for (int i = 0; i < 100; ++i) {
        std::string id = "com.example.app" + std::to_string(i) + ".extension";
        forms.push_back(Value::dictionary({
            {"uuid", Value::uuid(Uuid::random())},
            {"identifier", Value::string(id)},
            {"path", Value::string("/usr/share/apps/App" + std::to_string(i) + ".app/PlugIns/Ext.appex")},
            {"version", Value::string("1.2." + std::to_string(i))},
            {"shortVersion", Value::string("1.2")},
            {"point", Value::string("com.example.greeting")},
            {"protocol", Value::string("GreetingProtocol")},
            {"principal", Value::string("GreetingProvider")},
            {"sdk", Value::string("com.example.greeting")},
            {"registered", Value::date(Date{1.7e9 + i})},
            {"containingApp", Value::string("/usr/share/apps/App" + std::to_string(i) + ".app")},
            {"annotation", Value::dictionary({{"election", Value::int64(1)}})},
            {"extensions", Value::dictionary({{".", Value::string(std::string(64, 'a' + i % 26))}})},
            {"attributes",
             Value::dictionary({{"RZExtensionActivationRule", Value::dictionary({{"image/png", Value::int64(4)},
                                                                                 {"text/plain", Value::int64(1)}})}})},
            {"flags", Value::uint64(static_cast<uint64_t>(i) * 977)},
        }));
    }
    return Value::dictionary({{"matches", Value::array(std::move(forms))}});
}

void encode(benchmark::State& state, const Value& value) {
    std::vector<uint8_t> out;
    for (auto _ : state) {
        out.clear();
        if (ZemCodec::encode(value, out)) state.SkipWithError("encode failed");
        benchmark::DoNotOptimize(out.data());
    }
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * out.size()));
    state.counters["bytes"] = static_cast<double>(out.size());
}

void decode(benchmark::State& state, const Value& value) {
    std::vector<uint8_t> bytes = ZemCodec::encode(value).value();
    for (auto _ : state) {
        Result<Value> v = ZemCodec::decode(bytes);
        if (!v) state.SkipWithError("decode failed");
        benchmark::DoNotOptimize(v);
    }
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * bytes.size()));
    state.counters["bytes"] = static_cast<double>(bytes.size());
}

void BM_EncodeRequest(benchmark::State& state) { encode(state, typicalRequest()); }
void BM_DecodeRequest(benchmark::State& state) { decode(state, typicalRequest()); }
void BM_EncodeDiscoveryReply(benchmark::State& state) { encode(state, discoveryReply()); }
void BM_DecodeDiscoveryReply(benchmark::State& state) { decode(state, discoveryReply()); }

// A request frame end to end: encode it, cut it out of the stream, decode its payload.
void BM_RequestFrameRoundTrip(benchmark::State& state) {
    Value request = typicalRequest();
    std::vector<uint8_t> out;
    ZemFrameReader reader;
    uint64_t serial = 0;
    for (auto _ : state) {
        out.clear();
        if (ZemFrame::encode(ZemFrameKind::Request, ++serial, 0, request, out)) state.SkipWithError("encode failed");
        if (reader.feed(out)) state.SkipWithError("reader failed");
        Result<Value> v = reader.next()->decodePayload();
        benchmark::DoNotOptimize(v);
    }
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * out.size()));
}

BENCHMARK(BM_EncodeRequest);
BENCHMARK(BM_DecodeRequest);
BENCHMARK(BM_EncodeDiscoveryReply);
BENCHMARK(BM_DecodeDiscoveryReply);
BENCHMARK(BM_RequestFrameRoundTrip);

}  // namespace

BENCHMARK_MAIN();
