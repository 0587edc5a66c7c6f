// The sample bundles under examples/bundles keep the promises of docs/bundles.md: the table below lists every bundle
// with the facts that make it show what it is there for (its kind, identifier, extension point, the keys and
// entitlements its behaviour depends on). That each mis-configured example fails with the message it is named after
// is checked against the record's own diagnosis (ExampleDiagnoseTest).

#include <gtest/gtest.h>
#include <stdio.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <set>
#include <string>
#include <vector>

#include "TestSupport.h"
#include "base/Document.h"
#include "model/BXBundle.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;
using test::dict;
using test::Entries;
using test::str;

const fs::path kExamples = fs::path(BEXIL_SOURCE_DIR) / "examples" / "bundles";

enum class Kind { Application, PlugIn, AppExtension, DataPlugIn, SystemPlugIn, Misconfigured };

struct Example {
    std::string path;        // relative to examples/bundles
    Kind kind;
    const char* identifier;  // nullptr: the bundle has none
    const char* point;       // the extension point of a plug-in
    Entries facts;           // "/"-separated paths into Info.vrec and the values found there
    std::optional<Value> entitlements;
};

const std::vector<Example>& examples() {
    const std::string point = "RZExtension/RZExtensionPointIdentifier";
    const std::string language = "RZExtension/RZExtensionAttributes/Language";
    static const std::vector<Example> table = {
        {"Greeter.app", Kind::Application, "com.example.greeter", nullptr, {}, std::nullopt},
        {"Greeter.app/PlugIns/Hello.bxplugin", Kind::PlugIn, "com.example.greeter.hello", "com.example.greeting",
         {{language, str("en")},
          {"RZExtension/Shared", Value::array({str("Resources/greetings.txt"), str("Resources/Phrases")})}},
         std::nullopt},
        {"Greeter.app/PlugIns/Bonjour.bxplugin", Kind::PlugIn, "com.example.greeter.bonjour", "com.example.greeting",
         {{language, str("fr")},
          {"BDBundleExecutable", str("bin/bonjour")},
          {"ZEMService/EnvironmentVariables/GREETING_LANGUAGE", str("fr")}},
         dict({{"com.quorvel.developer.replace-plugin", str("com.example.system.clock")}})},
        {"Greeter.app/PlugIns/NightTheme.bxplugin", Kind::PlugIn, "com.example.greeter.night-theme",
         "com.example.greeter.theme", {{"RZExtension/Dedicated", Value::boolean(true)}}, std::nullopt},
        {"Notes.app", Kind::Application, "com.example.notes", nullptr, {}, std::nullopt},
        {"Notes.app/PlugIns/Clipper.wexa", Kind::AppExtension, "com.example.notes.clipper", "com.example.share", {},
         std::nullopt},
        {"Notes.app/PlugIns/Stationery.bxplugin", Kind::DataPlugIn, "com.example.notes.stationery",
         "com.example.notes.stationery", {{"RZExtension/Shared", str("Templates")}}, std::nullopt},
        {"System/Library/PlugIns/Clock.bxplugin", Kind::SystemPlugIn, "com.example.system.clock",
         "com.example.greeting", {{language, str("en")}},
         dict({{"com.quorvel.developer.auto-elect-plugin", Value::boolean(true)}})},
        {"Misconfigured.app", Kind::Application, "com.example.misconfigured", nullptr, {}, std::nullopt},
        {"Misconfigured.app/PlugIns/MissingIdentifier.bxplugin", Kind::Misconfigured, nullptr, nullptr, {},
         std::nullopt},
        {"Misconfigured.app/PlugIns/MissingProtocol.bxplugin", Kind::Misconfigured,
         "com.example.misconfigured.missing-protocol", nullptr, {}, std::nullopt},
        {"Misconfigured.app/PlugIns/MissingAttributes.bxplugin", Kind::Misconfigured,
         "com.example.misconfigured.missing-attributes", nullptr, {}, std::nullopt},
        {"Misconfigured.app/PlugIns/PrincipalClassInAppExtension.wexa", Kind::Misconfigured,
         "com.example.misconfigured.principal-class-in-app-extension", nullptr, {}, std::nullopt},
        {"Misconfigured.app/PlugIns/PassProxyKey.bxplugin", Kind::Misconfigured,
         "com.example.misconfigured.pass-proxy-key", nullptr, {}, std::nullopt},
        {"Misconfigured.app/PlugIns/HybridCode.bxplugin", Kind::Misconfigured, "com.example.misconfigured.hybrid-code",
         nullptr, {}, std::nullopt},
        {"OutsideApplication.bxplugin", Kind::Misconfigured, "com.example.outside-application", nullptr, {},
         std::nullopt},
    };
    return table;
}

// The value at a "/"-separated path of dictionary keys, or a null Value.
Value at(const Value& info, std::string_view path) {
    Value value = info;
    for (size_t start = 0; start <= path.size();) {
        size_t end = std::min(path.find('/', start), path.size());
        value = value.get(path.substr(start, end - start));
        start = end + 1;
    }
    return value;
}

TEST(ExampleBundles, EveryBundleOnDiskIsInTheTable) {
    std::set<std::string> listed;
    for (const Example& example : examples()) listed.insert(example.path);
    for (const auto& entry : fs::recursive_directory_iterator(kExamples)) {
        if (entry.path().filename() != "Info.vrec") continue;
        std::string relative = fs::relative(entry.path().parent_path(), kExamples).string();
        EXPECT_TRUE(listed.contains(relative)) << relative << " is not described in the example table";
    }
}

TEST(ExampleBundles, BundlesShowWhatTheTableSaysTheyShow) {
    for (const Example& example : examples()) {
        SCOPED_TRACE(example.path);
        fs::path path = kExamples / example.path;
        std::string root = fs::canonical(path).string();
        auto bundle = BXBundle::initWithPath(path.string());
        std::optional<Value> info = bundle->infoDictionary();
        ASSERT_TRUE(info);
        for (const char* key : {"BDBundleName", "BDBundleDisplayName", "BDBundleVersion", "BDBundleShortVersionString"})
            EXPECT_TRUE(info->get(key).isString()) << key;
        EXPECT_EQ(bundle->bundleIdentifier(),
                  example.identifier ? std::optional<std::string>(example.identifier) : std::nullopt);
        for (const auto& [where, value] : example.facts) EXPECT_EQ(at(*info, where), value) << where;
        Result<Value> entitlements = Document::readFile(path / "Entitlements.vrec");
        EXPECT_EQ(entitlements.ok(), example.entitlements.has_value());
        if (entitlements.ok() && example.entitlements) {
            EXPECT_EQ(*entitlements, *example.entitlements);
        }

        const Value extension = info->get("RZExtension");
        if (example.kind == Kind::Application) {
            EXPECT_TRUE(extension.isNull());
            EXPECT_TRUE(fs::is_directory(*bundle->plugInsPath()));
            continue;
        }
        // The mis-configured examples serve a point without an SDK, so that nothing fills in what they leave out.
        EXPECT_EQ(extension.get("RZExtensionPointIdentifier"),
                  str(example.point ? example.point : "com.example.undeclared"));
        if (Value attributes = extension.get("RZExtensionAttributes"); attributes.isDictionary()) {
            EXPECT_TRUE(attributes.get("RZExtensionVersion").isString());
        }
        if (example.kind == Kind::PlugIn || example.kind == Kind::SystemPlugIn) {
            EXPECT_TRUE(extension.get("RZExtensionProtocol").isString());
            EXPECT_TRUE(extension.get("PrincipalClass").isString());
        }
        if (example.kind == Kind::AppExtension) {
            EXPECT_TRUE(example.path.ends_with(".wexa"));
            EXPECT_FALSE(extension.contains("RZExtensionProtocol"));
            EXPECT_FALSE(extension.contains("PrincipalClass"));
        }
        EXPECT_EQ(extension.get("RZExtensionProtocol") == str("#Data"), example.kind == Kind::DataPlugIn);
        EXPECT_EQ(example.path.starts_with("System/"), example.kind == Kind::SystemPlugIn);

        // Shared resources are real files or directories inside the bundle.
        Value shared = extension.get("Shared");
        std::vector<Value> resources(shared.items().begin(), shared.items().end());
        if (shared.isString()) resources.push_back(shared);
        for (const Value& resource : resources) {
            fs::path target = path / std::string(resource.stringView());
            EXPECT_TRUE(fs::exists(target)) << target;
            EXPECT_TRUE(fs::canonical(target).string().starts_with(root + "/")) << target;
        }
    }
}

// Each executable, however deep inside its bundle, leads back to the bundle, runs, and says which bundle it is.
TEST(ExampleBundles, ExecutablesRunAndLeadBackToTheirBundle) {
    for (const Example& example : examples()) {
        SCOPED_TRACE(example.path);
        std::string root = fs::canonical(kExamples / example.path).string();
        auto bundle = BXBundle::initWithPath(root);
        std::optional<std::string> executable = bundle->stringProperty(BundleStringProperty::ExecutablePath);
        if (example.kind == Kind::DataPlugIn) {
            EXPECT_FALSE(executable);
            EXPECT_EQ(bundle->executablePath(), root);
            continue;
        }
        ASSERT_TRUE(executable);
        Value named = bundle->infoDictionary()->get("BDBundleExecutable");
        EXPECT_EQ(*executable, root + "/" + std::string(named.stringView()));
        EXPECT_EQ(BXBundle::initWithExecutablePath(*executable)->path(), root);

        std::string output;
        FILE* pipe = popen(("'" + *executable + "' 2>&1").c_str(), "r");
        ASSERT_NE(pipe, nullptr);
        char buffer[256];
        for (size_t n; (n = fread(buffer, 1, sizeof buffer, pipe)) > 0;) output.append(buffer, n);
        int status = pclose(pipe);
        EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << output;
        if (example.identifier) {
            EXPECT_NE(output.find("(" + std::string(example.identifier) + ")"), std::string::npos) << output;
        }
    }
}

}  // namespace
}  // namespace bexil
