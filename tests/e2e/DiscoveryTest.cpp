// Discovery through the real daemon: the example bundles are registered with "add", then "match" is asked as a
// client would, from this test program, from a client program inside an application, and through the bexil tool.

#include <gtest/gtest.h>

#include "E2eSupport.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;
using namespace test;

const std::string kHello = "com.example.greeter.hello";
const std::string kBonjour = "com.example.greeter.bonjour";
const std::string kNightTheme = "com.example.greeter.night-theme";
const std::string kStationery = "com.example.notes.stationery";
const std::string kClipper = "com.example.notes.clipper";

Value str(std::string_view s) { return Value::string(s); }

class DiscoveryTest : public DaemonTest {
  protected:
    void SetUp() override { copyExamples({"Greeter.app", "Notes.app"}); }

    // Starts the daemon and registers the plug-ins of both example applications (NightTheme is dedicated to
    // Greeter.app).
    void startWithExamples() {
        ASSERT_TRUE(start()) << bxd_.log();
        add({plugIn("Greeter.app/PlugIns/Hello.bxplugin"), plugIn("Greeter.app/PlugIns/Bonjour.bxplugin"),
             plugIn("Greeter.app/PlugIns/NightTheme.bxplugin"), plugIn("Notes.app/PlugIns/Stationery.bxplugin"),
             plugIn("Notes.app/PlugIns/Clipper.wexa")});
    }

    // A copy of Hello.bxplugin inside Notes.app with the extension version given.
    std::string helloCopy(const std::string& name, const std::string& version) {
        fs::path copy = bundles_ / "Notes.app" / "PlugIns" / (name + ".bxplugin");
        fs::copy(bundles_ / "Greeter.app/PlugIns/Hello.bxplugin", copy, fs::copy_options::recursive);
        Result<Value> info = Document::readFile(copy / "Info.vrec");
        EXPECT_TRUE(info.ok());
        MutableDictionary attributes(info->get("RZExtension").get("RZExtensionAttributes"));
        attributes.set("RZExtensionVersion", str(version));
        MutableDictionary plugIn(info->get("RZExtension"));
        plugIn.set("RZExtensionAttributes", attributes.take());
        MutableDictionary root(*info);
        root.set("RZExtension", plugIn.take());
        EXPECT_FALSE(Document::writeFileAtomically(copy / "Info.vrec", root.take()));
        return copy.string();
    }
};

// Guards the wiring of "match": without rules every visible plug-in (not the one dedicated to another application)
// with its annotations and, for shared resources, sandbox extensions (their kinds: BXDPlugInExtensionsTest); the
// daemon's re-check of attribute rules beyond what the registry pre-selects; an empty result that still carries
// "matches"; and the refusals of malformed requests.
TEST_F(DiscoveryTest, MatchSelectsVisiblePlugInsByRulesAndRefusesMalformedRequests) {
    startWithExamples();
    Value reply = succeed(matchRequest());
    EXPECT_EQ(identifiers(reply), (Ids{kBonjour, kHello, kClipper, kStationery}));
    for (const Value& form : reply.get("matches").items())
        EXPECT_TRUE(form.get("annotations").isDictionary() && !form.contains("overrider")) << form.description();
    Value helloExtensions = formsOf(reply, kHello).at(0).get("extensions");
    EXPECT_TRUE(helloExtensions.contains("Resources/greetings.txt")) << helloExtensions.description();

    Value french = succeed(matchRequest(
        Value::dictionary({{"RZExtensionPointIdentifier", str("com.example.greeting")}, {"Language", str("fr")}})));
    EXPECT_EQ(identifiers(french), (Ids{kBonjour}));

    Value none = succeed(matchRequest(identifierRule("com.example.none")));
    EXPECT_TRUE(none.get("matches").isArray() && none.get("matches").count() == 0) << none.description();
    expectLog("match returned 0 plug-ins");

    expectFailure(matchRequest(str("RZExtensionIdentifier=x")), 4, "invalid request format (bad rules dictionary)");
    // A version 2 client is answered, but the result has no encoding for it.
    Value old = succeed(Value::dictionary({{"request", str("match")}, {"version", Value::uint64(2)}}));
    EXPECT_FALSE(old.contains("matches")) << old.description();
}

// Guards who sees what: a client inside an application (found from its executable) sees the plug-in dedicated to
// it, which other clients do not (the policy's other cases: PolicyBundlesTest); privileged discovery is refused
// without the manager entitlement and to an entitled program in another user namespace (sandboxed); granted, it
// skips the visibility checks and the host's rule set, which otherwise restricts what an entitled host sees.
// Unknown flag bits are ignored.
TEST_F(DiscoveryTest, DedicatedPlugInsAndPrivilegedDiscoveryAreSeenOnlyByTheirClients) {
    startWithExamples();
    fs::path inside = bundles_ / "Greeter.app" / "greeter";
    fs::copy_file(kMatchClient, inside, fs::copy_options::overwrite_existing);
    Outcome own = shell("'" + inside.string() + "'");
    EXPECT_EQ(own.status, 0) << own.err;
    EXPECT_NE(own.out.find(kNightTheme + "\n"), std::string::npos) << own.out;
    expectLog("is inside bundle " + plugIn("Greeter.app") + " (com.example.greeter)");

    expectFailure(matchRequest(std::nullopt, kDiscoverAll), 11, "unauthorized discovery flag (BXDiscoverAll)");
    EXPECT_EQ(identifiers(TestClient().replyTo(matchRequest(std::nullopt, 0x10000))).size(), 4u);
    grantSelf(Value::dictionary({{kManagerEntitlement, Value::boolean(true)},
                                 {"com.quorvel.developer.bexil.allowedplugins", identifierRule(kHello)}}));
    TestClient client;
    EXPECT_EQ(identifiers(client.replyTo(matchRequest())), (Ids{kHello}));
    expectLog("the host's plug-in entitlement does not allow this plug-in");
    EXPECT_EQ(identifiers(client.replyTo(matchRequest(std::nullopt, kDiscoverAll))).size(), 5u)
        << "every plug-in, also the one dedicated to another application";

    grant(kMatchClient, Value::dictionary({{kManagerEntitlement, Value::boolean(true)}}), "match-client");
    Outcome sandboxed = shell("unshare --user '" + kMatchClient.string() + "' 0x200");
    EXPECT_EQ(sandboxed.status, 1) << sandboxed.out << sandboxed.err;
    EXPECT_EQ(sandboxed.out, "error 11: unauthorized discovery flag (BXDiscoverAll)\n");
}

// Guards the tool against the daemon: exclusions it writes to the preferences (and lists) are read at the next
// match, even under privileged discovery; a refused --set keeps them, clearing them brings the plug-ins back;
// "match" prints a table with a heading, identifiers and paths, or one line for nothing.
TEST_F(DiscoveryTest, ToolExclusionsApplyToTheNextMatchAndMatchPrintsATable) {
    startWithExamples();
    grantSelfManager();
    TestClient client;
    EXPECT_NE(bexil("exclusions").out.find("no exclusions"), std::string::npos);

    ASSERT_EQ(bexil("exclusions --add RZExtensionIdentifier=" + kBonjour).status, 0);
    EXPECT_NE(bexil("--json exclusions").out.find("\"RZExtensionIdentifier\": \"" + kBonjour + "\""),
              std::string::npos);
    EXPECT_EQ(identifiers(client.replyTo(matchRequest())), (Ids{kHello, kClipper, kStationery}));
    EXPECT_EQ(identifiers(client.replyTo(matchRequest(std::nullopt, kDiscoverAll))).size(), 4u)
        << "exclusions hold under discover-all";
    expectLog("globally excluded");

    fs::path bad = bxd_.root() / "bad.json";
    std::ofstream(bad) << "{\"exclusions\": [\"not a rule\"]}";
    EXPECT_EQ(bexil("exclusions --set " + bad.string()).status, 64);
    EXPECT_EQ(identifiers(client.replyTo(matchRequest())).size(), 3u) << "a refused --set keeps the old rules";
    ASSERT_EQ(bexil("exclusions --clear").status, 0);
    EXPECT_EQ(bexil("--json exclusions").out, "[]\n");
    EXPECT_EQ(identifiers(client.replyTo(matchRequest())).size(), 4u);

    Outcome run = bexil("match RZExtensionPointIdentifier=com.example.greeting");
    EXPECT_EQ(run.status, 0) << run.err;
    EXPECT_EQ(run.out.rfind("IDENTIFIER", 0), 0u) << run.out;
    EXPECT_NE(run.out.find(kBonjour + " "), std::string::npos) << run.out;
    EXPECT_EQ(run.out.find(kStationery), std::string::npos) << run.out;
    EXPECT_NE(run.out.find(plugIn("Greeter.app/PlugIns/Hello.bxplugin")), std::string::npos) << run.out;
    EXPECT_EQ(bexil("match RZExtensionPointIdentifier=com.example.none").out, "no plug-ins match\n");
}

// Guards version resolution: the best version wins (1.10 after 1.2); with all versions, equal versions still go
// to the later registration; only all versions together with all instances gives every copy.
TEST_F(DiscoveryTest, BestVersionWinsAndEqualVersionsGoToTheLaterRegistration) {
    startWithExamples();
    sleepToNextSecond();  // the copies are registered later than the examples
    std::string again = helloCopy("HelloAgain", "1.2");
    add({again, helloCopy("HelloNext", "1.10")});
    TestClient client;
    Value rules = identifierRule(kHello);

    std::vector<Value> best = formsOf(client.replyTo(matchRequest(rules)), kHello);
    ASSERT_EQ(best.size(), 1u);
    EXPECT_EQ(best[0].get("version").stringView(), "1.10");
    std::vector<Value> versions = formsOf(client.replyTo(matchRequest(rules, kAllVersions)), kHello);
    ASSERT_EQ(versions.size(), 2u);
    for (const Value& form : versions)
        EXPECT_TRUE(form.get("version").stringView() != "1.2" || form.get("path").stringView() == again)
            << "the later registration of 1.2 is chosen: " << form.description();
    EXPECT_EQ(formsOf(client.replyTo(matchRequest(rules, kAllVersions | kAllInstances)), kHello).size(), 3u);
    EXPECT_EQ(formsOf(client.replyTo(matchRequest(rules, kAllInstances)), kHello).size(), 1u)
        << "all instances has no effect without all versions";
}

// Guards the link between a replacing plug-in and the one it replaces in both forms, and its log line.
TEST_F(DiscoveryTest, ReplacingPlugInIsLinkedToThePlugInItReplaces) {
    ASSERT_FALSE(Document::writeFileAtomically(
        bundles_ / "Greeter.app/PlugIns/Bonjour.bxplugin/Entitlements.vrec",
        Value::dictionary({{"com.quorvel.developer.replace-plugin", Value::array({str(kHello), Value::int64(3)})}})));
    startWithExamples();
    Value reply = succeed(matchRequest());
    Value hello = formsOf(reply, kHello).at(0);
    Value replacing = formsOf(reply, kBonjour).at(0);
    EXPECT_EQ(hello.get("overrider"), replacing.get("uuid"));
    EXPECT_EQ(replacing.get("overriding").stringView(), kHello);
    EXPECT_FALSE(replacing.contains("overrider"));
    expectLog("plug-in " + std::string(replacing.get("uuid").stringView()) + " overrides " +
              std::string(hello.get("uuid").stringView()));
}

// Guards the forms a match sends from what each record keeps encoded between requests: an annotation made after a
// match shows in the very next one, paged or not, and so does a registration that changed the bundle; the forms of
// a match are those "watch" builds for the same plug-ins, entry for entry.
TEST_F(DiscoveryTest, KeptFormsShowAnnotationsAndRegistrationChangesInTheNextMatch) {
    startWithExamples();
    TestClient client;
    const Value rules = identifierRule(kHello);
    const Value paged = request("match", {{"rules", rules}, {"pagesize", Value::uint64(10)}});
    Value first = formsOf(client.replyTo(matchRequest(rules)), kHello).at(0);
    EXPECT_EQ(first, formsOf(client.replyTo(paged), kHello).at(0)) << "paged and unpaged forms are alike";
    const Value uuid = first.get("uuid");

    Value note = Value::dictionary({{"colour", str("green")}});
    succeed(request("annotate", {{"annotations", Value::dictionary({{"extension", note}})},
                                 {"uuids", Value::array({Value::uuid(*Uuid::parse(uuid.stringView()))})}}));
    for (const Value& message : {matchRequest(rules), paged}) {
        Value form = formsOf(client.replyTo(message), kHello).at(0);
        EXPECT_EQ(form.get("annotations").get("extension"), note) << form.description();
        MutableDictionary unchanged(form);
        unchanged.set("annotations", first.get("annotations"));
        EXPECT_EQ(unchanged.take(), first) << "only the annotations changed";
    }

    TestClient watcher;
    Value watched = watcher.replyTo(request("watch", {{"rules", rules}, {"flags", Value::uint64(0)}}));
    Value matched = formsOf(client.replyTo(matchRequest(rules)), kHello).at(0);
    ASSERT_TRUE(watched.get("matches").isArray()) << watched.description();
    ASSERT_EQ(watched.get("matches").count(), 1u) << watched.description();
    EXPECT_EQ(watched.get("matches").items()[0], matched);

    // The same bundle registered again with another version.
    fs::path hello = bundles_ / "Greeter.app/PlugIns/Hello.bxplugin";
    Result<Value> info = Document::readFile(hello / "Info.vrec");
    ASSERT_TRUE(info.ok());
    MutableDictionary root(*info);
    root.set("BDBundleVersion", str("7.7"));
    ASSERT_FALSE(Document::writeFileAtomically(hello / "Info.vrec", root.take()));
    add({hello.string()});
    Value again = formsOf(client.replyTo(matchRequest(rules)), kHello).at(0);
    EXPECT_EQ(again.get("bundleInfo").get("BDBundleVersion").stringView(), "7.7") << again.description();
    EXPECT_EQ(formsOf(client.replyTo(paged), kHello).at(0).get("bundleInfo"), again.get("bundleInfo"));
}

}  // namespace
}  // namespace bexil
