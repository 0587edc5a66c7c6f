// Change generations and "changes" through the real daemon: every kind of change moves the generation by exactly
// one and is answered by "changes" as what it did to which plug-in; generations never go back across restarts and
// SIGKILLs in the middle of changes, because the mark on disk is always ahead of what was handed out; generations
// from before a restart, or older than kept, answer "too old"; and a caller is never told about a plug-in it could
// not discover. How the feed folds long sequences and where its window ends is GenerationTest's.

#include <gtest/gtest.h>

#include <atomic>
#include <random>
#include <thread>

#include "E2eSupport.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;
using namespace test;

const std::string kHello = "com.example.greeter.hello";
const std::string kBonjour = "com.example.greeter.bonjour";
const std::string kNightTheme = "com.example.greeter.night-theme";

Value changesRequest(uint64_t generation, uint64_t flags = 0) {
    std::vector<std::pair<std::string, Value>> fields{{"generation", Value::uint64(generation)}};
    if (flags) fields.emplace_back("flags", Value::uint64(flags));
    return request("changes", std::move(fields));
}

// The mark of the generation file as docs/generations.md lays it out; none when the text is not that.
std::optional<uint64_t> markIn(const std::string& text) {
    const std::string header = "bexil generation mark 1\n";
    if (text.rfind(header, 0) != 0 || text.back() != '\n') return std::nullopt;
    std::string number = text.substr(header.size(), text.size() - header.size() - 1);
    if (number.empty() || number.find_first_not_of("0123456789") != std::string::npos) return std::nullopt;
    return std::stoull(number);
}

uint64_t generationOf(const Value& reply) { return reply.get("generation").numberAsUInt64().value_or(0); }

// The one entry of `uuid` in a "changes" reply, or null.
Value entryFor(const Value& reply, const Uuid& uuid) {
    for (const Value& entry : reply.get("changes").items())
        if (const Uuid* named = entry.get("uuid").getUuid(); named && *named == uuid) return entry;
    return Value();
}

std::vector<std::string> kindsOf(const Value& entry) {
    std::vector<std::string> kinds;
    for (const Value& kind : entry.get("kinds").items()) kinds.emplace_back(kind.stringView());
    return kinds;
}

class ChangesTest : public DaemonTest {
  protected:
    void SetUp() override { copyExamples({"Greeter.app", "Notes.app"}); }

    std::string hello() const { return plugIn("Greeter.app/PlugIns/Hello.bxplugin"); }
    std::string bonjour() const { return plugIn("Greeter.app/PlugIns/Bonjour.bxplugin"); }
    std::string nightTheme() const { return plugIn("Greeter.app/PlugIns/NightTheme.bxplugin"); }

    uint64_t currentGeneration() { return generationOf(succeed(matchRequest())); }

    // Expects exactly one change since `before` and returns the "changes" reply that says so.
    Value oneChangeSince(uint64_t before) {
        Value reply = succeed(changesRequest(before));
        EXPECT_EQ(generationOf(reply), before + 1) << reply.description() << "\n" << bxd_.log();
        return reply;
    }
};

// Guards each kind of change: registration, annotation, hold, release by UUID and by the placer's death, exclusions
// and unregistration each move the generation by one, "changes" names the plug-in with what happened to it, and a
// plug-in registered and removed again since the generation asked from is not listed at all.
TEST_F(ChangesTest, EachKindOfChangeIsOneGenerationAndAnsweredAsWhatItDid) {
    ASSERT_TRUE(start()) << bxd_.log();
    grantSelfManager();
    add({bonjour()});
    const uint64_t start = currentGeneration();

    add({hello()});
    std::optional<Uuid> helloUuid = registeredUuid(hello());
    ASSERT_TRUE(helloUuid);
    Value added = succeed(changesRequest(start));
    Value entry = entryFor(added, *helloUuid);
    EXPECT_EQ(entry.get("effect").stringView(), "added") << added.description();
    EXPECT_EQ(entry.get("identifier").stringView(), kHello);
    EXPECT_FALSE(entry.contains("kinds"));

    uint64_t before = generationOf(added);
    EXPECT_EQ(currentGeneration(), before) << "a match changes nothing";
    succeed(request("annotate", {{"uuids", Value::array({Value::uuid(*helloUuid)})},
                                 {"annotations", Value::dictionary({{"election", Value::int64(0)}})}}));
    entry = entryFor(oneChangeSince(before), *helloUuid);
    EXPECT_EQ(entry.get("effect").stringView(), "changed");
    EXPECT_EQ(kindsOf(entry), std::vector<std::string>{"annotation"});
    EXPECT_EQ(entry.get("generation").numberAsUInt64(), before + 1);

    before = currentGeneration();
    TestClient holder;
    Value hold = holder.replyTo(pathsRequest("lock", {plugIn("Greeter.app")}));
    ASSERT_TRUE(hold.get("uuids").getUuid()) << hold.description();
    Value held = oneChangeSince(before);
    EXPECT_EQ(kindsOf(entryFor(held, *helloUuid)), std::vector<std::string>{"hold"});
    EXPECT_EQ(held.get("changes").count(), 2u) << "Hello and Bonjour: " << held.description();

    before = generationOf(held);
    succeed(request("lock", {{"uuids", Value::array({hold.get("uuids")})}}));
    EXPECT_EQ(kindsOf(entryFor(oneChangeSince(before), *helloUuid)), std::vector<std::string>{"release"});
    // Both since the hold: one entry per plug-in, its kinds in order.
    EXPECT_EQ(kindsOf(entryFor(succeed(changesRequest(before - 1)), *helloUuid)),
              (std::vector<std::string>{"hold", "release"}));

    // A hold released because its client ended is a change too.
    before = currentGeneration();
    {
        TestClient dying;
        ASSERT_TRUE(dying.replyTo(pathsRequest("lock", {plugIn("Greeter.app")})).get("uuids").getUuid());
    }
    for (int i = 0; i < 500 && currentGeneration() < before + 2; ++i)
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    Value died = succeed(changesRequest(before + 1));
    EXPECT_EQ(kindsOf(entryFor(died, *helloUuid)), std::vector<std::string>{"release"}) << died.description();

    // Exclusions name no plug-in: the answer says to discover again.
    before = currentGeneration();
    ASSERT_EQ(bexil("exclusions --add RZExtensionIdentifier=" + kBonjour).status, 0);
    Value excluded = oneChangeSince(before);
    EXPECT_TRUE(excluded.get("resync").getBool().value_or(false)) << excluded.description();
    EXPECT_EQ(excluded.get("changes").count(), 0u);
    EXPECT_FALSE(succeed(changesRequest(generationOf(excluded))).contains("resync"));

    before = generationOf(excluded);
    succeed(pathsRequest("remove", {hello()}));
    Value removed = oneChangeSince(before);
    entry = entryFor(removed, *helloUuid);
    EXPECT_EQ(entry.get("effect").stringView(), "removed") << removed.description();
    EXPECT_FALSE(entry.contains("identifier")) << "a removed plug-in is a bare UUID";
    EXPECT_TRUE(entryFor(succeed(changesRequest(start)), *helloUuid).isNull())
        << "registered and removed since: nothing to tell";
}

// Guards the refusals: a generation from before this run, or one ahead of bxd's, or none at all; each says so and
// the first two carry the current generation to start again from. The tool exits with the code.
TEST_F(ChangesTest, OldFutureAndMalformedGenerationsAreRefusedClearly) {
    ASSERT_TRUE(start()) << bxd_.log();
    add({hello()});
    const uint64_t beforeRestart = currentGeneration();
    ASSERT_EQ(bxd_.stop(), 0);
    ASSERT_TRUE(start()) << bxd_.log();
    const uint64_t now = currentGeneration();
    EXPECT_GT(now, beforeRestart);

    Value old = TestClient().replyTo(changesRequest(beforeRestart));
    EXPECT_EQ(errorCode(old), 20);
    EXPECT_EQ(errorText(old),
              "generation " + std::to_string(beforeRestart) + " is older than the changes bxd keeps; match again");
    EXPECT_EQ(generationOf(old), now);
    EXPECT_EQ(errorCode(TestClient().replyTo(changesRequest(0))), 20);

    Value ahead = TestClient().replyTo(changesRequest(now + 1));
    EXPECT_EQ(errorCode(ahead), 4);
    EXPECT_EQ(errorText(ahead),
              "generation " + std::to_string(now + 1) + " is ahead of bxd's current generation " + std::to_string(now));
    expectFailure(request("changes"), 4, "invalid request format (generation must be an unsigned integer)");
    expectFailure(request("changes", {{"generation", Value::string("12")}}), 4,
                  "invalid request format (generation must be an unsigned integer)");
    expectFailure(changesRequest(now, kDiscoverAll), 11, "unauthorized discovery flag (BXDiscoverAll)");

    Outcome tooOld = bexil("changes " + std::to_string(beforeRestart));
    EXPECT_EQ(tooOld.status, 20) << tooOld.err;
    EXPECT_NE(tooOld.err.find("match again"), std::string::npos) << tooOld.err;
    Outcome fine = bexil("changes " + std::to_string(now));
    EXPECT_EQ(fine.status, 0) << fine.err;
    EXPECT_EQ(fine.out, "generation " + std::to_string(now) + "\n");
}

// Guards what a caller learns: NightTheme is dedicated to Greeter.app, so this test program, which cannot discover
// it, is told nothing of its registration or annotation, while a manager asking with discover-all is; the tool
// lists what the caller may know, and the library's paged match carries the generation of its first page.
TEST_F(ChangesTest, ACallerIsNotToldAboutPlugInsItCannotDiscover) {
    ASSERT_TRUE(start()) << bxd_.log();
    const uint64_t start = currentGeneration();
    add({nightTheme(), hello()});
    std::optional<Uuid> night = registeredUuid(nightTheme());
    std::optional<Uuid> helloUuid = registeredUuid(hello());
    ASSERT_TRUE(night && helloUuid);
    succeed(request("annotate", {{"uuids", Value::array({Value::uuid(*night)})},
                                 {"annotations", Value::dictionary({{"election", Value::int64(1)}})}}));
    Value told = succeed(changesRequest(start));
    EXPECT_TRUE(entryFor(told, *night).isNull()) << told.description();
    EXPECT_FALSE(entryFor(told, *helloUuid).isNull()) << told.description();
    EXPECT_EQ(told.description().find(kNightTheme), std::string::npos);

    grantSelfManager();
    Value all = TestClient().replyTo(changesRequest(start, kDiscoverAll));
    EXPECT_EQ(entryFor(all, *night).get("identifier").stringView(), kNightTheme) << all.description();

    Outcome tool = bexil("changes " + std::to_string(start));
    EXPECT_EQ(tool.status, 0) << tool.err;
    EXPECT_NE(tool.out.find("added    " + helloUuid->string() + " " + kHello), std::string::npos) << tool.out;
    EXPECT_EQ(tool.out.find(night->string()), std::string::npos) << tool.out;
    Outcome json = bexil("--json changes " + std::to_string(start));
    EXPECT_NE(json.out.find("\"effect\": \"added\""), std::string::npos) << json.out;

    Value paged = succeed(request("match", {{"pagesize", Value::uint64(1)}}));
    EXPECT_EQ(generationOf(paged), generationOf(told));
}

// Guards durability: a client keeps annotating and discovering while bxd is killed at a random moment, 100 times;
// after every kill the mark on disk is at least every generation any reply carried, and the next run starts above
// all of them.
TEST_F(ChangesTest, GenerationsNeverGoBackAcrossSigkillsDuringChanges) {
    ASSERT_TRUE(start()) << bxd_.log();
    add({hello()});
    std::optional<Uuid> helloUuid = registeredUuid(hello());
    ASSERT_TRUE(helloUuid);
    const fs::path markFile = bxd_.root() / "state" / "generation";
    std::mt19937 random(20261125);
    uint64_t highest = 0;
    int roundsWithChanges = 0;
    for (int round = 0; round < 100; ++round) {
        std::atomic<uint64_t> seen{0};
        std::atomic<bool> stop{false};
        std::thread changer([&] {
            TestClient client;
            for (int64_t election = 0; !stop.load(); ++election) {
                auto annotated = client.roundTrip(
                    request("annotate",
                            {{"uuids", Value::array({Value::uuid(*helloUuid)})},
                             {"annotations", Value::dictionary({{"election", Value::int64(election % 2)}})}}),
                    std::chrono::seconds(2));
                auto matched = client.roundTrip(matchRequest(identifierRule(kHello)), std::chrono::seconds(2));
                const Value* reply = std::get_if<Value>(&matched);
                if (!std::holds_alternative<Value>(annotated) || reply == nullptr) return;
                uint64_t generation = generationOf(*reply);
                if (generation > seen.load()) seen.store(generation);
            }
        });
        std::this_thread::sleep_for(std::chrono::microseconds(std::uniform_int_distribution<int>(0, 20000)(random)));
        bxd_.stop(SIGKILL);
        stop.store(true);
        changer.join();
        if (seen.load() > highest) ++roundsWithChanges;
        uint64_t before = std::max(highest, seen.load());
        std::optional<uint64_t> mark = markIn(slurp(markFile));
        ASSERT_TRUE(mark) << "round " << round;
        EXPECT_GE(*mark, before) << "round " << round;
        ASSERT_TRUE(start()) << bxd_.log();
        highest = currentGeneration();
        ASSERT_GT(highest, before) << "round " << round;
    }
    EXPECT_GE(roundsWithChanges, 25) << "most kills should land while changes are made";
}

}  // namespace
}  // namespace bexil
