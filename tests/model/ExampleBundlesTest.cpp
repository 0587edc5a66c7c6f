// The sample bundles under examples/bundles keep the promises of docs/bundles.md: the table below lists every bundle
// with the facts that make it show what it is there for (its kind, identifier, extension point, the keys and
// entitlements its behaviour depends on) and, for a plug-in, what the record's own diagnosis says of it, so that the
// examples and the checks cannot drift apart.

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
#include "model/BXPlugInCore.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;
using test::dict;
using test::Entries;
using test::str;

const fs::path kExamples = fs::path(BEXIL_SOURCE_DIR) / "examples" / "bundles";

enum class Kind { Application, PlugIn, AppExtension, DataPlugIn, SystemPlugIn, Misconfigured };

struct Example {
    std::string path;  // relative to examples/bundles
    Kind kind;
    const char* identifier = nullptr;  // nullptr: the bundle has none
    const char* point = nullptr;       // a plug-in's extension point; the mis-configured ones share an undeclared one
    Entries facts = {};                // "/"-separated paths into Info.vrec and the values found there
    std::optional<Value> entitlements = std::nullopt;
    const char* diagnosis = nullptr;  // the record's own diagnosis of a plug-in; nullptr: it passes
};

Example application(std::string path, const char* identifier) {
    return {.path = std::move(path), .kind = Kind::Application, .identifier = identifier};
}

// A plug-in whose Info.vrec holds `facts` ("/"-separated paths of keys and their values) beside its point.
Example plugIn(std::string path, Kind kind, const char* identifier, const char* point, Entries facts = {},
               std::optional<Value> entitlements = std::nullopt) {
    return {std::move(path), kind, identifier, point, std::move(facts), std::move(entitlements)};
}

Example misconfigured(std::string path, const char* identifier, const char* diagnosis) {
    return {.path = std::move(path), .kind = Kind::Misconfigured, .identifier = identifier, .diagnosis = diagnosis};
}

const std::vector<Example>& examples() {
    const std::string language = "RZExtension/RZExtensionAttributes/Language";
    const char* const greeting = "com.example.greeting";
    static const std::vector<Example> table = {
        application("Greeter.app", "com.example.greeter"),
        plugIn("Greeter.app/PlugIns/Hello.bxplugin", Kind::PlugIn, "com.example.greeter.hello", greeting,
               {{language, str("en")},
                {"RZExtension/Shared", Value::array({str("Resources/greetings.txt"), str("Resources/Phrases")})}}),
        plugIn("Greeter.app/PlugIns/Bonjour.bxplugin", Kind::PlugIn, "com.example.greeter.bonjour", greeting,
               {{language, str("fr")},
                {"BDBundleExecutable", str("bin/bonjour")},
                {"ZEMService/EnvironmentVariables/GREETING_LANGUAGE", str("fr")}},
               dict({{"com.quorvel.developer.replace-plugin", str("com.example.system.clock")}})),
        plugIn("Greeter.app/PlugIns/NightTheme.bxplugin", Kind::PlugIn, "com.example.greeter.night-theme",
               "com.example.greeter.theme", {{"RZExtension/Dedicated", Value::boolean(true)}}),
        application("Notes.app", "com.example.notes"),
        plugIn("Notes.app/PlugIns/Clipper.wexa", Kind::AppExtension, "com.example.notes.clipper", "com.example.share"),
        plugIn("Notes.app/PlugIns/Stationery.bxplugin", Kind::DataPlugIn, "com.example.notes.stationery",
               "com.example.notes.stationery", {{"RZExtension/Shared", str("Templates")}}),
        plugIn("System/Library/PlugIns/Clock.bxplugin", Kind::SystemPlugIn, "com.example.system.clock", greeting,
               {{language, str("en")}}, dict({{"com.quorvel.developer.auto-elect-plugin", Value::boolean(true)}})),
        application("Misconfigured.app", "com.example.misconfigured"),
        misconfigured("Misconfigured.app/PlugIns/MissingIdentifier.bxplugin", nullptr,
                      "missing identifier (no RZExtensionIdentifier, nor even BDBundleIdentifier)"),
        misconfigured("Misconfigured.app/PlugIns/MissingProtocol.bxplugin",
                      "com.example.misconfigured.missing-protocol",
                      "missing \"RZExtensionProtocol\" key in Info.vrec or SDK"),
        misconfigured("Misconfigured.app/PlugIns/MissingAttributes.bxplugin",
                      "com.example.misconfigured.missing-attributes",
                      "missing \"RZExtensionAttributes\" key in Info.vrec or SDK"),
        misconfigured("Misconfigured.app/PlugIns/PrincipalClassInAppExtension.wexa",
                      "com.example.misconfigured.principal-class-in-app-extension",
                      "Application Extensions may not use the \"PrincipalClass\" key"),
        misconfigured("Misconfigured.app/PlugIns/PassProxyKey.bxplugin", "com.example.misconfigured.pass-proxy-key",
                      "the \"PassProxy\" key is not supported on this platform"),
        misconfigured("Misconfigured.app/PlugIns/HybridCode.bxplugin", "com.example.misconfigured.hybrid-code",
                      "hybrid plug-ins are not supported on this platform"),
        // Refused only for where it lies, which the daemon checks (end-to-end tests); the record itself is sound.
        misconfigured("OutsideApplication.bxplugin", "com.example.outside-application", nullptr),
    };
    return table;
}

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
        // Each mis-configured example fails the record's own diagnosis with the message it is named after; they serve
        // a point without an SDK, so that nothing fills in what they leave out.
        auto record = recordFor(path, *info);
        ASSERT_NE(record, nullptr);
        std::optional<Error> error = record->diagnose();
        EXPECT_EQ(error ? error->localizedDescription() : "(passes)",
                  example.diagnosis ? example.diagnosis : "(passes)");
        EXPECT_EQ(extension.get("RZExtensionPointIdentifier"),
                  str(example.point ? example.point : "com.example.undeclared"));
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
