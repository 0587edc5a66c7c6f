// The sample plug-ins under examples/bundles, read from disk as a builder reads them, get the diagnosis they are
// there to show: the sound ones pass, each mis-configured one fails with the message it is named after. This is the
// one check of each diagnosis text, which the daemon logs when it ignores a plug-in.

#include <gtest/gtest.h>

#include <filesystem>
#include <string>

#include "TestSupport.h"
#include "model/BXBundle.h"
#include "model/BXPlugInCore.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;

const fs::path kExamples = fs::path(BEXIL_SOURCE_DIR) / "examples" / "bundles";

// A record built from a bundle's information the way a builder does: the identifier from the plug-in dictionary's
// "RZExtensionIdentifier", else the bundle's. Set-up refuses a record without one, so that one is built bare for
// the diagnosis still to judge.
std::shared_ptr<BXPlugInCore> recordFor(const fs::path& bundle, const Value& info) {
    std::optional<std::string> identifier;
    if (const std::string* s = info.get("RZExtension").get("RZExtensionIdentifier").getString()) identifier = *s;
    if (const std::string* s = info.get("BDBundleIdentifier").getString(); s && !identifier) identifier = *s;
    if (identifier)
        return BXPlugInCore::initWithNameUrlBundleInfoInfoUuid(identifier, bundle.string(), info, std::nullopt,
                                                               std::nullopt);
    auto record = std::make_shared<BXPlugInCore>();
    record->setUrl(bundle.string());
    record->setUuid(Uuid::random());
    EXPECT_TRUE(record->setDictionaries(info));
    return record;
}

TEST(ExampleBundles, EachPlugInGetsTheDiagnosisItIsThereToShow) {
    const char* const passes = "(passes)";
    const std::pair<const char*, const char*> plugIns[] = {
        {"Greeter.app/PlugIns/Hello.bxplugin", passes},
        {"Greeter.app/PlugIns/Bonjour.bxplugin", passes},
        {"Greeter.app/PlugIns/NightTheme.bxplugin", passes},
        {"Notes.app/PlugIns/Clipper.wexa", passes},
        {"Notes.app/PlugIns/Stationery.bxplugin", passes},
        {"System/Library/PlugIns/Clock.bxplugin", passes},
        // Refused only for where it lies, which the daemon checks; the record itself is sound.
        {"OutsideApplication.bxplugin", passes},
        {"Misconfigured.app/PlugIns/MissingIdentifier.bxplugin",
         "missing identifier (no RZExtensionIdentifier, nor even BDBundleIdentifier)"},
        {"Misconfigured.app/PlugIns/MissingProtocol.bxplugin",
         "missing \"RZExtensionProtocol\" key in Info.vrec or SDK"},
        {"Misconfigured.app/PlugIns/MissingAttributes.bxplugin",
         "missing \"RZExtensionAttributes\" key in Info.vrec or SDK"},
        {"Misconfigured.app/PlugIns/PrincipalClassInAppExtension.wexa",
         "Application Extensions may not use the \"PrincipalClass\" key"},
        {"Misconfigured.app/PlugIns/PassProxyKey.bxplugin", "the \"PassProxy\" key is not supported on this platform"},
        {"Misconfigured.app/PlugIns/HybridCode.bxplugin", "hybrid plug-ins are not supported on this platform"},
    };
    for (const auto& [path, diagnosis] : plugIns) {
        SCOPED_TRACE(path);
        fs::path bundle = kExamples / path;
        std::optional<Value> info = BXBundle::initWithPath(bundle.string())->infoDictionary();
        ASSERT_TRUE(info);
        auto record = recordFor(bundle, *info);
        ASSERT_NE(record, nullptr);
        std::optional<Error> error = record->diagnose();
        EXPECT_EQ(error ? error->localizedDescription() : passes, diagnosis);
    }
}

}  // namespace
}  // namespace bexil
