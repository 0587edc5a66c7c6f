// What durable generations add to an annotation change. One change of the annotation store (10,000 annotations,
// the durable rewrite of the document) is measured alone and followed by the change feed's publication with its
// generation mark on disk, in one run; the ratio of the two is what the persistence costs a change. Beside them:
// the publication alone (a mark is written once per GenerationStore::kReserveBlock generations) and one write of the
// mark, the cost that the block spreads. Files go under the temporary directory (or $BEXIL_BENCH_DIR).

#include <benchmark/benchmark.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <memory>
#include <string>

#include "daemon/ChangeFeed.h"
#include "daemon/GenerationStore.h"
#include "database/BXDAnnotationStore.h"

namespace {

using bexil::Value;

constexpr int kEntries = 10000;

std::string key(int i) { return "com.example.plugin-" + std::to_string(i); }

std::filesystem::path benchDirectory(const char* name) {
    std::filesystem::path base = std::filesystem::temp_directory_path();
    if (const char* dir = getenv("BEXIL_BENCH_DIR"); dir && *dir) base = dir;
    std::filesystem::path directory = base / (std::string(name) + "-" + std::to_string(getpid()));
    std::filesystem::remove_all(directory);
    std::filesystem::create_directories(directory);
    return directory;
}

std::unique_ptr<bexil::BXDAnnotationStore> filledStore(const std::filesystem::path& path) {
    auto store = std::make_unique<bexil::BXDAnnotationStore>(path.string());
    bexil::MutableDictionary map;
    map.reserve(kEntries);
    for (int i = 0; i < kEntries; ++i)
        map.set(key(i), Value::dictionary({{"election", Value::int64(i % 3)},
                                           {"extension", Value::dictionary({{"rank", Value::int64(i)}})}}));
    store->setAnnotations(map.take());
    if (store->saveDb()) return nullptr;
    return store;
}

// An annotation change, durable; with state.range(0) == 1 also published with its generation, as bxd does.
void BM_AnnotationChange(benchmark::State& state) {
    const bool withGeneration = state.range(0) == 1;
    std::filesystem::path directory = benchDirectory("generation-bench");
    auto store = filledStore(directory / "Bexil-Annotations");
    if (!store) {
        state.SkipWithError("cannot write the document");
        return;
    }
    bexil::ChangeFeed feed(std::make_unique<bexil::GenerationStore>(directory / "generation"));
    feed.subscribe([](const bexil::Change& change) { benchmark::DoNotOptimize(change.generation); });
    const std::vector<bexil::Uuid> touched{bexil::Uuid::random()};
    int64_t round = 0;
    for (auto _ : state) {
        ++round;
        std::string identifier = key(static_cast<int>(round % kEntries));
        store->setAnnotationForIdentifier(Value::dictionary({{"election", Value::int64(round % 5)}}), identifier);
        if (store->diskBehind()) state.SkipWithError("save failed");
        if (withGeneration) feed.publish(bexil::Change::Kind::Annotated, touched, {identifier});
    }
    state.SetLabel(withGeneration ? "with generation" : "without");
    std::filesystem::remove_all(directory);
}
BENCHMARK(BM_AnnotationChange)->Arg(0)->Arg(1)->Unit(benchmark::kMillisecond)->UseRealTime();

// The publication alone: the generation, the log, one observer, and the mark's write once per block.
void BM_PublishWithDurableGeneration(benchmark::State& state) {
    std::filesystem::path directory = benchDirectory("generation-bench-publish");
    bexil::ChangeFeed feed(std::make_unique<bexil::GenerationStore>(directory / "generation"));
    const std::vector<bexil::Uuid> touched{bexil::Uuid::random()};
    for (auto _ : state) feed.publish(bexil::Change::Kind::Annotated, touched, {"com.example.plugin"});
    std::filesystem::remove_all(directory);
}
BENCHMARK(BM_PublishWithDurableGeneration)->Unit(benchmark::kMicrosecond)->UseRealTime();

// One write of the mark (a block of one generation): the synced atomic replacement the block spreads.
void BM_OneMarkWrite(benchmark::State& state) {
    std::filesystem::path directory = benchDirectory("generation-bench-mark");
    bexil::GenerationStore store(directory / "generation", bexil::GenerationStore::wallClockMicroseconds,
                                 bexil::posixFileSystem(), 1);
    uint64_t generation = store.start();
    for (auto _ : state) store.reserveThrough(++generation);
    std::filesystem::remove_all(directory);
}
BENCHMARK(BM_OneMarkWrite)->Unit(benchmark::kMillisecond)->UseRealTime();

}  // namespace

BENCHMARK_MAIN();
