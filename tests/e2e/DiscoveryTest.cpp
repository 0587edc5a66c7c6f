// Discovery through the real daemon: the example bundles are registered with "add", then "match" is asked as a
// client would, from this test program, from a client program inside an application, and through the bexil tool.

#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <future>
#include <sstream>
#include <thread>
#include <variant>

#include "BxdProcess.h"
#include "E2eSupport.h"
#include "TestClient.h"
#include "base/Document.h"
#include "base/EventLoop.h"
#include "base/SerialQueue.h"
#include "platform/zem/ZemConnection.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;
using test::BxdProcess;
using test::errorCode;
using test::errorText;
using test::identifiers;
using test::Ids;
using test::matchRequest;

const fs::path kExamples = fs::path(BEXIL_SOURCE_DIR) / "examples" / "bundles";
constexpr const char* kManagerEntitlement = "com.quorvel.private.bexil.manager";
constexpr uint64_t kAllVersions = 0x1, kAllInstances = 0x4, kSystemOnly = 0x8, kDiscoverAll = 0x200;

const std::string kHello = "com.example.greeter.hello";
const std::string kBonjour = "com.example.greeter.bonjour";
const std::string kNightTheme = "com.example.greeter.night-theme";
const std::string kStationery = "com.example.notes.stationery";
const std::string kClipper = "com.example.notes.clipper";

Value str(std::string_view s) { return Value::string(s); }

using test::TestClient;

// The forms of the reply whose identifier is `identifier`.
std::vector<Value> formsOf(const Value& reply, const std::string& identifier) {
    std::vector<Value> forms;
    for (const Value& form : reply.get("matches").items())
        if (form.get("identifier").stringView() == identifier) forms.push_back(form);
    return forms;
}

struct Outcome {
    int status = -1;
    std::string out;
};

class DiscoveryTest : public ::testing::Test {
  protected:
    void SetUp() override {
        bundles_ = bxd_.root() / "bundles";
        fs::create_directories(bundles_);
        for (const char* bundle : {"Greeter.app", "Notes.app"})
            fs::copy(kExamples / bundle, bundles_ / bundle, fs::copy_options::recursive);
        bundles_ = fs::canonical(bundles_);
        preferences_ = bxd_.root() / "preferences";
        fs::create_directories(preferences_);
        setenv("BX_PREFERENCES_DIR", preferences_.c_str(), 1);
        bxd_.exportEnvironment();
    }

    void start() {
        ASSERT_TRUE(bxd_.start({"-d", (bxd_.root() / "annotations").string()},
                               {"BX_PREFERENCES_DIR=" + preferences_.string(), "BXD_LOG_LEVEL=debug"}))
            << bxd_.log();
    }

    // Registers the plug-ins of both example applications (NightTheme is dedicated to Greeter.app).
    void registerExamples() {
        add({plugIn("Greeter.app/PlugIns/Hello.bxplugin"), plugIn("Greeter.app/PlugIns/Bonjour.bxplugin"),
             plugIn("Greeter.app/PlugIns/NightTheme.bxplugin"), plugIn("Notes.app/PlugIns/Stationery.bxplugin"),
             plugIn("Notes.app/PlugIns/Clipper.wexa")});
    }

    void add(const std::vector<std::string>& paths) {
        std::vector<Value> values;
        for (const std::string& path : paths) values.push_back(str(path));
        TestClient client;
        Value reply = client.replyTo(Value::dictionary(
            {{"request", str("add")}, {"version", Value::uint64(3)}, {"paths", Value::array(std::move(values))}}));
        ASSERT_EQ(errorCode(reply), 0) << errorText(reply) << "\n" << bxd_.log();
    }

    // Gives `executable` entitlements through the daemon's trusted entitlements directory.
    void grant(const fs::path& executable, Value entitlements, const std::string& name) {
        fs::path file = bxd_.entitlementsDir() / (name + ".vrec");
        ASSERT_FALSE(Document::writeFileAtomically(
            file, Value::dictionary({{"Executable", str(executable.string())}, {"Entitlements", entitlements}})));
        ASSERT_EQ(chmod(file.c_str(), 0644), 0);
    }
    void grantSelf(Value entitlements) { grant(fs::canonical("/proc/self/exe"), std::move(entitlements), "self"); }

    // A copy of Hello.bxplugin inside Notes.app with the extension version given.
    std::string helloCopy(const std::string& name, const std::string& version) {
        fs::path copy = bundles_ / "Notes.app" / "PlugIns" / (name + ".bxplugin");
        fs::copy(bundles_ / "Greeter.app/PlugIns/Hello.bxplugin", copy, fs::copy_options::recursive);
        Result<Value> info = Document::readFile(copy / "Info.vrec");
        if (!info) {
            ADD_FAILURE() << info.error().description();
            return copy.string();
        }
        MutableDictionary attributes(info->get("RZExtension").get("RZExtensionAttributes"));
        attributes.set("RZExtensionVersion", str(version));
        MutableDictionary plugIn(info->get("RZExtension"));
        plugIn.set("RZExtensionAttributes", attributes.take());
        MutableDictionary root(*info);
        root.set("RZExtension", plugIn.take());
        EXPECT_FALSE(Document::writeFileAtomically(copy / "Info.vrec", root.take()));
        return copy.string();
    }

    // Runs `command` in a shell with the daemon's environment; captures standard output.
    Outcome shell(const std::string& command) {
        fs::path out = bxd_.root() / "out.txt";
        std::string line = command + " >'" + out.string() + "' 2>&1";
        Outcome outcome;
        int status = system(line.c_str());
        outcome.status = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
        std::ifstream in(out);
        std::stringstream text;
        text << in.rdbuf();
        outcome.out = text.str();
        return outcome;
    }

    static fs::path tool() { return fs::path(BEXIL_BINARY_DIR) / "tools" / "bexil" / "bexil"; }
    static fs::path matchClient() { return fs::path(BEXIL_BINARY_DIR) / "tests" / "bx_match_client"; }

    std::string plugIn(const std::string& relative) const { return (bundles_ / relative).string(); }

    BxdProcess bxd_;
    fs::path bundles_;
    fs::path preferences_;
};

TEST_F(DiscoveryTest, RulesSelectByExtensionPointAndIdentifier) {
    start();
    registerExamples();
    TestClient client;

    Value greeting =
        client.replyTo(matchRequest(Value::dictionary({{"RZExtensionPointIdentifier", str("com.example.greeting")}})));
    EXPECT_EQ(errorCode(greeting), 0) << errorText(greeting);
    EXPECT_EQ(identifiers(greeting), (Ids{kBonjour, kHello}));

    Value hello = client.replyTo(matchRequest(Value::dictionary({{"RZExtensionIdentifier", str(kHello)}})));
    EXPECT_EQ(identifiers(hello), (Ids{kHello}));
    // The rule is re-checked by the daemon beyond what the registry pre-selects: an attribute rule.
    Value french = client.replyTo(matchRequest(
        Value::dictionary({{"RZExtensionPointIdentifier", str("com.example.greeting")}, {"Language", str("fr")}})));
    EXPECT_EQ(identifiers(french), (Ids{kBonjour}));

    Value none = client.replyTo(matchRequest(Value::dictionary({{"RZExtensionIdentifier", str("com.example.none")}})));
    EXPECT_EQ(errorCode(none), 0);
    ASSERT_TRUE(none.contains("matches"));
    EXPECT_EQ(none.get("matches").count(), 0u);
    EXPECT_TRUE(bxd_.waitForLog("match returned 0 plug-ins")) << bxd_.log();
}

TEST_F(DiscoveryTest, NoRulesReturnsEveryVisiblePlugInWithAnnotationsAndExtensions) {
    start();
    registerExamples();
    TestClient client;
    Value reply = client.replyTo(matchRequest());
    ASSERT_EQ(errorCode(reply), 0) << errorText(reply);
    // NightTheme is dedicated to Greeter.app and this client is not inside it.
    EXPECT_EQ(identifiers(reply), (Ids{kBonjour, kHello, kClipper, kStationery}));
    for (const Value& form : reply.get("matches").items()) {
        EXPECT_TRUE(form.get("annotations").isDictionary()) << form.description();
        EXPECT_FALSE(form.contains("overrider"));
    }
    // Shared resources come with read-only tokens; an application extension gets one for its whole bundle.
    Value helloExtensions = formsOf(reply, kHello).at(0).get("extensions");
    EXPECT_TRUE(helloExtensions.contains("Resources/greetings.txt")) << helloExtensions.description();
    EXPECT_TRUE(formsOf(reply, kClipper).at(0).get("extensions").contains("."));
    EXPECT_FALSE(formsOf(reply, kBonjour).at(0).contains("extensions"));
}

TEST_F(DiscoveryTest, MalformedRequestsAreRefused) {
    start();
    registerExamples();
    TestClient client;
    Value rules = client.replyTo(matchRequest(str("RZExtensionIdentifier=x")));
    EXPECT_EQ(errorCode(rules), 4);
    EXPECT_EQ(errorText(rules), "invalid request format (bad rules dictionary)");
    EXPECT_FALSE(rules.contains("matches"));

    // A version 2 client is answered, but the result has no encoding for it.
    Value old = client.replyTo(matchRequest(std::nullopt, 0, 2));
    EXPECT_EQ(errorCode(old), 0) << errorText(old);
    EXPECT_FALSE(old.contains("matches")) << old.description();
}

TEST_F(DiscoveryTest, DiscoverAllNeedsTheManagerEntitlementAndNoSandbox) {
    start();
    registerExamples();
    {
        TestClient client;
        Value refused = client.replyTo(matchRequest(std::nullopt, kDiscoverAll));
        EXPECT_EQ(errorCode(refused), 11);
        EXPECT_EQ(errorText(refused), "unauthorized discovery flag (BXDiscoverAll)");
    }
    // Bits other than the four discovery flags are ignored.
    {
        TestClient client;
        EXPECT_EQ(identifiers(client.replyTo(matchRequest(std::nullopt, 0x10000))).size(), 4u);
    }

    grant(matchClient(), Value::dictionary({{kManagerEntitlement, Value::boolean(true)}}), "match-client");
    Outcome all = shell("'" + matchClient().string() + "' 0x200");
    EXPECT_EQ(all.status, 0) << all.out;
    // Privileged discovery skips the visibility checks: the dedicated plug-in shows up too.
    EXPECT_NE(all.out.find(kNightTheme + "\n"), std::string::npos) << all.out;

    // The same entitled program in another user namespace counts as sandboxed.
    Outcome sandboxed = shell("unshare --user '" + matchClient().string() + "' 0x200");
    EXPECT_EQ(sandboxed.status, 1) << sandboxed.out;
    EXPECT_NE(sandboxed.out.find("error 11: unauthorized discovery flag (BXDiscoverAll)"), std::string::npos)
        << sandboxed.out;
}

TEST_F(DiscoveryTest, DedicatedPlugInIsVisibleOnlyToItsOwnApplication) {
    start();
    registerExamples();
    fs::path inside = bundles_ / "Greeter.app" / "greeter";
    fs::remove(inside);
    fs::copy_file(matchClient(), inside);
    fs::permissions(inside, fs::perms::owner_all | fs::perms::group_read | fs::perms::group_exec |
                                fs::perms::others_read | fs::perms::others_exec);
    Outcome own = shell("'" + inside.string() + "'");
    EXPECT_EQ(own.status, 0) << own.out;
    EXPECT_NE(own.out.find(kNightTheme + "\n"), std::string::npos) << own.out;

    fs::path notes = bundles_ / "Notes.app" / "notes";
    fs::remove(notes);
    fs::copy_file(matchClient(), notes);
    fs::permissions(notes, fs::perms::owner_all);
    Outcome other = shell("'" + notes.string() + "'");
    EXPECT_EQ(other.status, 0) << other.out;
    EXPECT_EQ(other.out.find(kNightTheme), std::string::npos) << other.out;
    EXPECT_NE(other.out.find(kHello), std::string::npos) << other.out;

    // Only system plug-ins: none are registered here.
    Outcome system = shell("'" + inside.string() + "' 0x8");
    EXPECT_EQ(system.status, 0) << system.out;
    EXPECT_EQ(system.out, "");
}

TEST_F(DiscoveryTest, ExclusionsWrittenByTheToolApplyToTheNextMatchEvenUnderDiscoverAll) {
    start();
    registerExamples();
    grantSelf(Value::dictionary({{kManagerEntitlement, Value::boolean(true)}}));
    TestClient client;
    ASSERT_EQ(identifiers(client.replyTo(matchRequest())).size(), 4u);

    Outcome add = shell("'" + tool().string() + "' exclusions --add RZExtensionIdentifier=" + kBonjour);
    ASSERT_EQ(add.status, 0) << add.out;
    EXPECT_EQ(identifiers(client.replyTo(matchRequest())), (Ids{kHello, kClipper, kStationery}));
    Ids all = identifiers(client.replyTo(matchRequest(std::nullopt, kDiscoverAll)));
    EXPECT_EQ(std::count(all.begin(), all.end(), kBonjour), 0) << "exclusions hold under discover-all";
    EXPECT_EQ(std::count(all.begin(), all.end(), kNightTheme), 1);
    EXPECT_TRUE(bxd_.waitForLog("globally excluded")) << bxd_.log();

    ASSERT_EQ(shell("'" + tool().string() + "' exclusions --clear").status, 0);
    EXPECT_EQ(identifiers(client.replyTo(matchRequest())).size(), 4u);
}

TEST_F(DiscoveryTest, HostRuleSetRestrictsWhatTheHostSees) {
    start();
    registerExamples();
    grantSelf(Value::dictionary(
        {{kManagerEntitlement, Value::boolean(true)},
         {"com.quorvel.developer.bexil.allowedplugins", Value::dictionary({{"RZExtensionIdentifier", str(kHello)}})}}));
    TestClient client;
    EXPECT_EQ(identifiers(client.replyTo(matchRequest())), (Ids{kHello}));
    EXPECT_TRUE(bxd_.waitForLog("the host's plug-in entitlement does not allow this plug-in")) << bxd_.log();
    // Privileged discovery does not ask the host policy.
    EXPECT_EQ(identifiers(client.replyTo(matchRequest(std::nullopt, kDiscoverAll))).size(), 5u);
}

TEST_F(DiscoveryTest, BestVersionWinsUnlessAllVersionsAreAsked) {
    start();
    registerExamples();
    add({helloCopy("HelloNext", "1.10")});
    TestClient client;
    Value rules = Value::dictionary({{"RZExtensionIdentifier", str(kHello)}});

    std::vector<Value> best = formsOf(client.replyTo(matchRequest(rules)), kHello);
    ASSERT_EQ(best.size(), 1u);
    EXPECT_EQ(best[0].get("version").stringView(), "1.10") << "1.10 is later than 1.2";

    std::vector<Value> both = formsOf(client.replyTo(matchRequest(rules, kAllVersions)), kHello);
    EXPECT_EQ(both.size(), 2u);
}

TEST_F(DiscoveryTest, SameVersionGoesToTheLaterRegistrationUnlessAllInstancesAreAsked) {
    start();
    registerExamples();
    // Registration times are whole seconds; the copy must be registered in a later one.
    std::this_thread::sleep_for(std::chrono::milliseconds(1100));
    std::string copy = helloCopy("HelloAgain", "1.2");
    add({copy});
    TestClient client;
    Value rules = Value::dictionary({{"RZExtensionIdentifier", str(kHello)}});

    std::vector<Value> one = formsOf(client.replyTo(matchRequest(rules)), kHello);
    ASSERT_EQ(one.size(), 1u);
    EXPECT_EQ(one[0].get("path").stringView(), copy);
    EXPECT_EQ(formsOf(client.replyTo(matchRequest(rules, kAllVersions)), kHello).size(), 1u)
        << "all versions alone still resolves equal versions";
    EXPECT_EQ(formsOf(client.replyTo(matchRequest(rules, kAllVersions | kAllInstances)), kHello).size(), 2u);
    EXPECT_EQ(formsOf(client.replyTo(matchRequest(rules, kAllInstances)), kHello).size(), 1u)
        << "all instances has no effect without all versions";
}

TEST_F(DiscoveryTest, ReplacingPlugInIsLinkedToThePlugInItReplaces) {
    fs::path bonjour = bundles_ / "Greeter.app/PlugIns/Bonjour.bxplugin";
    ASSERT_FALSE(Document::writeFileAtomically(
        bonjour / "Entitlements.vrec",
        Value::dictionary({{"com.quorvel.developer.replace-plugin", Value::array({str(kHello), Value::int64(3)})}})));
    start();
    registerExamples();
    TestClient client;
    Value reply = client.replyTo(matchRequest());
    ASSERT_EQ(errorCode(reply), 0) << errorText(reply);
    Value hello = formsOf(reply, kHello).at(0);
    Value replacing = formsOf(reply, kBonjour).at(0);
    EXPECT_EQ(hello.get("overrider"), replacing.get("uuid"));
    EXPECT_EQ(replacing.get("overriding").stringView(), kHello);
    EXPECT_FALSE(replacing.contains("overrider"));
    EXPECT_TRUE(bxd_.waitForLog("plug-in " + std::string(replacing.get("uuid").stringView()) + " overrides " +
                                std::string(hello.get("uuid").stringView())))
        << bxd_.log();
}

TEST_F(DiscoveryTest, ToolPrintsTheMatchesAsATable) {
    start();
    registerExamples();
    Outcome run = shell("'" + tool().string() + "' match RZExtensionPointIdentifier=com.example.greeting");
    EXPECT_EQ(run.status, 0) << run.out;
    EXPECT_EQ(run.out.rfind("IDENTIFIER", 0), 0u) << run.out;
    EXPECT_NE(run.out.find(kHello + " "), std::string::npos) << run.out;
    EXPECT_NE(run.out.find(kBonjour + " "), std::string::npos) << run.out;
    EXPECT_EQ(run.out.find(kStationery), std::string::npos) << run.out;
    EXPECT_NE(run.out.find(plugIn("Greeter.app/PlugIns/Hello.bxplugin")), std::string::npos) << run.out;

    Outcome nothing = shell("'" + tool().string() + "' match RZExtensionPointIdentifier=com.example.none");
    EXPECT_EQ(nothing.status, 0) << nothing.out;
    EXPECT_EQ(nothing.out, "no plug-ins match\n");
}

}  // namespace
}  // namespace bexil
