// Discovery on one extension point with 1,000 and 10,000 plug-ins registered, 100 of them on the point: the
// database's query (registry pre-selection, records from the cache) followed by what the request does for each
// candidate before encoding (the rules, export, annotations, resource extensions). The first iteration fills the
// cache; the figures are those of a warm daemon. Registries are built once per size under the temporary directory.

#include <benchmark/benchmark.h>
#include <stdlib.h>

#include <filesystem>
#include <fstream>
#include <map>
#include <memory>
#include <string>

#include "base/Document.h"
#include "database/BXDatabase.h"
#include "platform/ledgerix/LedgerixWorkspace.h"
#include "policy/BXDPlugIn.h"

namespace {

using namespace bexil;
namespace fs = std::filesystem;

constexpr int kPlugInsPerApplication = 10;
constexpr int kPlugInsOnThePoint = 100;
constexpr const char* kPoint = "com.example.bench.wanted";

void writeBundle(const fs::path& bundle, int index, bool wanted) {
    fs::create_directories(bundle);
    Value info = Value::dictionary({
        {"BDBundleIdentifier", Value::string("com.example.bench.p" + std::to_string(index))},
        {"BDBundleVersion", Value::string("1")},
        {"RZExtension",
         Value::dictionary({
             {"RZExtensionPointIdentifier",
              Value::string(wanted ? kPoint : "com.example.bench.other" + std::to_string(index % 50))},
             {"RZExtensionProtocol", Value::string("#Data")},
             {"RZExtensionAttributes", Value::dictionary({{"RZExtensionVersion", Value::string("1.0")}})},
         })},
    });
    std::ofstream(bundle / "Info.vrec") << Document::write(info).value();
}

struct Registry {
    fs::path root;
    std::shared_ptr<LedgerixWorkspace> workspace;
    std::unique_ptr<BXDatabase> database;

    explicit Registry(int count) {
        std::string pattern = (fs::temp_directory_path() / "bexil-discovery-bench-XXXXXX").string();
        if (!mkdtemp(pattern.data())) abort();
        root = pattern;
        setenv("BX_STATE_DIR", (root / "state").c_str(), 1);
        LedgerixWorkspace::Options options;
        options.stateDirectory = root / "state";
        options.durability = LedgerixWorkspace::Durability::Process;
        workspace = *LedgerixWorkspace::open(options);
        database = BXDatabase::create((root / "annotations").string(), workspace, [](std::string_view) {});
        // The wanted plug-ins are spread evenly over the registry.
        int every = count / kPlugInsOnThePoint;
        for (int i = 0; i < count; ++i) {
            fs::path app = root / "apps" / ("A" + std::to_string(i / kPlugInsPerApplication) + ".app");
            fs::path bundle = app / "PlugIns" / ("P" + std::to_string(i) + ".bxplugin");
            // An application without its information document is a placeholder, whose plug-ins discovery skips.
            if (i % kPlugInsPerApplication == 0) {
                fs::create_directories(app);
                std::ofstream(app / "Info.vrec")
                    << Document::write(Value::dictionary({{"BDBundleIdentifier",
                                                           Value::string("com.example.a" + std::to_string(i))}}))
                           .value();
            }
            writeBundle(bundle, i, i % every == 0);
            if (!workspace->registerPlugin(bundle.string())) abort();
        }
    }
    ~Registry() {
        database.reset();
        workspace.reset();
        std::error_code ec;
        fs::remove_all(root, ec);
    }
};

Registry& registry(int count) {
    static std::map<int, std::unique_ptr<Registry>> registries;
    auto& slot = registries[count];
    if (!slot) slot = std::make_unique<Registry>(count);
    return *slot;
}

void BM_MatchOnePoint(benchmark::State& state) {
    Registry& r = registry(static_cast<int>(state.range(0)));
    Value rules = Value::dictionary({{"RZExtensionPointIdentifier", Value::string(kPoint)}});
    BXMatchContext context{.annotations = &r.database->annotationSource()};
    size_t matched = 0;
    for (auto _ : state) {
        std::optional<BXDatabase::PlugInSet> candidates = r.database->findPlugIns(rules);
        matched = 0;
        for (const auto& plugIn : candidates ? *candidates : BXDatabase::PlugInSet{}) {
            if (!plugIn->match(rules, context)) continue;
            Result<MutableDictionary> form = plugIn->exportForm();
            if (!form) continue;
            r.database->addAnnotationForPlugInIn(*plugIn, *form);
            plugIn->augmentForm(*form);
            benchmark::DoNotOptimize(form->value());
            ++matched;
        }
    }
    if (matched != kPlugInsOnThePoint) state.SkipWithError("unexpected number of matches");
    state.counters["matches"] = static_cast<double>(matched);
}
BENCHMARK(BM_MatchOnePoint)->Arg(1000)->Arg(10000)->Arg(100000)->Unit(benchmark::kMillisecond);

}  // namespace

BENCHMARK_MAIN();
