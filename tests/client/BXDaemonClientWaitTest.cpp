// Waiting for replies: a thread that waits synchronously may read its reply itself instead of having the client's
// queue hand it over. What must hold whichever way a reply travels: every waiter gets its own reply, callbacks keep
// their queue and their order, a late reply is never taken for the next one, a dropped or restarted service is
// noticed, and large messages cross intact. The service here is a listener on a private service directory.

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <future>
#include <mutex>
#include <optional>
#include <thread>
#include <vector>

#include "TestSupport.h"
#include "base/EventLoop.h"
#include "base/SerialQueue.h"
#include "client/BXDaemonClient.h"
#include "client/BXDaemonClientSync.h"
#include "platform/log/CaptureSink.h"
#include "platform/zem/ZemCodec.h"
#include "platform/zem/ZemListener.h"

namespace bexil {
namespace {

using Reply = BXDaemonClient::Reply;
using namespace std::chrono_literals;

// Flags that make the service misbehave; any other request is answered at once with {"echo": request}.
constexpr uint64_t kAnswerLate = 1000;   // answers after lateBy()
constexpr uint64_t kHangUp = 1001;       // closes the connection instead of answering
constexpr uint64_t kChatty = 1002;       // sends a one-way message, then the answer
constexpr uint64_t kNoteLater = 1003;    // answers, then sends a one-way message
constexpr uint64_t kEncodedEcho = 1004;  // answers with the echo encoded already, then sends a one-way message

class EchoService {
  public:
    EchoService() : queue_("echo", *loop_) {
        auto listener = ZemListener::create(BXDaemonClient::kDefaultServiceName, queue_);
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
                    received_.push_back(message->body().get("flags"));
                }
                Value answer = Value::dictionary({{"echo", message->body()}});
                const Value* flags = message->body().find("flags");
                uint64_t behaviour = flags != nullptr ? flags->numberAsUInt64().value_or(0) : 0;
                if (behaviour == kHangUp) return peer->cancel();
                if (behaviour == kAnswerLate)
                    return queue_.asyncAfter(lateBy_.load(),
                                             [peer, request = *message, answer] { peer->sendReply(request, answer); });
                if (behaviour == kChatty) {
                    // The message goes out first, the answer a little later, behind it.
                    peer->send(Value::dictionary({{"note", Value::string("unasked")}}));
                    return queue_.asyncAfter(20ms,
                                             [peer, request = *message, answer] { peer->sendReply(request, answer); });
                }
                if (behaviour == kEncodedEcho) {
                    // A large encoded reply leaves from its own buffer; the message queued behind it while the
                    // socket is still taking it must follow it whole.
                    Result<std::vector<uint8_t>> encoded = ZemCodec::encode(answer);
                    ASSERT_TRUE(encoded.ok());
                    peer->sendEncodedReply(*message, std::move(*encoded));
                    return peer->send(Value::dictionary({{"note", Value::string("behind the encoded reply")}}));
                }
                peer->sendReply(*message, answer);
                if (behaviour == kNoteLater) peer->send(Value::dictionary({{"note", Value::string("afterwards")}}));
            });
            peer->resume();
            std::lock_guard lock(mutex_);
            peers_.push_back(peer);
        });
        listener_->resume();
    }
    ~EchoService() {
        queue_.sync([this] {
            listener_->cancel();
            for (auto& peer : peers_) peer->cancel();
        });
        loop_.reset();
    }

    void setLateBy(std::chrono::milliseconds delay) { lateBy_.store(delay); }
    // Stops reading what the clients send, for `pause`; returns once no connection reads any more.
    void holdReading(std::chrono::milliseconds pause) {
        queue_.sync([this] {
            for (auto& peer : peers_) peer->suspend();
        });
        queue_.sync([] {});
        queue_.asyncAfter(pause, [this] {
            for (auto& peer : peers_) peer->resume();
        });
    }
    // The "flags" of every request received, in arrival order.
    std::vector<Value> received() {
        std::lock_guard lock(mutex_);
        return received_;
    }

  private:
    std::optional<EventLoop> loop_{std::in_place, 1};
    SerialQueue queue_;
    std::shared_ptr<ZemListener> listener_;
    std::atomic<std::chrono::milliseconds> lateBy_{200ms};
    std::mutex mutex_;
    std::vector<Value> received_;
    std::vector<std::shared_ptr<ZemConnection>> peers_;
};

class BXDaemonClientWaitTest : public ::testing::Test {
  protected:
    // A blocking "bulk" with `flags`; its reply, or none when it did not come within `timeout`.
    static std::optional<Reply> bulk(BXDaemonClient& client, uint64_t flags, std::chrono::milliseconds timeout = 10s) {
        return sendAndWait([&](auto handler) { client.bulkPluginsReply(flags, std::move(handler)); }, timeout);
    }
    // The flags that the service echoed, or none when the reply is not an echo.
    static std::optional<uint64_t> echoed(const std::optional<Reply>& reply) {
        if (!reply || !std::holds_alternative<Value>(*reply)) return std::nullopt;
        return std::get<Value>(*reply).get("echo").get("flags").numberAsUInt64();
    }

    test::TempDir dir_{"bexil-client-wait"};
    test::ScopedEnv serviceDir_{"BX_SERVICE_DIR", dir_.path().string()};
    std::optional<EchoService> service_{std::in_place};
};

// Guards the hand-over of the connection between waiting threads: many threads waiting on one client at once, each
// for many replies, every one of which must be the answer to its own request.
TEST_F(BXDaemonClientWaitTest, WaitersOnManyThreadsEachGetTheirOwnReply) {
    BXDaemonClient client;
    constexpr unsigned kThreads = 8, kRequests = 300;
    std::atomic<unsigned> wrong{0}, missing{0};
    std::vector<std::thread> threads;
    for (unsigned t = 0; t < kThreads; ++t)
        threads.emplace_back([&, t] {
            for (unsigned i = 0; i < kRequests; ++i) {
                uint64_t flags = t * 10000 + i;
                std::optional<Reply> reply = bulk(client, flags);
                if (!reply)
                    ++missing;
                else if (echoed(reply) != flags)
                    ++wrong;
            }
        });
    for (std::thread& thread : threads) thread.join();
    EXPECT_EQ(missing.load(), 0u);
    EXPECT_EQ(wrong.load(), 0u);
    EXPECT_EQ(service_->received().size(), kThreads * kRequests);
}

// Guards the callback contract beside waits on the same connection: callbacks run on the reply queue, one at a time,
// in the order of their requests, and a wait never overtakes requests its thread sent before it.
TEST_F(BXDaemonClientWaitTest, CallbacksKeepTheirQueueAndOrderAndWaitsDoNotOvertakeThem) {
    BXDaemonClient client;
    ASSERT_EQ(echoed(bulk(client, 1)), 1u);  // from here on the connection may be read by waiting threads
    std::mutex mutex;
    std::vector<uint64_t> order;
    std::atomic<bool> offQueue{false};
    std::promise<void> allDone;
    constexpr uint64_t kCallbacks = 200;
    std::vector<uint64_t> sent{1};
    for (uint64_t i = 0; i < kCallbacks; ++i) {
        uint64_t flags = 100 + i;
        client.bulkPluginsReply(flags, [&, flags](const Reply& reply) {
            if (!client.replyQueue().isCurrent()) offQueue = true;
            std::lock_guard lock(mutex);
            order.push_back(echoed(reply).value_or(0));
            if (flags == 100 + kCallbacks - 1) allDone.set_value();
        });
        sent.push_back(flags);
        if (i % 10 == 9) {
            ASSERT_EQ(echoed(bulk(client, 5000 + i)), 5000 + i);
            sent.push_back(5000 + i);
        }
    }
    ASSERT_EQ(allDone.get_future().wait_for(10s), std::future_status::ready);
    EXPECT_FALSE(offQueue.load());
    std::lock_guard lock(mutex);
    ASSERT_EQ(order.size(), kCallbacks);
    for (uint64_t i = 0; i < kCallbacks; ++i) EXPECT_EQ(order[i], 100 + i);
    std::vector<uint64_t> arrived;
    for (const Value& flags : service_->received()) arrived.push_back(flags.numberAsUInt64().value_or(0));
    EXPECT_EQ(arrived, sent);
}

// Guards a reply racing its waiter's time limit, on either side of it: the waiter gives up or gets it, and in both
// cases the next request gets its own reply, never the late one.
TEST_F(BXDaemonClientWaitTest, AReplyRacingTheTimeLimitIsNeverTakenForTheNextOne) {
    BXDaemonClient client;
    ASSERT_EQ(echoed(bulk(client, 1)), 1u);
    service_->setLateBy(20ms);
    unsigned gaveUp = 0;
    for (int timeout : {5, 15, 18, 19, 20, 21, 22, 25, 40, 1}) {
        std::optional<Reply> late = bulk(client, kAnswerLate, std::chrono::milliseconds(timeout));
        if (late)
            EXPECT_EQ(echoed(late), kAnswerLate);
        else
            ++gaveUp;
        uint64_t next = 7000 + static_cast<uint64_t>(timeout);
        EXPECT_EQ(echoed(bulk(client, next)), next) << "after a wait of " << timeout << " ms";
    }
    EXPECT_GT(gaveUp, 0u) << "a wait of 1 ms for a reply 20 ms late must give up";
}

// Guards a connection that ends under a waiting thread: it gets the connection error (code 4) rather than hanging,
// the failure is logged, and the client's next request reaches the service again.
TEST_F(BXDaemonClientWaitTest, AConnectionDroppedUnderAWaiterAnswersItAndTheNextRequestGoesThrough) {
    log::CaptureSink capture;
    BXDaemonClient client;
    ASSERT_EQ(echoed(bulk(client, 1)), 1u);
    for (int round = 0; round < 3; ++round) {
        std::optional<Reply> dropped = bulk(client, kHangUp);
        ASSERT_TRUE(dropped.has_value()) << "round " << round << ": a dropped connection must answer, not hang";
        ASSERT_TRUE(std::holds_alternative<ZemError>(*dropped));
        EXPECT_EQ(BXDaemonClient::errorInReply(*dropped)->code(), 4);
        EXPECT_EQ(echoed(bulk(client, 2 + round)), 2u + round) << "round " << round;
    }
    EXPECT_TRUE(capture.contains("Communications error: "));
}

// Guards a service that went away while the client sat idle between waits: the next request notices, connects to
// the service started in its place and is answered there.
TEST_F(BXDaemonClientWaitTest, AServiceRestartedBetweenWaitsServesTheNextRequest) {
    BXDaemonClient client;
    ASSERT_EQ(echoed(bulk(client, 1)), 1u);
    ASSERT_EQ(echoed(bulk(client, 2)), 2u);
    service_.reset();
    service_.emplace();
    EXPECT_EQ(echoed(bulk(client, 3)), 3u);
    EXPECT_EQ(service_->received().size(), 1u);
}

// Guards frames that are not the awaited reply: a one-way message of the service ahead of the reply goes to the
// connection's event handler (logged), and the reply still reaches its waiter.
TEST_F(BXDaemonClientWaitTest, AMessageAheadOfTheReplyGoesToTheEventHandler) {
    log::CaptureSink capture;
    BXDaemonClient client;
    ASSERT_EQ(echoed(bulk(client, 1)), 1u);
    EXPECT_EQ(echoed(bulk(client, kChatty)), kChatty);
    EXPECT_EQ(echoed(bulk(client, 2)), 2u);
    for (int i = 0; i < 100 && !capture.contains("unasked"); ++i) std::this_thread::sleep_for(10ms);
    EXPECT_TRUE(capture.contains("unasked"));
}

// Guards a client that expects messages it did not ask for: with its connection kept from parking, a message that
// comes after the last reply reaches the event handler without waiting for another request.
TEST_F(BXDaemonClientWaitTest, AConnectionKeptFromParkingDeliversMessagesBetweenRequests) {
    log::CaptureSink capture;
    BXDaemonClient client;
    client.bxd()->setParkable(false);
    ASSERT_EQ(echoed(bulk(client, 1)), 1u);
    EXPECT_EQ(echoed(bulk(client, kNoteLater)), kNoteLater);
    for (int i = 0; i < 200 && !capture.contains("afterwards"); ++i) std::this_thread::sleep_for(10ms);
    EXPECT_TRUE(capture.contains("afterwards"));
}

// Guards large messages both ways, at the sizes where reading changes its way (one read, the read chunk, the
// reader's first reservation, many reads): what comes back is byte for byte what went out, whether the client's
// queue or the waiting thread read it, and whether the service's reply was encoded into its outgoing buffer or left
// from a buffer of its own (encoded already, then followed by a message that must not cut into it).
TEST_F(BXDaemonClientWaitTest, LargeRequestsAndRepliesCrossIntact) {
    log::CaptureSink capture;
    BXDaemonClient client;
    for (size_t size : {size_t{0}, size_t{1}, size_t{65536 - 60}, size_t{65536}, size_t{65537}, size_t{131072 + 3},
                        size_t{1 << 20}, size_t{(1 << 20) + 13}, size_t{4 << 20}}) {
        std::vector<uint8_t> blob(size);
        for (size_t i = 0; i < size; ++i) blob[i] = static_cast<uint8_t>((i * 131 + size) >> 3);
        Value rules = Value::dictionary({{"blob", Value::data(blob)}});
        for (uint64_t flags : {uint64_t{9}, uint64_t{9}, kEncodedEcho, kEncodedEcho}) {
            auto reply = sendAndWait(
                [&](auto handler) { client.matchPlugInsFlagsReply(rules, flags, std::move(handler)); }, 10s);
            ASSERT_TRUE(reply && std::holds_alternative<Value>(*reply)) << size;
            Value back = std::get<Value>(*reply).get("echo").get("rules").get("blob");
            ASSERT_TRUE(back.isData()) << size;
            std::span<const uint8_t> bytes = back.dataBytes();
            EXPECT_TRUE(std::equal(bytes.begin(), bytes.end(), blob.begin(), blob.end())) << size;
        }
    }
    EXPECT_EQ(echoed(bulk(client, 2)), 2u);
    EXPECT_TRUE(capture.contains("behind the encoded reply"));
}

// Guards a large request that a waiting thread sends straight from the request's own bytes and cannot finish before
// its time limit (the service reads nothing for a while): the queue takes over the rest, which must be copied out
// of the request before the waiting thread lets go of it, and the reply still reaches the request's handler with
// the request byte for byte.
TEST_F(BXDaemonClientWaitTest, ALargeRequestCutShortByTheTimeLimitIsFinishedByTheQueue) {
    BXDaemonClient client;
    ASSERT_EQ(echoed(bulk(client, 1)), 1u);
    std::vector<uint8_t> blob(4 << 20);
    for (size_t i = 0; i < blob.size(); ++i) blob[i] = static_cast<uint8_t>((i * 151) >> 5);
    service_->holdReading(300ms);
    auto promise = std::make_shared<std::promise<Reply>>();
    {
        Value rules = Value::dictionary({{"blob", Value::data(blob)}});
        BXDaemonClient::waitOnCallingThread(
            [&] {
                client.matchPlugInsFlagsReply(
                    rules, 9,
                    BXDaemonClient::CallerThreadHandler{[promise](const Reply& reply) { promise->set_value(reply); }});
            },
            [] { return std::chrono::steady_clock::now() + 30ms; });
    }
    auto late = promise->get_future();
    ASSERT_EQ(late.wait_for(10s), std::future_status::ready);
    Reply reply = late.get();
    ASSERT_TRUE(std::holds_alternative<Value>(reply));
    Value back = std::get<Value>(reply).get("echo").get("rules").get("blob");
    ASSERT_TRUE(back.isData());
    EXPECT_TRUE(std::ranges::equal(back.dataBytes(), blob));
    EXPECT_EQ(echoed(bulk(client, 2)), 2u);
}

}  // namespace
}  // namespace bexil
