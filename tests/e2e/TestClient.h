#pragma once

// A client connection for end-to-end tests: its own loop and queue, and a blocking round trip with a time limit.

#include <gtest/gtest.h>

#include <chrono>
#include <future>
#include <memory>
#include <string>
#include <variant>

#include "base/EventLoop.h"
#include "base/SerialQueue.h"
#include "platform/zem/ZemConnection.h"

namespace bexil::test {

class TestClient {
  public:
    using Reply = std::variant<Value, ZemError>;

    explicit TestClient(const std::string& service = "com.quorvel.bexil.bxd")
        : loop_(1), queue_("test-client", loop_), connection_(ZemConnection::createClient(service, queue_)) {
        connection_->setEventHandler([](const ZemConnection::Event&) {});
        connection_->resume();
    }
    ~TestClient() { connection_->cancel(); }

    // The reply, or the connection error in its place (ConnectionInvalid when none came within `timeout`).
    Reply roundTrip(const Value& message, std::chrono::seconds timeout = std::chrono::seconds(10)) {
        auto promise = std::make_shared<std::promise<Reply>>();
        auto future = promise->get_future();
        connection_->sendWithReply(message, queue_, [promise](const Reply& reply) { promise->set_value(reply); });
        if (future.wait_for(timeout) != std::future_status::ready) return ZemError(ZemError::Kind::ConnectionInvalid);
        return future.get();
    }
    // The reply dictionary; a connection error fails the test and gives a null Value.
    Value replyTo(const Value& message) {
        Reply reply = roundTrip(message);
        EXPECT_TRUE(std::holds_alternative<Value>(reply)) << "connection error instead of a reply";
        return std::holds_alternative<Value>(reply) ? std::get<Value>(reply) : Value();
    }
    ZemConnection& connection() { return *connection_; }

  private:
    EventLoop loop_;
    SerialQueue queue_;
    std::shared_ptr<ZemConnection> connection_;
};

}  // namespace bexil::test
