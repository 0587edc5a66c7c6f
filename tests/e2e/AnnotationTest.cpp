// Changing plug-in annotations through the real daemon: "annotate" and "bulk-annotate" as a client sees them, the
// annotation document the daemon writes, the change notification another process observes, and the bexil tool's
// annotation subcommands end to end.

#include <gtest/gtest.h>
#include <sys/wait.h>

#include <atomic>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <future>
#include <sstream>
#include <variant>

#include "BxdProcess.h"
#include "E2eSupport.h"
#include "TestClient.h"
#include "base/Document.h"
#include "base/EventLoop.h"
#include "base/SerialQueue.h"
#include "platform/ledgerix/LXBexilProxy.h"
#include "platform/ledgerix/LedgerixWorkspace.h"
#include "platform/notify/SystemNotifications.h"
#include "platform/zem/ZemConnection.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;
using test::BxdProcess;
using test::errorCode;
using test::errorText;

constexpr const char* kChangeNotification = "com.quorvel.bexil.annotation-change";
// The annotation keys of the example plug-ins: their identifiers, except where a plug-in names another to replace.
constexpr const char* kHelloKey = "com.example.greeter.hello";
constexpr const char* kBonjourKey = "com.example.system.clock";

using test::TestClient;

Value request(const char* name, std::vector<std::pair<std::string, Value>> fields) {
    fields.emplace_back("request", Value::string(name));
    fields.emplace_back("version", Value::uint64(3));
    return Value::dictionary(std::move(fields));
}

Value uuidArray(const std::vector<Uuid>& uuids) {
    std::vector<Value> values;
    for (const Uuid& uuid : uuids) values.push_back(Value::uuid(uuid));
    return Value::array(std::move(values));
}

Value annotateRequest(const Value& annotations, const std::vector<Uuid>& uuids) {
    return request("annotate", {{"annotations", annotations}, {"uuids", uuidArray(uuids)}});
}

std::string slurp(const fs::path& path) {
    std::ifstream in(path);
    std::stringstream text;
    text << in.rdbuf();
    return text.str();
}

class AnnotationTest : public ::testing::Test {
  protected:
    void SetUp() override {
        bundles_ = test::copyExampleGreeter(bxd_.root());
        bxd_.exportEnvironment();
        ASSERT_TRUE(start()) << bxd_.log();

        TestClient client;
        Value added = client.replyTo(request(
            "add", {{"paths", Value::array({Value::string(plugIn("Hello")), Value::string(plugIn("Bonjour"))})}}));
        ASSERT_EQ(errorCode(added), 0) << errorText(added);
        std::optional<Uuid> hello = registeredUuid(plugIn("Hello")), bonjour = registeredUuid(plugIn("Bonjour"));
        ASSERT_TRUE(hello && bonjour);
        hello_ = *hello;
        bonjour_ = *bonjour;
    }

    bool start() { return bxd_.start({"-d", document().string()}); }

    fs::path document() const { return bxd_.root() / "annotations.vrec"; }
    std::string plugIn(const std::string& name) const {
        return (bundles_ / "Greeter.app" / "PlugIns" / (name + ".bxplugin")).string();
    }

    std::optional<Uuid> registeredUuid(const std::string& path) {
        return test::registeredUuid(bxd_.root() / "state", path);
    }

    // The annotation map of the document on disk (null when there is no document or no map).
    Value storedAnnotations() const {
        if (!fs::exists(document())) return Value();
        Result<Value> root = Document::readFile(document());
        EXPECT_TRUE(root.ok()) << root.error().description();
        return root.ok() ? root->get("data") : Value();
    }
    Value stored(const char* key) const { return storedAnnotations().get(key); }

    // How often the change notification was posted, read from its counter file as any process can.
    uint64_t notifications() const { return SystemNotifications(notifyDir()).state(kChangeNotification); }
    fs::path notifyDir() const { return bxd_.root() / "runtime" / "notify"; }

    BxdProcess bxd_;
    fs::path bundles_;
    Uuid hello_;
    Uuid bonjour_;
};

TEST_F(AnnotationTest, ElectionForSeveralPlugInsIsStoredLoggedAndNotifiedOnce) {
    TestClient client;
    Value extension = Value::dictionary({{"colour", Value::string("blue")}});
    Value first = client.replyTo(annotateRequest(Value::dictionary({{"extension", extension}}), {hello_}));
    ASSERT_EQ(errorCode(first), 0) << errorText(first);
    EXPECT_FALSE(first.contains("error"));
    EXPECT_EQ(notifications(), 1u);

    Value reply =
        client.replyTo(annotateRequest(Value::dictionary({{"election", Value::int64(0)}}), {hello_, bonjour_}));
    ASSERT_EQ(errorCode(reply), 0) << errorText(reply);
    EXPECT_EQ(notifications(), 2u) << "one post for the whole request, not one per plug-in";

    // The election merges into what was stored: Hello keeps its client data.
    EXPECT_EQ(stored(kHelloKey), Value::dictionary({{"election", Value::int64(0)}, {"extension", extension}}));
    EXPECT_EQ(stored(kBonjourKey), Value::dictionary({{"election", Value::int64(0)}}));

    std::string pid = std::to_string(getpid());
    for (const auto& [key, uuid] : {std::pair{kHelloKey, hello_}, std::pair{"com.example.greeter.bonjour", bonjour_}}) {
        std::string who = "client " + pid + " plug-in " + key + "(" + uuid.string() + ")";
        EXPECT_TRUE(bxd_.waitForLog(who + " election := 0")) << bxd_.log();
        EXPECT_TRUE(bxd_.waitForLog(who + " annotation change: ")) << bxd_.log();
    }
    // The first request carried no election, so only the second logged election lines.
    EXPECT_EQ(bxd_.countInLog(" election := "), 2u) << bxd_.log();
}

TEST_F(AnnotationTest, ChangesWithoutKnownKeysSucceedWithoutTouchingAnything) {
    TestClient client;
    // Neither "uuids" nor a known annotation key: nothing to do, so the missing list is never looked at.
    Value reply =
        client.replyTo(request("annotate", {{"annotations", Value::dictionary({{"colour", Value::string("blue")}})}}));
    EXPECT_EQ(errorCode(reply), 0) << errorText(reply);
    reply = client.replyTo(annotateRequest(Value::emptyDictionary(), {hello_}));
    EXPECT_EQ(errorCode(reply), 0) << errorText(reply);
    EXPECT_EQ(notifications(), 0u);
    EXPECT_TRUE(stored(kHelloKey).isNull());
    EXPECT_EQ(bxd_.countInLog("annotation change"), 0u);
}

TEST_F(AnnotationTest, MalformedAnnotateRequestsChangeNothing) {
    TestClient client;
    auto expectFailure = [&](const Value& message, int64_t code, const std::string& text) {
        Value reply = client.replyTo(message);
        EXPECT_EQ(errorCode(reply), code) << text;
        EXPECT_EQ(errorText(reply), text);
    };
    const std::vector<Uuid> both{hello_, bonjour_};
    expectFailure(request("annotate", {{"uuids", uuidArray(both)}}), 4,
                  "invalid request format (bad annotations dictionary)");
    expectFailure(request("annotate", {{"annotations", Value::array({})}, {"uuids", uuidArray(both)}}), 4,
                  "invalid request format (bad annotations dictionary)");
    // A bad election fails even when the extension beside it is fine: nothing of the request is applied.
    Value goodExtension = Value::dictionary({{"colour", Value::string("red")}});
    for (const Value& election : {Value::string("1"), Value::boolean(true), Value::emptyDictionary()})
        expectFailure(annotateRequest(Value::dictionary({{"election", election}, {"extension", goodExtension}}), both),
                      4, "invalid request format (annotation election)");
    for (const Value& extension : {Value::string("x"), Value::array({}), Value::int64(3)})
        expectFailure(annotateRequest(Value::dictionary({{"extension", extension}}), both), 4,
                      "invalid request format (annotation extension)");

    // Problems with the plug-in list are the list walker's.
    Value change = Value::dictionary({{"election", Value::int64(2)}});
    expectFailure(request("annotate", {{"annotations", change}}), 4, "invalid request format (uuid)");
    expectFailure(request("annotate", {{"annotations", change}, {"uuids", Value::uuid(hello_)}}), 4,
                  "invalid request format (uuid)");
    expectFailure(
        request("annotate", {{"annotations", change}, {"uuids", Value::array({Value::string(hello_.string())})}}), 4,
        "invalid request (bad uuid array)");

    EXPECT_EQ(notifications(), 0u);
    EXPECT_TRUE(storedAnnotations().isNull() || storedAnnotations().count() == 0) << storedAnnotations().description();
}

TEST_F(AnnotationTest, AFailingLaterPlugInKeepsEarlierChangesButPostsNothing) {
    TestClient client;
    Value change = Value::dictionary({{"election", Value::int64(3)}});
    Value reply = client.replyTo(annotateRequest(change, {hello_, Uuid::random(), bonjour_}));
    EXPECT_EQ(errorCode(reply), 4);
    EXPECT_EQ(errorText(reply), "no such plugin (uuid not found)");
    EXPECT_EQ(stored(kHelloKey), change) << "the plug-in before the unknown one was changed and saved";
    EXPECT_TRUE(stored(kBonjourKey).isNull()) << "the walk stopped at the unknown plug-in";
    EXPECT_EQ(notifications(), 0u);

    // A non-UUID element after a valid one: same rule.
    reply = client.replyTo(request("annotate", {{"annotations", Value::dictionary({{"election", Value::int64(4)}})},
                                                {"uuids", Value::array({Value::uuid(bonjour_), Value::int64(7)})}}));
    EXPECT_EQ(errorCode(reply), 4);
    EXPECT_EQ(errorText(reply), "invalid request (bad uuid array)");
    EXPECT_EQ(stored(kBonjourKey), Value::dictionary({{"election", Value::int64(4)}}));
    EXPECT_EQ(notifications(), 0u);
}

TEST_F(AnnotationTest, BulkReplacesClientDataAndKeepsTheElection) {
    TestClient client;
    Value old = Value::dictionary({{"old", Value::boolean(true)}, {"shared", Value::int64(1)}});
    ASSERT_EQ(errorCode(client.replyTo(
                  annotateRequest(Value::dictionary({{"election", Value::int64(1)}, {"extension", old}}), {hello_}))),
              0);
    const uint64_t before = notifications();

    Value replacement = Value::dictionary({{"shared", Value::int64(2)}});
    Value bonjourData = Value::dictionary({{"nested", Value::array({Value::string("a"), Value::real(1.5)})}});
    Value reply = client.replyTo(request(
        "bulk-annotate",
        {{"annotations", Value::dictionary({{hello_.string(), replacement}, {bonjour_.string(), bonjourData}})}}));
    ASSERT_EQ(errorCode(reply), 0) << errorText(reply);
    EXPECT_EQ(notifications(), before + 1);
    // The whole client data is replaced (the "old" key is gone), the election stays.
    EXPECT_EQ(stored(kHelloKey), Value::dictionary({{"election", Value::int64(1)}, {"extension", replacement}}));
    EXPECT_EQ(stored(kBonjourKey), Value::dictionary({{"extension", bonjourData}}));
    EXPECT_TRUE(bxd_.waitForLog("bulk change requested for 2 plug-ins")) << bxd_.log();
    EXPECT_TRUE(bxd_.waitForLog("client " + std::to_string(getpid()) + " bulk plug-in " + kHelloKey + "(" +
                                hello_.string() + ") annotation change: "))
        << bxd_.log();

    // UUID text in lower case names the same plug-in.
    std::string lower = hello_.string();
    for (char& c : lower) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    reply = client.replyTo(
        request("bulk-annotate", {{"annotations", Value::dictionary({{lower, Value::emptyDictionary()}})}}));
    EXPECT_EQ(errorCode(reply), 0) << errorText(reply);
    EXPECT_EQ(stored(kHelloKey).get("extension"), Value::emptyDictionary());
}

TEST_F(AnnotationTest, EmptyBulkSucceedsAndStillNotifies) {
    TestClient client;
    Value reply = client.replyTo(request("bulk-annotate", {{"annotations", Value::emptyDictionary()}}));
    EXPECT_EQ(errorCode(reply), 0) << errorText(reply);
    EXPECT_EQ(notifications(), 1u);
    EXPECT_TRUE(bxd_.waitForLog("bulk change requested for 0 plug-ins")) << bxd_.log();
}

TEST_F(AnnotationTest, MalformedBulkEntriesAreRefusedWithTheirCodes) {
    TestClient client;
    auto bulk = [&](const Value& annotations) {
        return client.replyTo(request("bulk-annotate", {{"annotations", annotations}}));
    };
    Value missing = client.replyTo(request("bulk-annotate", {}));
    EXPECT_EQ(errorCode(missing), 4);
    EXPECT_EQ(errorText(missing), "invalid request format (bad annotations dictionary)");
    Value notDictionary = bulk(Value::string("x"));
    EXPECT_EQ(errorCode(notDictionary), 4);
    EXPECT_EQ(errorText(notDictionary), "invalid request format (bad annotations dictionary)");

    Value data = Value::dictionary({{"k", Value::string("v")}});
    for (const Value& value : {Value::string("v"), Value::int64(1), Value::array({data})}) {
        Value reply = bulk(Value::dictionary({{hello_.string(), value}}));
        EXPECT_EQ(errorCode(reply), 18);
        EXPECT_EQ(errorText(reply), "annotations values must be dictionaries");
    }
    // The value is checked before the key, so a bad key with a bad value reports the value.
    Value both = bulk(Value::dictionary({{"not-a-uuid", Value::int64(1)}}));
    EXPECT_EQ(errorText(both), "annotations values must be dictionaries");
    for (const char* key : {"not-a-uuid", "", "11111111-2222-4333-8444-55555555555", "com.example.greeter.hello"}) {
        Value reply = bulk(Value::dictionary({{key, data}}));
        EXPECT_EQ(errorCode(reply), 18) << key;
        EXPECT_EQ(errorText(reply), "invalid plug-in UUID value") << key;
    }
    Value unknown = bulk(Value::dictionary({{Uuid::random().string(), data}}));
    EXPECT_EQ(errorCode(unknown), 2);
    EXPECT_EQ(errorText(unknown), "no plug-in with the requested uuid");

    EXPECT_EQ(notifications(), 0u);
    EXPECT_TRUE(stored(kHelloKey).isNull()) << storedAnnotations().description();
}

TEST_F(AnnotationTest, AnotherProcessObservesTheChangeNotification) {
    EventLoop loop(1);
    SerialQueue queue("observer", loop);
    SystemNotifications observer(notifyDir());
    std::atomic<int> calls{0};
    auto first = std::make_shared<std::promise<void>>();
    auto token = observer.observe(
        kChangeNotification,
        [&calls, first](const std::string&, uint64_t) {
            if (++calls == 1) first->set_value();
        },
        queue);
    ASSERT_TRUE(token.ok()) << token.error().description();

    TestClient client;
    ASSERT_EQ(errorCode(client.replyTo(annotateRequest(Value::dictionary({{"election", Value::int64(1)}}), {hello_}))),
              0);
    ASSERT_EQ(first->get_future().wait_for(std::chrono::seconds(5)), std::future_status::ready);
    observer.cancel(*token);
    EXPECT_EQ(calls.load(), 1);
}

TEST_F(AnnotationTest, DiscoveryReplyTooLargeForAFrameIsAnErrorNotASilence) {
    // Each annotation fits in a request, but the two together make a discovery reply larger than one frame.
    TestClient client;
    std::string bulk(9u << 20, 'x');
    for (const Uuid& uuid : {hello_, bonjour_}) {
        Value extension = Value::dictionary({{"bulk", Value::string(bulk)}});
        Value reply = client.replyTo(annotateRequest(Value::dictionary({{"extension", extension}}), {uuid}));
        ASSERT_EQ(errorCode(reply), 0) << errorText(reply);
    }
    Value reply = client.replyTo(request("match", {}));
    EXPECT_EQ(errorCode(reply), 4);
    EXPECT_NE(errorText(reply).find("exceeds the frame limit"), std::string::npos) << errorText(reply);
    EXPECT_TRUE(bxd_.waitForLog("exceeds the frame limit of")) << bxd_.log();
    // The connection stays usable.
    reply = client.replyTo(
        request("match", {{"rules", Value::dictionary({{"RZExtensionIdentifier", Value::string("none")}})}}));
    EXPECT_EQ(errorCode(reply), 0) << errorText(reply);
}

TEST_F(AnnotationTest, AnnotationsSurviveARestart) {
    Value extension = Value::dictionary({{"colour", Value::string("green")}});
    {
        TestClient client;
        ASSERT_EQ(errorCode(client.replyTo(annotateRequest(
                      Value::dictionary({{"election", Value::int64(2)}, {"extension", extension}}), {hello_}))),
                  0);
    }
    bxd_.stop();
    ASSERT_TRUE(start()) << bxd_.log();

    // The restarted daemon changes only the client data; had it not loaded the document, the election written
    // before the restart would be gone from the document it saves now.
    TestClient client;
    Value replacement = Value::dictionary({{"colour", Value::string("violet")}});
    Value reply = client.replyTo(
        request("bulk-annotate", {{"annotations", Value::dictionary({{hello_.string(), replacement}})}}));
    ASSERT_EQ(errorCode(reply), 0) << errorText(reply);
    EXPECT_EQ(stored(kHelloKey), Value::dictionary({{"election", Value::int64(2)}, {"extension", replacement}}));
}

TEST_F(AnnotationTest, ToolSubcommandsChangeAnnotationsEndToEnd) {
    auto run = [&](const std::string& arguments) {
        fs::path err = bxd_.root() / "tool-err.txt";
        std::string line = "timeout 60 '" + (fs::path(BEXIL_BINARY_DIR) / "tools" / "bexil" / "bexil").string() + "' " +
                           arguments + " >/dev/null 2>'" + err.string() + "'";
        int raw = std::system(line.c_str());
        int status = WIFEXITED(raw) ? WEXITSTATUS(raw) : -1;
        EXPECT_EQ(status, 0) << arguments << ": " << slurp(err);
        return status;
    };

    run("elect " + hello_.string() + " " + bonjour_.string());
    EXPECT_EQ(stored(kHelloKey), Value::dictionary({{"election", Value::int64(1)}}));
    EXPECT_EQ(stored(kBonjourKey), Value::dictionary({{"election", Value::int64(1)}}));

    fs::path extensionFile = bxd_.root() / "extension.json";
    std::ofstream(extensionFile) << R"({"colour": "amber", "size": 3})";
    run("annotate --election 2 --extension '" + extensionFile.string() + "' " + hello_.string());
    Value hello = stored(kHelloKey);
    EXPECT_EQ(hello.get("election"), Value::int64(2));
    EXPECT_EQ(hello.get("extension").get("colour"), Value::string("amber"));

    run("unelect " + bonjour_.string());
    EXPECT_EQ(stored(kBonjourKey), Value::dictionary({{"election", Value::int64(0)}}));

    fs::path bulkFile = bxd_.root() / "bulk.json";
    std::ofstream(bulkFile) << "{\"" << bonjour_.string() << "\": {\"from\": \"bulk\"}}";
    run("bulk-annotate '" + bulkFile.string() + "'");
    EXPECT_EQ(stored(kBonjourKey).get("extension").get("from"), Value::string("bulk"));
    EXPECT_EQ(stored(kBonjourKey).get("election"), Value::int64(0));
    EXPECT_EQ(notifications(), 4u);
}

}  // namespace
}  // namespace bexil
