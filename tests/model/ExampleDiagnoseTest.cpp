// Every mis-configured example bundle is refused by the record's own diagnosis with exactly the message it is
// named after, and every good example passes, so the examples and the checks cannot drift apart.

#include <gtest/gtest.h>

#include <filesystem>
#include <map>

#include "base/Document.h"
#include "model/BXPlugInCore.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;

fs::path examples() { return fs::path(BEXIL_SOURCE_DIR) / "examples" / "bundles"; }

// A record built from a bundle on disk the way a builder does: the identifier from the plug-in dictionary's
// "RZExtensionIdentifier", else the bundle's "BDBundleIdentifier".
std::shared_ptr<BXPlugInCore> recordFor(const fs::path& bundle) {
    Result<Value> info = Document::readFile(bundle / "Info.vrec");
    EXPECT_TRUE(info.ok()) << bundle;
    if (!info.ok()) return nullptr;
    std::optional<std::string> identifier;
    if (const std::string* s = info->get("RZExtension").get("RZExtensionIdentifier").getString()) identifier = *s;
    if (!identifier)
        if (const std::string* s = info->get("BDBundleIdentifier").getString()) identifier = *s;
    if (identifier)
        return BXPlugInCore::initWithNameUrlBundleInfoInfoUuid(identifier, bundle.string(), *info, std::nullopt,
                                                               std::nullopt);
    // Set-up refuses a record without an identifier, so build the bare record the diagnosis still has to judge.
    auto record = std::make_shared<BXPlugInCore>();
    record->setUrl(bundle.string());
    record->setUuid(Uuid::random());
    EXPECT_TRUE(record->setDictionaries(*info));
    return record;
}

TEST(ExampleDiagnose, EachMisconfiguredExampleFailsWithItsMessage) {
    const std::map<std::string, std::string> expected = {
        {"MissingIdentifier.bxplugin", "missing identifier (no RZExtensionIdentifier, nor even BDBundleIdentifier)"},
        {"MissingProtocol.bxplugin", "missing \"RZExtensionProtocol\" key in Info.vrec or SDK"},
        {"MissingAttributes.bxplugin", "missing \"RZExtensionAttributes\" key in Info.vrec or SDK"},
        {"PrincipalClassInAppExtension.wexa", "Application Extensions may not use the \"PrincipalClass\" key"},
        {"PassProxyKey.bxplugin", "the \"PassProxy\" key is not supported on this platform"},
        {"HybridCode.bxplugin", "hybrid plug-ins are not supported on this platform"},
    };
    size_t seen = 0;
    for (const auto& entry : fs::directory_iterator(examples() / "Misconfigured.app" / "PlugIns")) {
        std::string name = entry.path().filename().string();
        auto it = expected.find(name);
        ASSERT_NE(it, expected.end()) << "unexpected example " << name;
        auto record = recordFor(entry.path());
        ASSERT_NE(record, nullptr) << name;
        std::optional<Error> error = record->diagnose();
        ASSERT_TRUE(error) << name << " passed the diagnosis";
        EXPECT_EQ(error->code(), 12) << name;
        EXPECT_EQ(error->localizedDescription(), it->second) << name;
        ++seen;
    }
    EXPECT_EQ(seen, expected.size());
}

TEST(ExampleDiagnose, GoodExamplesPass) {
    for (const fs::path& plugIns : {examples() / "Greeter.app" / "PlugIns", examples() / "Notes.app" / "PlugIns",
                                    examples() / "System" / "Library" / "PlugIns"}) {
        for (const auto& entry : fs::directory_iterator(plugIns)) {
            auto record = recordFor(entry.path());
            ASSERT_NE(record, nullptr) << entry.path();
            std::optional<Error> error = record->diagnose();
            EXPECT_FALSE(error) << entry.path() << ": " << error->description();
        }
    }
}

}  // namespace
}  // namespace bexil
