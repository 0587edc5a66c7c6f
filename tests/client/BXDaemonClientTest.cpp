// The client end of the protocol without a daemon: what each request method puts on the wire (captured by a
// listener on a private service directory), how replies become errors, and the message-form conversions.

#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>
#include <future>
#include <mutex>
#include <optional>
#include <thread>
#include <tuple>

#include "TestSupport.h"
#include "base/EventLoop.h"
#include "base/SerialQueue.h"
#include "client/BXDaemonClient.h"
#include "client/BXDaemonClientSync.h"
#include "client/BXPlugInMatches.h"
#include "platform/log/CaptureSink.h"
#include "platform/zem/ZemFrame.h"
#include "platform/zem/ZemFrameReader.h"
#include "platform/zem/ZemListener.h"

namespace bexil {
namespace {

using Reply = BXDaemonClient::Reply;

// A service on a private directory that answers every request with `answer` and remembers what it got.
class CapturingService {
  public:
    explicit CapturingService(std::string service = BXDaemonClient::kDefaultServiceName) : queue_("capture", *loop_) {
        auto listener = ZemListener::create(service, queue_);
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
        EXPECT_TRUE(reply.has_value() && std::holds_alternative<Value>(*reply));
        return service_.lastRequest();
    }

    CapturingService service_;
};

Value uuids(std::initializer_list<Uuid> items) {
    MutableArray array;
    for (const Uuid& item : items) array.append(Value::uuid(item));
    return array.take();
}

// Guards the wire form of each request method the end-to-end tests do not send through the tool ("match",
// "annotate" and "bulk-annotate" are): the whole message, so that a missing or extra key shows; hold and release
// are both "lock" requests, told apart by paths or uuids. Numbers must travel as uint64, which == alone would not
// see.
TEST_F(BXDaemonClientRequestTest, EachRequestCarriesItsNameVersion3AndExactlyItsArguments) {
    EXPECT_EQ(BXDaemonClient().serviceName(), "com.quorvel.bexil.bxd");
    using Call = std::function<void(BXDaemonClient&, BXDaemonClient::ReplyHandler)>;
    const std::vector<std::tuple<const char*, Call, test::Entries>> cases = {
        {"add",
         [](auto& c, auto h) {
             c.addPlugInsReply(strings({"/a", "/b"}), h);
         },
         {{"paths", strings({"/a", "/b"})}}},
        {"remove", [](auto& c, auto h) { c.removePlugInsReply(strings({"/x"}), h); }, {{"paths", strings({"/x"})}}},
        {"bulk",
         [](auto& c, auto h) { c.bulkPluginsReply(0x8000000000000001ull, h); },
         {{"flags", Value::uint64(0x8000000000000001ull)}}},
        {"ready",
         [](auto& c, auto h) {
             c.readyPlugInsFlagsReply({kSecond, kFirst}, 7, h);
         },
         {{"uuids", uuids({kSecond, kFirst})}, {"flags", Value::uint64(7)}}},
        {"access",
         [](auto& c, auto h) {
             c.accessPlugInsFlagsReply({kFirst, kFirst}, 0, h);
         },
         {{"uuids", uuids({kFirst, kFirst})}, {"flags", Value::uint64(0)}}},
        {"lock",
         [](auto& c, auto h) { c.holdPluginsFlagsReply(strings({"/Apps/A.app"}), 0x3, h); },
         {{"paths", strings({"/Apps/A.app"})}, {"flags", Value::uint64(3)}}},
        {"lock", [](auto& c, auto h) { c.releaseHoldReply(kSecond, h); }, {{"uuids", uuids({kSecond})}}},
    };
    for (const auto& [name, call, arguments] : cases) {
        test::Entries expected = arguments;
        expected.emplace_back("request", Value::string(name));
        expected.emplace_back("version", Value::uint64(3));
        Value request = sent(call);
        EXPECT_EQ(request, test::dict(expected)) << name;
        for (const char* number : {"version", "flags"}) {
            if (request.contains(number)) {
                EXPECT_TRUE(request.get(number).getUInt64()) << name << " " << number;
            }
        }
    }
}

// Guards the client's threading promise, reply handlers run on its reply queue, and its trace: the request and
// the reply are logged on the traffic channel, which is what a developer turns on to see the conversation.
TEST_F(BXDaemonClientRequestTest, RepliesRunOnTheReplyQueueAndTheConversationIsTraced) {
    log::CaptureSink capture;
    BXDaemonClient client;
    std::promise<bool> onQueue;
    client.bulkPluginsReply(0, [&](const Reply&) { onQueue.set_value(client.replyQueue().isCurrent()); });
    auto future = onQueue.get_future();
    ASSERT_EQ(future.wait_for(std::chrono::seconds(10)), std::future_status::ready);
    EXPECT_TRUE(future.get());
    auto requests = capture.matching("request: ");
    ASSERT_EQ(requests.size(), 1u);
    EXPECT_EQ(requests[0].category, "traffic");
    EXPECT_EQ(capture.count("reply: "), 1u);
}

// Guards the connection-failure path of the library: a service that is not there answers the request (no hang)
// with the connection error, which is code 4 with the platform's description and is logged as a communications
// error.
TEST(BXDaemonClientConnectionTest, MissingServiceAnswersWithAConnectionErrorThatIsCode4) {
    test::TempDir empty("bexil-client-empty");
    test::ScopedEnv serviceDir("BX_SERVICE_DIR", empty.path().string());
    log::CaptureSink capture;
    BXDaemonClient client("com.example.nobody");
    auto reply = sendAndWait([&](auto h) { client.bulkPluginsReply(0, h); }, std::chrono::seconds(10));
    ASSERT_TRUE(reply.has_value()) << "a missing service must answer, not hang";
    ASSERT_TRUE(std::holds_alternative<ZemError>(*reply));
    auto error = BXDaemonClient::errorInReply(*reply);
    ASSERT_TRUE(error.has_value());
    EXPECT_EQ(error->code(), 4);
    EXPECT_EQ(error->localizedDescription(), std::get<ZemError>(*reply).description());
    EXPECT_TRUE(capture.contains("Communications error: " + std::get<ZemError>(*reply).description()));
}

// Guards the difference between a request that cannot travel and a connection that failed: text that is not UTF-8
// is refused before anything is sent, as a malformed request (the public client says the connection did not fail),
// and the same connection carries the next request. Reporting it as a connection failure made the tool say bxd was
// not running.
TEST_F(BXDaemonClientRequestTest, ARequestThatCannotBeEncodedFailsAloneAndTheConnectionGoesOn) {
    BXDaemonClient client;
    Value rules = Value::dictionary({{"RZExtensionPointIdentifier", Value::string("com.example.\xff")}});
    auto refused = sendAndWait([&](auto h) { client.matchPlugInsFlagsReply(rules, 0, h); }, std::chrono::seconds(10));
    ASSERT_TRUE(refused.has_value());
    ASSERT_TRUE(std::holds_alternative<ZemError>(*refused));
    EXPECT_EQ(std::get<ZemError>(*refused).kind(), ZemError::Kind::MessageInvalid);
    std::optional<Error> error = BXDaemonClient::errorInReply(*refused);
    ASSERT_TRUE(error.has_value());
    EXPECT_EQ(error->code(), static_cast<int64_t>(ErrorCode::InvalidRequest));
    EXPECT_NE(error->localizedDescription().value_or("").find("not UTF-8"), std::string::npos);

    auto next = sendAndWait([&](auto h) { client.bulkPluginsReply(0, h); }, std::chrono::seconds(10));
    ASSERT_TRUE(next.has_value());
    EXPECT_TRUE(std::holds_alternative<Value>(*next)) << "the connection must survive a request it could not send";
    EXPECT_EQ(service_.lastRequest().get("request"), Value::string("bulk"));
}

// A service written frame by frame: it answers the first request with a one-way message and, in the same write (so
// that the client reads both at once and queues their blocks in that order), a page of a paged match that asks for
// more. It counts the requests that come until the client hangs up.
class FirstPageService {
  public:
    FirstPageService() {
        std::string path = ZemListener::socketPathForService(BXDaemonClient::kDefaultServiceName).string();
        listener_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        EXPECT_LT(path.size(), sizeof address.sun_path);
        std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
        EXPECT_EQ(bind(listener_, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
        EXPECT_EQ(listen(listener_, 1), 0);
        serving_ = std::thread([this] { serve(); });
    }
    ~FirstPageService() {
        shutdown(listener_, SHUT_RDWR);
        if (serving_.joinable()) serving_.join();
        close(listener_);
    }

    // The requests received, once the client has hung up (waited for up to a time limit).
    size_t requestsWhenClosed() {
        if (serving_.joinable()) serving_.join();
        return requests_;
    }

  private:
    void serve() {
        pollfd incoming{listener_, POLLIN, 0};
        if (poll(&incoming, 1, 10000) != 1) return;
        int peer = accept4(listener_, nullptr, nullptr, SOCK_CLOEXEC);
        if (peer < 0) return;
        ZemFrameReader reader;
        uint8_t chunk[4096];
        for (;;) {
            while (std::optional<ZemFrame> frame = reader.next()) {
                if (frame->kind() != ZemFrameKind::Request || ++requests_ > 1) continue;
                std::vector<uint8_t> both;
                Value page = Value::dictionary({{"matches", Value::emptyArray()},
                                                {"continuation", Value::data(std::vector<uint8_t>{1})},
                                                {"generation", Value::uint64(7)}});
                EXPECT_FALSE(
                    ZemFrame::encode(ZemFrameKind::Message, 1, 0, Value::dictionary({{"note", test::str("x")}}), both));
                EXPECT_FALSE(ZemFrame::encode(ZemFrameKind::Reply, 2, frame->serial(), page, both));
                EXPECT_EQ(write(peer, both.data(), both.size()), static_cast<ssize_t>(both.size()));
            }
            pollfd ready{peer, POLLIN, 0};
            if (poll(&ready, 1, 10000) != 1) break;
            ssize_t n = read(peer, chunk, sizeof chunk);
            if (n <= 0 || reader.feed(std::span<const uint8_t>(chunk, static_cast<size_t>(n)))) break;
        }
        close(peer);
    }

    int listener_ = -1;
    std::thread serving_;
    size_t requests_ = 0;
};

// Guards a paged match whose client is destroyed while a page that asks for more is already read and queued: the
// walk must not ask for the next page through the destroyed client (it used to, touching freed memory), but end as
// the client's outstanding requests do, with a connection error, and nothing more reaches the service.
TEST(BXDaemonClientPagedMatchTest, APageArrivingAfterTheClientIsDestroyedEndsTheWalkWithAConnectionError) {
    test::TempDir dir("bexil-client-pages");
    test::ScopedEnv serviceDir("BX_SERVICE_DIR", dir.path().string());
    FirstPageService service;
    auto client = std::make_unique<BXDaemonClient>();
    // The message's block runs first on the reply queue and holds it while this thread destroys the client; the
    // page's block comes next.
    std::promise<void> messageArrived, clientGone;
    std::shared_future<void> gone = clientGone.get_future().share();
    client->setMessageHandler([&messageArrived, gone](const Value&) {
        messageArrived.set_value();
        gone.wait();
    });
    std::promise<Reply> walked;
    client->matchAllPagesReply(Value::dictionary({{"RZExtensionPointIdentifier", test::str("com.example.paged")}}), 0,
                               4, nullptr, [&walked](const Reply& reply) { walked.set_value(reply); });
    auto arrived = messageArrived.get_future();
    ASSERT_EQ(arrived.wait_for(std::chrono::seconds(10)), std::future_status::ready);
    client.reset();
    clientGone.set_value();

    auto reply = walked.get_future();
    ASSERT_EQ(reply.wait_for(std::chrono::seconds(10)), std::future_status::ready);
    Reply answer = reply.get();
    ASSERT_TRUE(std::holds_alternative<ZemError>(answer));
    EXPECT_EQ(std::get<ZemError>(answer).kind(), ZemError::Kind::ConnectionInvalid);
    EXPECT_EQ(service.requestsWhenClosed(), 1u);
}

// ---- errorInReply ----

Reply replyWith(std::vector<std::pair<std::string, Value>> entries) { return Value::dictionary(std::move(entries)); }

// Guards how replies become errors. Only the low 32 bits of "errorcode" count, read as a signed number; zero is
// success, a code without a message gets the generic text, and a message without a code is a broken invariant.
TEST(BXDaemonClientErrorTest, TheLow32BitsOfTheCodeMakeTheErrorWithItsMessageOrTheGenericText) {
    EXPECT_FALSE(BXDaemonClient::errorInReply(Value::emptyDictionary()).has_value());
    EXPECT_FALSE(BXDaemonClient::errorInReply(replyWith({{"errorcode", Value::uint64(0x100000000ull)}})));
    EXPECT_EQ(BXDaemonClient::errorInReply(replyWith({{"errorcode", Value::uint64(14)}})),
              BXError(14, "unknown error returned by Bexil subsystem"));
    // A negative 32-bit code widened with its sign.
    EXPECT_EQ(BXDaemonClient::errorInReply(
                  replyWith({{"errorcode", Value::uint64(0xFFFFFFFFFFFFFFFEull)}, {"error", Value::string("m")}})),
              BXError(-2, "m"));
    try {
        (void)BXDaemonClient::errorInReply(replyWith({{"error", Value::string("oops")}}));
        FAIL() << "expected InternalInconsistency";
    } catch (const InternalInconsistency& e) {
        EXPECT_STREQ(e.what(), "bxd reported error without a code: oops");
    }
}

// ---- conversions ----

// Guards the message form: the kinds the end-to-end requests do not carry survive version 3 with their kind, and
// no other version is encoded.
TEST(BXDaemonClientConversionTest, MessageFormRoundTripsEveryKindAtVersion3AndEveryOtherVersionYieldsNone) {
    BXDaemonClient client("com.example.unused");
    Value original = Value::array({test::dict({{"null", Value::null()},
                                               {"int", Value::int64(-5)},
                                               {"uint", Value::uint64(UINT64_MAX)},
                                               {"real", Value::real(2.5)},
                                               {"data", Value::data(std::vector<uint8_t>{0, 1, 255})},
                                               {"date", Value::date(Date{1.5e9})},
                                               {"uuid", Value::uuid(kFirst)}})});
    auto encoded = BXDaemonClient::convertToZEMVersion(original, 3);
    ASSERT_TRUE(encoded.has_value());
    auto decoded = client.convertFromZEM(*encoded);
    ASSERT_TRUE(decoded.has_value());
    EXPECT_EQ(*decoded, original);
    // Kinds stay apart: an int64 does not come back as a uint64 and vice versa.
    EXPECT_TRUE(decoded->items()[0].get("int").getInt64().has_value());
    EXPECT_TRUE(decoded->items()[0].get("uint").getUInt64().has_value());

    for (int64_t version : {int64_t{2}, int64_t{4}, (int64_t{1} << 32) | 3})
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

// Guards discovery results: forms become records in reply order; a form that cannot be read is left out, while an
// error reply and a reply without matches are errors.
TEST(BXPlugInMatchesTest, FormsBecomeRecordsInReplyOrderUnreadableOnesAreLeftOutAndBadRepliesAreErrors) {
    BXDaemonClient client("com.example.unused");
    MutableDictionary noPath(formFor("com.example.c", kFirst));
    noPath.remove("path");
    Value matches = Value::array({formFor("com.example.b", kSecond), noPath.take(), formFor("com.example.a", kFirst)});
    auto plugIns = plugInsFromMatchReply(client, Value::dictionary({{"matches", matches}}));
    ASSERT_TRUE(plugIns.ok());
    ASSERT_EQ(plugIns->size(), 2u);
    EXPECT_EQ((*plugIns)[0]->uuid(), std::optional<Uuid>(kSecond));
    EXPECT_EQ((*plugIns)[1]->uuid(), std::optional<Uuid>(kFirst));
    ASSERT_TRUE((*plugIns)[1]->annotations().has_value());
    EXPECT_EQ((*plugIns)[1]->annotations()->get("election"), Value::int64(1));

    auto codeOf = [&](const Value& reply) {
        auto result = plugInsFromMatchReply(client, reply);
        return result.ok() ? 0 : result.error().code();
    };
    EXPECT_EQ(codeOf(Value::dictionary({{"errorcode", Value::uint64(11)}, {"error", Value::string("denied")}})), 11);
    EXPECT_EQ(codeOf(Value::emptyDictionary()), 4);
}

}  // namespace
}  // namespace bexil
