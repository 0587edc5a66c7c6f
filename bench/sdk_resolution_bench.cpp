// Cost of resolving a plug-in's SDK as a client does when it builds a record from a bundle: set up the record from
// its information dictionary, merge its extension point's SDK under it and canonicalize. The reference in the same
// run is set-up plus canonicalize alone (what a plug-in without an SDK pays); the SDK comes once from a document on
// disk through the real registry (opened at every look-up, parsed again only when the file changed) and once from
// memory, which is the merge alone. Run it as
//   build/release/bench/sdk_resolution_bench --benchmark_repetitions=3 --benchmark_report_aggregates_only=true
// and read the medians.

#include <benchmark/benchmark.h>
#include <stdlib.h>

#include <filesystem>
#include <fstream>
#include <memory>
#include <string>

#include "base/Document.h"
#include "model/BXPlugInCore.h"
#include "platform/sdks/SDKDirectoryRegistry.h"

namespace {

using namespace bexil;
namespace fs = std::filesystem;

constexpr const char* kPoint = "com.quorvel.share-services";

Value str(const char* s) { return Value::string(s); }

// About the size of a real share extension's information dictionary.
Value plugInInfo() {
    Value attributes = Value::dictionary({
        {"RZExtensionVersion", str("4.2.1")},
        {"RZExtensionActivationRule",
         Value::dictionary({{"public.image", Value::int64(10)}, {"public.url", Value::int64(1)}})},
        {"RZExtensionServiceRoleType", str("RZExtensionServiceRoleTypeEditor")},
    });
    Value plugIn = Value::dictionary({
        {"RZExtensionPointIdentifier", str(kPoint)},
        {"PrincipalClass", str("RZObject")},
        {"RZExtensionAttributes", attributes},
        {"Shared", Value::array({str("Resources/Icons"), str("Resources/Templates")})},
        {"CleanTimeout", Value::int64(60)},
    });
    return Value::dictionary({
        {"BDBundleIdentifier", str("com.example.photos.share-extension")},
        {"BDBundleName", str("Share to Photos")},
        {"BDBundleExecutable", str("PhotosShare")},
        {"BDBundleShortVersionString", str("4.2")},
        {"BDBundleVersion", str("4200.17")},
        {"RZExtension", plugIn},
    });
}

// An extension point's defaults: a protocol, a host entitlement, a timeout, shared paths and a few attributes.
Value sdkDictionary() {
    Value attributes = Value::dictionary({
        {"RZExtensionActivationRule", Value::dictionary({{"public.text", Value::int64(1)}})},
        {"RZExtensionServiceAllowsFinderPreviewItem", Value::boolean(false)},
        {"RZExtensionServiceRoleType", str("RZExtensionServiceRoleTypeViewer")},
        {"RZExtensionServiceSubtitle", str("Share")},
    });
    Value plugIn = Value::dictionary({
        {"RZExtensionProtocol", str("ShareServiceProtocol")},
        {"RZExtensionHostEntitlement", str("com.quorvel.private.share-host")},
        {"CleanTimeout", Value::int64(15)},
        {"Shared", Value::array({str("Resources/Icons"), str("Resources/Localizations")})},
        {"RZExtensionAttributes", attributes},
    });
    return Value::dictionary({{"BDMinimumSystemVersion", str("12.0")}, {"RZExtension", plugIn}});
}

std::shared_ptr<BXPlugInCore> setUp(const Value& info) {
    return BXPlugInCore::initWithNameUrlBundleInfoInfoUuid("com.example.photos.share-extension",
                                                           std::string("/Applications/Photos.app/PlugIns/Share.wexa"),
                                                           info, std::nullopt, std::nullopt);
}

class MemorySDK : public ExtensionSDKRegistry {
  public:
    std::optional<Value> copySDKEntry(std::string_view) const override { return sdk; }
    Value sdk = sdkDictionary();
};

// A private SDK directory holding the one document, removed at exit.
struct SDKDirectory {
    SDKDirectory() {
        std::string pattern = (fs::temp_directory_path() / "bx-sdk-bench-XXXXXX").string();
        if (mkdtemp(pattern.data()) != nullptr) path = pattern;
        std::ofstream(path / (std::string(kPoint) + ".vrec")) << Document::write(sdkDictionary()).value();
    }
    ~SDKDirectory() {
        std::error_code ec;
        fs::remove_all(path, ec);
    }
    fs::path path;
};

void BM_SetUpCanonicalize(benchmark::State& state) {
    Value info = plugInInfo();
    for (auto _ : state) {
        auto record = setUp(info);
        record->canonicalize();
        benchmark::DoNotOptimize(record);
    }
}
BENCHMARK(BM_SetUpCanonicalize);

void BM_SetUpResolveSDKFromDisk(benchmark::State& state) {
    SDKDirectory directory;
    auto previous =
        ExtensionSDKRegistry::setShared(std::make_shared<SDKDirectoryRegistry>(std::vector<fs::path>{directory.path}));
    Value info = plugInInfo();
    for (auto _ : state) {
        auto record = setUp(info);
        record->resolveSDK();
        benchmark::DoNotOptimize(record);
    }
    ExtensionSDKRegistry::setShared(previous);
}
BENCHMARK(BM_SetUpResolveSDKFromDisk);

void BM_SetUpResolveSDKFromMemory(benchmark::State& state) {
    auto previous = ExtensionSDKRegistry::setShared(std::make_shared<MemorySDK>());
    Value info = plugInInfo();
    for (auto _ : state) {
        auto record = setUp(info);
        record->resolveSDK();
        benchmark::DoNotOptimize(record);
    }
    ExtensionSDKRegistry::setShared(previous);
}
BENCHMARK(BM_SetUpResolveSDKFromMemory);

}  // namespace

BENCHMARK_MAIN();
