// Plug-in annotations through the real daemon: "annotate" and "bulk-annotate", the document written, the change
// notification posted (observed from another process: SystemNotificationsTest), the tool's annotation subcommands,
// and the document surviving the daemon being killed at any moment.

#include <gtest/gtest.h>

#include <cstdio>
#include <iostream>
#include <map>
#include <mutex>
#include <random>
#include <tuple>

#include "E2eSupport.h"
#include "platform/notify/SystemNotifications.h"
#include "platform/zem/ZemFrame.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;
using namespace test;

// The annotation keys of the example plug-ins: their identifiers, except where a plug-in names another to replace.
constexpr const char* kHelloKey = "com.example.greeter.hello";
constexpr const char* kBonjourKey = "com.example.system.clock";

Value uuidArray(const std::vector<Uuid>& uuids) {
    std::vector<Value> values;
    for (const Uuid& uuid : uuids) values.push_back(Value::uuid(uuid));
    return Value::array(std::move(values));
}
Value annotateRequest(const Value& annotations, const std::vector<Uuid>& uuids) {
    return request("annotate", {{"annotations", annotations}, {"uuids", uuidArray(uuids)}});
}
Value bulkRequest(const Value& annotations) { return request("bulk-annotate", {{"annotations", annotations}}); }
Value election(int64_t n) { return Value::dictionary({{"election", Value::int64(n)}}); }

class AnnotationTest : public DaemonTest {
  protected:
    void SetUp() override {
        copyExamples({"Greeter.app"});
        ASSERT_TRUE(start()) << bxd_.log();
        add({plugIn("Greeter.app/PlugIns/Hello.bxplugin"), plugIn("Greeter.app/PlugIns/Bonjour.bxplugin")});
        hello_ = registeredUuid(plugIn("Greeter.app/PlugIns/Hello.bxplugin")).value_or(Uuid());
        bonjour_ = registeredUuid(plugIn("Greeter.app/PlugIns/Bonjour.bxplugin")).value_or(Uuid());
        ASSERT_FALSE(hello_.isNil() || bonjour_.isNil());
    }

    // The annotation stored under `key` in the document on disk (null when there is none).
    Value stored(const char* key) const {
        if (!fs::exists(document())) return Value();
        Result<Value> root = Document::readFile(document());
        EXPECT_TRUE(root.ok()) << root.error().description();
        return root.ok() ? root->get("data").get(key) : Value();
    }
    // How often the change notification was posted, read from its counter file as any process can.
    uint64_t notifications() const {
        return SystemNotifications(bxd_.root() / "runtime" / "notify").state("com.quorvel.bexil.annotation-change");
    }

    Uuid hello_;
    Uuid bonjour_;
};

// Guards "annotate": an election for several plug-ins merges into what was stored, is logged per plug-in and
// posts one notification per request; a request without known keys (or without the plug-in list it then does not
// need) succeeds and touches nothing.
TEST_F(AnnotationTest, ElectionForSeveralPlugInsIsMergedLoggedAndNotifiedOnce) {
    succeed(request("annotate", {{"annotations", Value::dictionary({{"x", election(1)}})}}));
    succeed(annotateRequest(Value::emptyDictionary(), {hello_}));
    EXPECT_EQ(notifications(), 0u);
    EXPECT_EQ(bxd_.countInLog("annotation change"), 0u);

    Value extension = Value::dictionary({{"colour", Value::string("blue")}});
    succeed(annotateRequest(Value::dictionary({{"extension", extension}}), {hello_}));
    succeed(annotateRequest(election(0), {hello_, bonjour_}));
    EXPECT_EQ(notifications(), 2u) << "one post for each request, not one per plug-in";
    EXPECT_EQ(stored(kHelloKey), Value::dictionary({{"election", Value::int64(0)}, {"extension", extension}}));
    EXPECT_EQ(stored(kBonjourKey), election(0));

    for (const auto& [key, uuid] : {std::pair{kHelloKey, hello_}, std::pair{"com.example.greeter.bonjour", bonjour_}}) {
        std::string who = "client " + std::to_string(getpid()) + " plug-in " + key + "(" + uuid.string() + ")";
        expectLog(who + " election := 0");
        expectLog(who + " annotation change: ");
    }
    EXPECT_EQ(bxd_.countInLog(" election := "), 2u) << "only the request with an election logs one";
}

// Guards "bulk-annotate": client data is replaced whole while the election stays, one post per request (also for
// an empty map), and its log lines.
TEST_F(AnnotationTest, BulkReplacesClientDataAndKeepsTheElection) {
    Value old = Value::dictionary({{"old", Value::boolean(true)}, {"shared", Value::int64(1)}});
    succeed(annotateRequest(Value::dictionary({{"election", Value::int64(1)}, {"extension", old}}), {hello_}));
    Value replacement = Value::dictionary({{"shared", Value::int64(2)}});
    Value bonjourData = Value::dictionary({{"nested", Value::array({Value::string("a"), Value::real(1.5)})}});
    succeed(bulkRequest(Value::dictionary({{hello_.string(), replacement}, {bonjour_.string(), bonjourData}})));
    EXPECT_EQ(notifications(), 2u);
    EXPECT_EQ(stored(kHelloKey), Value::dictionary({{"election", Value::int64(1)}, {"extension", replacement}}));
    EXPECT_EQ(stored(kBonjourKey), Value::dictionary({{"extension", bonjourData}}));
    expectLog("bulk change requested for 2 plug-ins");
    expectLog("client " + std::to_string(getpid()) + " bulk plug-in " + kHelloKey + "(" + hello_.string() +
              ") annotation change: ");

    succeed(bulkRequest(Value::emptyDictionary()));
    EXPECT_EQ(notifications(), 3u) << "an empty bulk change is posted too";
}

// Guards the checks of "annotate" and "bulk-annotate": each bad field has its own code and text (a bad election
// fails even beside a good extension), a refused request changes and posts nothing, a partly failed one posts
// nothing either.
TEST_F(AnnotationTest, MalformedRequestsAreRefusedAndPartialFailuresPostNothing) {
    const std::vector<Uuid> both{hello_, bonjour_};
    const Value data = Value::dictionary({{"k", Value::string("v")}});
    const std::string badAnnotations = "invalid request format (bad annotations dictionary)";
    const std::string badValue = "annotations values must be dictionaries", badKey = "invalid plug-in UUID value";
    const std::tuple<Value, int64_t, std::string> cases[] = {
        {request("annotate", {{"uuids", uuidArray(both)}}), 4, badAnnotations},
        {request("annotate", {{"annotations", Value::array({})}, {"uuids", uuidArray(both)}}), 4, badAnnotations},
        {annotateRequest(Value::dictionary({{"election", Value::string("1")}, {"extension", data}}), both), 4,
         "invalid request format (annotation election)"},
        {annotateRequest(Value::dictionary({{"extension", Value::string("x")}}), both), 4,
         "invalid request format (annotation extension)"},
        {request("annotate", {{"annotations", election(2)}}), 4, "invalid request format (uuid)"},
        {request("annotate", {{"annotations", election(2)}, {"uuids", Value::uuid(hello_)}}), 4,
         "invalid request format (uuid)"},
        {request("annotate", {{"annotations", election(2)}, {"uuids", Value::array({Value::string(hello_.string())})}}),
         4, "invalid request (bad uuid array)"},
        {request("bulk-annotate"), 4, badAnnotations},
        {bulkRequest(Value::string("x")), 4, badAnnotations},
        {bulkRequest(Value::dictionary({{hello_.string(), Value::string("v")}})), 18, badValue},
        // The value is checked before the key.
        {bulkRequest(Value::dictionary({{"not-a-uuid", Value::int64(1)}})), 18, badValue},
        {bulkRequest(Value::dictionary({{"not-a-uuid", data}})), 18, badKey},
        {bulkRequest(Value::dictionary({{"11111111-2222-4333-8444-55555555555", data}})), 18, badKey},
        {bulkRequest(Value::dictionary({{Uuid::random().string(), data}})), 2, "no plug-in with the requested uuid"},
    };
    for (const auto& [message, code, text] : cases) expectFailure(message, code, text);
    EXPECT_TRUE(stored(kHelloKey).isNull());

    // A plug-in list that fails part way keeps (and saves) the changes made before the failure but posts nothing.
    expectFailure(annotateRequest(election(3), {hello_, Uuid::random(), bonjour_}), 4,
                  "no such plugin (uuid not found)");
    EXPECT_EQ(stored(kHelloKey), election(3));
    EXPECT_TRUE(stored(kBonjourKey).isNull()) << "the walk stopped at the unknown plug-in";
    EXPECT_EQ(notifications(), 0u);
}

// Guards the kinds an election may have: every number kind, booleans included, is stored and read back by
// discovery's election rule as the number it stands for; a string is refused (above).
TEST_F(AnnotationTest, ElectionsOfEveryNumberKindAreReadAsTheirNumber) {
    auto electedAs = [&](const std::string& value) {
        Value rules = Value::dictionary(
            {{"RZExtensionIdentifier", Value::string(kHelloKey)}, {"RZUserElection", Value::string(value)}});
        return identifiers(succeed(matchRequest(rules))) == Ids{kHelloKey};
    };
    const std::pair<Value, const char*> kinds[] = {
        {Value::boolean(true), "1"}, {Value::uint64(2), "2"}, {Value::real(3.0), "3"}, {Value::boolean(false), "0"}};
    for (const auto& [value, number] : kinds) {
        succeed(annotateRequest(Value::dictionary({{"election", value}}), {hello_}));
        EXPECT_TRUE(electedAs(number)) << value.description() << " is not read as " << number;
    }
}

// Guards the frame limit on the reply side: annotations that fit one request each but together make a discovery
// reply larger than a frame give an error reply, and the connection stays usable.
TEST_F(AnnotationTest, DiscoveryReplyTooLargeForAFrameIsAnErrorNotASilence) {
    Value extension = Value::dictionary({{"bulk", Value::string(std::string(9u << 20, 'x'))}});
    for (const Uuid& uuid : {hello_, bonjour_})
        succeed(annotateRequest(Value::dictionary({{"extension", extension}}), {uuid}));
    TestClient client;
    Value reply = client.replyTo(matchRequest());
    EXPECT_EQ(errorCode(reply), 4);
    EXPECT_NE(errorText(reply).find("exceeds the frame limit"), std::string::npos) << errorText(reply);
    expectLog("exceeds the frame limit of");
    EXPECT_EQ(errorCode(client.replyTo(matchRequest(identifierRule("none")))), 0) << "the connection stays usable";
}

// Guards the refusal of a reply that passes the frame limit well before its last form: it still names the whole
// reply's size, so a client learns how far over it is, though bxd stopped keeping the reply once it was past.
TEST_F(AnnotationTest, OversizedDiscoveryReplyIsMeasuredToItsEnd) {
    copyExamples({"Notes.app"});
    add({plugIn("Notes.app/PlugIns/Stationery.bxplugin")});
    const Uuid stationery = registeredUuid(plugIn("Notes.app/PlugIns/Stationery.bxplugin")).value_or(Uuid());
    ASSERT_FALSE(stationery.isNil());
    ASSERT_EQ(identifiers(succeed(matchRequest())).size(), 3u) << "every plug-in is a form of the reply";
    // The two registered first take the reply past the limit; the last one comes after that.
    constexpr size_t kLarge = 9u << 20;
    constexpr size_t kAfter = 6u << 20;
    auto annotation = [](size_t size) {
        return Value::dictionary({{"extension", Value::dictionary({{"bulk", Value::string(std::string(size, 'y'))}})}});
    };
    succeed(annotateRequest(annotation(kLarge), {hello_, bonjour_}));
    succeed(annotateRequest(annotation(kAfter), {stationery}));
    TestClient client;
    Value reply = client.replyTo(matchRequest());
    ASSERT_EQ(errorCode(reply), 4) << errorText(reply);
    unsigned long long size = 0, limit = 0;
    ASSERT_EQ(std::sscanf(errorText(reply).c_str(), "reply of %llu bytes exceeds the frame limit of %llu bytes", &size,
                          &limit),
              2)
        << errorText(reply);
    EXPECT_EQ(limit, ZemFrame::kMaxPayloadBytes);
    EXPECT_GT(size, 2 * kLarge + kAfter) << "the form after the limit is counted too";
    EXPECT_LT(size, 2 * kLarge + kAfter + 64 * 1024);
    EXPECT_EQ(errorCode(client.replyTo(matchRequest(identifierRule("none")))), 0) << "the connection stays usable";
}

// Guards the tool's annotation subcommands against the real daemon: elect, annotate with a JSON file, unelect,
// bulk-annotate from a file.
TEST_F(AnnotationTest, ToolSubcommandsChangeAnnotationsEndToEnd) {
    auto run = [&](const std::string& arguments) {
        Outcome outcome = bexil(arguments);
        EXPECT_EQ(outcome.status, 0) << arguments << ": " << outcome.err;
    };
    run("elect " + hello_.string() + " " + bonjour_.string());
    EXPECT_EQ(stored(kBonjourKey), election(1));

    fs::path extensionFile = bxd_.root() / "extension.json";
    std::ofstream(extensionFile) << R"({"colour": "amber", "size": 3})";
    run("annotate --election 2 --extension '" + extensionFile.string() + "' " + hello_.string());
    EXPECT_EQ(stored(kHelloKey).get("election"), Value::int64(2));
    EXPECT_EQ(stored(kHelloKey).get("extension").get("colour"), Value::string("amber"));

    run("unelect " + bonjour_.string());
    EXPECT_EQ(stored(kBonjourKey), election(0));

    fs::path bulkFile = bxd_.root() / "bulk.json";
    std::ofstream(bulkFile) << "{\"" << bonjour_.string() << "\": {\"from\": \"bulk\"}}";
    run("bulk-annotate '" + bulkFile.string() + "'");
    EXPECT_EQ(stored(kBonjourKey),
              Value::dictionary({{"election", Value::int64(0)},
                                 {"extension", Value::dictionary({{"from", Value::string("bulk")}})}}));
    EXPECT_EQ(notifications(), 4u);
}

// ---- the document survives the daemon being killed ----

// The annotation a client sets in its `n`th change: an election and client data whose size varies, so that a
// document mixing two writes or cut short cannot pass for a whole one.
Value numberedAnnotation(const std::string& writer, int64_t n) {
    std::string text(static_cast<size_t>(n * 37 % 301), static_cast<char>('a' + n % 26));
    return Value::dictionary({{"election", Value::int64(n)},
                              {"extension", Value::dictionary({{"n", Value::int64(n)},
                                                               {"writer", Value::string(writer)},
                                                               {"text", Value::string(text)}})}});
}

// One client changing the annotation of one plug-in until the daemon goes away.
struct Writer {
    std::string identifier;     // the plug-in's identifier
    std::string annotationKey;  // the key its annotation is stored under
    Uuid uuid;
    Value acknowledged;  // null while the plug-in has no annotation
    std::optional<Value> inFlight;
    std::string failure;
    int64_t counter = 0;
    std::mutex mutex;

    void run() {
        TestClient client;
        for (;;) {
            Value change = numberedAnnotation(identifier, ++counter);
            {
                std::lock_guard lock(mutex);
                inFlight = change;
            }
            TestClient::Reply reply = client.roundTrip(annotateRequest(change, {uuid}), std::chrono::seconds(5));
            if (!std::holds_alternative<Value>(reply)) return;  // the daemon was killed
            std::lock_guard lock(mutex);
            if (errorCode(std::get<Value>(reply)) != 0) {
                failure = std::get<Value>(reply).description();
                return;
            }
            acknowledged = change;
            inFlight.reset();
        }
    }
};

class AnnotationCrashTest : public AnnotationTest {
  protected:
    // Checks the document on disk against what the writers saw, and makes what it holds their new starting point.
    void checkDocument(int round) {
        std::map<std::string, Value> stored;
        if (fs::exists(document())) {
            Result<Value> root = Document::readFile(document());
            ASSERT_TRUE(root.ok()) << "round " << round << ": " << root.error().description();
            ASSERT_TRUE(root->get("data").isDictionary()) << root->description();
            for (const DictionaryEntry& entry : root->get("data").entries())
                stored[std::string(entry.key)] = entry.value;
        }
        for (Writer& writer : writers_) {
            Value onDisk = stored.count(writer.annotationKey) ? stored[writer.annotationKey] : Value();
            stored.erase(writer.annotationKey);
            EXPECT_TRUE(onDisk == writer.acknowledged || (writer.inFlight && onDisk == *writer.inFlight))
                << "round " << round << ", " << writer.identifier << " on disk: " << onDisk.description()
                << "\nacknowledged: " << writer.acknowledged.description()
                << "\nin flight: " << (writer.inFlight ? writer.inFlight->description() : "none");
            writer.acknowledged = onDisk;
            writer.inFlight.reset();
        }
        EXPECT_TRUE(stored.empty()) << "round " << round << ": annotations nobody set, first " << stored.begin()->first;
    }

    // Starts the daemon again and checks that it serves what the document holds.
    void restartAndCheckServed(int round) {
        ASSERT_TRUE(start()) << bxd_.log();
        TestClient client;
        for (Writer& writer : writers_) {
            std::vector<Value> forms =
                formsOf(client.replyTo(matchRequest(identifierRule(writer.identifier))), writer.identifier);
            ASSERT_EQ(forms.size(), 1u) << "round " << round << ", " << writer.identifier;
            Value expected = writer.acknowledged.isNull() ? Value::emptyDictionary() : writer.acknowledged;
            EXPECT_EQ(forms[0].get("annotations"), expected) << "round " << round << ", " << writer.identifier;
        }
    }

    Writer writers_[2];
};

// Guards durability: two clients keep changing one plug-in's annotation each while the real daemon is killed with
// SIGKILL at a random moment, twenty times. After every kill the document must load and hold, for each plug-in,
// what its client last saw acknowledged or the change it had in flight (nothing else, nothing half-written), and
// the restarted daemon must serve exactly that. The test prints its seed; E2E_CRASH_SEED repeats a run's moments.
TEST_F(AnnotationCrashTest, DocumentHoldsAWholeAcknowledgedOrInFlightChangeAfterEveryKill) {
    constexpr int kRounds = 20;
    unsigned seed = std::random_device{}();
    if (const char* fixed = std::getenv("E2E_CRASH_SEED"))
        seed = static_cast<unsigned>(std::strtoul(fixed, nullptr, 10));
    std::cout << "annotation crash seed " << seed << " (E2E_CRASH_SEED=" << seed
              << " kills at the same moments again)\n";
    std::mt19937 random(seed);
    std::uniform_int_distribution<int> runMs(0, 150);
    // Bonjour replaces the system clock, so its annotation is the clock's.
    writers_[0].identifier = writers_[0].annotationKey = kHelloKey;
    writers_[0].uuid = hello_;
    writers_[1].identifier = "com.example.greeter.bonjour";
    writers_[1].annotationKey = kBonjourKey;
    writers_[1].uuid = bonjour_;

    for (int round = 0; round < kRounds && !HasFailure(); ++round) {
        if (round > 0) restartAndCheckServed(round);
        if (HasFailure()) break;
        std::thread threads[2] = {std::thread([&] { writers_[0].run(); }), std::thread([&] { writers_[1].run(); })};
        std::this_thread::sleep_for(std::chrono::milliseconds(runMs(random)));
        bxd_.stop(SIGKILL);
        for (std::thread& thread : threads) thread.join();
        for (Writer& writer : writers_) ASSERT_EQ(writer.failure, "") << "round " << round;
        checkDocument(round);
    }
    if (!HasFailure()) restartAndCheckServed(kRounds);
    EXPECT_EQ(bxd_.countInLog("unable to load annotation database"), 0u) << bxd_.log();
    EXPECT_GT(writers_[0].counter + writers_[1].counter, int64_t{kRounds}) << "the clients hardly wrote anything";
}

}  // namespace
}  // namespace bexil
