// The sample bundles under examples/bundles, defined once here. The tests check that every Info.vrec and
// Entitlements.vrec on disk holds exactly what this table says and that each bundle keeps the promises of
// docs/bundles.md. That each mis-configured example fails with the message it is named after is checked against
// the record's own diagnosis (ExampleDiagnoseTest) rather than a second copy of its checks here.
//
// After changing the table, rewrite the documents with
//     BX_WRITE_EXAMPLE_BUNDLES=1 build/debug/tests/model_tests --gtest_filter='ExampleBundles.*'
// and commit them together with the change.

#include <gtest/gtest.h>
#include <stdio.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
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

const fs::path kExamples = fs::path(BEXIL_SOURCE_DIR) / "examples" / "bundles";

enum class Kind { Application, PlugIn, AppExtension, DataPlugIn, SystemPlugIn, Misconfigured };

struct Example {
    std::string path;  // relative to examples/bundles
    Kind kind;
    Value info;
    std::optional<Value> entitlements;
};

using test::dict;
using test::Entries;
using test::str;

// The top-level keys every example bundle carries, plus `more`.
Value bundleInfo(const char* identifier, const char* name, const char* version, std::optional<const char*> executable,
                 Entries more) {
    Entries entries = {
        {"BDBundleName", str(name)},
        {"BDBundleDisplayName", str(name)},
        {"BDBundleVersion", str("1")},
        {"BDBundleShortVersionString", str(version)},
    };
    if (identifier != nullptr) entries.emplace_back("BDBundleIdentifier", str(identifier));
    if (executable) entries.emplace_back("BDBundleExecutable", str(*executable));
    for (auto& entry : more) entries.push_back(std::move(entry));
    return dict(std::move(entries));
}

Value attributes(const char* version, Entries more = {}) {
    more.emplace_back("RZExtensionVersion", str(version));
    return dict(std::move(more));
}

// The plug-in dictionary of the mis-configured examples before each loses or gains its one fault. Their point has
// no SDK, so nothing fills in what they leave out.
Entries undeclaredPoint(const char* principal) {
    return {{"RZExtensionPointIdentifier", str("com.example.undeclared")},
            {"RZExtensionProtocol", str("GreetingProvider")},
            {"PrincipalClass", str(principal)},
            {"RZExtensionAttributes", attributes("1.0")}};
}

Value misconfigured(const char* identifier, const char* name, const char* executable, Entries extension) {
    return bundleInfo(identifier, name, "1.0", executable, {{"RZExtension", dict(std::move(extension))}});
}

Entries without(Entries entries, const std::string& key) {
    std::erase_if(entries, [&](const auto& entry) { return entry.first == key; });
    return entries;
}

Entries with(Entries entries, const std::string& key, Value value) {
    entries.emplace_back(key, std::move(value));
    return entries;
}

const std::vector<Example>& examples() {
    static const std::vector<Example> table = {
        {"Greeter.app", Kind::Application, bundleInfo("com.example.greeter", "Greeter", "1.0", "greeter", {}),
         std::nullopt},
        {"Greeter.app/PlugIns/Hello.bxplugin", Kind::PlugIn,
         bundleInfo("com.example.greeter.hello", "Hello", "1.2", "hello",
                    {{"RZExtension",
                      dict({{"RZExtensionPointIdentifier", str("com.example.greeting")},
                            {"RZExtensionProtocol", str("GreetingProvider")},
                            {"PrincipalClass", str("HelloGreeting")},
                            {"RZExtensionAttributes", attributes("1.2", {{"Language", str("en")}})},
                            {"Shared", Value::array({str("Resources/greetings.txt"), str("Resources/Phrases")})}})}}),
         std::nullopt},
        {"Greeter.app/PlugIns/Bonjour.bxplugin", Kind::PlugIn,
         bundleInfo("com.example.greeter.bonjour", "Bonjour", "1.0", "bin/bonjour",
                    {{"RZExtension", dict({{"RZExtensionPointIdentifier", str("com.example.greeting")},
                                           {"RZExtensionProtocol", str("GreetingProvider")},
                                           {"PrincipalClass", str("BonjourGreeting")},
                                           {"RZExtensionAttributes", attributes("1.0", {{"Language", str("fr")}})}})},
                     {"ZEMService", dict({{"EnvironmentVariables", dict({{"GREETING_LANGUAGE", str("fr")}})}})}}),
         dict({{"com.quorvel.developer.replace-plugin", str("com.example.system.clock")}})},
        {"Greeter.app/PlugIns/NightTheme.bxplugin", Kind::PlugIn,
         bundleInfo(
             "com.example.greeter.night-theme", "Night Theme", "2.0", "night-theme",
             {{"RZExtension", dict({{"RZExtensionPointIdentifier", str("com.example.greeter.theme")},
                                    {"RZExtensionProtocol", str("ThemeProvider")},
                                    {"PrincipalClass", str("NightTheme")},
                                    {"Dedicated", Value::boolean(true)},
                                    {"RZExtensionAttributes", attributes("2.0", {{"Appearance", str("dark")}})}})}}),
         std::nullopt},
        {"Notes.app", Kind::Application, bundleInfo("com.example.notes", "Notes", "3.1", "notes", {}), std::nullopt},
        {"Notes.app/PlugIns/Clipper.wexa", Kind::AppExtension,
         bundleInfo("com.example.notes.clipper", "Clipper", "1.0", "clipper",
                    {{"RZExtension", dict({{"RZExtensionPointIdentifier", str("com.example.share")},
                                           {"RZExtensionAttributes", attributes("1.0")}})}}),
         std::nullopt},
        {"Notes.app/PlugIns/Stationery.bxplugin", Kind::DataPlugIn,
         bundleInfo(
             "com.example.notes.stationery", "Stationery", "1.0", std::nullopt,
             {{"RZExtension", dict({{"RZExtensionPointIdentifier", str("com.example.notes.stationery")},
                                    {"RZExtensionProtocol", str("#Data")},
                                    {"RZExtensionAttributes", attributes("1.0", {{"TemplateCount", Value::int64(2)}})},
                                    {"Shared", str("Templates")}})}}),
         std::nullopt},
        {"System/Library/PlugIns/Clock.bxplugin", Kind::SystemPlugIn,
         bundleInfo("com.example.system.clock", "Clock", "1.0", "clock",
                    {{"RZExtension", dict({{"RZExtensionPointIdentifier", str("com.example.greeting")},
                                           {"RZExtensionProtocol", str("GreetingProvider")},
                                           {"PrincipalClass", str("ClockGreeting")},
                                           {"RZExtensionAttributes", attributes("1.0", {{"Language", str("en")}})}})}}),
         dict({{"com.quorvel.developer.auto-elect-plugin", Value::boolean(true)}})},
        {"Misconfigured.app", Kind::Application,
         bundleInfo("com.example.misconfigured", "Misconfigured", "1.0", "misconfigured", {}), std::nullopt},
        {"Misconfigured.app/PlugIns/MissingIdentifier.bxplugin", Kind::Misconfigured,
         misconfigured(nullptr, "MissingIdentifier", "missing-identifier", undeclaredPoint("Greeting")), std::nullopt},
        {"Misconfigured.app/PlugIns/MissingProtocol.bxplugin", Kind::Misconfigured,
         misconfigured("com.example.misconfigured.missing-protocol", "MissingProtocol", "missing-protocol",
                       without(undeclaredPoint("Greeting"), "RZExtensionProtocol")),
         std::nullopt},
        {"Misconfigured.app/PlugIns/MissingAttributes.bxplugin", Kind::Misconfigured,
         misconfigured("com.example.misconfigured.missing-attributes", "MissingAttributes", "missing-attributes",
                       without(undeclaredPoint("Greeting"), "RZExtensionAttributes")),
         std::nullopt},
        {"Misconfigured.app/PlugIns/PrincipalClassInAppExtension.wexa", Kind::Misconfigured,
         misconfigured("com.example.misconfigured.principal-class-in-app-extension", "PrincipalClassInAppExtension",
                       "principal-class-in-app-extension", undeclaredPoint("ClipperController")),
         std::nullopt},
        {"Misconfigured.app/PlugIns/PassProxyKey.bxplugin", Kind::Misconfigured,
         misconfigured("com.example.misconfigured.pass-proxy-key", "PassProxyKey", "pass-proxy-key",
                       with(undeclaredPoint("Greeting"), "PassProxy", Value::boolean(true))),
         std::nullopt},
        {"Misconfigured.app/PlugIns/HybridCode.bxplugin", Kind::Misconfigured,
         misconfigured("com.example.misconfigured.hybrid-code", "HybridCode", "hybrid-code",
                       with(undeclaredPoint("Greeting"), "EmbeddedCode", Value::boolean(true))),
         std::nullopt},
        {"OutsideApplication.bxplugin", Kind::Misconfigured,
         misconfigured("com.example.outside-application", "OutsideApplication", "outside-application",
                       undeclaredPoint("Greeting")),
         std::nullopt},
    };
    return table;
}

bool endsWith(std::string_view text, std::string_view suffix) {
    return text.size() >= suffix.size() && text.substr(text.size() - suffix.size()) == suffix;
}

struct RunResult {
    int status = -1;
    std::string output;
};

RunResult run(const fs::path& program) {
    RunResult result;
    std::string command = "'" + program.string() + "' 2>&1";
    FILE* pipe = popen(command.c_str(), "r");
    if (pipe == nullptr) return result;
    char buffer[256];
    size_t n = 0;
    while ((n = fread(buffer, 1, sizeof buffer, pipe)) > 0) result.output.append(buffer, n);
    result.status = pclose(pipe);
    return result;
}

TEST(ExampleBundles, DocumentsOnDiskHoldWhatTheTableSays) {
    const bool rewrite = std::getenv("BX_WRITE_EXAMPLE_BUNDLES") != nullptr;
    for (const Example& example : examples()) {
        SCOPED_TRACE(example.path);
        fs::path bundle = kExamples / example.path;
        if (rewrite) {
            ASSERT_FALSE(Document::writeFileAtomically(bundle / "Info.vrec", example.info));
            if (example.entitlements) {
                ASSERT_FALSE(Document::writeFileAtomically(bundle / "Entitlements.vrec", *example.entitlements));
            }
        }
        Result<Value> info = Document::readFile(bundle / "Info.vrec");
        ASSERT_TRUE(info.ok()) << info.error().description();
        EXPECT_EQ(*info, example.info) << info->description();

        if (example.entitlements) {
            Result<Value> entitlements = Document::readFile(bundle / "Entitlements.vrec");
            ASSERT_TRUE(entitlements.ok()) << entitlements.error().description();
            EXPECT_EQ(*entitlements, *example.entitlements);
        } else {
            EXPECT_FALSE(fs::exists(bundle / "Entitlements.vrec"));
        }
    }
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

TEST(ExampleBundles, BundlesKeepThePromisesOfTheFormat) {
    for (const Example& example : examples()) {
        SCOPED_TRACE(example.path);
        fs::path path = kExamples / example.path;
        std::string root = fs::canonical(path).string();
        auto bundle = BXBundle::initWithPath(path.string());
        ASSERT_EQ(bundle->path(), root);
        std::optional<Value> info = bundle->infoDictionary();
        ASSERT_TRUE(info);
        for (const char* key : {"BDBundleName", "BDBundleDisplayName", "BDBundleVersion", "BDBundleShortVersionString"})
            EXPECT_TRUE(info->get(key).isString()) << key;
        if (std::optional<std::string> identifier = bundle->bundleIdentifier()) {
            EXPECT_TRUE(identifier->starts_with("com.example.")) << *identifier;
        }

        if (example.kind == Kind::Application) {
            EXPECT_TRUE(bundle->bundleIdentifier());
            EXPECT_FALSE(info->contains("RZExtension"));
            EXPECT_TRUE(fs::is_directory(*bundle->plugInsPath()));
        } else {
            const Value extension = info->get("RZExtension");
            ASSERT_TRUE(extension.isDictionary());
            EXPECT_TRUE(extension.get("RZExtensionPointIdentifier").isString());
            if (extension.get("RZExtensionAttributes").isDictionary()) {
                EXPECT_TRUE(extension.get("RZExtensionAttributes").get("RZExtensionVersion").isString());
            }
        }

        const Value extension = info->get("RZExtension");
        switch (example.kind) {
            case Kind::AppExtension:
                EXPECT_TRUE(endsWith(example.path, ".wexa"));
                EXPECT_FALSE(extension.contains("RZExtensionProtocol"));
                EXPECT_FALSE(extension.contains("PrincipalClass"));
                break;
            case Kind::DataPlugIn:
                EXPECT_EQ(extension.get("RZExtensionProtocol"), Value::string("#Data"));
                EXPECT_FALSE(info->contains("BDBundleExecutable"));
                EXPECT_EQ(bundle->executablePath(), root);
                break;
            case Kind::SystemPlugIn:
                EXPECT_TRUE(example.path.starts_with("System/"));
                break;
            default:
                break;
        }

        // Shared resources are real files or directories inside the bundle.
        Value shared = extension.get("Shared");
        std::vector<Value> sharedPaths(shared.items().begin(), shared.items().end());
        if (shared.isString()) sharedPaths.push_back(shared);
        for (const Value& resource : sharedPaths) {
            ASSERT_TRUE(resource.isString());
            fs::path target = path / std::string(resource.stringView());
            EXPECT_TRUE(fs::exists(target)) << target;
            EXPECT_TRUE(fs::canonical(target).string().starts_with(root + "/")) << target;
        }
    }
}

TEST(ExampleBundles, ExecutablesRunAndLeadBackToTheirBundle) {
    for (const Example& example : examples()) {
        if (!example.info.contains("BDBundleExecutable")) continue;
        SCOPED_TRACE(example.path);
        fs::path path = kExamples / example.path;
        std::string root = fs::canonical(path).string();
        auto bundle = BXBundle::initWithPath(path.string());
        std::optional<std::string> executable = bundle->stringProperty(BundleStringProperty::ExecutablePath);
        ASSERT_TRUE(executable);
        EXPECT_EQ(*executable, root + "/" + std::string(example.info.get("BDBundleExecutable").stringView()));
        EXPECT_EQ(access(executable->c_str(), X_OK), 0) << "not executable";
        EXPECT_EQ(BXBundle::initWithExecutablePath(*executable)->path(), root);

        RunResult ran = run(*executable);
        EXPECT_TRUE(WIFEXITED(ran.status) && WEXITSTATUS(ran.status) == 0) << ran.output;
        // Each program says who it is.
        if (std::optional<std::string> identifier = bundle->bundleIdentifier()) {
            EXPECT_NE(ran.output.find("(" + *identifier + ")"), std::string::npos) << ran.output;
        }
    }
}

}  // namespace
}  // namespace bexil
