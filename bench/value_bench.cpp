// Cost of the operations that the request path does most: copying Values (a reference count, never the contents)
// and looking keys up in dictionaries of realistic and large sizes.

#include <benchmark/benchmark.h>

#include <string>

#include "bexil/Value.h"

namespace {

using bexil::MutableDictionary;
using bexil::Value;

Value makeDictionary(int entries) {
    MutableDictionary d;
    for (int i = 0; i < entries; ++i) d.set("com.example.key-" + std::to_string(i), Value::int64(i));
    return d.take();
}

void BM_CopyScalar(benchmark::State& state) {
    Value v = Value::int64(42);
    for (auto _ : state) {
        Value copy = v;
        benchmark::DoNotOptimize(copy);
    }
}
BENCHMARK(BM_CopyScalar);

void BM_CopyDictionary(benchmark::State& state) {
    Value v = makeDictionary(static_cast<int>(state.range(0)));
    for (auto _ : state) {
        Value copy = v;
        benchmark::DoNotOptimize(copy);
    }
}
BENCHMARK(BM_CopyDictionary)->Arg(16)->Arg(10000);

void BM_DictionaryLookup(benchmark::State& state) {
    const int n = static_cast<int>(state.range(0));
    Value v = makeDictionary(n);
    std::vector<std::string> keys;
    for (int i = 0; i < 64; ++i) keys.push_back("com.example.key-" + std::to_string((i * 7919) % n));
    size_t k = 0;
    for (auto _ : state) {
        const Value* found = v.find(keys[k++ & 63]);
        benchmark::DoNotOptimize(found);
    }
}
BENCHMARK(BM_DictionaryLookup)->Arg(16)->Arg(1000)->Arg(100000);

void BM_DictionaryChangeOneKey(benchmark::State& state) {
    Value v = makeDictionary(static_cast<int>(state.range(0)));
    for (auto _ : state) {
        MutableDictionary d(v);
        d.set("com.example.key-1", Value::int64(-1));
        Value changed = d.take();
        benchmark::DoNotOptimize(changed);
    }
}
BENCHMARK(BM_DictionaryChangeOneKey)->Arg(16)->Arg(10000);

void BM_ValueEqualityAcrossKinds(benchmark::State& state) {
    Value a = Value::int64(1), b = Value::real(1.0);
    for (auto _ : state) benchmark::DoNotOptimize(a == b);
}
BENCHMARK(BM_ValueEqualityAcrossKinds);

}  // namespace

BENCHMARK_MAIN();
