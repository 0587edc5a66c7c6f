#include <gtest/gtest.h>
#include <signal.h>
#include <sqlite3.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <random>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "FaultyVfs.h"
#include "TestSupport.h"
#include "base/Document.h"
#include "platform/ledgerix/LXApplicationProxy.h"
#include "platform/ledgerix/LXApplicationWorkspaceObserverProtocol.h"
#include "platform/ledgerix/LXBexilProxy.h"
#include "platform/ledgerix/LedgerixWorkspace.h"
#include "platform/log/CaptureSink.h"

// Test bundles are described with designated initializers that name only what differs from the defaults; g++ 12
// warns about the members left to their default initializers, which is the point.
#pragma GCC diagnostic ignored "-Wmissing-field-initializers"

namespace bexil {
namespace {

namespace fs = std::filesystem;

const fs::path kExamples = fs::path(BEXIL_SOURCE_DIR) / "examples" / "bundles";

using test::str;

// What a test plug-in bundle holds; every field has a usable default.
struct TestBundle {
    std::string identifier = "com.example.plugin";
    std::string version = "1";
    std::string point = "com.example.point";
    std::optional<Value> entitlements;
    test::Entries extraInfo;
    test::Entries extraAttributes;
};

// Records observer callbacks in order as "install <uuid>" / "uninstall <uuid>", and whether the record was still
// registered when its uninstall was announced.
class RecordingObserver : public LXApplicationWorkspaceObserverProtocol {
  public:
    explicit RecordingObserver(LedgerixWorkspace* workspace) : workspace_(workspace) {}
    void pluginsDidInstall(const LXProxyList& plugIns) override {
        std::lock_guard lock(mutex_);
        for (const auto& p : plugIns) events_.push_back("install " + p->pluginUUID()->string());
    }
    void pluginsWillUninstall(const LXProxyList& plugIns) override {
        // Looking records up from inside the callback must work: the registry holds no lock here.
        bool stillThere = workspace_->plugInProxyForUUID(*plugIns.front()->pluginUUID()) != nullptr;
        std::lock_guard lock(mutex_);
        for (const auto& p : plugIns) events_.push_back("uninstall " + p->pluginUUID()->string());
        uninstallsSeenRegistered += stillThere ? 1 : 0;
    }
    std::vector<std::string> snapshot() {
        std::lock_guard lock(mutex_);
        return events_;
    }

    int uninstallsSeenRegistered = 0;

  private:
    LedgerixWorkspace* workspace_;
    std::mutex mutex_;
    std::vector<std::string> events_;
};

// A private state directory, bundle directory and root for each test, removed afterwards.
class LedgerixTest : public ::testing::Test {
  protected:
    void SetUp() override {
        fs::create_directories(bundles_);
        fs::create_directories(root_);
        open();
    }
    void TearDown() override { workspace_.reset(); }

    void open() {
        workspace_.reset();
        Result<std::shared_ptr<LedgerixWorkspace>> opened = LedgerixWorkspace::open({state_, root_});
        ASSERT_TRUE(opened.ok()) << opened.error().description();
        workspace_ = std::move(opened).value();
        observer_ = std::make_shared<RecordingObserver>(workspace_.get());
        workspace_->addObserver(observer_);
    }

    fs::path writePlugIn(const fs::path& bundle, const TestBundle& shape) {
        test::Entries attributes = shape.extraAttributes;
        test::Entries info = shape.extraInfo;
        info.emplace_back("BDBundleVersion", str(shape.version));
        info.emplace_back("RZExtension", test::dict({{"RZExtensionPointIdentifier", str(shape.point)},
                                                     {"RZExtensionAttributes", test::dict(attributes)}}));
        if (!shape.identifier.empty()) info.emplace_back("BDBundleIdentifier", str(shape.identifier));
        fs::create_directories(bundle);
        EXPECT_FALSE(Document::writeFileAtomically(bundle / "Info.vrec", test::dict(info)).has_value());
        if (shape.entitlements)
            EXPECT_FALSE(Document::writeFileAtomically(bundle / "Entitlements.vrec", *shape.entitlements).has_value());
        else
            fs::remove(bundle / "Entitlements.vrec");
        return bundle;
    }
    std::shared_ptr<const LXBexilProxy> registerOK(const fs::path& path) {
        Result<std::shared_ptr<const LXBexilProxy>> result = workspace_->registerPlugin(path.string());
        EXPECT_TRUE(result.ok()) << (result.ok() ? "" : result.error().description());
        return result.ok() ? result.value() : nullptr;
    }
    size_t count() { return workspace_->plugInCount().value_or(SIZE_MAX); }
    // Registers enough plug-ins that the database spans many pages, then closes the registry.
    void fillAndClose() {
        for (int i = 0; i < 150; ++i)
            registerOK(writePlugIn(bundles_ / ("P" + std::to_string(i) + ".bxplugin"),
                                   {.identifier = "com.example.p" + std::to_string(i)}));
        workspace_.reset();
    }

    test::TempDir tmp_{"bexil-ledgerix"};
    const fs::path dir_ = tmp_.path(), state_ = dir_ / "state", bundles_ = dir_ / "bundles", root_ = dir_ / "root";
    std::shared_ptr<LedgerixWorkspace> workspace_;
    std::shared_ptr<RecordingObserver> observer_;
};

// ---- Registering, unregistering and looking up ----

using LedgerixRegistrationTest = LedgerixTest;

// Guards what the registry records beside the bundle's dictionaries (which discovery shows end to end): the
// entitlements, the containing application, and the data container private to its owner.
TEST_F(LedgerixRegistrationTest, RecordCarriesWhatTheBundleAndItsApplicationSay) {
    auto proxy = registerOK(kExamples / "Greeter.app/PlugIns/Bonjour.bxplugin");
    ASSERT_TRUE(proxy && proxy->entitlements());
    EXPECT_TRUE(proxy->entitlements()->contains("com.quorvel.developer.replace-plugin"));

    ASSERT_TRUE(proxy->containingBundle());
    EXPECT_EQ(proxy->containingBundle()->bundleURL(), fs::canonical(kExamples / "Greeter.app").string());
    ASSERT_TRUE(proxy->dataContainerURL());
    EXPECT_EQ(*proxy->dataContainerURL(), (state_ / "containers/com.example.greeter.bonjour").string());
    EXPECT_TRUE(fs::is_directory(*proxy->dataContainerURL() + "/tmp"));
    EXPECT_EQ(fs::status(*proxy->dataContainerURL()).permissions() & fs::perms::all, fs::perms::owner_all);
}

// Guards the container rule (only code with an identifier gets one) and the application record: one per
// application, listing its plug-ins, forgotten with its last plug-in.
TEST_F(LedgerixRegistrationTest, DataOrNamelessPlugInGetsNoContainerAndApplicationIsRecordedOnce) {
    auto stationery = registerOK(kExamples / "Notes.app/PlugIns/Stationery.bxplugin");
    auto clipper = registerOK(kExamples / "Notes.app/PlugIns/Clipper.wexa");
    auto nameless = registerOK(kExamples / "Misconfigured.app/PlugIns/MissingIdentifier.bxplugin");
    ASSERT_TRUE(stationery && clipper && nameless);
    EXPECT_FALSE(stationery->dataContainerURL());
    EXPECT_TRUE(clipper->dataContainerURL());
    EXPECT_FALSE(nameless->dataContainerURL());

    auto app = workspace_->applicationProxyForBundleURL((kExamples / "Notes.app").string());
    ASSERT_TRUE(app);
    EXPECT_EQ(app->plugIns().size(), 2u);

    EXPECT_FALSE(workspace_->unregisterPlugin((kExamples / "Notes.app/PlugIns/Clipper.wexa").string()));
    EXPECT_FALSE(workspace_->unregisterPlugin((kExamples / "Notes.app/PlugIns/Stationery.bxplugin").string()));
    EXPECT_FALSE(workspace_->applicationProxyForBundleURL((kExamples / "Notes.app").string()));
}

// Guards look-up: by UUID, and by any spelling of the path (URL, trailing slash, "..", a link) as the same record.
TEST_F(LedgerixRegistrationTest, LookUpByUuidAndByAnyFormOfThePath) {
    fs::path bundle = writePlugIn(bundles_ / "A.app/PlugIns/One.bxplugin", {.identifier = "com.example.one"});
    auto proxy = registerOK(bundle);
    ASSERT_TRUE(proxy);
    ASSERT_TRUE(workspace_->plugInProxyForUUID(*proxy->pluginUUID()));
    EXPECT_FALSE(workspace_->plugInProxyForUUID(Uuid::random()));

    fs::create_directory_symlink(bundle, dir_ / "link.bxplugin");
    for (std::string form :
         {bundle.string(), "file://" + bundle.string(), "file://localhost" + bundle.string(),
          "file://" + (bundles_ / "A.app/Plug%49ns/One.bxplugin").string(), bundle.string() + "/",
          (bundles_ / "A.app/PlugIns/../PlugIns/One.bxplugin").string(), (dir_ / "link.bxplugin").string()}) {
        auto found = workspace_->plugInProxyForURL(form);
        ASSERT_TRUE(found) << form;
        EXPECT_EQ(found->pluginUUID(), proxy->pluginUUID()) << form;
    }
    EXPECT_FALSE(workspace_->plugInProxyForURL("relative/One.bxplugin"));
    EXPECT_FALSE(workspace_->plugInProxyForURL("file://elsewhere" + bundle.string()));
}

// Guards unregistering a bundle already deleted (announced, looked-up-able during the announcement), and the
// refusal of a path that is not registered.
TEST_F(LedgerixRegistrationTest, UnregisterWorksAfterTheBundleIsGoneAndRefusesUnknownPaths) {
    fs::path bundle = writePlugIn(bundles_ / "A.app/PlugIns/One.bxplugin", {});
    auto proxy = registerOK(bundle);
    fs::remove_all(bundles_ / "A.app");
    EXPECT_FALSE(workspace_->unregisterPlugin(bundle.string()));
    EXPECT_EQ(count(), 0u);
    EXPECT_FALSE(workspace_->plugInProxyForUUID(*proxy->pluginUUID()));
    EXPECT_EQ(observer_->snapshot(), (std::vector<std::string>{"install " + proxy->pluginUUID()->string(),
                                                               "uninstall " + proxy->pluginUUID()->string()}));
    EXPECT_EQ(observer_->uninstallsSeenRegistered, 1);
    // The data container outlives the registration: it holds the plug-in's data for a later reinstall.
    EXPECT_TRUE(fs::is_directory(*proxy->dataContainerURL()));

    std::optional<Error> error = workspace_->unregisterPlugin(bundle.string());
    ASSERT_TRUE(error);
    EXPECT_EQ(error->domain(), LXErrorDomain);
    EXPECT_EQ(error->code(), kLXNotRegistered);
}

// Guards the registry's locking: two threads registering and looking up at once lose nothing and damage nothing.
TEST_F(LedgerixRegistrationTest, ConcurrentRegistrationsAllLand) {
    constexpr int kPerThread = 25;
    std::vector<fs::path> paths;
    for (int i = 0; i < 2 * kPerThread; ++i)
        paths.push_back(writePlugIn(bundles_ / ("App.app/PlugIns/P" + std::to_string(i) + ".bxplugin"),
                                    {.identifier = "com.example.p" + std::to_string(i)}));
    std::atomic<int> failures = 0;
    auto worker = [&](int offset) {
        for (int i = offset; i < 2 * kPerThread; i += 2) {
            if (!workspace_->registerPlugin(paths[i].string()).ok()) ++failures;
            if (!workspace_->plugInProxyForURL(paths[i].string())) ++failures;
        }
    };
    std::thread a(worker, 0), b(worker, 1);
    a.join();
    b.join();
    EXPECT_EQ(failures, 0);
    EXPECT_EQ(count(), paths.size());
    EXPECT_EQ(workspace_->applicationProxyForBundleURL((bundles_ / "App.app").string())->plugIns().size(),
              paths.size());
    EXPECT_FALSE(workspace_->checkIntegrity());
}

// Guards the strings a decoded information dictionary shares: with the record's own identifier and name, and
// short strings with other records' dictionaries (each record still reads back exactly what its text says, odd
// texts too); a long string is every record's own.
TEST(LXBexilProxyTest, DecodedDictionariesShareTheRecordsTextsAndRepeatedShortStrings) {
    const std::string longText(200, 'x');
    auto proxyFor = [&](const std::string& identifier) {
        LXBexilProxy::Fields fields;
        fields.pluginIdentifier = identifier;
        fields.bundleIdentifier = identifier;
        fields.localizedName = "Name \xc3\xa9";
        fields.infoVrecDocument =
            Document::write(
                Value::dictionary(
                    {{"BDBundleIdentifier", str(identifier)},
                     {"BDBundleName", str("Name \xc3\xa9")},
                     {"RZExtension", Value::dictionary({{"RZExtensionPointIdentifier", str("com.example.point.shared")},
                                                        {"Long", str(longText)},
                                                        {"Empty", str("")},
                                                        {"List", Value::array({str("\xe2\x9c\x93")})}})}}))
                .value();
        return std::make_shared<LXBexilProxy>(std::move(fields));
    };
    auto a = proxyFor("com.example.first.plug-in"), b = proxyFor("com.example.second.plug-in");
    ASSERT_TRUE(a->infoVrec() && b->infoVrec());
    EXPECT_EQ(a->infoVrec()->get("BDBundleIdentifier"), str("com.example.first.plug-in"));
    EXPECT_TRUE(a->infoVrec()->get("BDBundleIdentifier").identical(a->pluginIdentifierValue()));
    EXPECT_TRUE(a->infoVrec()->get("BDBundleName").identical(a->localizedNameValue()));
    EXPECT_EQ(b->infoVrec()->get("BDBundleIdentifier"), str("com.example.second.plug-in"));
    Value pointA = a->objectForInfoDictionaryKeyOfClassInScope("RZExtensionPointIdentifier", ValueKind::String,
                                                               LXInfoScope::PlugIn)
                       .value();
    Value pointB = b->objectForInfoDictionaryKeyOfClassInScope("RZExtensionPointIdentifier", ValueKind::String,
                                                               LXInfoScope::PlugIn)
                       .value();
    EXPECT_EQ(pointA, str("com.example.point.shared"));
    EXPECT_TRUE(pointA.identical(pointB));
    Value plugInA = *a->bexilDictionary(), plugInB = *b->bexilDictionary();
    EXPECT_EQ(plugInA.get("Long").stringView(), longText);
    EXPECT_FALSE(plugInA.get("Long").identical(plugInB.get("Long")));
    EXPECT_EQ(plugInA.get("Empty"), str(""));
    EXPECT_EQ(plugInB.get("List"), Value::array({str("\xe2\x9c\x93")}));
}

// Guards the sharing of application records between the records of their plug-ins: plug-ins of one application
// share one, never one of another application, and never one whose plug-in list was read before they were looked
// up (it would miss plug-ins registered since); a record's own list stays the one it read.
TEST_F(LedgerixRegistrationTest, PlugInsOfOneApplicationShareItsRecordUntilItsListIsRead) {
    auto plugIn = [&](const std::string& app, int i) {
        return writePlugIn(bundles_ / (app + ".app/PlugIns/P" + std::to_string(i) + ".bxplugin"),
                           {.identifier = "com.example." + app + std::to_string(i)});
    };
    fs::path p0 = plugIn("App", 0), p1 = plugIn("App", 1), other = plugIn("Other", 0);
    for (const fs::path& path : {p0, p1, other}) registerOK(path);

    std::shared_ptr<const LXBexilProxy> a = workspace_->plugInProxyForURL(p0.string());
    std::shared_ptr<const LXBexilProxy> b = workspace_->plugInProxyForURL(p1.string());
    std::shared_ptr<const LXBexilProxy> c = workspace_->plugInProxyForURL(other.string());
    ASSERT_TRUE(a && b && c && a->containingBundle() && c->containingBundle());
    EXPECT_EQ(a->containingBundle(), b->containingBundle());
    EXPECT_NE(a->containingBundle(), c->containingBundle());
    EXPECT_EQ(c->containingBundle()->bundleURL(), fs::canonical(bundles_ / "Other.app").string());
    EXPECT_EQ(a->containingBundle()->plugIns().size(), 2u);

    fs::path p2 = plugIn("App", 2);
    registerOK(p2);
    std::shared_ptr<const LXBexilProxy> d = workspace_->plugInProxyForURL(p2.string());
    ASSERT_TRUE(d && d->containingBundle());
    EXPECT_NE(d->containingBundle(), a->containingBundle());
    EXPECT_EQ(d->containingBundle()->bundleURL(), a->containingBundle()->bundleURL());
    EXPECT_EQ(d->containingBundle()->plugIns().size(), 3u);
    EXPECT_EQ(a->containingBundle()->plugIns().size(), 2u);
    // Shared again by the next record while its list is unread.
    std::shared_ptr<const LXBexilProxy> e = workspace_->plugInProxyForURL(p0.string());
    std::shared_ptr<const LXBexilProxy> f = workspace_->plugInProxyForURL(p1.string());
    ASSERT_TRUE(e && f);
    EXPECT_EQ(e->containingBundle(), f->containingBundle());
    EXPECT_NE(e->containingBundle(), d->containingBundle());
}

// Guards old-style bundles: their "Bexil" dictionary stands in for the plug-in dictionary.
TEST(LXBexilProxyTest, OldStyleBundleFallsBackToItsBexilDictionary) {
    LXBexilProxy::Fields oldStyle;
    Value bexil = Value::dictionary({{"RZExtensionAttributes", Value::dictionary({{"a", str("b")}})}});
    oldStyle.infoVrec = Value::dictionary({{"Bexil", bexil}});
    LXBexilProxy proxy(oldStyle);
    EXPECT_EQ(proxy.objectForInfoDictionaryKeyOfClassInScope("a", ValueKind::String, LXInfoScope::Attributes),
              str("b"));
}

// Guards the records' dictionaries read from text: they decode once, on first use from whichever thread, and the
// text is then dropped, so what every later call sees must be that one decoding; text that does not decode, or
// whose root is not a dictionary, reads as absent every time, and a value given beside text wins.
TEST(LXBexilProxyTest, DictionariesDecodeOnceFromTextAndUnreadableTextStaysAbsent) {
    Value info = Value::dictionary(
        {{"RZExtension", Value::dictionary({{"RZExtensionAttributes", Value::dictionary({{"Flavour", str("salt")}})}})},
         {"BDBundleIdentifier", str("com.example.dr\u00e9sser.long-identifier")}});
    Value entitlements = Value::dictionary({{"com.example.entitled", Value::boolean(true)}});
    for (int round = 0; round < 20; ++round) {
        LXBexilProxy::Fields fields;
        fields.infoVrecDocument = Document::write(info).value();
        fields.entitlementsDocument = Document::write(entitlements).value();
        LXBexilProxy proxy(std::move(fields));
        std::optional<Value> seen[2];
        std::optional<Value> seenEntitlements[2];
        std::thread a([&] {
            seen[0] = proxy.infoVrec();
            seenEntitlements[0] = proxy.entitlements();
        });
        std::thread b([&] {
            seenEntitlements[1] = proxy.entitlements();
            seen[1] =
                proxy.objectForInfoDictionaryKeyOfClassInScope("BDBundleIdentifier", std::nullopt, LXInfoScope::Info)
                    ? proxy.infoVrec()
                    : std::nullopt;
        });
        a.join();
        b.join();
        ASSERT_TRUE(seen[0] && seen[1] && seenEntitlements[0] && seenEntitlements[1]);
        EXPECT_EQ(*seen[0], info);
        EXPECT_TRUE(seen[0]->identical(*seen[1]));
        EXPECT_TRUE(seenEntitlements[0]->identical(*seenEntitlements[1]));
        EXPECT_EQ(*seenEntitlements[0], entitlements);
        // Asked again after the text is gone, the same decoding answers.
        EXPECT_TRUE(proxy.infoVrec()->identical(*seen[0]));
        EXPECT_EQ(proxy.objectForInfoDictionaryKeyOfClassInScope("Flavour", ValueKind::String, LXInfoScope::Attributes),
                  str("salt"));
    }

    for (std::string text : {std::string("<vrec version=\"1\"><dict><key>a</key>"), std::string("not a document"),
                             Document::write(Value::array({str("x")})).value(), Document::write(str("x")).value()}) {
        LXBexilProxy::Fields fields;
        fields.infoVrecDocument = text;
        fields.entitlementsDocument = text;
        LXBexilProxy proxy(std::move(fields));
        for (int twice = 0; twice < 2; ++twice) {
            EXPECT_FALSE(proxy.infoVrec()) << text;
            EXPECT_FALSE(proxy.bexilDictionary()) << text;
            EXPECT_FALSE(proxy.entitlements()) << text;
            EXPECT_FALSE(proxy.objectForInfoDictionaryKeyOfClassInScope("a", std::nullopt, LXInfoScope::Info));
        }
    }

    LXBexilProxy::Fields both;
    both.infoVrec = info;
    both.infoVrecDocument = Document::write(Value::dictionary({{"other", str("text")}})).value();
    both.entitlements = str("not a dictionary");
    both.entitlementsDocument = Document::write(entitlements).value();
    LXBexilProxy proxy(std::move(both));
    ASSERT_TRUE(proxy.infoVrec());
    EXPECT_TRUE(proxy.infoVrec()->identical(info));
    // A value given wins over text even when it is not a dictionary: the record then has none.
    EXPECT_FALSE(proxy.entitlements());
}

// Registering a bundle again is silent when nothing changed, keeps the UUID when only the content changed, and
// makes a new record under a new UUID for a new version; every change is announced as uninstall then install, the
// uninstall while the old record is still there, so that whoever caches records by UUID rebuilds them.
using LedgerixReRegistrationTest = LedgerixTest;

TEST_F(LedgerixReRegistrationTest, NewVersionIsUninstallThenInstallUnderANewUuid) {
    fs::path bundle = writePlugIn(bundles_ / "A.app/PlugIns/One.bxplugin", {.version = "1"});
    auto first = registerOK(bundle);
    auto unchanged = registerOK(bundle);
    ASSERT_TRUE(first && unchanged);
    EXPECT_EQ(unchanged->pluginUUID(), first->pluginUUID());
    EXPECT_EQ(observer_->snapshot().size(), 1u);

    writePlugIn(bundle, {.version = "1", .entitlements = Value::dictionary({{"k", Value::boolean(true)}})});
    auto newContent = registerOK(bundle);
    ASSERT_TRUE(newContent && newContent->entitlements());
    EXPECT_EQ(newContent->pluginUUID(), first->pluginUUID());
    EXPECT_EQ(newContent->entitlements()->get("k"), Value::boolean(true));

    writePlugIn(bundle, {.version = "2"});
    auto newVersion = registerOK(bundle);
    ASSERT_TRUE(newVersion);
    const std::string one = first->pluginUUID()->string(), two = newVersion->pluginUUID()->string();
    EXPECT_EQ(observer_->snapshot(), (std::vector<std::string>{"install " + one, "uninstall " + one, "install " + one,
                                                               "uninstall " + one, "install " + two}));
    EXPECT_EQ(observer_->uninstallsSeenRegistered, 2);
    EXPECT_FALSE(workspace_->plugInProxyForUUID(*first->pluginUUID()));
    EXPECT_EQ(count(), 1u);
}

// ---- Persistence and damage ----

using LedgerixPersistenceTest = LedgerixTest;

// Guards durability: a registry killed at a random moment while registering reopens intact and keeps every
// registration it had reported done.
TEST_F(LedgerixPersistenceTest, KilledWhileRegisteringLosesNothingThatWasReported) {
    constexpr int kBundles = 40;
    std::vector<fs::path> paths;
    for (int i = 0; i < kBundles; ++i)
        paths.push_back(
            writePlugIn(bundles_ / ("App" + std::to_string(i % 4) + ".app/PlugIns/P" + std::to_string(i) + ".bxplugin"),
                        {.identifier = "com.example.crash" + std::to_string(i)}));
    workspace_.reset();

    std::mt19937 random(12345);
    bool anyReported = false;
    for (int round = 0; round < 8; ++round) {
        int pipeEnds[2];
        ASSERT_EQ(pipe(pipeEnds), 0);
        pid_t child = fork();
        ASSERT_GE(child, 0);
        if (child == 0) {
            // Register, re-register with new versions and unregister for ever; report each registration that
            // returned, so the parent can check that it survived the kill.
            close(pipeEnds[0]);
            auto opened = LedgerixWorkspace::open({state_, root_});
            if (!opened.ok()) _exit(3);
            auto workspace = opened.value();
            for (unsigned step = 0;; ++step) {
                const fs::path& path = paths[step % kBundles];
                if (step % 7 == 3) {
                    (void)workspace->unregisterPlugin(path.string());
                    continue;
                }
                if (!workspace->registerPlugin(path.string()).ok()) _exit(4);
                std::string line = path.string() + "\n";
                if (write(pipeEnds[1], line.data(), line.size()) != static_cast<ssize_t>(line.size())) _exit(5);
            }
        }
        close(pipeEnds[1]);
        std::this_thread::sleep_for(std::chrono::milliseconds(20 + random() % 150));
        kill(child, SIGKILL);
        int status = 0;
        waitpid(child, &status, 0);
        ASSERT_TRUE(WIFSIGNALED(status)) << "the registering child stopped by itself: " << WEXITSTATUS(status);
        std::string text;
        char buffer[4096];
        ssize_t n;
        while ((n = read(pipeEnds[0], buffer, sizeof buffer)) > 0) text.append(buffer, n);
        close(pipeEnds[0]);

        // The last reported registration for a path may since have been undone by an unregistration the child
        // made later; only the final reported path is certain to be registered.
        std::string last;
        for (size_t start = 0, end; (end = text.find('\n', start)) != std::string::npos; start = end + 1)
            last = text.substr(start, end - start);

        auto opened = LedgerixWorkspace::open({state_, root_});
        ASSERT_TRUE(opened.ok()) << opened.error().description();
        auto workspace = opened.value();
        EXPECT_FALSE(workspace->checkIntegrity()) << "round " << round;
        if (!last.empty()) {
            anyReported = true;
            EXPECT_TRUE(workspace->plugInProxyForURL(last)) << "round " << round << ": lost " << last;
        }
    }
    EXPECT_TRUE(anyReported) << "the child never got a registration done before being killed";
}

// Guards a failing disk: while the store's writes or its syncs fail, a registration fails with the store's error and
// changes nothing that can be seen, now or after reopening; once the disk works again the same registration lands,
// and a reopened registry holds each bundle once under the UUID it was given.
TEST_F(LedgerixPersistenceTest, FailingWritesOrSyncsRefuseTheRegistrationAndLeaveTheStoreWhole) {
    workspace_.reset();
    LedgerixWorkspace::Options options{state_, root_};
    options.storeVfs = test::FaultyVfs::kName;
    test::FaultyVfs::set(test::FaultyVfs::Fault::None);
    for (test::FaultyVfs::Fault fault : {test::FaultyVfs::Fault::Writes, test::FaultyVfs::Fault::Syncs}) {
        SCOPED_TRACE(fault == test::FaultyVfs::Fault::Writes ? "failing writes" : "failing syncs");
        const std::string tag = fault == test::FaultyVfs::Fault::Writes ? "w" : "s";
        fs::path kept = writePlugIn(bundles_ / ("Kept" + tag + ".bxplugin"), {.identifier = "com.example.kept" + tag});
        fs::path refused =
            writePlugIn(bundles_ / ("Refused" + tag + ".bxplugin"), {.identifier = "com.example.refused" + tag});
        std::optional<Uuid> keptUuid, refusedUuid;
        {
            auto opened = LedgerixWorkspace::open(options);
            ASSERT_TRUE(opened.ok()) << opened.error().description();
            workspace_ = opened.value();
            keptUuid = registerOK(kept)->pluginUUID();
            const size_t before = count();

            test::FaultyVfs::set(fault);
            auto failed = workspace_->registerPlugin(refused.string());
            test::FaultyVfs::set(test::FaultyVfs::Fault::None);
            ASSERT_FALSE(failed.ok());
            EXPECT_EQ(failed.error().code(), kLXStoreFailure) << failed.error().description();
            EXPECT_NE(failed.error().description().find("disk I/O error"), std::string::npos)
                << failed.error().description();
            EXPECT_EQ(count(), before);
            EXPECT_FALSE(workspace_->plugInProxyForURL(refused.string()));

            std::shared_ptr<const LXBexilProxy> landed = registerOK(refused);
            ASSERT_TRUE(landed);
            refusedUuid = landed->pluginUUID();
            workspace_.reset();
        }
        auto reopened = LedgerixWorkspace::open({state_, root_});
        ASSERT_TRUE(reopened.ok()) << reopened.error().description();
        EXPECT_FALSE(reopened.value()->checkIntegrity());
        EXPECT_EQ(reopened.value()->plugInProxyForURL(kept.string())->pluginUUID(), keptUuid);
        EXPECT_EQ(reopened.value()->plugInProxyForURL(refused.string())->pluginUUID(), refusedUuid);
    }
}

// A database cut short (which a light open would not notice) is moved aside untouched at open and an empty, working
// registry started in its place.
TEST_F(LedgerixPersistenceTest, DamagedDatabaseIsMovedAsideAtOpenAndRegistryStartsEmpty) {
    const fs::path file = state_ / "registry.sqlite3";
    fillAndClose();
    ASSERT_FALSE(fs::exists(state_ / "registry.sqlite3-wal")) << "closing should have checkpointed the log";
    fs::resize_file(file, fs::file_size(file) / 2);
    const std::string damaged = test::readText(file);

    log::CaptureSink sink(log::Level::Error);
    open();
    EXPECT_EQ(count(), 0u);
    EXPECT_TRUE(sink.contains("is damaged"));
    bool keptAside = false;
    for (const auto& entry : fs::directory_iterator(state_))
        if (entry.path().filename().string().starts_with("registry.sqlite3.corrupt-"))
            keptAside = keptAside || test::readText(entry.path()) == damaged;
    EXPECT_TRUE(keptAside);
    EXPECT_TRUE(registerOK(writePlugIn(bundles_ / "One.bxplugin", {})));
}

// Guards damage a light open misses: a failing read marks the file, and the next open checks it and moves it aside.
TEST_F(LedgerixPersistenceTest, DamageFoundWhileRunningIsCheckedAndMovedAsideAtNextOpen) {
    fillAndClose();
    // Overwrite the middle of the file, leaving the header and the schema page intact: a light open passes.
    fs::path file = state_ / "registry.sqlite3";
    uintmax_t size = fs::file_size(file);
    {
        std::fstream stream(file, std::ios::in | std::ios::out | std::ios::binary);
        stream.seekp(static_cast<std::streamoff>(size / 4));
        std::string garbage(size / 2, '\xa5');
        stream.write(garbage.data(), static_cast<std::streamsize>(garbage.size()));
    }
    open();
    EXPECT_FALSE(workspace_->installedPlugins()) << "reading a damaged table must fail, not answer wrongly";
    EXPECT_TRUE(fs::exists(state_ / "registry.sqlite3.needs-check"));

    open();
    EXPECT_EQ(count(), 0u);
    EXPECT_FALSE(fs::exists(state_ / "registry.sqlite3.needs-check"));
    EXPECT_FALSE(workspace_->checkIntegrity());
}

// Guards downgrades: a database written by a newer version is refused and left alone, never moved aside as damage.
TEST_F(LedgerixPersistenceTest, DatabaseOfANewerSchemaIsRefused) {
    workspace_.reset();
    fs::path file = state_ / "registry.sqlite3";
    // user_version is the big-endian 32-bit number at offset 60 of the database header.
    std::fstream stream(file, std::ios::in | std::ios::out | std::ios::binary);
    stream.seekp(60);
    const char version[4] = {0, 0, 0, 99};
    stream.write(version, 4);
    stream.close();
    Result<std::shared_ptr<LedgerixWorkspace>> opened = LedgerixWorkspace::open({state_, root_});
    ASSERT_FALSE(opened.ok());
    EXPECT_EQ(opened.error().code(), kLXStoreFailure);
    EXPECT_NE(opened.error().localizedDescription()->find("schema version 99"), std::string::npos);
    EXPECT_TRUE(fs::exists(file)) << "a newer database must be left alone";
}

// A file of the previous schema (before the pre-selection's walk indexes) is brought up to date when it is opened,
// and a narrowed walk then reads through the new indexes (which it names, so it would fail without them).
TEST_F(LedgerixPersistenceTest, AFileOfTheEarlierSchemaGetsTheWalkIndexesWhenOpened) {
    for (int i = 0; i < 4; ++i)
        registerOK(writePlugIn(bundles_ / ("P" + std::to_string(i) + ".bxplugin"),
                               {.identifier = "com.example.p" + std::to_string(i),
                                .point = i % 2 ? "com.example.odd" : "com.example.even"}));
    workspace_.reset();
    const std::string file = (state_ / "registry.sqlite3").string();
    auto sql = [&](const std::string& statements, int64_t* number = nullptr) {
        sqlite3* db = nullptr;
        ASSERT_EQ(sqlite3_open(file.c_str(), &db), SQLITE_OK);
        auto keep = [](void* out, int, char** values, char**) {
            *static_cast<int64_t*>(out) = values[0] ? std::stoll(values[0]) : -1;
            return 0;
        };
        EXPECT_EQ(sqlite3_exec(db, statements.c_str(), number ? +keep : nullptr, number, nullptr), SQLITE_OK)
            << sqlite3_errmsg(db);
        sqlite3_close(db);
    };
    const std::string walkIndexes =
        "SELECT count(*) FROM sqlite_master WHERE type = 'index' AND name IN "
        "('plugins_point_walk', 'plugins_wild_walk', 'plugins_identifier_walk')";
    sql("DROP INDEX plugins_point_walk; DROP INDEX plugins_wild_walk; DROP INDEX plugins_identifier_walk; "
        "PRAGMA user_version = 2;");
    int64_t indexes = -1, version = -1;
    sql(walkIndexes, &indexes);
    ASSERT_EQ(indexes, 0);

    open();
    std::optional<LXWalkSlice> odd = workspace_->pluginsMatchingQueryAfterIdentifier(
        Value(), {}, LXPreselection{.extensionPoints = std::vector<std::string>{"com.example.odd"}}, std::nullopt, 10);
    ASSERT_TRUE(odd);
    ASSERT_EQ(odd->plugIns.size(), 2u);
    EXPECT_EQ(odd->plugIns[0]->pluginIdentifier(), "com.example.p1");
    EXPECT_EQ(odd->plugIns[1]->pluginIdentifier(), "com.example.p3");
    EXPECT_TRUE(odd->ended);
    workspace_.reset();
    sql(walkIndexes, &indexes);
    sql("PRAGMA user_version", &version);
    EXPECT_EQ(indexes, 3);
    EXPECT_EQ(version, LedgerixWorkspace::kSchemaVersion);
}

// ---- Discovery queries ----

class LedgerixQueryTest : public LedgerixTest {
  protected:
    void SetUp() override {
        LedgerixTest::SetUp();
        const char* points[] = {"com.example.a", "com.example.b", "com.example.v01"};
        for (int i = 0; i < 30; ++i) {
            TestBundle shape{.identifier = "com.example.q" + std::to_string(i), .point = points[i % 3]};
            if (i % 5 == 0) shape.entitlements = Value::dictionary({{"tag", str(shape.identifier)}});
            registerOK(writePlugIn(bundles_ / ("Q.app/PlugIns/Q" + std::to_string(i) + ".bxplugin"), shape));
        }
    }

    // Runs the query and returns the identifiers the filter saw; the filter keeps what `keep` says. Each call of
    // the filter re-enters the registry (which must not deadlock) and checks that it got the plug-in's own
    // entitlements.
    std::vector<std::string> filtered(const LXPreselection& preselection, std::optional<LXProxyList>* result = nullptr,
                                      std::function<bool(std::string_view)> keep = nullptr) {
        std::vector<std::string> seen;
        auto matches = workspace_->pluginsMatchingQueryApplyFilter(
            Value(),
            [&](std::string_view identifier, const std::optional<Value>& entitlements) {
                EXPECT_TRUE(workspace_->installedPlugins());
                if (entitlements) {
                    ++withEntitlements_;
                    EXPECT_EQ(entitlements->get("tag"), str(std::string(identifier)));
                }
                seen.emplace_back(identifier);
                return keep ? keep(identifier) : true;
            },
            preselection);
        EXPECT_TRUE(matches);
        if (result) *result = matches;
        return seen;
    }

    int withEntitlements_ = 0;
};

using Strings = std::vector<std::string>;

// The pre-selection narrows through the index (the filter sees only those plug-ins, in registration order); digit
// runs are indexed by value, a list is alternatives, and points and identifiers narrow together. No pre-selection
// narrows nothing.
TEST_F(LedgerixQueryTest, ThePreselectionNarrowsWhatTheFilterSees) {
    std::optional<LXProxyList> result;
    auto seen = filtered({.extensionPoints = Strings{"com.example.b"}}, &result,
                         [](std::string_view id) { return id != "com.example.q1"; });
    // In registration order, though the index keeps them by identifier ("q10" before "q4").
    Strings pointB;
    for (int i = 1; i < 30; i += 3) pointB.push_back("com.example.q" + std::to_string(i));
    EXPECT_EQ(seen, pointB);
    EXPECT_EQ(result->size(), 9u);    // the filter's refusal counts
    EXPECT_EQ(withEntitlements_, 2);  // q10 and q25 serve point b and carry entitlements
    // "v1" and "v01" share an index key: a few more candidates, never fewer.
    EXPECT_EQ(filtered({.extensionPoints = Strings{"com.example.v1"}}).size(), 10u);
    EXPECT_EQ(filtered({.extensionPoints = Strings{"com.example.a"},
                        .identifiers = Strings{"com.example.q3", "com.example.q4", "com.example.q99"}}),
              Strings{"com.example.q3"});
    EXPECT_EQ(filtered({}).size(), 30u);
    EXPECT_EQ(filtered({.extensionPoints = Strings{}}).size(), 30u) << "an empty list is no pre-selection";
}

// A point rule may be answered from the attributes or the top of the information, and an identifier rule by a
// plug-in without an identifier: such plug-ins are never left out by the pre-selection.
TEST_F(LedgerixQueryTest, PlugInsThatMayAnswerAPointRuleElsewhereAreAlwaysCandidates) {
    registerOK(writePlugIn(
        bundles_ / "W1.bxplugin",
        {.identifier = "com.example.w1", .extraAttributes = {{"RZExtensionPointIdentifier", str("com.example.zzz")}}}));
    registerOK(writePlugIn(
        bundles_ / "W2.bxplugin",
        {.identifier = "com.example.w2", .extraInfo = {{"RZExtensionPointIdentifier", str("com.example.yyy")}}}));
    registerOK(writePlugIn(bundles_ / "W3.bxplugin", {.identifier = ""}));
    auto seen = filtered({.extensionPoints = Strings{"com.example.b"}});
    EXPECT_EQ(seen.size(), 12u);
    EXPECT_NE(std::find(seen.begin(), seen.end(), "com.example.w1"), seen.end());
    EXPECT_NE(std::find(seen.begin(), seen.end(), "com.example.w2"), seen.end());
    // Without an identifier a plug-in may still answer an identifier rule from its dictionaries.
    seen = filtered({.identifiers = Strings{"com.example.q1"}});
    EXPECT_EQ(seen, (std::vector<std::string>{"com.example.q1", ""}));
}

// The paged walk: stretches of any size, from the indexed query and from the interface's default (which sorts the
// whole candidate list), visit every candidate once, by identifier (none first) and then registration; no
// identifier is split between stretches, a stretch that is not the last has at least the rows asked for, and the
// pre-selection narrows the walk as it narrows a query. A narrowed walk merges the alternatives of its
// pre-selection (each point or identifier, and the plug-ins that may answer a rule elsewhere), read separately.
TEST_F(LedgerixQueryTest, TheWalkVisitsEveryCandidateOnceByIdentifierWithoutSplittingOne) {
    for (const char* copy : {"Q7b", "Q7c"})
        registerOK(writePlugIn(bundles_ / (std::string(copy) + ".bxplugin"),
                               {.identifier = "com.example.q7", .point = "com.example.b"}));
    registerOK(writePlugIn(bundles_ / "W3.bxplugin", {.identifier = ""}));
    // Their points are not one plain string, so every point pre-selection keeps them; they sort among the others.
    registerOK(writePlugIn(
        bundles_ / "W1.bxplugin",
        {.identifier = "com.example.q15", .extraAttributes = {{"RZExtensionPointIdentifier", str("com.example.b")}}}));
    registerOK(writePlugIn(bundles_ / "W2.bxplugin",
                           {.identifier = "com.example.q0", .extraInfo = {{"RZExtensionPointIdentifier", str("x")}}}));
    auto keepAll = [](std::string_view, const std::optional<Value>&) { return true; };
    auto identifierOf = [](const auto& proxy) { return proxy->pluginIdentifier().value_or(""); };
    for (const LXPreselection& preselection :
         {LXPreselection{}, LXPreselection{.extensionPoints = Strings{"com.example.b"}},
          LXPreselection{.extensionPoints = Strings{"com.example.b", "com.example.a", "com.example.b"}},
          LXPreselection{.identifiers = Strings{"com.example.q7", "com.example.q15", "com.example.q0"}},
          LXPreselection{.extensionPoints = Strings{"com.example.a", "com.example.v1"},
          .identifiers = Strings{"com.example.q0", "com.example.q1", "com.example.q15"}}}) {
        std::optional<LXProxyList> all = workspace_->pluginsMatchingQueryApplyFilter(Value(), keepAll, preselection);
        ASSERT_TRUE(all);
        std::stable_sort(all->begin(), all->end(),
                         [&](const auto& a, const auto& b) { return identifierOf(a) < identifierOf(b); });
        Strings expected;
        for (const auto& proxy : *all) expected.push_back(*proxy->bundleURL());
        for (bool indexed : {true, false}) {
            for (size_t rows : {1u, 2u, 5u, 100u}) {
                Strings walked;
                std::set<std::string> earlierIdentifiers;
                std::optional<std::string> after;
                for (int stretches = 0; stretches < 100; ++stretches) {
                    std::optional<LXWalkSlice> slice =
                        indexed ? workspace_->pluginsMatchingQueryAfterIdentifier(Value(), keepAll, preselection, after,
                                                                                  rows)
                                : workspace_->LXApplicationWorkspace::pluginsMatchingQueryAfterIdentifier(
                                      Value(), keepAll, preselection, after, rows);
                    ASSERT_TRUE(slice);
                    std::set<std::string> identifiers;
                    for (const auto& proxy : slice->plugIns) {
                        walked.push_back(*proxy->bundleURL());
                        identifiers.insert(identifierOf(proxy));
                        EXPECT_FALSE(earlierIdentifiers.count(identifierOf(proxy))) << identifierOf(proxy);
                    }
                    earlierIdentifiers.insert(identifiers.begin(), identifiers.end());
                    if (slice->ended) break;
                    EXPECT_GE(slice->plugIns.size(), rows);
                    after = slice->last;
                }
                EXPECT_EQ(walked, expected) << (indexed ? "indexed" : "default") << ", stretches of " << rows << ", "
                                            << expected.size() << " candidates";
            }
        }
    }
}

// A query told which records the caller holds hands those back as UUIDs in their place and the others as records,
// the same candidates in the same order (and with the same placeholder flag) as a query told nothing, in the walk too
// (where a held candidate still counts towards its stretch and its identifier). A query with a filter reads every
// candidate for it and never asks.
TEST_F(LedgerixQueryTest, RecordsTheCallerHoldsComeBackAsUuidsInTheirPlaceUnlessAFilterNeedsThem) {
    std::optional<LXProxyList> installed = workspace_->installedPlugins();
    ASSERT_TRUE(installed);
    std::set<Uuid> holding;
    for (size_t i = 0; i < installed->size(); i += 3) holding.insert(*(*installed)[i]->pluginUUID());
    int asked = 0;
    LXKnownRecord known = [&](const Uuid& uuid) {
        ++asked;
        return holding.count(uuid) > 0;
    };
    auto expectSame = [&](const std::optional<LXCandidateList>& candidates, const LXProxyList& expected) {
        ASSERT_TRUE(candidates);
        ASSERT_EQ(candidates->size(), expected.size());
        for (size_t i = 0; i < expected.size(); ++i) {
            const LXCandidate& candidate = (*candidates)[i];
            EXPECT_EQ(candidate.uuid, *expected[i]->pluginUUID()) << i;
            EXPECT_EQ(candidate.proxy == nullptr, holding.count(candidate.uuid) > 0) << i;
            if (candidate.proxy) {
                EXPECT_EQ(candidate.proxy->bundleURL(), expected[i]->bundleURL()) << i;
            }
            const auto& application = expected[i]->containingBundle();
            EXPECT_EQ(candidate.inPlaceholderApplication, application && application->isPlaceholder()) << i;
        }
    };
    expectSame(workspace_->installedCandidates(known), *installed);
    EXPECT_EQ(asked, 30);
    const LXPreselection pointB{.extensionPoints = Strings{"com.example.b"}};
    expectSame(workspace_->candidatesMatchingQuery(Value(), {}, pointB, known),
               *workspace_->pluginsMatchingQueryApplyFilter(Value(), {}, pointB));
    EXPECT_EQ(asked, 40);

    for (size_t rows : {1u, 4u}) {
        std::optional<std::string> after;
        for (int stretches = 0; stretches < 100; ++stretches) {
            std::optional<LXWalkSlice> told =
                workspace_->pluginsMatchingQueryAfterIdentifier(Value(), {}, {}, after, rows);
            std::optional<LXCandidateSlice> slice =
                workspace_->candidatesAfterIdentifier(Value(), {}, {}, after, rows, known);
            ASSERT_TRUE(told && slice);
            expectSame(slice->candidates, told->plugIns);
            EXPECT_EQ(slice->last, told->last);
            EXPECT_EQ(slice->ended, told->ended);
            if (slice->ended) break;
            after = slice->last;
        }
    }

    asked = 0;
    int filtered = 0;
    auto keepOdd = [&](std::string_view, const std::optional<Value>&) { return ++filtered % 2 == 1; };
    std::optional<LXCandidateList> withFilter = workspace_->candidatesMatchingQuery(Value(), keepOdd, {}, known);
    ASSERT_TRUE(withFilter);
    EXPECT_EQ(filtered, 30);
    EXPECT_EQ(withFilter->size(), 15u);
    for (const LXCandidate& candidate : *withFilter) EXPECT_TRUE(candidate.proxy);
    std::optional<LXCandidateSlice> walkedWithFilter =
        workspace_->candidatesAfterIdentifier(Value(), keepOdd, {}, std::nullopt, 100, known);
    ASSERT_TRUE(walkedWithFilter);
    EXPECT_EQ(walkedWithFilter->candidates.size(), 15u);
    EXPECT_EQ(asked, 0);
}

// Guards the walk in registration order: stretches of any size, from the start, give every plug-in once in
// registration order, and only the last stretch says the walk ended, also when a filter refuses half of them (a
// refusal is still a row read); a pre-selection comes in one stretch; and the content version moves with a commit
// and only then.
TEST_F(LedgerixQueryTest, StretchesInRegistrationOrderMakeUpTheWholeAndTheVersionMovesWithCommits) {
    std::optional<LXProxyList> installed = workspace_->installedPlugins();
    ASSERT_TRUE(installed);
    ASSERT_EQ(installed->size(), 30u);
    std::vector<Uuid> inOrder;
    for (const auto& proxy : *installed) inOrder.push_back(*proxy->pluginUUID());
    int offered = 0;
    auto keepOdd = [&](std::string_view, const std::optional<Value>&) { return ++offered % 2 == 1; };
    auto walk = [&](size_t rows, const LXPlugInFilter& filter, size_t* stretches) {
        std::vector<Uuid> walked;
        int64_t after = 0;
        for (*stretches = 1; *stretches < 100; ++*stretches) {
            std::optional<LXRegistrationSlice> slice =
                workspace_->candidatesAfterRegistration(Value(), filter, {}, after, rows, {});
            EXPECT_TRUE(slice);
            if (!slice) break;
            EXPECT_LE(slice->candidates.size(), rows);
            for (const LXCandidate& candidate : slice->candidates) walked.push_back(candidate.uuid);
            if (slice->ended) break;
            EXPECT_GT(slice->last, after);
            after = slice->last;
        }
        return walked;
    };
    for (size_t rows : {1u, 7u, 30u, 100u}) {
        size_t stretches = 0;
        EXPECT_EQ(walk(rows, {}, &stretches), inOrder) << "stretches of " << rows;
        // A full stretch cannot tell that nothing follows it: one more, empty or short, ends the walk.
        EXPECT_EQ(stretches, rows > 30 ? 1u : 30 / rows + 1) << "stretches of " << rows;
    }
    size_t stretches = 0;
    std::vector<Uuid> kept = walk(4, keepOdd, &stretches);
    EXPECT_EQ(offered, 30);
    EXPECT_EQ(kept.size(), 15u);
    EXPECT_EQ(stretches, 8u);

    std::optional<LXRegistrationSlice> pointB =
        workspace_->candidatesAfterRegistration(Value(), {}, {.extensionPoints = Strings{"com.example.b"}}, 0, 1, {});
    ASSERT_TRUE(pointB);
    EXPECT_TRUE(pointB->ended);
    EXPECT_EQ(pointB->candidates.size(), 10u);

    std::optional<uint64_t> version = workspace_->contentVersion();
    ASSERT_TRUE(version);
    workspace_->installedPlugins();
    EXPECT_EQ(workspace_->contentVersion(), version) << "a read is no change";
    registerOK(writePlugIn(bundles_ / "Q.app/PlugIns/Late.bxplugin", {.identifier = "com.example.late"}));
    EXPECT_NE(workspace_->contentVersion(), version);
}

// ---- Bundles the registry refuses ----

using LedgerixBadBundleTest = LedgerixTest;

// Guards every refusal's code (one bundle per kind of fault, plus identifiers that would put the container outside
// the containers directory) and that no refusal changes the registry, not even one at a registered path.
TEST_F(LedgerixBadBundleTest, RefusalsLeaveTheRegistryUnchangedAContainerThatCannotBeMadeIncluded) {
    // A good registration that must survive every failure below, including failures at its own path.
    fs::path good = writePlugIn(bundles_ / "A.app/PlugIns/Good.bxplugin", {.identifier = "com.example.good"});
    auto original = registerOK(good);
    ASSERT_TRUE(original);
    const auto write = test::writeText;
    fs::create_directories(bundles_ / "NoPlugIn.bxplugin");
    write(bundles_ / "Garbled.bxplugin/Info.vrec", "<vrec version=\"1\"><dict><key>x</key>");
    ASSERT_FALSE(Document::writeFileAtomically(bundles_ / "NoPlugIn.bxplugin/Info.vrec",
                                               Value::dictionary({{"BDBundleIdentifier", str("x.y")}})));
    writePlugIn(bundles_ / "BadEntitlements.bxplugin", {.identifier = "x.bad1"});
    write(bundles_ / "BadEntitlements.bxplugin/Entitlements.vrec", "garbage");
    writePlugIn(bundles_ / "HugeEntitlements.bxplugin", {.identifier = "x.bad3"});
    write(bundles_ / "HugeEntitlements.bxplugin/Entitlements.vrec", std::string(2 << 20, ' '));
    writePlugIn(bundles_ / "Escape.bxplugin", {.identifier = "../../escape"});
    writePlugIn(bundles_ / "Dots.bxplugin", {.identifier = ".."});
    fs::create_directory_symlink(bundles_ / "LoopB.bxplugin", bundles_ / "LoopA.bxplugin");
    fs::create_directory_symlink(bundles_ / "LoopA.bxplugin", bundles_ / "LoopB.bxplugin");

    struct Case {
        std::string path;
        int code;
    };
    const Case cases[] = {
        {"relative/Thing.bxplugin", kLXBadPath},
        {std::string("/tmp/nul\0byte", 13), kLXBadPath},
        {(bundles_ / "LoopA.bxplugin").string(), kLXBadPath},
        {(bundles_ / "Garbled.bxplugin").string(), kLXBadInfo},
        {(bundles_ / "NoPlugIn.bxplugin").string(), kLXNotAPlugIn},
        {(bundles_ / "BadEntitlements.bxplugin").string(), kLXBadEntitlements},
        {(bundles_ / "HugeEntitlements.bxplugin").string(), kLXBadEntitlements},
        {(bundles_ / "Escape.bxplugin").string(), kLXBadIdentifier},
        {(bundles_ / "Dots.bxplugin").string(), kLXBadIdentifier},
    };
    for (const Case& c : cases) {
        auto result = workspace_->registerPlugin(c.path);
        ASSERT_FALSE(result.ok()) << c.path;
        EXPECT_EQ(result.error().domain(), LXErrorDomain) << c.path;
        EXPECT_EQ(result.error().code(), c.code) << c.path << ": " << result.error().description();
    }
    EXPECT_FALSE(fs::exists(dir_ / "escape"));

    // The good bundle turns bad in place: the old record stays as it was.
    write(good / "Info.vrec", "broken");
    EXPECT_FALSE(workspace_->registerPlugin(good.string()).ok());
    EXPECT_EQ(count(), 1u);
    auto still = workspace_->plugInProxyForURL(good.string());
    ASSERT_TRUE(still);
    EXPECT_EQ(still->pluginUUID(), original->pluginUUID());
    EXPECT_EQ(still->infoVrec(), original->infoVrec());
    EXPECT_EQ(observer_->snapshot().size(), 1u);
    EXPECT_FALSE(workspace_->checkIntegrity());

    // A container that cannot be made (a file stands where its directory should be) refuses the registration.
    fs::create_directories(state_ / "containers");
    std::ofstream(state_ / "containers/com.example.blocked") << "in the way";
    auto result = workspace_->registerPlugin(
        writePlugIn(bundles_ / "Blocked.bxplugin", {.identifier = "com.example.blocked"}).string());
    ASSERT_FALSE(result.ok());
    EXPECT_EQ(result.error().code(), kLXContainerFailure);
    EXPECT_EQ(count(), 1u) << "only the good registration";
}

}  // namespace
}  // namespace bexil
