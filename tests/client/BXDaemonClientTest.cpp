// The client end of the protocol without a daemon: what each request method puts on the wire (captured by a
// listener on a private service directory), how replies become errors, and the message-form conversions.

#include <gtest/gtest.h>

#include <filesystem>
#include <future>
#include <mutex>
#include <optional>

#include "TestSupport.h"
#include "base/EventLoop.h"
#include "base/SerialQueue.h"
#include "client/BXDaemonClient.h"
#include "client/BXDaemonClientSync.h"
#include "client/BXPlugInMatches.h"
#include "platform/zem/ZemListener.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;
using Reply = BXDaemonClient::Reply;

// A service on a private directory that answers every request with `answer` and remembers what it got.
class CapturingService {
  public:
    explicit CapturingService(std::string service = BXDaemonClient::kDefaultServiceName)
        : queue_("capture", *loop_) {
        auto listener = ZemListener::create(service, queue_, nullptr);
        EXPECT_TRUE(listener.ok());
        listener_ = *listener;
        listener_->setConnectionHandler([this](std::shared_ptr<ZemConnection> peer) {
            std::weak_ptr<ZemConnection> weak = peer;
            peer->setEventHandler([this, weak](const ZemConnection::Event& event) {
                auto peer = weak.lock();
                const auto* message = std::get_if<ZemMessage>(&event);
                if (!peer || !message) return;
                {
                    std::lock_guard lock(mutex_);
                    requests_.push_back(message->body());
                }
                peer->sendReply(*message, answer_);
            });
            peer->resume();
            std::lock_guard lock(mutex_);
            peers_.push_back(peer);
        });
        listener_->resume();
    }
    // A client may still be connecting while the test ends, so its accept can race this destructor: cancel on the
    // service's own queue, then end the loop's thread before the members its handlers use are destroyed.
    ~CapturingService() {
        queue_.sync([this] {
            listener_->cancel();
            for (auto& peer : peers_) peer->cancel();
        });
        loop_.reset();
    }

    void setAnswer(Value answer) { answer_ = std::move(answer); }
    Value lastRequest() {
        std::lock_guard lock(mutex_);
        return requests_.empty() ? Value() : requests_.back();
    }

  private:
    test::TempDir dir_{"bexil-client-test"};
    test::ScopedEnv serviceDir_{"BX_SERVICE_DIR", dir_.path().string()};
    std::optional<EventLoop> loop_{std::in_place, 1};
    SerialQueue queue_;
    std::shared_ptr<ZemListener> listener_;
    std::mutex mutex_;
    std::vector<Value> requests_;
    std::vector<std::shared_ptr<ZemConnection>> peers_;
    Value answer_ = Value::emptyDictionary();
};

Value strings(std::initializer_list<const char*> items) {
    MutableArray array;
    for (const char* item : items) array.append(Value::string(item));
    return array.take();
}

const Uuid kFirst = *Uuid::parse("11111111-2222-4333-8444-555555555555");
const Uuid kSecond = *Uuid::parse("AAAAAAAA-BBBB-4CCC-8DDD-EEEEEEEEEEEE");

class BXDaemonClientRequestTest : public ::testing::Test {
  protected:
    // Sends through `call` and returns what the service received.
    Value sent(const std::function<void(BXDaemonClient&, BXDaemonClient::ReplyHandler)>& call) {
        BXDaemonClient client;
        auto reply = sendAndWait([&](auto handler) { call(client, std::move(handler)); }, std::chrono::seconds(10));
        EXPECT_TRUE(reply.has_value());
        if (reply) {
            EXPECT_TRUE(std::holds_alternative<Value>(*reply));
        }
        return service_.lastRequest();
    }
    static void expectEnvelope(const Value& request, const char* name) {
        EXPECT_EQ(request.get("request").stringView(), name);
        ASSERT_TRUE(request.get("version").getUInt64().has_value()) << "version must travel as uint64";
        EXPECT_EQ(*request.get("version").getUInt64(), 3u);
    }
    static std::vector<Uuid> uuidsOf(const Value& request) {
        std::vector<Uuid> out;
        for (const Value& v : request.get("uuids").items()) out.push_back(v.getUuid() ? *v.getUuid() : Uuid());
        return out;
    }

    CapturingService service_;
};

TEST_F(BXDaemonClientRequestTest, CreationDefaultsToTheDaemonServiceQueueAndVersion3) {
    BXDaemonClient client;
    EXPECT_EQ(client.serviceName(), "com.quorvel.bexil.bxd");
    EXPECT_EQ(client.replyQueue().label(), "bxd_client");
    EXPECT_EQ(client.protocolVersion(), 3);
    EXPECT_EQ(client.bxd()->serviceName(), "com.quorvel.bexil.bxd");
}

TEST_F(BXDaemonClientRequestTest, PathRequestsCarryPathsOnlyFlagRequestsUnsignedFlags) {
    Value add = sent([](auto& c, auto h) { c.addPlugInsReply(strings({"/a", "/b"}), h); });
    expectEnvelope(add, "add");
    EXPECT_EQ(add.get("paths"), strings({"/a", "/b"}));
    EXPECT_EQ(add.count(), 3u);

    Value remove = sent([](auto& c, auto h) { c.removePlugInsReply(strings({"/x"}), h); });
    expectEnvelope(remove, "remove");
    EXPECT_EQ(remove.get("paths"), strings({"/x"}));
    EXPECT_EQ(remove.count(), 3u);

    Value bulk = sent([](auto& c, auto h) { c.bulkPluginsReply(0x8000000000000001ull, h); });
    expectEnvelope(bulk, "bulk");
    EXPECT_EQ(bulk.get("flags").getUInt64(), std::optional<uint64_t>(0x8000000000000001ull));
    EXPECT_EQ(bulk.count(), 3u);

    Value rules = Value::dictionary({{"RZExtensionPointIdentifier", Value::string("com.example.*")}});
    Value match = sent([&](auto& c, auto h) { c.matchPlugInsFlagsReply(rules, 0x201, h); });
    expectEnvelope(match, "match");
    EXPECT_EQ(match.get("rules"), rules);
    EXPECT_EQ(match.get("flags").getUInt64(), std::optional<uint64_t>(0x201));
    EXPECT_EQ(match.count(), 4u);
}

TEST_F(BXDaemonClientRequestTest, UuidAndAnnotationRequestsKeepTheOrderGiven) {
    Value ready = sent([](auto& c, auto h) { c.readyPlugInsFlagsReply({kSecond, kFirst}, 7, h); });
    expectEnvelope(ready, "ready");
    EXPECT_EQ(uuidsOf(ready), (std::vector<Uuid>{kSecond, kFirst}));
    EXPECT_EQ(ready.get("flags").getUInt64(), std::optional<uint64_t>(7));

    Value access = sent([](auto& c, auto h) { c.accessPlugInsFlagsReply({kFirst, kFirst}, 0, h); });
    expectEnvelope(access, "access");
    EXPECT_EQ(uuidsOf(access), (std::vector<Uuid>{kFirst, kFirst}));
    EXPECT_TRUE(access.get("flags").getUInt64().has_value());

    Value annotations = Value::dictionary({{"election", Value::int64(1)}});
    Value annotate = sent([&](auto& c, auto h) { c.setPluginAnnotationsAnnotationsReply({kFirst}, annotations, h); });
    expectEnvelope(annotate, "annotate");
    EXPECT_EQ(uuidsOf(annotate), std::vector<Uuid>{kFirst});
    EXPECT_EQ(annotate.get("annotations"), annotations);
    EXPECT_EQ(annotate.count(), 4u);

    Value bulk = Value::dictionary({{kFirst.string(), Value::emptyDictionary()}});
    Value bulkAnnotate = sent([&](auto& c, auto h) { c.bulkSetPluginAnnotationsReply(bulk, h); });
    expectEnvelope(bulkAnnotate, "bulk-annotate");
    EXPECT_EQ(bulkAnnotate.get("annotations"), bulk);
    EXPECT_FALSE(bulkAnnotate.contains("uuids"));
}

TEST_F(BXDaemonClientRequestTest, HoldAndReleaseAreBothLockRequests) {
    Value hold = sent([](auto& c, auto h) { c.holdPluginsFlagsReply(strings({"/Apps/A.app"}), 0x3, h); });
    expectEnvelope(hold, "lock");
    EXPECT_EQ(hold.get("paths"), strings({"/Apps/A.app"}));
    EXPECT_EQ(hold.get("flags").getUInt64(), std::optional<uint64_t>(3));
    EXPECT_FALSE(hold.contains("uuids"));

    Value release = sent([](auto& c, auto h) { c.releaseHoldReply(kSecond, h); });
    expectEnvelope(release, "lock");
    EXPECT_EQ(uuidsOf(release), std::vector<Uuid>{kSecond});
    EXPECT_FALSE(release.contains("paths"));
    EXPECT_FALSE(release.contains("flags"));
}

TEST_F(BXDaemonClientRequestTest, ChangedProtocolVersionTravelsAndGatesDecoding) {
    BXDaemonClient client;
    client.setProtocolVersion(2);
    auto reply = sendAndWait([&](auto h) { client.bulkPluginsReply(0, h); }, std::chrono::seconds(10));
    ASSERT_TRUE(reply.has_value());
    EXPECT_EQ(service_.lastRequest().get("version").getUInt64(), std::optional<uint64_t>(2));
    EXPECT_FALSE(client.convertFromZEM(Value::emptyArray()).has_value());
}

TEST_F(BXDaemonClientRequestTest, ReplyCallbacksRunOnTheReplyQueue) {
    BXDaemonClient client;
    std::promise<bool> onQueue;
    client.bulkPluginsReply(0, [&](const Reply&) { onQueue.set_value(client.replyQueue().isCurrent()); });
    auto future = onQueue.get_future();
    ASSERT_EQ(future.wait_for(std::chrono::seconds(10)), std::future_status::ready);
    EXPECT_TRUE(future.get());
}

TEST(BXDaemonClientConnectionTest, MissingServiceAnswersWithAConnectionErrorThatIsCode4) {
    test::TempDir empty("bexil-client-empty");
    test::ScopedEnv serviceDir("BX_SERVICE_DIR", empty.path().string());
    BXDaemonClient client("com.example.nobody");
    auto reply = sendAndWait([&](auto h) { client.bulkPluginsReply(0, h); }, std::chrono::seconds(10));
    ASSERT_TRUE(reply.has_value()) << "a missing service must answer, not hang";
    ASSERT_TRUE(std::holds_alternative<ZemError>(*reply));
    auto error = BXDaemonClient::errorInReply(*reply);
    ASSERT_TRUE(error.has_value());
    EXPECT_EQ(error->code(), 4);
    EXPECT_EQ(error->localizedDescription(), std::get<ZemError>(*reply).description());
}

// ---- errorInReply ----

Reply replyWith(std::vector<std::pair<std::string, Value>> entries) { return Value::dictionary(std::move(entries)); }

TEST(BXDaemonClientErrorTest, EmptyReplyAndZeroCodeAreSuccessACodeIsABexilErrorWithItsMessageOrTheGenericText) {
    EXPECT_FALSE(BXDaemonClient::errorInReply(Value::emptyDictionary()).has_value());
    EXPECT_FALSE(BXDaemonClient::errorInReply(replyWith({{"errorcode", Value::uint64(0)}})).has_value());

    auto error = BXDaemonClient::errorInReply(
        replyWith({{"errorcode", Value::uint64(9)}, {"error", Value::string("no plugin at /x")}}));
    ASSERT_TRUE(error.has_value());
    EXPECT_TRUE(error->isBexil());
    EXPECT_EQ(error->code(), 9);
    EXPECT_EQ(error->localizedDescription(), std::optional<std::string>("no plugin at /x"));

    auto generic = BXDaemonClient::errorInReply(replyWith({{"errorcode", Value::uint64(14)}}));
    ASSERT_TRUE(generic.has_value());
    EXPECT_EQ(generic->code(), 14);
    EXPECT_EQ(generic->localizedDescription(), std::optional<std::string>("unknown error returned by Bexil subsystem"));
}

TEST(BXDaemonClientErrorTest, OnlyTheLow32BitsOfTheCodeCountAndAMessageWithoutCodeIsABrokenInvariant) {
    // A negative 32-bit code widened with its sign, and a code with junk in the high half.
    auto negative = BXDaemonClient::errorInReply(
        replyWith({{"errorcode", Value::uint64(0xFFFFFFFFFFFFFFFEull)}, {"error", Value::string("m")}}));
    ASSERT_TRUE(negative.has_value());
    EXPECT_EQ(negative->code(), -2);
    auto highOnly = BXDaemonClient::errorInReply(replyWith({{"errorcode", Value::uint64(0x100000000ull)}}));
    EXPECT_FALSE(highOnly.has_value()) << "low half 0 and no message is success";

    try {
        (void)BXDaemonClient::errorInReply(replyWith({{"error", Value::string("oops")}}));
        FAIL() << "expected InternalInconsistency";
    } catch (const InternalInconsistency& e) {
        EXPECT_STREQ(e.what(), "bxd reported error without a code: oops");
    }
}

// ---- conversions ----

Value everyKind() {
    MutableDictionary d;
    d.set("null", Value::null());
    d.set("bool", Value::boolean(true));
    d.set("int", Value::int64(-5));
    d.set("uint", Value::uint64(UINT64_MAX));
    d.set("real", Value::real(2.5));
    d.set("string", Value::string("héllo"));
    d.set("data", Value::data(std::vector<uint8_t>{0, 1, 255}));
    d.set("date", Value::date(Date{1.5e9}));
    d.set("uuid", Value::uuid(kFirst));
    d.set("array", Value::array({Value::string("a"), Value::emptyDictionary()}));
    return Value::array({d.take()});
}

TEST(BXDaemonClientConversionTest, MessageFormRoundTripsEveryKindAtVersion3AndEveryOtherVersionYieldsNone) {
    BXDaemonClient client("com.example.unused");
    Value original = everyKind();
    auto encoded = BXDaemonClient::convertToZEMVersion(original, 3);
    ASSERT_TRUE(encoded.has_value());
    auto decoded = client.convertFromZEM(*encoded);
    ASSERT_TRUE(decoded.has_value());
    EXPECT_EQ(*decoded, original);
    // Kinds stay apart: an int64 does not come back as a uint64 and vice versa.
    EXPECT_TRUE(decoded->items()[0].get("int").getInt64().has_value());
    EXPECT_TRUE(decoded->items()[0].get("uint").getUInt64().has_value());

    for (int64_t version : {int64_t{0}, int64_t{1}, int64_t{2}, int64_t{4}, int64_t{-3}, (int64_t{1} << 32) | 3})
        EXPECT_FALSE(BXDaemonClient::convertToZEMVersion(Value::emptyArray(), version).has_value()) << version;
}

// ---- discovery matches ----

Value formFor(const char* identifier, const Uuid& uuid) {
    MutableDictionary form;
    form.set("identifier", Value::string(identifier));
    form.set("original-identifier", Value::string(identifier));
    form.set("path", Value::string(std::string("/Apps/A.app/PlugIns/") + identifier + ".bxplugin"));
    form.set("uuid", Value::string(uuid.string()));
    form.set("annotations", Value::dictionary({{"election", Value::int64(1)}}));
    return form.take();
}

TEST(BXPlugInMatchesTest, FormsBecomeRecordsInReplyOrder) {
    BXDaemonClient client("com.example.unused");
    Value matches = Value::array({formFor("com.example.b", kSecond), formFor("com.example.a", kFirst)});
    auto plugIns = plugInsFromMatchReply(client, Value::dictionary({{"matches", matches}}));
    ASSERT_TRUE(plugIns.ok());
    ASSERT_EQ(plugIns->size(), 2u);
    EXPECT_EQ((*plugIns)[0]->identifier(), std::optional<std::string>("com.example.b"));
    EXPECT_EQ((*plugIns)[0]->uuid(), std::optional<Uuid>(kSecond));
    EXPECT_EQ((*plugIns)[1]->uuid(), std::optional<Uuid>(kFirst));
    ASSERT_TRUE((*plugIns)[1]->annotations().has_value());
    EXPECT_EQ((*plugIns)[1]->annotations()->get("election"), Value::int64(1));
}

TEST(BXPlugInMatchesTest, UnreadableFormsAreLeftOutAndBadRepliesAreErrors) {
    BXDaemonClient client("com.example.unused");
    MutableDictionary noPath(formFor("com.example.c", kFirst));
    noPath.remove("path");
    auto some = plugInsFromMatchReply(
        client, Value::dictionary({{"matches", Value::array({noPath.take(), formFor("com.example.d", kSecond)})}}));
    ASSERT_TRUE(some.ok());
    ASSERT_EQ(some->size(), 1u);
    EXPECT_EQ((*some)[0]->identifier(), std::optional<std::string>("com.example.d"));

    auto failed = plugInsFromMatchReply(
        client, Value::dictionary({{"errorcode", Value::uint64(11)}, {"error", Value::string("denied")}}));
    ASSERT_FALSE(failed.ok());
    EXPECT_EQ(failed.error().code(), 11);

    auto missing = plugInsFromMatchReply(client, Value::emptyDictionary());
    ASSERT_FALSE(missing.ok());
    EXPECT_EQ(missing.error().code(), 4);

    client.setProtocolVersion(2);
    auto oldVersion = plugInsFromMatchReply(client, Value::dictionary({{"matches", Value::emptyArray()}}));
    ASSERT_FALSE(oldVersion.ok());
    EXPECT_EQ(oldVersion.error().code(), 7);
}

}  // namespace
}  // namespace bexil
