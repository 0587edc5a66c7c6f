// The registry's costs: one registration (read the bundle, write one transaction) in a registry that grows to
// 10,000 plug-ins in 1,000 applications; opening a registry of 100,000 plug-ins; a look-up by UUID; a query by
// extension point that selects about 20 of the 100,000. The large registry is built once per run in a temporary
// directory (set LEDGERIX_BENCH_PLUGINS to change its size) and removed at exit.

#include <benchmark/benchmark.h>
#include <stdlib.h>

#include <chrono>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <memory>
#include <random>
#include <string>
#include <vector>

#include "base/Document.h"
#include "platform/ledgerix/LXBexilProxy.h"
#include "platform/ledgerix/LedgerixWorkspace.h"

namespace {

using namespace bexil;
namespace fs = std::filesystem;

constexpr int kPlugInsPerApplication = 10;
constexpr int kPlugInsPerPoint = 20;

// Writes a plug-in bundle; the Info.vrec text is rendered once per shape and patched, not synced, to keep set-up
// short.
void writeBundle(const fs::path& bundle, int index, bool carriesCode) {
    fs::create_directories(bundle);
    Value info = Value::dictionary({
        {"BDBundleIdentifier", Value::string("com.example.bench.p" + std::to_string(index))},
        {"BDBundleName", Value::string("P" + std::to_string(index))},
        {"BDBundleVersion", Value::string("1")},
        {"RZExtension", Value::dictionary({
                            {"RZExtensionPointIdentifier",
                             Value::string("com.example.point" + std::to_string(index / kPlugInsPerPoint))},
                            {"RZExtensionProtocol", Value::string(carriesCode ? "BenchProtocol" : "#Data")},
                            {"PrincipalClass", Value::string("BenchPrincipal")},
                            {"RZExtensionAttributes", Value::dictionary({{"RZExtensionVersion", Value::string("1.0")},
                                                                         {"Flavour", Value::string("plain")}})},
                        })},
    });
    std::ofstream(bundle / "Info.vrec") << Document::write(info).value();
}

LedgerixWorkspace::Options options(fs::path state,
                                   LedgerixWorkspace::Durability durability = LedgerixWorkspace::Durability::Full) {
    LedgerixWorkspace::Options result;
    result.stateDirectory = std::move(state);
    result.durability = durability;
    return result;
}

fs::path bundlePath(const fs::path& base, int index) {
    return base / ("A" + std::to_string(index / kPlugInsPerApplication) + ".app") / "PlugIns" /
           ("P" + std::to_string(index) + ".bxplugin");
}

struct Fixture {
    fs::path dir;
    fs::path bundles;
    int plugInCount = 100000;
    std::vector<Uuid> uuids;

    Fixture() {
        if (const char* n = getenv("LEDGERIX_BENCH_PLUGINS")) plugInCount = std::max(100, atoi(n));
        std::string pattern = (fs::temp_directory_path() / "bexil-ledgerix-bench-XXXXXX").string();
        if (!mkdtemp(pattern.data())) abort();
        dir = pattern;
        bundles = dir / "bundles";
    }
    ~Fixture() {
        std::error_code ec;
        fs::remove_all(dir, ec);
    }

    // The registry of plugInCount plug-ins, made once. Data plug-ins, so that it does not also make 100,000
    // containers; the registration benchmark below measures plug-ins with containers.
    fs::path largeState() {
        fs::path state = dir / "large";
        if (!uuids.empty()) return state;
        auto start = std::chrono::steady_clock::now();
        for (int i = 0; i < plugInCount; ++i) writeBundle(bundlePath(bundles, i), i, false);
        auto written = std::chrono::steady_clock::now();
        auto workspace = LedgerixWorkspace::open(options(state, LedgerixWorkspace::Durability::Process)).value();
        for (int i = 0; i < plugInCount; ++i) {
            auto proxy = workspace->registerPlugin(bundlePath(bundles, i).string());
            if (!proxy.ok()) abort();
            uuids.push_back(*proxy.value()->pluginUUID());
        }
        auto registered = std::chrono::steady_clock::now();
        std::fprintf(stderr, "built a registry of %d plug-ins: bundles %.1f s, registrations %.1f s (%.0f us each)\n",
                     plugInCount, std::chrono::duration<double>(written - start).count(),
                     std::chrono::duration<double>(registered - written).count(),
                     std::chrono::duration<double, std::micro>(registered - written).count() / plugInCount);
        return state;
    }
};

Fixture& fixture() {
    static Fixture shared;
    return shared;
}

// One registration into a registry that grows to 10,000 plug-ins in 1,000 applications, with data containers.
void registerPlugIns(benchmark::State& state, LedgerixWorkspace::Durability durability) {
    Fixture& f = fixture();
    fs::path base = f.dir / (durability == LedgerixWorkspace::Durability::Full ? "reg-full" : "reg-process");
    const int count = static_cast<int>(state.max_iterations);
    for (int i = 0; i < count; ++i) writeBundle(bundlePath(base / "bundles", i), i, true);
    auto workspace = LedgerixWorkspace::open(options(base / "state", durability)).value();
    int i = 0;
    for (auto _ : state) {
        auto proxy = workspace->registerPlugin(bundlePath(base / "bundles", i++).string());
        if (!proxy.ok()) state.SkipWithError("registration failed");
    }
    state.counters["plug-ins"] = static_cast<double>(workspace->plugInCount().value_or(0));
}
BENCHMARK_CAPTURE(registerPlugIns, full_durability, LedgerixWorkspace::Durability::Full)
    ->Iterations(10000)
    ->Unit(benchmark::kMicrosecond);
BENCHMARK_CAPTURE(registerPlugIns, process_durability, LedgerixWorkspace::Durability::Process)
    ->Iterations(10000)
    ->Unit(benchmark::kMicrosecond);

// Registering a bundle that is already registered unchanged: the registry only reads and compares.
void registerUnchanged(benchmark::State& state) {
    Fixture& f = fixture();
    fs::path large = f.largeState();
    auto workspace = LedgerixWorkspace::open(options(large)).value();
    int i = 0;
    for (auto _ : state) {
        auto proxy = workspace->registerPlugin(bundlePath(f.bundles, (i++ * 7919) % f.plugInCount).string());
        benchmark::DoNotOptimize(proxy);
    }
}
BENCHMARK(registerUnchanged)->Unit(benchmark::kMicrosecond);

void openLargeRegistry(benchmark::State& state) {
    fs::path large = fixture().largeState();
    for (auto _ : state) {
        auto workspace = LedgerixWorkspace::open(options(large));
        if (!workspace.ok()) state.SkipWithError("open failed");
        benchmark::DoNotOptimize(workspace);
    }
    state.counters["plug-ins"] = fixture().plugInCount;
}
BENCHMARK(openLargeRegistry)->Unit(benchmark::kMillisecond);

void lookUpByUuid(benchmark::State& state, bool readDictionaries) {
    Fixture& f = fixture();
    auto workspace = LedgerixWorkspace::open(options(f.largeState())).value();
    std::mt19937 random(7);
    for (auto _ : state) {
        auto proxy = workspace->plugInProxyForUUID(f.uuids[random() % f.uuids.size()]);
        if (!proxy) state.SkipWithError("missing record");
        if (readDictionaries) benchmark::DoNotOptimize(proxy->bexilDictionary());
        benchmark::DoNotOptimize(proxy);
    }
}
BENCHMARK_CAPTURE(lookUpByUuid, record_only, false)->Unit(benchmark::kMicrosecond);
BENCHMARK_CAPTURE(lookUpByUuid, with_dictionaries, true)->Unit(benchmark::kMicrosecond);

void queryByExtensionPoint(benchmark::State& state) {
    Fixture& f = fixture();
    auto workspace = LedgerixWorkspace::open(options(f.largeState())).value();
    std::mt19937 random(11);
    size_t found = 0, filtered = 0;
    for (auto _ : state) {
        std::string point = "com.example.point" + std::to_string(random() % (f.plugInCount / kPlugInsPerPoint));
        Value query = Value::dictionary(
            {{"RZExtensionPointIdentifier", Value::string(point)}, {"RZUserElection", Value::string("1")}});
        auto matches = workspace->pluginsMatchingQueryApplyFilter(
            query,
            [&](std::string_view, const std::optional<Value>& entitlements) {
                ++filtered;
                return !entitlements.has_value();
            },
            LXPreselection{.extensionPoints = std::vector<std::string>{point}});
        found += matches ? matches->size() : 0;
    }
    state.counters["matches"] = benchmark::Counter(static_cast<double>(found), benchmark::Counter::kAvgIterations);
    state.counters["filter calls"] =
        benchmark::Counter(static_cast<double>(filtered), benchmark::Counter::kAvgIterations);
}
BENCHMARK(queryByExtensionPoint)->Unit(benchmark::kMicrosecond);

// For scale: every record of the large registry, as an empty discovery query gets them.
void installedPlugIns(benchmark::State& state) {
    auto workspace = LedgerixWorkspace::open(options(fixture().largeState())).value();
    for (auto _ : state) {
        auto all = workspace->installedPlugins();
        benchmark::DoNotOptimize(all);
    }
}
BENCHMARK(installedPlugIns)->Unit(benchmark::kMillisecond)->Iterations(5);

}  // namespace

BENCHMARK_MAIN();
