// The listener keeps taking connections whatever the connection handler does: a handler that throws for one
// connection must not leave the service deaf to the next.

#include <gtest/gtest.h>

#include <atomic>
#include <future>
#include <stdexcept>

#include "TestSupport.h"
#include "base/EventLoop.h"
#include "base/SerialQueue.h"
#include "platform/zem/ZemConnection.h"
#include "platform/zem/ZemListener.h"

namespace bexil {
namespace {

constexpr const char* kService = "com.example.listener";

TEST(ZemListenerService, AConnectionHandlerThatThrowsDoesNotStopAccepting) {
    test::TempDir dir("zem-listener");
    test::ScopedEnv serviceDir("BX_SERVICE_DIR", dir.path().string());
    EventLoop::setUncaughtExceptionHandler([](std::string_view, std::exception_ptr) {});
    auto loop = std::make_unique<EventLoop>(1);
    SerialQueue queue("listener", *loop);
    auto listener = ZemListener::create(kService, queue);
    ASSERT_TRUE(listener.ok());
    std::atomic<int> accepted{0};
    std::vector<std::shared_ptr<ZemConnection>> peers;
    (*listener)->setConnectionHandler([&](std::shared_ptr<ZemConnection> peer) {
        if (accepted.fetch_add(1) == 0) throw std::runtime_error("the first connection's handler fails");
        std::weak_ptr<ZemConnection> weak = peer;
        peer->setEventHandler([weak](const ZemConnection::Event& event) {
            auto peer = weak.lock();
            if (const auto* message = std::get_if<ZemMessage>(&event); peer && message)
                peer->sendReply(*message, Value::dictionary({{"ok", Value::boolean(true)}}));
        });
        peer->resume();
        peers.push_back(peer);
    });
    (*listener)->resume();

    EventLoop clientLoop(1);
    SerialQueue clientQueue("client", clientLoop);
    auto ask = [&] {
        auto client = ZemConnection::createClient(kService, clientQueue);
        client->setEventHandler([](const ZemConnection::Event&) {});
        client->resume();
        auto promise = std::make_shared<std::promise<bool>>();
        client->sendWithReply(Value::dictionary({{"request", Value::string("ping")}}), clientQueue,
                              [promise](const std::variant<Value, ZemError>& reply) {
                                  promise->set_value(std::holds_alternative<Value>(reply));
                              });
        auto future = promise->get_future();
        bool answered = future.wait_for(std::chrono::seconds(5)) == std::future_status::ready && future.get();
        client->cancel();
        return answered;
    };
    ask();  // the connection whose handler throws: no answer expected
    EXPECT_TRUE(ask()) << "the service stopped accepting after a handler threw";
    EXPECT_GE(accepted.load(), 2);

    queue.sync([&] {
        (*listener)->cancel();
        for (auto& peer : peers) peer->cancel();
    });
    loop.reset();
    EventLoop::setUncaughtExceptionHandler(nullptr);
}

}  // namespace
}  // namespace bexil
