// Cost of one annotation change with 10,000 stored annotations. Every change rewrites the whole document, so the
// change is measured next to the bare atomic write of the same document and its serialisation alone, in one run:
// what the store adds is the difference between the first two. The documents are written under the temporary
// directory (or $BEXIL_BENCH_DIR), on a real file system so that the fsyncs cost what they cost.

#include <benchmark/benchmark.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <memory>
#include <string>

#include "base/Document.h"
#include "database/BXDAnnotationStore.h"

namespace {

using bexil::Value;

constexpr int kEntries = 10000;

std::string key(int i) { return "com.example.plugin-" + std::to_string(i); }

Value annotation(int i) {
    Value extension = Value::dictionary({{"enabled", Value::boolean(i % 2 == 0)},
                                         {"label", Value::string("Plug-in number " + std::to_string(i))},
                                         {"rank", Value::int64(i * 7)}});
    return Value::dictionary({{"election", Value::int64(i % 3)}, {"extension", extension}});
}

std::filesystem::path benchDirectory(const char* name) {
    std::filesystem::path base = std::filesystem::temp_directory_path();
    if (const char* dir = getenv("BEXIL_BENCH_DIR"); dir && *dir) base = dir;
    std::filesystem::path directory = base / (std::string(name) + "-" + std::to_string(getpid()));
    std::filesystem::remove_all(directory);
    std::filesystem::create_directories(directory);
    return directory;
}

// A store holding kEntries annotations, written once.
std::unique_ptr<bexil::BXDAnnotationStore> filledStore(const std::filesystem::path& path) {
    auto store = std::make_unique<bexil::BXDAnnotationStore>(path.string());
    bexil::MutableDictionary map;
    map.reserve(kEntries);
    for (int i = 0; i < kEntries; ++i) map.set(key(i), annotation(i));
    store->setAnnotations(map.take());
    if (store->saveDb()) return nullptr;
    return store;
}

Value rootOf(const bexil::BXDAnnotationStore& store) {
    return Value::dictionary({{"version", Value::int64(16)}, {"data", store.annotations()}});
}

// One change through the store: merge into an existing annotation, then the whole durable rewrite.
void BM_AnnotationChange(benchmark::State& state) {
    std::filesystem::path directory = benchDirectory("annotation-store-bench");
    std::filesystem::path path = directory / "Bexil-Annotations";
    auto store = filledStore(path);
    if (!store) {
        state.SkipWithError("cannot write the document");
        return;
    }
    int64_t round = 0;
    for (auto _ : state) {
        ++round;
        store->setAnnotationForIdentifier(Value::dictionary({{"election", Value::int64(round % 5)}}),
                                          key(static_cast<int>(round % kEntries)));
        if (store->diskBehind()) state.SkipWithError("save failed");
    }
    state.counters["doc_bytes"] = static_cast<double>(std::filesystem::file_size(path));
    std::filesystem::remove_all(directory);
}
BENCHMARK(BM_AnnotationChange)->Unit(benchmark::kMillisecond)->UseRealTime();

// The same document written atomically without the store: the floor of a change.
void BM_AtomicWriteOfTheSameDocument(benchmark::State& state) {
    std::filesystem::path directory = benchDirectory("annotation-store-bench-raw");
    std::filesystem::path path = directory / "Bexil-Annotations";
    auto store = filledStore(path);
    if (!store) {
        state.SkipWithError("cannot write the document");
        return;
    }
    Value root = rootOf(*store);
    for (auto _ : state) {
        if (bexil::Document::writeFileAtomically(path, root)) state.SkipWithError("write failed");
    }
    state.counters["doc_bytes"] = static_cast<double>(std::filesystem::file_size(path));
    std::filesystem::remove_all(directory);
}
BENCHMARK(BM_AtomicWriteOfTheSameDocument)->Unit(benchmark::kMillisecond)->UseRealTime();

// The store's in-memory part of a change alone: copy of the map with one merged entry (no serialisation, no I/O).
void BM_MergeIntoTheMap(benchmark::State& state) {
    bexil::MutableDictionary filled;
    for (int i = 0; i < kEntries; ++i) filled.set(key(i), annotation(i));
    Value map = filled.take();
    int64_t round = 0;
    for (auto _ : state) {
        ++round;
        std::string k = key(static_cast<int>(round % kEntries));
        bexil::MutableDictionary next(map);
        bexil::MutableDictionary merged(map.get(k));
        merged.set("election", Value::int64(round % 5));
        next.set(k, merged.take());
        map = next.take();
        benchmark::DoNotOptimize(map);
    }
}
BENCHMARK(BM_MergeIntoTheMap)->Unit(benchmark::kMicrosecond);

// Serialisation of the document alone, for the split between text and disk.
void BM_SerialiseTheDocument(benchmark::State& state) {
    bexil::MutableDictionary filled;
    for (int i = 0; i < kEntries; ++i) filled.set(key(i), annotation(i));
    Value root = Value::dictionary({{"version", Value::int64(16)}, {"data", filled.take()}});
    for (auto _ : state) {
        auto text = bexil::Document::write(root);
        if (!text.ok()) state.SkipWithError("write failed");
        benchmark::DoNotOptimize(text);
    }
}
BENCHMARK(BM_SerialiseTheDocument)->Unit(benchmark::kMillisecond);

}  // namespace

BENCHMARK_MAIN();
