// Cost of saving and loading an annotation document of 10,000 plug-ins, the size that every annotation change
// rewrites in full. Reports the document's size alongside the time.

#include <benchmark/benchmark.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <string>

#include "base/Document.h"

namespace {

constexpr int kEntries = 10000;

bexil::Value annotationDocument() {
    using bexil::Value;
    bexil::MutableDictionary map;
    map.reserve(kEntries);
    for (int i = 0; i < kEntries; ++i) {
        Value extension = Value::dictionary({{"enabled", Value::boolean(i % 2 == 0)},
                                             {"label", Value::string("Plug-in number " + std::to_string(i))},
                                             {"rank", Value::int64(i * 7)}});
        map.set("com.example.plugin-" + std::to_string(i),
                Value::dictionary({{"election", Value::int64(i % 3)}, {"extension", extension}}));
    }
    return Value::dictionary({{"version", Value::int64(16)}, {"data", map.take()}});
}

const bexil::Value& document() {
    static const bexil::Value value = annotationDocument();
    return value;
}

void BM_DocumentWrite(benchmark::State& state) {
    size_t bytes = 0;
    for (auto _ : state) {
        auto text = bexil::Document::write(document());
        if (!text.ok()) state.SkipWithError("write failed");
        bytes = text->size();
        benchmark::DoNotOptimize(text);
    }
    state.counters["doc_bytes"] = static_cast<double>(bytes);
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * bytes));
}
BENCHMARK(BM_DocumentWrite)->Unit(benchmark::kMillisecond);

void BM_DocumentRead(benchmark::State& state) {
    std::string text = *bexil::Document::write(document());
    for (auto _ : state) {
        auto value = bexil::Document::read(text);
        if (!value.ok()) state.SkipWithError("read failed");
        benchmark::DoNotOptimize(value);
    }
    state.counters["doc_bytes"] = static_cast<double>(text.size());
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * text.size()));
}
BENCHMARK(BM_DocumentRead)->Unit(benchmark::kMillisecond);

// The whole save: text, temporary file, two fsyncs and the rename, as the annotation store does after each change.
void BM_DocumentWriteFileAtomically(benchmark::State& state) {
    std::filesystem::path directory =
        std::filesystem::temp_directory_path() / ("document-bench-" + std::to_string(getpid()));
    std::filesystem::create_directories(directory);
    std::filesystem::path path = directory / "Annotations.vrec";
    for (auto _ : state) {
        if (auto error = bexil::Document::writeFileAtomically(path, document())) state.SkipWithError("write failed");
    }
    state.counters["doc_bytes"] = static_cast<double>(std::filesystem::file_size(path));
    std::filesystem::remove_all(directory);
}
BENCHMARK(BM_DocumentWriteFileAtomically)->Unit(benchmark::kMillisecond);

}  // namespace

BENCHMARK_MAIN();
