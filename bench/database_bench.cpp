// findPlugIn: a cached look-up against one that builds the record from the registry (the cache is emptied before
// every look-up, which costs next to nothing), in one run so that the ratio holds on a noisy machine: first on the
// three plug-ins of the example application, then on a registry of 100,000 plug-ins (ten to an application, on 50
// extension points), and a warm stretch of 32 plug-ins of a paged walk (BM_WalkStretchCachedLarge). With the large
// registry, BM_CacheMemory fills the cache with every record and reports what that
// costs per record: the growth of the heap's in-use bytes (mallinfo2) and of the resident set while filling, and the
// in-use bytes that emptying the cache gives back (the records alone, without what the registry's own page cache
// grew by), and how much of that is the registry's record of the plug-in, which each cached record keeps (the same
// look-ups held as registry records only), and what decoding those records' dictionaries adds to them (the decoded
// dictionaries less the text they replace; the rest of a cached record is the daemon's own). BM_PurgeFullCache empties
// the full cache and reports the purging thread's stall (CPU time and wall-clock) and how the writer then frees the
// records: in total, and its longest block, the longest a write queued meanwhile waits. The small registry lives under
// the temporary directory, the large one on /dev/shm when there is one (see LargeRegistry.h).
//
//     cmake --build --preset release --target database_bench
//     build/release/bench/database_bench [--benchmark_filter=Large|Memory]
//
// DATABASE_BENCH_PLUGINS=N changes the size of the large registry (built once per run, in about half a minute).

#include <benchmark/benchmark.h>
#include <malloc.h>
#include <stdlib.h>
#include <time.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <functional>
#include <memory>
#include <random>

#include "LargeRegistry.h"
#include "database/BXDatabase.h"
#include "platform/ledgerix/LXBexilProxy.h"
#include "platform/ledgerix/LedgerixWorkspace.h"
#include "policy/BXDPlugIn.h"

namespace {

namespace fs = std::filesystem;
using namespace bexil;

struct Fixture {
    fs::path root;
    std::shared_ptr<LedgerixWorkspace> workspace;
    std::unique_ptr<BXDatabase> database;
    std::vector<Uuid> uuids;

    Fixture() {
        char pattern[] = "/tmp/database-bench-XXXXXX";
        root = mkdtemp(pattern);
        setenv("BX_STATE_DIR", (root / "state").c_str(), 1);
        fs::copy(fs::path(BEXIL_SOURCE_DIR) / "examples/bundles/Greeter.app", root / "Greeter.app",
                 fs::copy_options::recursive);
        LedgerixWorkspace::Options options;
        options.stateDirectory = root / "state";
        workspace = *LedgerixWorkspace::open(options);
        database = BXDatabase::create((root / "annotations").string(), workspace, [](std::string_view) {});
        for (const char* name : {"Hello", "Bonjour", "NightTheme"}) {
            std::string path = (root / "Greeter.app/PlugIns" / (std::string(name) + ".bxplugin")).string();
            (void)database->addPlugIn(path);
            uuids.push_back(*workspace->plugInProxyForURL(path)->pluginUUID());
        }
    }
    ~Fixture() {
        database.reset();
        workspace.reset();
        fs::remove_all(root);
    }
};

Fixture& fixture() {
    static Fixture instance;
    return instance;
}

void BM_FindPlugInCached(benchmark::State& state) {
    Fixture& f = fixture();
    size_t i = 0;
    for (auto _ : state) benchmark::DoNotOptimize(f.database->findPlugIn(f.uuids[i++ % f.uuids.size()]));
}
BENCHMARK(BM_FindPlugInCached);

void BM_FindPlugInUncached(benchmark::State& state) {
    Fixture& f = fixture();
    size_t i = 0;
    for (auto _ : state) {
        f.database->sync().sync([&] { f.database->purgeCachesToLimit(0); });
        benchmark::DoNotOptimize(f.database->findPlugIn(f.uuids[i++ % f.uuids.size()]));
    }
}
BENCHMARK(BM_FindPlugInUncached);

struct LargeFixture {
    static constexpr int kPoints = 50;
    fs::path root;
    int count = 100000;
    bench::LargeRegistry registry;
    std::shared_ptr<LedgerixWorkspace> workspace;
    std::unique_ptr<BXDatabase> database;

    LargeFixture() {
        if (const char* n = getenv("DATABASE_BENCH_PLUGINS")) count = std::max(100, atoi(n));
        root = bench::makeScratchDirectory("database-bench-large");
        registry = bench::LargeRegistry::build(root / "bundles", root / "state", count, kPoints, false);
        fprintf(stderr, "built a registry of %d plug-ins: bundles %.1f s, registrations %.1f s\n", count,
                registry.writeSeconds, registry.registerSeconds);
        LedgerixWorkspace::Options options;
        options.stateDirectory = root / "state";
        workspace = *LedgerixWorkspace::open(options);
        database = BXDatabase::create((root / "annotations").string(), workspace, [](std::string_view) {});
    }
    ~LargeFixture() {
        database.reset();
        workspace.reset();
        std::error_code ec;
        fs::remove_all(root, ec);
    }

    void fill() {
        if (database->cachedCount() == registry.uuids.size()) return;
        for (const Uuid& uuid : registry.uuids)
            if (!database->findPlugIn(uuid)) abort();
    }
    // Empties the cache and waits until the writer has released what it held, so that no figure taken afterwards
    // pays for (or counts memory of) records still being freed.
    void empty() {
        database->sync().sync([&] { database->purgeCachesToLimit(0); });
        database->waitForWriter();
    }
};

LargeFixture& largeFixture() {
    static LargeFixture instance;
    return instance;
}

// Bytes handed out by malloc: small chunks from the arenas plus the large ones it maps on their own (such as the
// cache's bucket array).
size_t heapInUse() {
    struct mallinfo2 info = mallinfo2();
    return info.uordblks + info.hblkhd;
}

size_t residentBytes() {
    std::ifstream statm("/proc/self/statm");
    size_t pages = 0, resident = 0;
    statm >> pages >> resident;
    return resident * static_cast<size_t>(sysconf(_SC_PAGESIZE));
}

void BM_CacheMemory(benchmark::State& state) {
    LargeFixture& f = largeFixture();
    double perRecordHeap = 0, perRecordResident = 0, perRecordFreed = 0, perRecordProxy = 0, perRecordDecoded = 0;
    for (auto _ : state) {
        f.empty();
        size_t heapBefore = heapInUse(), residentBefore = residentBytes();
        f.fill();
        size_t heapFull = heapInUse(), residentFull = residentBytes();
        f.empty();
        size_t heapEmptied = heapInUse();
        double n = static_cast<double>(f.registry.uuids.size());
        perRecordHeap = (static_cast<double>(heapFull) - static_cast<double>(heapBefore)) / n;
        perRecordResident = (static_cast<double>(residentFull) - static_cast<double>(residentBefore)) / n;
        perRecordFreed = (static_cast<double>(heapFull) - static_cast<double>(heapEmptied)) / n;

        // The share of the registry's record, which every cached record keeps: the same look-ups held as proxies.
        std::vector<std::shared_ptr<const LXBexilProxy>> proxies;
        proxies.reserve(f.registry.uuids.size());
        size_t heapNoProxies = heapInUse();
        for (const Uuid& uuid : f.registry.uuids) proxies.push_back(f.workspace->plugInProxyForUUID(uuid));
        size_t heapProxies = heapInUse();
        perRecordProxy = (static_cast<double>(heapProxies) - static_cast<double>(heapNoProxies)) / n;
        // The same records with their dictionaries decoded, as a cached record keeps them: what decoding adds
        // (the decoded dictionaries less the text they replace).
        for (const auto& proxy : proxies) {
            benchmark::DoNotOptimize(proxy->infoVrec());
            benchmark::DoNotOptimize(proxy->entitlements());
        }
        perRecordDecoded = (static_cast<double>(heapInUse()) - static_cast<double>(heapProxies)) / n;
    }
    state.counters["records"] = static_cast<double>(f.registry.uuids.size());
    state.counters["heap_B_per_record"] = perRecordHeap;
    state.counters["rss_B_per_record"] = perRecordResident;
    state.counters["freed_B_per_record"] = perRecordFreed;
    state.counters["registry_record_B"] = perRecordProxy;
    state.counters["decoding_adds_B"] = perRecordDecoded;
}
BENCHMARK(BM_CacheMemory)->Iterations(1)->Unit(benchmark::kMillisecond);

// What discovery adds to a full cache: the form entries each record keeps encoded (BXDPlugIn::keptFormEntries),
// made by the first match that returns the record, so a match of every plug-in makes them all. Per record: the
// growth of the heap's in-use bytes and the bytes the records keep, within the daemon's budget for kept forms and
// (for comparison) with no budget at all.
void BM_KeptFormMemory(benchmark::State& state) {
    LargeFixture& f = largeFixture();
    double perRecordHeap = 0, perRecordKept = 0, perRecordHeapUnbounded = 0;
    auto measure = [&f](double& heap, double* kept) {
        f.empty();
        f.fill();
        std::vector<std::shared_ptr<BXDPlugIn>> records;
        records.reserve(f.registry.uuids.size());
        for (const Uuid& uuid : f.registry.uuids) records.push_back(f.database->findPlugIn(uuid));
        size_t heapBefore = heapInUse(), keptBefore = BXDPlugIn::keptFormBytes();
        for (const std::shared_ptr<BXDPlugIn>& record : records) benchmark::DoNotOptimize(record->keptFormEntries());
        double n = static_cast<double>(records.size());
        heap = (static_cast<double>(heapInUse()) - static_cast<double>(heapBefore)) / n;
        if (kept) *kept = static_cast<double>(BXDPlugIn::keptFormBytes() - keptBefore) / n;
    };
    for (auto _ : state) {
        measure(perRecordHeap, &perRecordKept);
        BXDPlugIn::setKeptFormBudget(SIZE_MAX);
        measure(perRecordHeapUnbounded, nullptr);
        BXDPlugIn::setKeptFormBudget(BXDPlugIn::kKeptFormBudgetBytes);
    }
    state.counters["records"] = static_cast<double>(f.registry.uuids.size());
    state.counters["kept_form_heap_B_per_record"] = perRecordHeap;
    state.counters["kept_form_B_per_record"] = perRecordKept;
    state.counters["unbounded_kept_form_heap_B_per_record"] = perRecordHeapUnbounded;
}
BENCHMARK(BM_KeptFormMemory)->Iterations(1)->Unit(benchmark::kMillisecond);

void BM_FindPlugInCachedLarge(benchmark::State& state) {
    LargeFixture& f = largeFixture();
    f.fill();
    std::mt19937 random(7);
    for (auto _ : state)
        benchmark::DoNotOptimize(f.database->findPlugIn(f.registry.uuids[random() % f.registry.uuids.size()]));
    state.counters["cached"] = static_cast<double>(f.database->cachedCount());
}
BENCHMARK(BM_FindPlugInCachedLarge);

void BM_FindPlugInUncachedLarge(benchmark::State& state) {
    LargeFixture& f = largeFixture();
    std::mt19937 random(7);
    // The benchmark before this one left the cache full; emptying that is the purge's cost, not a look-up's.
    f.empty();
    for (auto _ : state) {
        f.empty();
        benchmark::DoNotOptimize(f.database->findPlugIn(f.registry.uuids[random() % f.registry.uuids.size()]));
    }
}
BENCHMARK(BM_FindPlugInUncachedLarge);

// One stretch of a paged walk through every plug-in, the cache full as it is after the first walk: the part of a
// step that cannot end early when a request waits for it. Stretches follow each other through the registry and
// start again from the first at its end.
void BM_WalkStretchCachedLarge(benchmark::State& state) {
    LargeFixture& f = largeFixture();
    f.fill();
    constexpr size_t kStretch = 32;
    const Value everything = Value::dictionary({});
    std::optional<std::string> after;
    size_t records = 0;
    for (auto _ : state) {
        std::optional<BXDatabase::PlugInSlice> slice =
            f.database->findPlugInsAfterIdentifier(everything, after, kStretch);
        if (!slice) abort();
        records += slice->plugIns.size();
        after = slice->ended ? std::nullopt : slice->last;
    }
    state.counters["records"] = benchmark::Counter(static_cast<double>(records), benchmark::Counter::kAvgIterations);
}
BENCHMARK(BM_WalkStretchCachedLarge)->Unit(benchmark::kMicrosecond);

// This thread's CPU time in milliseconds: on a busy machine a thread waiting for a CPU would count as a stall in
// wall-clock time, so the stall figures are CPU time (wall-clock beside them).
double threadCpuMs() {
    timespec now{};
    clock_gettime(CLOCK_THREAD_CPUTIME_ID, &now);
    return static_cast<double>(now.tv_sec) * 1e3 + static_cast<double>(now.tv_nsec) / 1e6;
}

// The purge of a full cache as its caller sees it: the time inside the database's lock (the whole stall of the
// thread that built the record over the limit), and apart from it how long the writer then takes to free the
// records, in total and in its longest single block (which delays a write queued behind it).
void BM_PurgeFullCache(benchmark::State& state) {
    LargeFixture& f = largeFixture();
    double stallMs = 0, stallCpuMs = 0, releaseMs = 0, longestBlockMs = 0, longestBlockCpuMs = 0;
    for (auto _ : state) {
        state.PauseTiming();
        f.fill();
        state.ResumeTiming();
        auto start = std::chrono::steady_clock::now();
        double startCpu = threadCpuMs();
        f.database->sync().sync([&] { f.database->purgeCachesToLimit(0); });
        stallCpuMs = std::max(stallCpuMs, threadCpuMs() - startCpu);
        auto purged = std::chrono::steady_clock::now();
        stallMs = std::max(stallMs, std::chrono::duration<double, std::milli>(purged - start).count());
        // A block that queues itself again behind each release batch, as a write arriving meanwhile would be: the
        // widest gap between its runs is the longest a write waits.
        auto last = std::make_shared<std::chrono::steady_clock::time_point>(purged);
        auto longest = std::make_shared<double>(0), lastCpu = std::make_shared<double>(-1),
             longestCpu = std::make_shared<double>(0);
        auto tick = std::make_shared<std::function<void()>>();
        *tick = [&f, last, longest, lastCpu, longestCpu, weak = std::weak_ptr<std::function<void()>>(tick)] {
            auto now = std::chrono::steady_clock::now();
            *longest = std::max(*longest, std::chrono::duration<double, std::milli>(now - *last).count());
            *last = now;
            double cpu = threadCpuMs();
            if (*lastCpu >= 0) *longestCpu = std::max(*longestCpu, cpu - *lastCpu);
            *lastCpu = cpu;
            if (f.database->releasingPurgedRecords())
                if (auto again = weak.lock()) f.database->writer().async(*again);
        };
        f.database->writer().async(*tick);
        f.database->waitForWriter();
        f.database->waitForWriter();  // a last tick may have been queued behind the first wait
        releaseMs = std::chrono::duration<double, std::milli>(*last - purged).count();
        longestBlockMs = std::max(longestBlockMs, *longest);
        longestBlockCpuMs = std::max(longestBlockCpuMs, *longestCpu);
    }
    state.counters["records"] = static_cast<double>(f.registry.uuids.size());
    state.counters["stall_ms"] = stallMs;
    state.counters["stall_cpu_ms"] = stallCpuMs;
    state.counters["release_ms"] = releaseMs;
    state.counters["longest_writer_block_ms"] = longestBlockMs;
    state.counters["longest_writer_block_cpu_ms"] = longestBlockCpuMs;
}
BENCHMARK(BM_PurgeFullCache)->Iterations(3)->Unit(benchmark::kMillisecond);

}  // namespace

BENCHMARK_MAIN();
