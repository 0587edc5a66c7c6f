#include <gtest/gtest.h>
#include <stdlib.h>

#include <filesystem>
#include <fstream>
#include <unordered_set>

#include "TestSupport.h"
#include "platform/ledgerix/LXApplicationProxy.h"
#include "platform/ledgerix/LXBexilProxy.h"
#include "platform/log/CaptureSink.h"
#include "platform/sandbox/SandboxExtensions.h"
#include "policy/BXDPlugIn.h"

namespace bexil {
namespace {

using test::dict;
using test::Entries;
using test::str;

const char* const kAppPath = "/Applications/Greeter.app";
const char* const kHelloPath = "/Applications/Greeter.app/PlugIns/Hello.bxplugin";
const Uuid kHelloUuid = *Uuid::parse("6F1C2A0B-0C3D-4E5F-8A9B-0C1D2E3F4A5B");

Value plugInDictionary(Entries extra = {}) {
    Entries entries = {
        {"RZExtensionPointIdentifier", str("com.example.greeting")},
        {"RZExtensionProtocol", str("GreetingProvider")},
        {"PrincipalClass", str("HelloGreeting")},
        {"RZExtensionAttributes", dict({{"RZExtensionVersion", str("1.2")}, {"Language", str("en")}})},
    };
    for (auto& e : extra) {
        std::erase_if(entries, [&](const auto& have) { return have.first == e.first; });
        entries.push_back(std::move(e));
    }
    return dict(std::move(entries));
}

Value helloInfo(std::optional<Value> plugIn = std::nullopt, Entries extra = {}) {
    Entries entries = {
        {"BDBundleIdentifier", str("com.example.greeter.hello")},
        {"BDBundleVersion", str("7")},
        {"RZExtension", plugIn ? *plugIn : plugInDictionary()},
    };
    for (auto& e : extra) entries.push_back(std::move(e));
    return dict(std::move(entries));
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
    fields.originalIdentifier = "com.example.greeter.hello";
    fields.pluginUUID = kHelloUuid;
    fields.registrationDate = Date{1700000000.75};
    fields.containingBundle = greeterApp();
    fields.dataContainerURL = "/var/lib/bexil/containers/com.example.greeter.hello";
    fields.localizedName = "Hello";
    fields.localizedShortName = "Hi";
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

TEST(BXDPlugInConstruction, TakesItsFactsFromTheRegistryRecordWithTheDateTruncatedTowardZero) {
    std::shared_ptr<BXDPlugIn> plugIn = build(helloFields());
    ASSERT_NE(plugIn, nullptr);
    EXPECT_EQ(plugIn->identifier(), "com.example.greeter.hello");
    EXPECT_EQ(plugIn->url(), kHelloPath);
    EXPECT_EQ(plugIn->uuid(), kHelloUuid);
    EXPECT_EQ(plugIn->containingUrl(), kAppPath);
    EXPECT_EQ(plugIn->lastModified(), 1700000000);
    EXPECT_FALSE(plugIn->onSystemVolume());
    EXPECT_EQ(plugIn->plugInDictionary(), plugInDictionary());
    EXPECT_EQ(plugIn->bundleInfoDictionary(), helloInfo());
    EXPECT_EQ(plugIn->protocolSpec(), str("GreetingProvider"));
    EXPECT_EQ(plugIn->version(), str("1.2"));
    EXPECT_EQ(plugIn->infoKey("BDBundleVersion"), str("7"));
    EXPECT_EQ(plugIn->attribute("Language"), str("en"));
    EXPECT_EQ(plugIn->lxproxy()->bundleURL(), kHelloPath);

    // The registration date is truncated toward zero and saturates.
    auto fields = helloFields();
    fields.registrationDate = Date{-1.9};
    EXPECT_EQ(build(fields)->lastModified(), -1);
    fields.registrationDate = Date{1e12};
    EXPECT_EQ(build(fields)->lastModified(), INT32_MAX) << "out-of-range dates saturate instead of wrapping";
}

TEST(BXDPlugInConstruction, GenerationFromExplicitKeyOldStyleKeyOrDefault) {
    auto explicitFields = helloFields();
    explicitFields.infoVrec = helloInfo(plugInDictionary({{"HubProtocolVersion", Value::uint64(3)}}));
    EXPECT_EQ(build(explicitFields)->hubProtocolVersion(), 3u);

    // An old-style bundle keeps its configuration under "Bexil" instead of "RZExtension".
    auto oldStyle = helloFields();
    oldStyle.infoVrec = dict({{"BDBundleIdentifier", str("com.example.greeter.hello")}, {"Bexil", plugInDictionary()}});
    std::shared_ptr<BXDPlugIn> old = build(oldStyle);
    ASSERT_NE(old, nullptr);
    EXPECT_EQ(old->hubProtocolVersion(), 1u);

    EXPECT_EQ(build(helloFields())->hubProtocolVersion(), 2u);
}

TEST(BXDPlugInConstruction, MissingUrlOrIdentifierYieldsNothingMissingUuidARandomOne) {
    log::CaptureSink capture;
    auto noUrl = helloFields();
    noUrl.bundleURL.reset();
    EXPECT_EQ(build(noUrl), nullptr);
    EXPECT_TRUE(capture.entries().empty()) << "a record without a bundle URL is refused silently";

    auto noIdentifier = helloFields();
    noIdentifier.pluginIdentifier.reset();
    EXPECT_EQ(build(noIdentifier), nullptr);
    EXPECT_TRUE(capture.contains(std::string("missing identifier in plug-in at ") + kHelloPath));

    auto fields = helloFields();
    fields.pluginUUID.reset();
    std::shared_ptr<BXDPlugIn> a = build(fields);
    std::shared_ptr<BXDPlugIn> b = build(fields);
    ASSERT_TRUE(a && b && a->uuid() && b->uuid());
    EXPECT_NE(*a->uuid(), *b->uuid());
}

TEST(BXDPlugInConstruction, TwoRecordsOfOneRegistryRecordAreEqualAndHashAlike) {
    auto proxy = std::make_shared<LXBexilProxy>(helloFields());
    std::shared_ptr<BXDPlugIn> a = BXDPlugIn::initWithLXData(proxy);
    std::shared_ptr<BXDPlugIn> b = BXDPlugIn::initWithLXData(proxy);
    ASSERT_TRUE(a && b);
    EXPECT_NE(a.get(), b.get());
    EXPECT_TRUE(*a == *b);
    EXPECT_EQ(a->hash(), b->hash());
    std::unordered_set<std::shared_ptr<BXDPlugIn>, BXPlugInCoreHash, BXPlugInCoreEqual> set{a, b};
    EXPECT_EQ(set.size(), 1u);
}

TEST(BXDPlugInDiagnose, BaseChecksStillApplyAndCodeCarryingPlugInNeedsADataContainer) {
    auto fields = helloFields();
    fields.infoVrec = helloInfo(plugInDictionary({{"PassProxy", Value::boolean(true)}}));
    EXPECT_NE(refusal(fields).find(": the \"PassProxy\" key is not supported on this platform"), std::string::npos);

    fields = helloFields();
    fields.dataContainerURL.reset();
    EXPECT_EQ(refusal(fields), std::string("ignoring mis-configured plug-in at ") + kHelloPath +
                                   ": this plug-in has no sandbox data container");

    fields.infoVrec = helloInfo(plugInDictionary({{"RZExtensionProtocol", str("#Data")}}));
    std::shared_ptr<BXDPlugIn> data = build(fields);
    ASSERT_NE(data, nullptr) << "a data plug-in needs no container";
    EXPECT_TRUE(data->isData());
}

TEST(BXDPlugInDiagnose, OutsideApplicationsOnlyBelowSystemWithCode12InTheBexilDomain) {
    auto fields = helloFields();
    fields.containingBundle.reset();
    fields.bundleURL = "/System/Library/PlugIns/Clock.bxplugin";
    std::shared_ptr<BXDPlugIn> system = build(fields);
    ASSERT_NE(system, nullptr);
    EXPECT_FALSE(system->containingUrl());
    EXPECT_FALSE(system->diagnose());

    for (const char* outside : {"/var/tmp/Clock.bxplugin", "/SystemX/Clock.bxplugin", "/System"}) {
        fields.bundleURL = outside;
        EXPECT_EQ(refusal(fields), std::string("ignoring mis-configured plug-in at ") + outside +
                                       ": plug-ins outside containing apps must be in /System")
            << outside;
    }

    std::shared_ptr<BXDPlugIn> plugIn = build(helloFields());
    ASSERT_NE(plugIn, nullptr);
    plugIn->setContainingUrl(std::nullopt);
    std::optional<Error> error = plugIn->diagnose();
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->isBexil());
    EXPECT_EQ(error->code(), 12);
    EXPECT_EQ(error->localizedDescription(), "plug-ins outside containing apps must be in /System");
}

TEST(BXDPlugInEntitlements, FalseAndZeroAreNotEntitlementsAndWithoutAnyNothingIsGranted) {
    auto fields = helloFields();
    fields.entitlements = dict({{"false", Value::boolean(false)},
                                {"zero", Value::int64(0)},
                                {"zeroReal", Value::real(0.0)},
                                {"true", Value::boolean(true)},
                                {"one", Value::int64(1)},
                                {"text", str("no")},
                                {"list", Value::emptyArray()}});
    std::shared_ptr<BXDPlugIn> plugIn = build(fields);
    ASSERT_NE(plugIn, nullptr);
    for (const char* no : {"false", "zero", "zeroReal", "absent"}) EXPECT_FALSE(plugIn->hasEntitlement(no)) << no;
    for (const char* yes : {"true", "one", "text", "list"}) EXPECT_TRUE(plugIn->hasEntitlement(yes)) << yes;
    EXPECT_EQ(plugIn->valueForEntitlement("text"), str("no"));
    EXPECT_FALSE(plugIn->valueForEntitlement("absent"));

    plugIn = build(helloFields());
    EXPECT_FALSE(plugIn->hasEntitlement(BXDPlugIn::kAutoElectEntitlement));
    EXPECT_FALSE(plugIn->valueForEntitlement(BXDPlugIn::kAutoElectEntitlement));
}

TEST(BXDPlugInEntitlements, AnnotationKeyFollowsAStringReplaceEntitlementOnly) {
    auto fields = helloFields();
    EXPECT_EQ(build(fields)->annotationKey(), "com.example.greeter.hello");
    fields.entitlements = dict({{"com.quorvel.developer.replace-plugin", str("com.example.old.hello")}});
    EXPECT_EQ(build(fields)->annotationKey(), "com.example.old.hello");
    fields.entitlements = dict({{"com.quorvel.developer.replace-plugin", Value::array({str("com.example.old")})}});
    EXPECT_EQ(build(fields)->annotationKey(), "com.example.greeter.hello");
}

TEST(BXDPlugInInfo, PrunedInfoDropsOnlyUpperCaseDTKeys) {
    Value info = dict({{"DTPlatformName", str("x")},
                       {"DT", str("x")},
                       {"dtLower", str("kept")},
                       {"BDBundleVersion", str("3")},
                       {"XDTMiddle", str("kept")}});
    Value pruned = BXDPlugIn::prunedInfoDictionaryFor(info);
    EXPECT_EQ(pruned, dict({{"dtLower", str("kept")}, {"BDBundleVersion", str("3")}, {"XDTMiddle", str("kept")}}));
    EXPECT_EQ(info.count(), 5u) << "the argument is never changed";
}

TEST(BXDPlugInInfo, DisplayNamesAreFetchedLazilyAndCached) {
    auto fields = helloFields();
    fields.localizedShortName.reset();
    std::shared_ptr<BXDPlugIn> plugIn = build(fields);
    ASSERT_NE(plugIn, nullptr);
    EXPECT_EQ(plugIn->localizedName(), "Hello");
    EXPECT_EQ(plugIn->localizedContainingName(), "Greeter");
    EXPECT_FALSE(plugIn->localizedShortName());

    // A stored name answers before the registry is asked again.
    plugIn->setLocalizedName("Bonjour");
    EXPECT_EQ(plugIn->localizedName(), "Bonjour");

    // The form carries what the registry said.
    Result<MutableDictionary> form = plugIn->exportForm();
    ASSERT_TRUE(form);
    Value exported = form->value();
    EXPECT_EQ(exported.get("localizedContainingDisplayName"), str("Greeter"));
    EXPECT_EQ(exported.get("bundleInfo"), helloInfo());
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
    Value single = plugIn->issueResourceExtensions(str("Resources"));
    EXPECT_EQ(single.count(), 1u);
    EXPECT_TRUE(single.contains("Resources"));
}

TEST_F(BXDPlugInExtensionsTest, ApplicationExtensionGetsOneTokenForItsWholeBundle) {
    auto plugIn = plugInAt("Greeter.app/PlugIns/Clipper.wexa",
                           plugInDictionary({{"PrincipalClass", str("RZObject")}, {"Shared", str("ignored")}}));
    ASSERT_NE(plugIn, nullptr);
    ASSERT_TRUE(plugIn->isAppExtension());
    MutableDictionary form;
    plugIn->augmentForm(form);
    Value extensions = form.value().get("extensions");
    ASSERT_EQ(extensions.count(), 1u);
    EXPECT_EQ(grantedPath(extensions.get(".")), *plugIn->url());
}

TEST_F(BXDPlugInExtensionsTest, PlugInWithoutSharedResourcesLeavesTheFormAlone) {
    auto plugIn = plugInAt("Greeter.app/PlugIns/Hello.bxplugin", plugInDictionary());
    ASSERT_NE(plugIn, nullptr);
    MutableDictionary form;
    form.set("identifier", str("x"));
    plugIn->augmentForm(form);
    EXPECT_EQ(form.value(), dict({{"identifier", str("x")}}));

    // Resources that all fail still leave an (empty) "extensions" entry.
    auto missing = plugInAt("Greeter.app/PlugIns/Hello.bxplugin", plugInDictionary({{"Shared", str("nothing")}}));
    MutableDictionary other;
    missing->augmentForm(other);
    EXPECT_EQ(other.value().get("extensions"), Value::emptyDictionary());
}

}  // namespace
}  // namespace bexil
