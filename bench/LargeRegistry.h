#pragma once

// A large registry for the benchmarks that need one: `count` plug-in bundles, ten to an application, spread
// round-robin over `points` extension points, registered straight through the registry library with process-level
// durability (a crash of the machine may lose the last registrations, which a benchmark throws away anyway). Every
// application has an information document, so none of them is a placeholder that discovery would skip.
//
// Such a registry means over 200,000 files and directories. Writing them to this machine's disk takes seconds, but
// removing them takes minutes (every freed block is discarded), so they go to a memory file system when there is one.

#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <vector>

#include "base/Document.h"
#include "bexil/Value.h"
#include "platform/ledgerix/LXBexilProxy.h"
#include "platform/ledgerix/LedgerixWorkspace.h"

namespace bexil::bench {

// A new private directory for a large registry: under $BEXIL_BENCH_TMPDIR when set, else under /dev/shm when it is
// a writable directory, else under the temporary directory.
inline std::filesystem::path makeScratchDirectory(const char* prefix) {
    namespace fs = std::filesystem;
    fs::path base = fs::temp_directory_path();
    if (const char* chosen = std::getenv("BEXIL_BENCH_TMPDIR")) {
        base = chosen;
    } else if (::access("/dev/shm", W_OK | X_OK) == 0) {
        base = "/dev/shm";
    }
    std::string pattern = (base / (std::string(prefix) + "-XXXXXX")).string();
    if (!mkdtemp(pattern.data())) {
        std::fprintf(stderr, "cannot make a directory like %s\n", pattern.c_str());
        std::exit(1);
    }
    return pattern;
}

struct LargeRegistry {
    static constexpr int kPlugInsPerApplication = 10;

    std::vector<Uuid> uuids;  // in registration order
    double writeSeconds = 0;
    double registerSeconds = 0;

    static std::filesystem::path applicationPath(const std::filesystem::path& bundles, int index) {
        return bundles / ("A" + std::to_string(index / kPlugInsPerApplication) + ".app");
    }
    static std::filesystem::path plugInPath(const std::filesystem::path& bundles, int index) {
        return applicationPath(bundles, index) / "PlugIns" / ("P" + std::to_string(index) + ".bxplugin");
    }
    static std::string pointIdentifier(int point) { return "com.example.bench.point" + std::to_string(point); }

    // Writes the bundles under `bundles` and registers them in a registry in `state`. Plug-ins that carry code get
    // a data container each at registration (one directory more per plug-in); data plug-ins do not.
    static LargeRegistry build(const std::filesystem::path& bundles, const std::filesystem::path& state, int count,
                               int points, bool carryCode) {
        namespace fs = std::filesystem;
        LargeRegistry result;
        auto start = std::chrono::steady_clock::now();
        for (int i = 0; i < count; ++i) {
            if (i % kPlugInsPerApplication == 0) {
                fs::path app = applicationPath(bundles, i);
                fs::create_directories(app / "PlugIns");
                std::ofstream(app / "Info.vrec")
                    << Document::write(
                           Value::dictionary({
                               {"BDBundleIdentifier", Value::string("com.example.bench.a" + std::to_string(i))},
                               {"BDBundleName", Value::string("Bench")},
                               {"BDBundleVersion", Value::string("1")},
                           }))
                           .value();
            }
            fs::path bundle = plugInPath(bundles, i);
            fs::create_directory(bundle);
            Value info = Value::dictionary({
                {"BDBundleIdentifier", Value::string("com.example.bench.p" + std::to_string(i))},
                {"BDBundleName", Value::string("P" + std::to_string(i))},
                {"BDBundleVersion", Value::string("1")},
                {"RZExtension",
                 Value::dictionary({
                     {"RZExtensionPointIdentifier", Value::string(pointIdentifier(i % points))},
                     {"RZExtensionProtocol", Value::string(carryCode ? "BenchProtocol" : "#Data")},
                     {"PrincipalClass", Value::string("BenchPrincipal")},
                     {"RZExtensionAttributes", Value::dictionary({{"RZExtensionVersion", Value::string("1.0")},
                                                                  {"Flavour", Value::string("plain")}})},
                 })},
            });
            std::ofstream(bundle / "Info.vrec") << Document::write(info).value();
        }
        auto written = std::chrono::steady_clock::now();

        LedgerixWorkspace::Options options;
        options.stateDirectory = state;
        options.durability = LedgerixWorkspace::Durability::Process;
        Result<std::shared_ptr<LedgerixWorkspace>> workspace = LedgerixWorkspace::open(options);
        if (!workspace.ok()) {
            std::fprintf(stderr, "cannot open a registry in %s\n", state.c_str());
            std::exit(1);
        }
        result.uuids.reserve(static_cast<size_t>(count));
        for (int i = 0; i < count; ++i) {
            auto proxy = (*workspace)->registerPlugin(plugInPath(bundles, i).string());
            if (!proxy.ok()) {
                std::fprintf(stderr, "cannot register %s\n", plugInPath(bundles, i).c_str());
                std::exit(1);
            }
            result.uuids.push_back(*proxy.value()->pluginUUID());
        }
        auto registered = std::chrono::steady_clock::now();
        result.writeSeconds = std::chrono::duration<double>(written - start).count();
        result.registerSeconds = std::chrono::duration<double>(registered - written).count();
        return result;
    }
};

}  // namespace bexil::bench
