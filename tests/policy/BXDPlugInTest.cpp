#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/wait.h>

#include <filesystem>
#include <fstream>

#include "TestSupport.h"
#include "base/Document.h"
#include "platform/ksn/ConsentStore.h"
#include "platform/ledgerix/LXApplicationProxy.h"
#include "platform/ledgerix/LXBexilProxy.h"
#include "platform/log/CaptureSink.h"
#include "platform/sandbox/SandboxExtensions.h"
#include "policy/BXDPlugIn.h"
#include "policy/BXDPlugInSignature.h"
#include "policy/BXIssueReadExtension.h"
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

// Discovery keeps each record's encoded form while the budget allows. Past it the entries are made for each reply
// and must be the same bytes; what records keep is given back to the budget when they go, or a long-running daemon
// would stop keeping forms for good after enough registrations.
TEST(BXDPlugInInfo, KeptFormsStayWithinTheirBudgetAndGiveItBack) {
    const size_t before = BXDPlugIn::keptFormBytes();
    std::shared_ptr<BXDPlugIn> kept = build(helloFields());
    ASSERT_NE(kept, nullptr);
    std::shared_ptr<const ZemCodec::Entries> first = kept->keptFormEntries();
    ASSERT_NE(first, nullptr);
    EXPECT_EQ(kept->keptFormEntries(), first) << "a kept form is made once";
    const size_t charged = BXDPlugIn::keptFormBytes() - before;
    EXPECT_GE(charged, first->bytes.size());

    BXDPlugIn::setKeptFormBudget(before + charged);  // full: nothing more fits
    std::shared_ptr<BXDPlugIn> over = build(helloFields());
    ASSERT_NE(over, nullptr);
    std::shared_ptr<const ZemCodec::Entries> a = over->keptFormEntries();
    std::shared_ptr<const ZemCodec::Entries> b = over->keptFormEntries();
    ASSERT_NE(a, nullptr);
    ASSERT_NE(b, nullptr);
    EXPECT_NE(a, b) << "past the budget nothing is kept";
    EXPECT_EQ(a->bytes, first->bytes);
    EXPECT_EQ(a->starts, first->starts);
    EXPECT_EQ(BXDPlugIn::keptFormBytes(), before + charged);

    first.reset();
    kept.reset();
    EXPECT_EQ(BXDPlugIn::keptFormBytes(), before) << "a dropped record gives its bytes back";
    std::shared_ptr<const ZemCodec::Entries> now = over->keptFormEntries();
    EXPECT_EQ(over->keptFormEntries(), now) << "room again: the form is kept";
    BXDPlugIn::setKeptFormBudget(BXDPlugIn::kKeptFormBudgetBytes);
}

// Only the build tools' "DT" keys go, by a case-sensitive prefix: a key that merely starts with "dt", or holds
// "DT" later, is the bundle's own.
TEST(BXDPlugInInfo, PruningDropsTheBuildToolKeysOnly) {
    Value pruned = BXDPlugIn::prunedInfoDictionaryFor(dict({{"DTCompiler", str("cc")},
                                                            {"DT", str("bare prefix")},
                                                            {"BDBundleVersion", str("7")},
                                                            {"dtLocal", str("kept")},
                                                            {"XDTool", str("kept")}}));
    EXPECT_EQ(pruned, dict({{"BDBundleVersion", str("7")}, {"dtLocal", str("kept")}, {"XDTool", str("kept")}}));
    EXPECT_EQ(BXDPlugIn::prunedInfoDictionaryFor(dict({})), dict({}));
}

// The signature summary is a placeholder that must never repeat, so that nothing can take two bundles' summaries
// for the same code.
TEST(BXDPlugInInfo, SignatureSummaryIsAFreshDigestWithThePlaceholderRequirement) {
    BXDPlugInSignature first(kHelloPath), second(kHelloPath);
    EXPECT_EQ(first.requirement(), "dummy requirement");
    EXPECT_NE(first.cdhash(), second.cdhash()) << "the same URL still gives another digest";
    EXPECT_NE(first.cdhash(), (std::array<uint8_t, BXDPlugInSignature::kDigestBytes>{}));
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

// A record's tokens are made once and handed out again: later forms keep the path the resource resolved to first,
// even when a link inside the bundle now leads elsewhere, and stay checkable after the key file was removed. A
// resource that got no token is asked again, so it gets one once it exists.
TEST_F(BXDPlugInExtensionsTest, TokensAreMadeOncePerRecordAndMissingOnesAreAskedAgain) {
    namespace fs = std::filesystem;
    fs::path bundle = root_ / "Greeter.app/PlugIns/Hello.bxplugin";
    fs::create_directories(root_ / "elsewhere");
    fs::create_directory_symlink(bundle / "Resources", bundle / "Current");
    auto plugIn = plugInAt("Greeter.app/PlugIns/Hello.bxplugin",
                           plugInDictionary({{"Shared", Value::array({str("Current"), str("Later.txt")})}}));
    ASSERT_NE(plugIn, nullptr);

    auto extensionsOf = [&] {
        MutableDictionary form;
        plugIn->augmentForm(form);
        return form.value().get("extensions");
    };
    Value first = extensionsOf();
    ASSERT_EQ(first.count(), 1u) << "Later.txt does not exist yet";
    std::ofstream(bundle / "Later.txt") << "now";
    Value second = extensionsOf();
    ASSERT_EQ(second.count(), 2u) << second.description();
    EXPECT_EQ(second.get("Current"), first.get("Current"));

    fs::remove(bundle / "Current");
    fs::create_directory_symlink(root_ / "elsewhere", bundle / "Current");
    Value third = extensionsOf();
    EXPECT_EQ(third, second);
    EXPECT_EQ(grantedPath(third.get("Current")), (bundle / "Resources").string());

    fs::remove(SandboxExtensions::shared().keyPath());
    ASSERT_TRUE(BXKeepReadExtensionsCheckable());
    EXPECT_EQ(grantedPath(extensionsOf().get("Later.txt")), (bundle / "Later.txt").string());
}

// ---- Enabling for a host ----

// The calling process plays the host; its grant is read back from the service manager, which keeps what enabling
// handed it.
class BXDPlugInEnableTest : public ::testing::Test {
  protected:
    class Host : public HostAccessClient {
      public:
        Value entitlementValueForKey(std::string_view) const override { return Value::null(); }
        bool hasEntitlement(std::string_view) const override { return false; }
        pid_t pid() const override { return pid_; }
        const std::string& path() const override { return path_; }
        pid_t pid_ = getpid();
        std::string path_ = "/usr/bin/host";
    };

    void SetUp() override {
        unsetenv("BXTEST_SDK");
        std::filesystem::create_directories(app() / "PlugIns/Keys.bxplugin");
        ASSERT_FALSE(Document::writeFileAtomically(app() / "Info.vrec",
                                                   dict({{"BDBundleIdentifier", str("com.example.greeter")}})));
        ASSERT_FALSE(Document::writeFileAtomically(
            bundle() / "Info.vrec",
            dict({{"BDBundleIdentifier", str("com.example.greeter.keys")}, {"BDBundleExecutable", str("keys")}})));
        std::ofstream(bundle() / "keys") << "#!/bin/sh\n";
    }
    void TearDown() override { unsetenv("BXTEST_SDK"); }

    std::filesystem::path app() const { return dir_.path() / "Greeter.app"; }
    std::filesystem::path bundle() const { return app() / "PlugIns/Keys.bxplugin"; }
    std::string executable() const { return (bundle() / "keys").string(); }

    // A code-carrying plug-in of `point` whose information dictionary adds `info`.
    std::shared_ptr<BXDPlugIn> plugIn(const std::string& point, Entries info = {}, Entries attributes = {}) {
        auto fields = helloFields();
        fields.bundleURL = bundle().string();
        LXApplicationProxy::Fields appFields;
        appFields.bundleURL = app().string();
        fields.containingBundle = std::make_shared<LXApplicationProxy>(appFields, LXApplicationProxy::PlugInList{});
        MutableDictionary attributeEntries(dict({{"RZExtensionVersion", str("1.2")}}));
        for (const auto& [key, value] : attributes) attributeEntries.set(key, value);
        MutableDictionary entries(helloInfo(plugInDictionary(
            {{"RZExtensionPointIdentifier", str(point)}, {"RZExtensionAttributes", attributeEntries.take()}})));
        for (const auto& [key, value] : info) entries.set(key, value);
        fields.infoVrec = entries.take();
        std::shared_ptr<BXDPlugIn> record = build(fields);
        // A plug-in that carries code is refused without a container when it is built, so a record that lost its
        // container is made by swapping in a registry record without one.
        if (record && !withContainer_) {
            fields.dataContainerURL.reset();
            record->setLxproxy(std::make_shared<LXBexilProxy>(std::move(fields)));
        }
        return record;
    }

    // Enables `p` for the host; the overlay the service manager was given, or the error.
    Result<Value> enable(const BXDPlugIn& p) {
        if (std::optional<Error> error = p.enableForClient(host_, {manager_, consent_})) return *error;
        std::optional<Value> overlay = manager_.grantedOverlay(host_.pid(), executable());
        if (!overlay) return BXError(ErrorCode::OperationFailed, "no grant recorded");
        return *overlay;
    }
    Value description(const BXDPlugIn& p) {
        Result<Value> overlay = enable(p);
        EXPECT_TRUE(overlay) << overlay.error().description();
        return overlay ? overlay->get("ZEMService") : Value::null();
    }

    test::TempDir dir_{"bxdplugin-enable"};
    test::TempDir runtime_{"bxdplugin-enable-runtime"};
    Host host_;
    bool withContainer_ = true;
    ServiceManager manager_{InstanceRecords(InstanceRecords::Kind::Running, runtime_.path())};
    ConsentStore consent_{dir_.path() / "consent.vrec"};
};

// The overlay holds the bundle's service dictionary with the daemon's three keys and the package type; the
// environment starts from the data container, the plug-in's own variables win, BXTEST_SDK is passed on.
TEST_F(BXDPlugInEnableTest, DescriptionMergesTheBundlesServiceOverTheDaemonsEnvironment) {
    setenv("BXTEST_SDK", "/opt/sdk-under-test", 1);
    auto p = plugIn(
        "com.example.greeting",
        {{"ZEMService", dict({{"RunLoopType", str("main")},
                              {"EnvironmentVariables", dict({{"HOME", str("/own/home")}, {"LANG", str("C")}})}})}});
    ASSERT_NE(p, nullptr);
    log::CaptureSink capture;
    Result<Value> overlay = enable(*p);
    ASSERT_TRUE(overlay) << overlay.error().description();
    const std::string container = "/var/lib/bexil/containers/com.example.greeter.hello";
    EXPECT_EQ(*overlay,
              dict({{"ZEMService", dict({{"RunLoopType", str("main")},
                                         {"EnvironmentVariables", dict({{"HOME", str("/own/home")},
                                                                        {"BDFIXED_USER_HOME", str(container)},
                                                                        {"TMPDIR", str(container + "/tmp")},
                                                                        {"BXTEST_SDK", str("/opt/sdk-under-test")},
                                                                        {"LANG", str("C")}})},
                                         {"_SandboxProfile", str("plugin")},
                                         {"_OmitSandboxParameters", Value::boolean(true)}})},
                    {"BDBundlePackageType", str("ZEM!")}}));
    EXPECT_TRUE(capture.contains("assigning plug-in com.example.greeter.hello(1.2) " + kHelloUuid.string() +
                                 " to plugin sandbox"));
    EXPECT_TRUE(capture.contains("allowing host " + std::to_string(getpid()) +
                                 " /usr/bin/host to use plug-in "
                                 "com.example.greeter.hello(1.2) uuid=" +
                                 kHelloUuid.string() + " at " + bundle().string()));
    // Enabling again replaces the grant rather than adding one.
    ASSERT_TRUE(enable(*p));
    EXPECT_EQ(manager_.grantCount(), 1u);
}

// Without a data container or a service dictionary the description still carries an (empty) environment; an
// "EnvironmentVariables" that is not a dictionary is left out of the merge instead of replacing the daemon's.
TEST_F(BXDPlugInEnableTest, MissingOrMalformedPartsLeaveTheDaemonsKeysStanding) {
    withContainer_ = false;
    auto noContainer = plugIn("com.example.greeting");
    ASSERT_NE(noContainer, nullptr);
    withContainer_ = true;
    log::CaptureSink capture;
    EXPECT_EQ(description(*noContainer), dict({{"EnvironmentVariables", Value::emptyDictionary()},
                                               {"_SandboxProfile", str("plugin")},
                                               {"_OmitSandboxParameters", Value::boolean(true)}}));
    EXPECT_TRUE(capture.contains("no ZEMService for plug-in; database returned (null)"));

    auto malformed = plugIn("com.example.greeting", {{"ZEMService", dict({{"EnvironmentVariables", str("X=1")}})}});
    ASSERT_NE(malformed, nullptr);
    Value environment = description(*malformed).get("EnvironmentVariables");
    EXPECT_EQ(environment.get("HOME"), str("/var/lib/bexil/containers/com.example.greeter.hello"));
    EXPECT_EQ(environment.count(), 3u) << environment.description();
}

// The profile table, in its order: typepad plug-ins reach the ordinary sandbox only with open access requested
// and the typepad network granted to their application; every other point maps by name, unknown ones to "plugin".
TEST_F(BXDPlugInEnableTest, SandboxProfileFollowsTheExtensionPoint) {
    auto profile = [&](const std::string& point, Entries attributes = {}) {
        auto p = plugIn(point, {}, std::move(attributes));
        return p ? p->sandboxProfile(consent_) : std::string("(no record)");
    };
    const std::string typepad = "com.quorvel.typepad-service";
    EXPECT_EQ(profile(typepad), "typepad");
    EXPECT_EQ(profile(typepad, {{"RequestsOpenAccess", Value::boolean(true)}}), "typepad") << "no consent yet";
    ASSERT_FALSE(consent_.setGranted("com.example.greeter", "typepad-network", true));
    EXPECT_EQ(profile(typepad, {{"RequestsOpenAccess", Value::boolean(true)}}), "plugin");
    EXPECT_EQ(profile(typepad, {{"RequestsOpenAccess", Value::int64(1)}}), "typepad") << "only boolean true counts";
    EXPECT_EQ(profile(typepad), "typepad");
    EXPECT_EQ(profile("com.quorvel.netguard.filter-data"), "netguard-filter");
    EXPECT_EQ(profile("com.quorvel.peekview.extension.preview"), "peekviewd");
    EXPECT_EQ(profile("com.quorvel.app.non-ui-extension"), "sketchpad-devtools");
    EXPECT_EQ(profile("com.quorvel.app.non-ui-extension.multiple-instances"), "sketchpad-devtools");
    EXPECT_EQ(profile("com.quorvel.app.non-ui-extension.other"), "plugin");
}

// Enabling fails before the service manager is asked when the bundle has no executable to start, and with the
// service manager's refusal when the host is gone; neither leaves a grant.
TEST_F(BXDPlugInEnableTest, NoExecutableOrAGoneHostFailsWithCodeFour) {
    auto p = plugIn("com.example.greeting");
    ASSERT_NE(p, nullptr);
    std::filesystem::remove(executable());
    log::CaptureSink capture;
    Result<Value> missing = enable(*p);
    ASSERT_FALSE(missing);
    EXPECT_EQ(missing.error().code(), 4);
    EXPECT_EQ(missing.error().localizedDescription(),
              "cannot obtain executable path for plug-in com.example.greeter.hello(" + kHelloUuid.string() + ")");
    EXPECT_TRUE(capture.contains("failed to obtain execPath for plug-in "));

    std::ofstream(executable()) << "#!/bin/sh\n";
    pid_t child = fork();
    if (child == 0) _exit(0);
    ASSERT_EQ(waitpid(child, nullptr, 0), child);
    host_.pid_ = child;  // ended and reaped: no process to grant anything to
    Result<Value> gone = enable(*p);
    ASSERT_FALSE(gone);
    EXPECT_EQ(gone.error().localizedDescription(),
              "unable to enable plug-in com.example.greeter.hello(" + kHelloUuid.string() + ")");
    EXPECT_TRUE(capture.contains("jobard error " + std::to_string(ESRCH) + " trying to allow " + std::to_string(child) +
                                 " /usr/bin/host"));
    EXPECT_EQ(manager_.grantCount(), 0u);
}

}  // namespace
}  // namespace bexil
