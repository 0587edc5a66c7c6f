// Typed connections over a socket pair: a host's calls are checked before anything is sent, a server refuses
// whatever ill-typed or unreadable message a hand-written peer sends and keeps serving, and only a broken frame
// stream ends it.

#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <chrono>
#include <thread>

#include "bexil/TypedConnection.h"
#include "client/TypedMessage.h"
#include "platform/zem/ZemFrame.h"
#include "platform/zem/ZemFrameReader.h"

namespace bexil {
namespace {

struct Protocols {
    Protocols() {
        auto& registry = BXProtocolRegistry::shared();
        if (registry.lookup("TypedEcho")) return;
        auto nested = registry.createProtocol("TypedNote");
        nested->addMethod("note", {"{BXString}"}, {});
        EXPECT_TRUE(nested->registerProtocol().ok());
        auto echo = registry.createProtocol("TypedEcho");
        echo->addMethod("echo", {"{BXString}"}, {"{BXString}"});
        echo->addMethod("count", {"{BXArray}", "TypedNote"}, {"{BXInteger}"});
        EXPECT_TRUE(echo->registerProtocol().ok());
    }
};

// The server end runs `serve` on its own thread; the host end is either a TypedConnection or raw frames.
class TypedConnectionTest : public ::testing::Test {
  protected:
    void SetUp() override {
        static Protocols protocols;
        std::array<int, 2> ends{};
        ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends.data()), 0);
        host_ = ends[0];
        auto server = TypedConnection::bind(ends[1], Value::string("TypedEcho"));
        ASSERT_TRUE(server.ok());
        server_ = std::move(*server);
        serving_ = std::thread([this] { served_ = server_->serve(handler); });
    }
    void TearDown() override {
        if (host_ >= 0) close(host_);
        if (serving_.joinable()) serving_.join();
    }

    static Result<Value> handler(std::string_view selector, const Value& arguments) {
        if (selector == "count") {
            if (arguments.items()[0].count() == 13) return Value::array({Value::string("thirteen")});  // ill-typed
            return Value::array({Value::uint64(arguments.items()[0].count())});
        }
        if (arguments.items()[0].stringView() == "refuse") return BXError(ErrorCode::NotAllowed, "refused");
        return Value::array({arguments.items()[0]});
    }

    // Sends one frame as a hand-written peer would, with any payload bytes.
    void sendRaw(ZemFrameKind kind, uint64_t serial, const std::vector<uint8_t>& payload) {
        std::array<uint8_t, ZemFrame::kHeaderBytes> header{};
        ZemFrame::encodeHeader({kind, serial, 0, static_cast<uint32_t>(payload.size()), 0}, header);
        ASSERT_EQ(write(host_, header.data(), header.size()), static_cast<ssize_t>(header.size()));
        if (!payload.empty()) {
            ASSERT_EQ(write(host_, payload.data(), payload.size()), static_cast<ssize_t>(payload.size()));
        }
    }
    void sendCall(uint64_t serial, const Value& message) {
        std::vector<uint8_t> bytes;
        ASSERT_FALSE(ZemFrame::encode(ZemFrameKind::Request, serial, 0, message, bytes));
        ASSERT_EQ(write(host_, bytes.data(), bytes.size()), static_cast<ssize_t>(bytes.size()));
    }
    // The next reply frame's dictionary; it must answer `serial`.
    Value readReply(uint64_t serial) {
        uint8_t buffer[4096];
        for (;;) {
            if (auto frame = reader_.next()) {
                EXPECT_EQ(frame->kind(), ZemFrameKind::Reply);
                EXPECT_EQ(frame->inReplyTo(), serial);
                auto payload = frame->decodePayload();
                return payload.ok() ? *payload : Value::string("an unreadable reply");
            }
            pollfd ready{host_, POLLIN, 0};
            if (poll(&ready, 1, 5000) != 1) return Value::string("no reply in time");
            ssize_t n = read(host_, buffer, sizeof buffer);
            if (n <= 0) return Value::string("the server hung up");
            reader_.feed(std::span<const uint8_t>(buffer, static_cast<size_t>(n)));
        }
    }

    int host_ = -1;
    std::unique_ptr<TypedConnection> server_;
    std::thread serving_;
    std::optional<Error> served_;
    ZemFrameReader reader_;
};

TEST_F(TypedConnectionTest, CallsAreCheckedBeforeSendingAndAnswersAfterReceiving) {
    TypedConnection host(dup(host_), BXInterface::interfaceWithProtocol(protocolNamed("TypedEcho")));
    auto echoed = host.call("echo", Value::array({Value::string("hi")}));
    ASSERT_TRUE(echoed.ok()) << echoed.error().description();
    EXPECT_EQ(*echoed, Value::array({Value::string("hi")}));

    auto refusedHere = host.call("echo", Value::array({Value::uint64(1)}));
    ASSERT_FALSE(refusedHere.ok());
    EXPECT_EQ(refusedHere.error().localizedDescription(),
              "argument 0 of the request of \"echo\" is a uint64, not one of {BXString}");
    pollfd nothing{host_, POLLIN, 0};
    EXPECT_EQ(poll(&nothing, 1, 200), 0) << "an ill-typed call reached the server, which answered it";

    auto refusedThere = host.call("echo", Value::array({Value::string("refuse")}));
    ASSERT_FALSE(refusedThere.ok());
    EXPECT_EQ(refusedThere.error(), BXError(ErrorCode::NotAllowed, "refused"));

    Value note =
        Value::dictionary({{"selector", Value::string("note")}, {"arguments", Value::array({Value::string("x")})}});
    auto counted = host.call("count", Value::array({Value::array({Value::null(), Value::null()}), note}));
    ASSERT_TRUE(counted.ok()) << counted.error().description();
    EXPECT_EQ(*counted, Value::array({Value::uint64(2)}));
    Value badNote =
        Value::dictionary({{"selector", Value::string("note")}, {"arguments", Value::array({Value::int64(1)})}});
    EXPECT_FALSE(host.call("count", Value::array({Value::emptyArray(), badNote})).ok());

    // A handler's ill-typed answer does not travel as it is: the caller gets an error.
    std::vector<Value> thirteen(13, Value::null());
    auto answer = host.call("count", Value::array({Value::array(thirteen), note}));
    ASSERT_FALSE(answer.ok());
    EXPECT_EQ(answer.error().localizedDescription(),
              "ill-typed answer: argument 0 of the reply of \"count\" is a string, not one of {BXInteger}");
}

TEST_F(TypedConnectionTest, IllTypedAndUnreadableMessagesGetErrorRepliesAndServingGoesOn) {
    sendCall(1, typed::callMessage("echo", Value::array({Value::boolean(true)})));
    EXPECT_EQ(readReply(1).get("errorcode"), Value::uint64(4));
    sendCall(2, typed::callMessage("shout", Value::array({Value::string("x")})));
    EXPECT_EQ(readReply(2).get("error"), Value::string("protocol \"TypedEcho\" has no method \"shout\""));
    sendCall(3, Value::dictionary({{"arguments", Value::array({Value::string("x")})}}));
    EXPECT_EQ(readReply(3).get("error"), Value::string("the call names no selector"));
    sendCall(4, typed::callMessage("echo", Value::string("x")));
    EXPECT_EQ(readReply(4).get("errorcode"), Value::uint64(4));
    sendRaw(ZemFrameKind::Request, 5, {0x0B, 0xFF, 0xFF, 0xFF, 0xFF, 0x06});
    EXPECT_EQ(readReply(5).get("errorcode"), Value::uint64(4));
    sendRaw(ZemFrameKind::Request, 6, {});
    EXPECT_EQ(readReply(6).get("errorcode"), Value::uint64(4));
    sendRaw(ZemFrameKind::Message, 0, {0x06, 0x01});  // one-way: no answer, and nothing breaks
    sendCall(7, typed::callMessage("echo", Value::array({Value::string("still here")})));
    EXPECT_EQ(readReply(7).get("arguments"), Value::array({Value::string("still here")}));

    // Bytes that are no frame at all cannot be resynchronised: serving ends with the error, without a crash.
    const char garbage[] = "GET / HTTP/1.1\r\nHost: x\r\n\r\n";
    ASSERT_EQ(write(host_, garbage, sizeof garbage), static_cast<ssize_t>(sizeof garbage));
    serving_.join();
    ASSERT_TRUE(served_);
    EXPECT_EQ(served_->domain(), "Zem");
}

// A peer that chatters instead of answering cannot stretch a call beyond its time limit.
TEST(TypedConnectionTimeLimit, StrayFramesDoNotExtendTheWait) {
    static Protocols protocols;
    std::array<int, 2> ends{};
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends.data()), 0);
    std::atomic<bool> done = false;
    std::thread chatter([&] {
        std::vector<uint8_t> frame;
        ZemFrame::encode(ZemFrameKind::Message, 0, 0, Value::emptyDictionary(), frame);
        // Chatters for 2.5 s at most, so that a call that waits as long as frames come fails instead of hanging.
        for (int i = 0; i < 125 && !done && write(ends[1], frame.data(), frame.size()) > 0; ++i)
            std::this_thread::sleep_for(std::chrono::milliseconds(20));
    });
    TypedConnection host(ends[0], BXInterface::interfaceWithProtocol(protocolNamed("TypedEcho")));
    const auto start = std::chrono::steady_clock::now();
    auto answer = host.call("echo", Value::array({Value::string("anyone?")}), std::chrono::milliseconds(200));
    const auto waited = std::chrono::steady_clock::now() - start;
    done = true;
    chatter.join();
    close(ends[1]);
    ASSERT_FALSE(answer.ok());
    EXPECT_EQ(answer.error().localizedDescription(), "no answer in time");
    EXPECT_LT(waited, std::chrono::seconds(2));
}

}  // namespace
}  // namespace bexil
