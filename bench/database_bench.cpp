// findPlugIn: a cached look-up against one that builds the record from the registry (the cache is emptied before
// every look-up, which costs next to nothing), in one run so that the ratio holds on a noisy machine. The registry and
// the bundles live under the temporary directory.

#include <benchmark/benchmark.h>
#include <stdlib.h>

#include <filesystem>
#include <memory>

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
            uuids.push_back(*workspace->pluginProxyForURL(path)->pluginUUID());
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

}  // namespace

BENCHMARK_MAIN();
