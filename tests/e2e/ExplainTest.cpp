// "explain" through the real daemon: each step of discovery that leaves a plug-in out is named with what it
// compared, duplicates name their winner and tie-break, the answer agrees with a "match" of the same rules, and a
// plug-in the caller could not discover is answered exactly as one that was never registered, except to a manager.

#include <gtest/gtest.h>
#include <unistd.h>

#include <set>

#include "E2eSupport.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;
using namespace test;

const std::string kHello = "com.example.greeter.hello";
const std::string kBonjour = "com.example.greeter.bonjour";
const std::string kNightTheme = "com.example.greeter.night-theme";
const std::string kPoint = "com.example.greeting";

Value str(std::string_view s) { return Value::string(s); }

Value explainRequest(const Value& plugIn, std::optional<Value> rules = std::nullopt, uint64_t flags = 0) {
    std::vector<std::pair<std::string, Value>> fields{{"plugin", plugIn}};
    if (rules) fields.emplace_back("rules", *rules);
    if (flags) fields.emplace_back("flags", Value::uint64(flags));
    return request("explain", std::move(fields));
}

// The one candidate of a reply (a failure when there is not exactly one).
Value onlyEntry(const Value& reply) {
    const Value& entries = reply.get("explanation");
    EXPECT_EQ(entries.count(), 1u) << reply.description();
    return entries.count() == 1 ? entries.items()[0] : Value::emptyDictionary();
}
Value entryFor(const Value& reply, const std::string& uuid) {
    for (const Value& entry : reply.get("explanation").items())
        if (entry.get("uuid").stringView() == uuid) return entry;
    ADD_FAILURE() << "no entry for " << uuid << " in " << reply.description();
    return Value::emptyDictionary();
}
std::vector<std::string> stepNames(const Value& entry) {
    std::vector<std::string> names;
    for (const Value& step : entry.get("steps").items()) names.emplace_back(step.get("step").stringView());
    return names;
}
Value lastStep(const Value& entry) {
    const Value& steps = entry.get("steps");
    return steps.count() > 0 ? steps.items()[steps.count() - 1] : Value::emptyDictionary();
}
std::string outcome(const Value& entry) { return std::string(entry.get("outcome").stringView()); }

class ExplainTest : public DaemonTest {
  protected:
    void SetUp() override {
        copyExamples({"Greeter.app", "Notes.app"});
        ASSERT_TRUE(start()) << bxd_.log();
        add({hello(), bonjour(), nightTheme()});
    }
    std::string hello() const { return plugIn("Greeter.app/PlugIns/Hello.bxplugin"); }
    std::string bonjour() const { return plugIn("Greeter.app/PlugIns/Bonjour.bxplugin"); }
    std::string nightTheme() const { return plugIn("Greeter.app/PlugIns/NightTheme.bxplugin"); }
    std::string uuidOf(const std::string& path) const {
        std::optional<Uuid> uuid = registeredUuid(path);
        EXPECT_TRUE(uuid) << path;
        return uuid ? uuid->string() : std::string();
    }

    // A copy of Hello.bxplugin inside Notes.app with the extension version given, registered.
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
        add({copy.string()});
        return copy.string();
    }

    // The UUID texts a "match" of the same rules and flags returns, on `client`.
    std::set<std::string> matched(TestClient& client, std::optional<Value> rules, uint64_t flags = 0) {
        std::set<std::string> uuids;
        Value reply = client.replyTo(matchRequest(rules, flags));
        for (const Value& form : reply.get("matches").items()) uuids.emplace(form.get("uuid").stringView());
        return uuids;
    }
};

// Guards the steps an ordinary client is told about: a plug-in that matches passes every step in discovery's order;
// the registry's pre-selection, the system-only flag, each kind of rule (comparison, presence, list, with the
// plug-in's value and the operator) and a global exclusion (its index and rule set) each stop it where they do.
TEST_F(ExplainTest, EachFilterStepIsNamedWithWhatItCompared) {
    TestClient client;
    Value matchedEntry = onlyEntry(succeed(explainRequest(str(kHello))));
    EXPECT_EQ(outcome(matchedEntry), "matched");
    EXPECT_EQ(stepNames(matchedEntry), (std::vector<std::string>{"registry", "residence", "dedication", "hold", "rules",
                                                                 "exclusions", "host-policy", "duplicates"}));
    for (const Value& step : matchedEntry.get("steps").items()) EXPECT_EQ(step.get("passed"), Value::boolean(true));
    EXPECT_EQ(matchedEntry.get("steps").items()[1].get("containingApplication").stringView(), plugIn("Greeter.app"));
    EXPECT_EQ(matchedEntry.get("path").stringView(), hello());
    EXPECT_EQ(matchedEntry.get("version").stringView(), "1.2");

    Value elsewhere = onlyEntry(client.replyTo(
        explainRequest(str(hello()), Value::dictionary({{"RZExtensionPointIdentifier", str("com.example.other")}}))));
    EXPECT_EQ(stepNames(elsewhere), (std::vector<std::string>{"registry"}));
    EXPECT_EQ(lastStep(elsewhere).get("reason").stringView(),
              "the rules' RZExtensionPointIdentifier names other extension points");

    Value systemOnly = onlyEntry(client.replyTo(explainRequest(str(kHello), std::nullopt, kSystemOnly)));
    EXPECT_EQ(lastStep(systemOnly).get("step").stringView(), "residence");
    EXPECT_EQ(lastStep(systemOnly).get("reason").stringView(),
              "outside the system volume, and the flags ask for system plug-ins only");

    struct RuleCase {
        Value pattern;
        std::string op;
        Value operand;  // null: none expected
    };
    const RuleCase cases[] = {
        {str(">=1.10"), ">=", str("1.10")},
        {str("fr"), "=", str("fr")},
        {Value::array({str("de"), str("fr")}), "any of", Value()},
        {Value::boolean(false), "absent", Value()},
    };
    for (const RuleCase& rule : cases) {
        // Rules are taken in key order: the first holds and is listed too; the second is where the plug-in stops.
        Value rules = Value::dictionary(
            {{"BDBundleName", str("Hello")}, {rule.op == ">=" ? "RZExtensionVersion" : "Language", rule.pattern}});
        Value entry = onlyEntry(client.replyTo(explainRequest(str(kHello), rules)));
        EXPECT_EQ(outcome(entry), "rejected") << rule.op;
        Value step = lastStep(entry);
        ASSERT_EQ(step.get("step").stringView(), "rules") << entry.description();
        const Value& findings = step.get("findings");
        ASSERT_EQ(findings.count(), 2u) << step.description();
        EXPECT_EQ(findings.items()[0].get("passed"), Value::boolean(true));
        const Value& failed = findings.items()[1];
        EXPECT_EQ(failed.get("passed"), Value::boolean(false));
        EXPECT_EQ(failed.get("operator").stringView(), rule.op);
        EXPECT_EQ(failed.get("operand"), rule.operand) << failed.description();
        EXPECT_EQ(failed.get("pattern"), rule.pattern);
        EXPECT_EQ(failed.get("value"), str(rule.op == ">=" ? "1.2" : "en"));
    }
    Value absent =
        onlyEntry(client.replyTo(explainRequest(str(kHello), Value::dictionary({{"Flavour", Value::boolean(true)}}))));
    EXPECT_EQ(lastStep(absent).get("findings").items()[0].get("operator").stringView(), "present");
    EXPECT_FALSE(lastStep(absent).get("findings").items()[0].contains("value")) << "the plug-in has no such value";

    ASSERT_EQ(bexil("exclusions --add RZExtensionPointIdentifier=com.example.none").status, 0);
    ASSERT_EQ(bexil("exclusions --add RZExtensionIdentifier=" + kHello + " Language=en").status, 0);
    Value excluded = onlyEntry(client.replyTo(explainRequest(str(kHello))));
    Value exclusion = lastStep(excluded);
    EXPECT_EQ(exclusion.get("step").stringView(), "exclusions");
    EXPECT_EQ(exclusion.get("exclusion"), Value::uint64(1));
    EXPECT_EQ(exclusion.get("count"), Value::uint64(2));
    EXPECT_EQ(exclusion.get("exclusionRules"),
              Value::dictionary({{"RZExtensionIdentifier", str(kHello)}, {"Language", str("en")}}));
    EXPECT_TRUE(matched(client, identifierRule(kHello)).empty()) << "the explanation agrees with the match";
}

// Guards what is hidden: to an ordinary client a dedicated plug-in, a held one and one its host policy refuses
// get exactly the reply of an identity nobody registered, whether asked by identifier, UUID or path; a manager is
// shown the step that hides each (the hold with its UUID and placer, the policy's reason) and told plainly what is
// not registered.
TEST_F(ExplainTest, HiddenPlugInsLookUnregisteredToOthersAndAreExplainedToTheManager) {
    TestClient holder;
    Value hold =
        holder.replyTo(request("lock", {{"paths", Value::array({str(bonjour())})}, {"flags", Value::uint64(1)}}));
    ASSERT_EQ(errorCode(hold), 0) << hold.description();
    const Uuid* holdUuid = hold.get("uuids").getUuid();
    ASSERT_NE(holdUuid, nullptr);

    TestClient client;
    Value nobody = client.replyTo(explainRequest(str("com.example.nobody")));
    EXPECT_EQ(nobody.get("notFound").stringView(), "not registered, or not visible to you");
    EXPECT_EQ(nobody.get("explanation"), Value::emptyArray());
    for (const Value& hidden : {str(kNightTheme), str(nightTheme()), Value::uuid(*registeredUuid(nightTheme())),
                                str(kBonjour), str(uuidOf(bonjour())), str(bonjour())})
        EXPECT_EQ(client.replyTo(explainRequest(hidden)), nobody) << hidden.description();
    EXPECT_EQ(client.replyTo(explainRequest(str(Uuid::random().string()))), nobody);
    // A plug-in refused as mis-configured (outside every application) is discovered by nobody.
    copyExamples({"OutsideApplication.bxplugin"});
    const std::string outside = plugIn("OutsideApplication.bxplugin");
    add({outside});
    EXPECT_EQ(client.replyTo(explainRequest(str(outside))), nobody);
    // A path is looked at with the caller's rights: no bundle there is something it can see for itself.
    Value noBundle = client.replyTo(explainRequest(str(plugIn("Greeter.app/PlugIns/None.bxplugin"))));
    EXPECT_EQ(noBundle.get("notFound").stringView(), "no bundle at this path");

    grantSelf(Value::dictionary(
        {{kManagerEntitlement, Value::boolean(true)},
         {"com.quorvel.developer.bexil.allowedplugins",
          Value::dictionary({{"RZExtensionIdentifier", Value::array({str(kHello), str(kBonjour)})}})}}));
    TestClient manager;
    EXPECT_EQ(manager.replyTo(explainRequest(str("com.example.nobody"))).get("notFound").stringView(),
              "not registered");
    EXPECT_EQ(manager.replyTo(explainRequest(str(outside))).get("notFound").stringView(),
              "registered, but refused as mis-configured (the log says why)");
    Value dedicated = lastStep(onlyEntry(manager.replyTo(explainRequest(str(kNightTheme)))));
    EXPECT_EQ(dedicated.get("step").stringView(), "dedication");
    EXPECT_EQ(dedicated.get("dedicated"), Value::boolean(true));
    EXPECT_EQ(dedicated.get("reason").stringView(), "dedicated to another application");

    Value held = lastStep(onlyEntry(manager.replyTo(explainRequest(str(bonjour())))));
    EXPECT_EQ(held.get("step").stringView(), "hold");
    EXPECT_EQ(held.get("holdUuid"), Value::uuid(*holdUuid));
    EXPECT_EQ(held.get("placedBy").get("pid"), Value::uint64(static_cast<uint64_t>(getpid())));
    EXPECT_EQ(held.get("placedBy").get("executable").stringView(), fs::canonical("/proc/self/exe").string());

    grantSelf(Value::dictionary({{kManagerEntitlement, Value::boolean(true)},
                                 {"com.quorvel.developer.bexil.allowedplugins", identifierRule(kBonjour)}}));
    TestClient restricted;
    Value policy = lastStep(onlyEntry(restricted.replyTo(explainRequest(str(kHello)))));
    EXPECT_EQ(policy.get("step").stringView(), "host-policy");
    EXPECT_EQ(policy.get("reason").stringView(), "the host's plug-in entitlement does not allow this plug-in");
    // Discover-all skips the visibility steps and the policy, as in "match".
    Value all = onlyEntry(restricted.replyTo(explainRequest(str(bonjour()), std::nullopt, kDiscoverAll)));
    EXPECT_EQ(outcome(all), "matched") << all.description();
    EXPECT_EQ(all.get("steps").items()[3].get("skipped"), Value::boolean(true));
}

// Guards duplicate resolution and its agreement with "match": of the plug-ins of one identifier the lower version
// loses by version, an equal version registered earlier by registration, the winner named by UUID; with all
// versions both stay. A plug-in claiming the identifier is named as its replacement. A registered bundle gone from
// the disk is still explained, as "match" still finds it.
TEST_F(ExplainTest, DuplicatesNameTheirWinnerAndAgreeWithMatch) {
    sleepToNextSecond();  // the copies are registered later than the examples
    std::string again = helloCopy("HelloAgain", "1.2");
    std::string next = helloCopy("HelloNext", "1.10");
    TestClient client;
    Value reply = client.replyTo(explainRequest(str(kHello)));
    ASSERT_EQ(reply.get("explanation").count(), 3u) << reply.description();
    std::set<std::string> explainedMatches;
    for (const Value& entry : reply.get("explanation").items())
        if (outcome(entry) == "matched") explainedMatches.emplace(entry.get("uuid").stringView());
    EXPECT_EQ(explainedMatches, matched(client, identifierRule(kHello)));
    EXPECT_EQ(explainedMatches, std::set<std::string>{uuidOf(next)});

    Value original = entryFor(reply, uuidOf(hello()));
    EXPECT_EQ(outcome(original), "lost");
    EXPECT_EQ(lastStep(original).get("step").stringView(), "duplicates");
    // Met first, it lost to the equal version registered later, which then lost to the higher version.
    EXPECT_EQ(lastStep(original).get("winner").stringView(), uuidOf(again));
    EXPECT_EQ(lastStep(original).get("tieBreak").stringView(), "later registration");
    Value middle = entryFor(reply, uuidOf(again));
    EXPECT_EQ(lastStep(middle).get("winner").stringView(), uuidOf(next));
    EXPECT_EQ(lastStep(middle).get("tieBreak").stringView(), "higher version");

    Value versions = client.replyTo(explainRequest(str(kHello), std::nullopt, kAllVersions));
    EXPECT_EQ(outcome(entryFor(versions, uuidOf(hello()))), "lost") << "equal versions still compete";
    EXPECT_EQ(outcome(entryFor(versions, uuidOf(again))), "matched");

    fs::remove_all(next);
    Value gone = onlyEntry(client.replyTo(explainRequest(str(next))));
    EXPECT_EQ(gone.get("steps").items()[0].get("bundleOnDisk"), Value::boolean(false)) << gone.description();
    EXPECT_EQ(outcome(gone) == "matched", matched(client, identifierRule(kHello)).contains(uuidOf(next)));
}

// Guards the replacement link: a plug-in that claims the identifier, and that a match of the same rules returns, is
// named on the plug-in it replaces (having beaten its own duplicate); rules that leave it out name no replacement.
TEST_F(ExplainTest, ReplacementIsNamedOnThePlugInReplaced) {
    fs::path claimer = bundles_ / "Notes.app/PlugIns/Claimer.bxplugin";
    fs::copy(bonjour(), claimer, fs::copy_options::recursive);
    ASSERT_FALSE(Document::writeFileAtomically(
        claimer / "Entitlements.vrec", Value::dictionary({{"com.quorvel.developer.replace-plugin", str(kHello)}})));
    sleepToNextSecond();
    add({claimer.string()});
    Value rules = Value::dictionary({{"RZExtensionPointIdentifier", str(kPoint)}});
    Value entry = onlyEntry(succeed(explainRequest(str(kHello), rules)));
    EXPECT_EQ(outcome(entry), "matched");
    EXPECT_EQ(lastStep(entry).get("replacedBy").stringView(), uuidOf(claimer.string())) << entry.description();
    std::vector<Value> forms = formsOf(TestClient().replyTo(matchRequest(rules)), kHello);
    ASSERT_EQ(forms.size(), 1u);
    EXPECT_EQ(forms[0].get("overrider"), lastStep(entry).get("replacedBy")) << "as the match links them";
    Value narrow = onlyEntry(succeed(explainRequest(str(kHello), identifierRule(kHello))));
    EXPECT_FALSE(lastStep(narrow).contains("replacedBy")) << "a match of these rules does not return the claimer";
}

// Guards the request's own checks: "plugin" missing, empty or of another kind, and the rules and flags exactly as
// "match" refuses them; the daemon answers the next request on the same connection.
TEST_F(ExplainTest, BadRequestsAreRefusedWithClearErrors) {
    expectFailure(request("explain"), 4, "invalid request format (missing plugin)");
    const std::string wrong = "invalid request format (plugin must be an identifier, a UUID or an absolute path)";
    for (const Value& plugIn : {str(""), Value::uint64(7), Value::array({str(kHello)}), Value::emptyDictionary(),
                                Value::data(std::vector<uint8_t>(16, 0))})
        expectFailure(explainRequest(plugIn), 4, wrong);
    expectFailure(explainRequest(str(kHello), str("RZExtensionIdentifier=x")), 4,
                  "invalid request format (bad rules dictionary)");
    expectFailure(explainRequest(str(kHello), std::nullopt, kDiscoverAll), 11,
                  "unauthorized discovery flag (BXDiscoverAll)");
    TestClient client;
    EXPECT_EQ(errorCode(client.replyTo(explainRequest(Value::boolean(true)))), 4);
    // An identifier is compared as it is written, never read as a rule's operator.
    EXPECT_EQ(client.replyTo(explainRequest(str("<zzz"))).get("explanation"), Value::emptyArray());
    EXPECT_EQ(outcome(onlyEntry(client.replyTo(explainRequest(str(kHello))))), "matched");
}

// Guards the tool: one heading per candidate and one marked line per step, the failing rule with the plug-in's
// value; --json prints the reply; --plugin is required.
TEST_F(ExplainTest, ToolPrintsOneLinePerStep) {
    Outcome run = bexil("explain BDBundleName=Hello Language=fr --plugin " + kHello);
    EXPECT_EQ(run.status, 0) << run.err;
    EXPECT_EQ(run.out.rfind(kHello + " 1.2 (" + uuidOf(hello()) + "): rejected\n  " + hello() + "\n", 0), 0u)
        << run.out;
    EXPECT_NE(run.out.find("  [ ok ] registry     found by the registry's query for these rules\n"), std::string::npos)
        << run.out;
    EXPECT_NE(run.out.find("  [FAIL] rules        BDBundleName = \"Hello\": value \"Hello\", holds; Language = \"fr\": "
                           "value \"en\", fails\n"),
              std::string::npos)
        << run.out;
    EXPECT_EQ(run.out.find("exclusions"), std::string::npos) << "steps after the failure are not shown";

    Outcome json = bexil("--json explain --plugin " + kNightTheme);
    EXPECT_EQ(json.status, 0) << json.err;
    EXPECT_NE(json.out.find("\"notFound\": \"not registered, or not visible to you\""), std::string::npos) << json.out;
    EXPECT_EQ(bexil("explain " + kHello).status, 64);
}

}  // namespace
}  // namespace bexil
