// Cost of a plug-in record's life in a discovery reply: set up from a realistic information dictionary, export the
// form, read it back on the client side. Reports time per record and heap allocations per record (counted by the
// global operator new below), and the same for each step alone so a regression points at its step.

#include <benchmark/benchmark.h>

#include <atomic>
#include <cstdlib>
#include <new>

#include "model/BXPlugInCore.h"

namespace {

std::atomic<uint64_t> gAllocations{0};

}  // namespace

// The replacements stay out of line: inlined into callers, g++ would pair the malloc/free inside them with the
// new/delete expressions outside and report a mismatch that is not there.
__attribute__((noinline)) void* operator new(std::size_t size) {
    gAllocations.fetch_add(1, std::memory_order_relaxed);
    if (void* p = std::malloc(size == 0 ? 1 : size)) return p;
    throw std::bad_alloc();
}
__attribute__((noinline)) void* operator new[](std::size_t size) { return operator new(size); }
__attribute__((noinline)) void operator delete(void* p) noexcept { std::free(p); }
__attribute__((noinline)) void operator delete[](void* p) noexcept { std::free(p); }
__attribute__((noinline)) void operator delete(void* p, std::size_t) noexcept { std::free(p); }
__attribute__((noinline)) void operator delete[](void* p, std::size_t) noexcept { std::free(p); }

namespace {

using bexil::BXPlugInCore;
using bexil::Value;

Value str(const char* s) { return Value::string(s); }

// About the size of a real share extension's information dictionary.
Value realisticInfo() {
    Value attributes = Value::dictionary({
        {"RZExtensionVersion", str("4.2.1")},
        {"RZExtensionActivationRule",
         Value::dictionary({{"public.image", Value::int64(10)}, {"public.url", Value::int64(1)}})},
        {"RZExtensionServiceAllowsFinderPreviewItem", Value::boolean(true)},
        {"RZExtensionServiceRoleType", str("RZExtensionServiceRoleTypeEditor")},
    });
    Value plugIn = Value::dictionary({
        {"RZExtensionPointIdentifier", str("com.quorvel.share-services")},
        {"RZExtensionProtocol", str("RZObject")},
        {"PrincipalClass", str("RZObject")},
        {"RZExtensionAttributes", attributes},
        {"Shared", Value::array({str("Resources/Icons"), str("Resources/Templates")})},
        {"RZExtensionHostEntitlement", str("com.quorvel.private.share-host")},
    });
    return Value::dictionary({
        {"BDBundleIdentifier", str("com.example.photos.share-extension")},
        {"BDBundleName", str("Share to Photos")},
        {"BDBundleDisplayName", str("Photos")},
        {"BDBundleExecutable", str("PhotosShare")},
        {"BDBundleShortVersionString", str("4.2")},
        {"BDBundleVersion", str("4200.17")},
        {"BDBundleInfoVrecURL", str("file:///Applications/Photos.app/PlugIns/PhotosShare.wexa/Info.vrec")},
        {"BDBundlePackageType", str("PLUG")},
        {"BDMinimumSystemVersion", str("12.0")},
        {"RZExtension", plugIn},
    });
}

std::shared_ptr<BXPlugInCore> setUp(const Value& info) {
    auto record = BXPlugInCore::initWithNameUrlBundleInfoInfoUuid(
        "com.example.photos.share-extension", std::string("/Applications/Photos.app/PlugIns/PhotosShare.wexa"), info,
        std::nullopt, std::nullopt);
    record->setOriginalIdentifier("com.example.photos.share-extension");
    record->setHubProtocolVersion(2);
    record->setLastModified(1'763'892'000);
    record->setContainingUrl("/Applications/Photos.app");
    record->setLocalizedName("Photos");
    record->setAnnotations(Value::dictionary({{"election", Value::int64(1)}}));
    return record;
}

void reportAllocations(benchmark::State& state, uint64_t before) {
    state.counters["allocs/record"] =
        benchmark::Counter(static_cast<double>(gAllocations.load() - before) / static_cast<double>(state.iterations()));
}

void BM_SetUpExportReadBack(benchmark::State& state) {
    Value info = realisticInfo();
    uint64_t before = gAllocations.load();
    for (auto _ : state) {
        auto record = setUp(info);
        Value form = record->exportForm()->take();
        auto client = BXPlugInCore::initWithForm(form);
        benchmark::DoNotOptimize(client);
    }
    reportAllocations(state, before);
}
BENCHMARK(BM_SetUpExportReadBack);

void BM_SetUp(benchmark::State& state) {
    Value info = realisticInfo();
    uint64_t before = gAllocations.load();
    for (auto _ : state) benchmark::DoNotOptimize(setUp(info));
    reportAllocations(state, before);
}
BENCHMARK(BM_SetUp);

void BM_Export(benchmark::State& state) {
    auto record = setUp(realisticInfo());
    uint64_t before = gAllocations.load();
    for (auto _ : state) benchmark::DoNotOptimize(record->exportForm()->take());
    reportAllocations(state, before);
}
BENCHMARK(BM_Export);

void BM_ReadBack(benchmark::State& state) {
    Value form = setUp(realisticInfo())->exportForm()->take();
    uint64_t before = gAllocations.load();
    for (auto _ : state) benchmark::DoNotOptimize(BXPlugInCore::initWithForm(form));
    reportAllocations(state, before);
}
BENCHMARK(BM_ReadBack);

void BM_DerivedProperties(benchmark::State& state) {
    auto record = setUp(realisticInfo());
    uint64_t before = gAllocations.load();
    for (auto _ : state) {
        benchmark::DoNotOptimize(record->protocolSpec());
        benchmark::DoNotOptimize(record->version());
        benchmark::DoNotOptimize(record->isData());
        benchmark::DoNotOptimize(record->diagnose());
    }
    reportAllocations(state, before);
}
BENCHMARK(BM_DerivedProperties);

}  // namespace

BENCHMARK_MAIN();
