#include <gtest/gtest.h>
#include <stdlib.h>

#include <filesystem>
#include <fstream>

#include "TestSupport.h"
#include "platform/ledgerix/LXApplicationProxy.h"
#include "platform/ledgerix/LXBexilProxy.h"
#include "platform/log/CaptureSink.h"
#include "platform/sandbox/SandboxExtensions.h"
#include "policy/BXDPlugIn.h"
#include "policy/BXMatchRules.h"

namespace bexil {
namespace {

using test::dict;
using test::Entries;
using test::str;

const char* const kAppPath = "/Applications/Greeter.app";
const char* const kHelloPath = "/Applications/Greeter.app/PlugIns/Hello.bxplugin";
const Uuid kHelloUuid = *Uuid::parse("6F1C2A0B-0C3D-4E5F-8A9B-0C1D2E3F4A5B");

// The plug-in dictionary of a well-formed plug-in, with `changes` set in it.
Value plugInDictionary(Entries changes = {}) {
    MutableDictionary entries(dict({
        {"RZExtensionPointIdentifier", str("com.example.greeting")},
        {"RZExtensionProtocol", str("GreetingProvider")},
        {"PrincipalClass", str("HelloGreeting")},
        {"RZExtensionAttributes", dict({{"RZExtensionVersion", str("1.2")}, {"Language", str("en")}})},
    }));
    for (const auto& [key, value] : changes) entries.set(key, value);
    return entries.take();
}

Value helloInfo(Value plugIn = plugInDictionary()) {
    return dict({{"BDBundleIdentifier", str("com.example.greeter.hello")},
                 {"BDBundleVersion", str("7")},
                 {"RZExtension", std::move(plugIn)}});
}

std::shared_ptr<const LXApplicationProxy> greeterApp() {
    LXApplicationProxy::Fields fields;
    fields.bundleURL = kAppPath;
    fields.localizedName = "Greeter";
    return std::make_shared<LXApplicationProxy>(fields, LXApplicationProxy::PlugInList{});
}

// A registry record of a well-formed plug-in inside Greeter.app; tests change the fields they are about.
LXBexilProxy::Fields helloFields() {
    LXBexilProxy::Fields fields;
    fields.bundleURL = kHelloPath;
    fields.pluginIdentifier = "com.example.greeter.hello";
    fields.originalIdentifier = "com.example.hello";
    fields.pluginUUID = kHelloUuid;
    fields.registrationDate = Date{1700000000.75};
    fields.containingBundle = greeterApp();
    fields.dataContainerURL = "/var/lib/bexil/containers/com.example.greeter.hello";
    fields.localizedName = "Hello";
    fields.infoVrec = helloInfo();
    return fields;
}

std::shared_ptr<BXDPlugIn> build(LXBexilProxy::Fields fields) {
    return BXDPlugIn::initWithLXData(std::make_shared<LXBexilProxy>(std::move(fields)));
}

// The diagnosis that made construction fail, read from the info-level line construction logs.
std::string refusal(LXBexilProxy::Fields fields) {
    log::CaptureSink capture;
    EXPECT_EQ(build(std::move(fields)), nullptr);
    auto line = capture.find("ignoring mis-configured plug-in at ");
    return line ? line->message : std::string("(constructed or refused silently)");
}

// The record takes its facts from the registry record and asks it for every look-up, each in its own scope. The
// registration date becomes whole seconds toward zero, held to the 32-bit range of the form instead of wrapping.
TEST(BXDPlugInConstruction, TakesItsFactsFromTheRegistryRecordWithTheDateTruncatedTowardZero) {
    std::shared_ptr<BXDPlugIn> plugIn = build(helloFields());
    ASSERT_NE(plugIn, nullptr);
    EXPECT_EQ(plugIn->originalIdentifier(), "com.example.hello");
    EXPECT_EQ(plugIn->uuid(), kHelloUuid);
    EXPECT_EQ(plugIn->containingUrl(), kAppPath);
    EXPECT_EQ(plugIn->lastModified(), 1700000000);
    EXPECT_EQ(plugIn->protocolSpec(), str("GreetingProvider"));
    EXPECT_EQ(plugIn->infoKey("BDBundleVersion"), str("7"));
    EXPECT_EQ(plugIn->attribute("Language"), str("en"));
    EXPECT_FALSE(plugIn->infoKey("Language"));

    auto fields = helloFields();
    fields.registrationDate = Date{-1.9};
    EXPECT_EQ(build(fields)->lastModified(), -1);
    fields.registrationDate = Date{1e12};
    EXPECT_EQ(build(fields)->lastModified(), INT32_MAX);
}

// The generation decides which protocol the host speaks to the plug-in: an explicit key, else 1 for an old-style
// bundle (configuration under "Bexil"), else 2.
TEST(BXDPlugInConstruction, GenerationFromExplicitKeyOldStyleKeyOrDefault) {
    auto explicitFields = helloFields();
    explicitFields.infoVrec = helloInfo(plugInDictionary({{"HubProtocolVersion", Value::uint64(3)}}));
    EXPECT_EQ(build(explicitFields)->hubProtocolVersion(), 3u);

    // An old-style bundle keeps its configuration under "Bexil" instead of "RZExtension".
    auto oldStyle = helloFields();
    oldStyle.infoVrec = dict({{"BDBundleIdentifier", str("com.example.greeter.hello")}, {"Bexil", plugInDictionary()}});
    EXPECT_EQ(build(oldStyle)->hubProtocolVersion(), 1u);

    EXPECT_EQ(build(helloFields())->hubProtocolVersion(), 2u);
}

// A plug-in that states no version in its attributes has one all the same: the version shown to users, else "1".
// The form carries it and a rule on the version compares against it; a stated version is never replaced.
TEST(BXDPlugInConstruction, VersionFallsBackToTheShortVersionStringThenOne) {
    auto versionOf = [](Value info) {
        auto fields = helloFields();
        fields.infoVrec = std::move(info);
        std::shared_ptr<BXDPlugIn> plugIn = build(fields);
        EXPECT_NE(plugIn, nullptr);
        Result<MutableDictionary> form = plugIn->exportForm();
        EXPECT_TRUE(form);
        EXPECT_EQ(form->value().get("version"), plugIn->version().value_or(Value()));
        EXPECT_TRUE(BXMatchRules::match(dict({{"RZExtensionVersion", plugIn->version().value_or(str("?"))}}), *plugIn,
                                        BXMatchContext{}));
        return plugIn->version();
    };
    Value unversioned = plugInDictionary({{"RZExtensionAttributes", dict({{"Language", str("en")}})}});
    MutableDictionary withShortVersion(helloInfo(unversioned));
    withShortVersion.set("BDBundleShortVersionString", str("2.10"));

    EXPECT_EQ(versionOf(helloInfo()), str("1.2"));
    EXPECT_EQ(versionOf(withShortVersion.take()), str("2.10"));
    EXPECT_EQ(versionOf(helloInfo(unversioned)), str("1"));
    EXPECT_EQ(versionOf(helloInfo(plugInDictionary({{"RZExtensionAttributes", str("not a dictionary")}}))), str("1"));
}

// A registry record without a bundle URL or an identifier yields no record (and no crash); a missing identifier is
// logged with the plug-in's path, which is how its author learns why it is not served.
TEST(BXDPlugInConstruction, MissingUrlOrIdentifierYieldsNothing) {
    auto noUrl = helloFields();
    noUrl.bundleURL.reset();
    EXPECT_EQ(build(noUrl), nullptr);
    auto noIdentifier = helloFields();
    noIdentifier.pluginIdentifier.reset();
    log::CaptureSink capture;
    EXPECT_EQ(build(noIdentifier), nullptr);
    EXPECT_EQ(capture.count(std::string("missing identifier in plug-in at ") + kHelloPath), 1u);
}

// A plug-in that runs code must have a sandbox data container; a data plug-in needs none. The refusal is logged
// with the plug-in's path, the line operators look for.
TEST(BXDPlugInDiagnose, CodeCarryingPlugInNeedsADataContainer) {
    auto fields = helloFields();
    fields.dataContainerURL.reset();
    EXPECT_EQ(refusal(fields), std::string("ignoring mis-configured plug-in at ") + kHelloPath +
                                   ": this plug-in has no sandbox data container");

    fields.infoVrec = helloInfo(plugInDictionary({{"RZExtensionProtocol", str("#Data")}}));
    EXPECT_NE(build(fields), nullptr) << "a data plug-in needs no container";
}

// Outside an application only paths inside /System/ itself pass: not /SystemX, not /System without its separator.
TEST(BXDPlugInDiagnose, OutsideApplicationsOnlyBelowSystem) {
    auto fields = helloFields();
    fields.containingBundle.reset();
    fields.bundleURL = "/System/Library/PlugIns/Clock.bxplugin";
    EXPECT_NE(build(fields), nullptr);

    for (const char* outside : {"/var/tmp/Clock.bxplugin", "/SystemX/Clock.bxplugin", "/System"}) {
        fields.bundleURL = outside;
        EXPECT_EQ(refusal(fields), std::string("ignoring mis-configured plug-in at ") + outside +
                                       ": plug-ins outside containing apps must be in /System")
            << outside;
    }
}

// Entitlements grant privileges, so a false or zero value must not count as held.
TEST(BXDPlugInEntitlements, FalseAndZeroAreNotEntitlementsAndWithoutAnyNothingIsGranted) {
    auto fields = helloFields();
    fields.entitlements = dict({{"false", Value::boolean(false)},
                                {"zero", Value::int64(0)},
                                {"true", Value::boolean(true)},
                                {"text", str("no")}});
    std::shared_ptr<BXDPlugIn> plugIn = build(fields);
    ASSERT_NE(plugIn, nullptr);
    for (const char* no : {"false", "zero", "absent"}) EXPECT_FALSE(plugIn->hasEntitlement(no)) << no;
    for (const char* yes : {"true", "text"}) EXPECT_TRUE(plugIn->hasEntitlement(yes)) << yes;
    EXPECT_FALSE(build(helloFields())->hasEntitlement("true"));
}

// A replacing plug-in keeps the user's election for the plug-in it replaces: the annotation key follows a string
// "replace-plugin" entitlement, and nothing else.
TEST(BXDPlugInEntitlements, AnnotationKeyFollowsAStringReplaceEntitlementOnly) {
    auto fields = helloFields();
    EXPECT_EQ(build(fields)->annotationKey(), "com.example.greeter.hello");
    fields.entitlements = dict({{"com.quorvel.developer.replace-plugin", str("com.example.old.hello")}});
    EXPECT_EQ(build(fields)->annotationKey(), "com.example.old.hello");
    fields.entitlements = dict({{"com.quorvel.developer.replace-plugin", Value::array({str("com.example.old")})}});
    EXPECT_EQ(build(fields)->annotationKey(), "com.example.greeter.hello");
}

// Display names come from the registry on first use and are then kept. The form
// carries what the registry said, and the registry's information dictionary rather than a stored one.
TEST(BXDPlugInInfo, DisplayNamesAreFetchedLazilyAndCached) {
    std::shared_ptr<BXDPlugIn> plugIn = build(helloFields());
    ASSERT_NE(plugIn, nullptr);
    EXPECT_EQ(plugIn->localizedName(), "Hello");
    EXPECT_EQ(plugIn->localizedContainingName(), "Greeter");

    Result<MutableDictionary> form = plugIn->exportForm();
    ASSERT_TRUE(form);
    EXPECT_EQ(form->value().get("localizedContainingDisplayName"), str("Greeter"));
    EXPECT_EQ(form->value().get("bundleInfo"), helloInfo());
}

// Plug-in bundles on disk, so that the sandbox can resolve the paths it issues tokens for.
class BXDPlugInExtensionsTest : public ::testing::Test {
  protected:
    void SetUp() override {
        root_ = dir_.path();
        // The process's sandbox keeps its key under the runtime dir, read once on first use.
        setenv("BX_RUNTIME_DIR", (root_ / "runtime").c_str(), 1);
        std::filesystem::create_directories(root_ / "Greeter.app/PlugIns/Hello.bxplugin/Resources");
        std::ofstream(root_ / "Greeter.app/PlugIns/Hello.bxplugin/Resources/greetings.txt") << "hi";
        std::filesystem::create_directories(root_ / "Greeter.app/PlugIns/Clipper.wexa");
    }

    std::shared_ptr<BXDPlugIn> plugInAt(const std::string& relative, Value plugIn) {
        auto fields = helloFields();
        fields.bundleURL = (root_ / relative).string();
        fields.infoVrec = helloInfo(plugIn);
        return build(fields);
    }

    // The path a token grants, as a consumer over the same key sees it.
    std::string grantedPath(const Value& token) {
        SandboxExtensions consumer(SandboxExtensions::shared().keyPath());
        int64_t handle = consumer.consume(std::string(token.stringView()));
        EXPECT_GT(handle, 0);
        return consumer.consumedPath(handle).value_or("(refused)");
    }

    test::TempDir dir_{"bxdplugin-extensions"};
    std::filesystem::path root_;
};

// Tokens are keyed by the path as declared; elements that are no string are passed over, and a path that gets no
// token is left out with a log line saying why. A plug-in without "Shared" leaves the form alone, one whose
// resources all fail still gets an (empty) "extensions" entry.
TEST_F(BXDPlugInExtensionsTest, SharedResourcesGetTokensKeyedAsDeclared) {
    auto plugIn = plugInAt("Greeter.app/PlugIns/Hello.bxplugin",
                           plugInDictionary({{"Shared", Value::array({str("Resources/greetings.txt"), Value::int64(7),
                                                                      str("Resources/missing.txt")})}}));
    ASSERT_NE(plugIn, nullptr);
    log::CaptureSink capture;
    MutableDictionary form;
    plugIn->augmentForm(form);
    Value extensions = form.value().get("extensions");
    ASSERT_EQ(extensions.count(), 1u) << extensions.description();
    EXPECT_EQ(grantedPath(extensions.get("Resources/greetings.txt")),
              (root_ / "Greeter.app/PlugIns/Hello.bxplugin/Resources/greetings.txt").string());
    EXPECT_TRUE(capture.contains("failed to make extension for " + *plugIn->url() +
                                 "/Resources/missing.txt in plug-in at " + *plugIn->url() +
                                 ": No such file or directory"));
    // A single string is a list of one.
    EXPECT_TRUE(plugIn->issueResourceExtensions(str("Resources")).contains("Resources"));

    MutableDictionary untouched;
    plugInAt("Greeter.app/PlugIns/Hello.bxplugin", plugInDictionary())->augmentForm(untouched);
    EXPECT_EQ(untouched.value(), Value::emptyDictionary());
    MutableDictionary failed;
    plugInAt("Greeter.app/PlugIns/Hello.bxplugin", plugInDictionary({{"Shared", str("nothing")}}))->augmentForm(failed);
    EXPECT_EQ(failed.value(), dict({{"extensions", Value::emptyDictionary()}}));
}

// An application extension's host may read its whole bundle; its "Shared" entry is not used.
TEST_F(BXDPlugInExtensionsTest, ApplicationExtensionGetsOneTokenForItsWholeBundle) {
    auto plugIn = plugInAt("Greeter.app/PlugIns/Clipper.wexa",
                           plugInDictionary({{"PrincipalClass", str("RZObject")}, {"Shared", str("ignored")}}));
    ASSERT_NE(plugIn, nullptr);
    MutableDictionary form;
    plugIn->augmentForm(form);
    Value extensions = form.value().get("extensions");
    ASSERT_EQ(extensions.count(), 1u);
    EXPECT_EQ(grantedPath(extensions.get(".")), *plugIn->url());
}

}  // namespace
}  // namespace bexil
