#pragma once

// One request and its reply, for the small client programs the end-to-end tests run as separate processes.

#include <cstdio>
#include <future>
#include <optional>
#include <string>
#include <variant>

#include "base/EventLoop.h"
#include "base/SerialQueue.h"
#include "platform/zem/ZemConnection.h"

namespace bexil::test {

// Sends `request` to `service` and returns the reply; without one within ten seconds, or on a connection error,
// says why on standard error (after `program`) and returns nothing.
inline std::optional<Value> sendOneRequest(const char* program, const std::string& service, const Value& request) {
    EventLoop loop(1);
    SerialQueue queue(program, loop);
    auto connection = ZemConnection::createClient(service, queue);
    connection->setEventHandler([](const ZemConnection::Event&) {});
    connection->resume();
    auto promise = std::make_shared<std::promise<std::variant<Value, ZemError>>>();
    connection->sendWithReply(request, queue,
                              [promise](const std::variant<Value, ZemError>& reply) { promise->set_value(reply); });
    auto future = promise->get_future();
    bool answered = future.wait_for(std::chrono::seconds(10)) == std::future_status::ready;
    connection->cancel();
    if (!answered) {
        fprintf(stderr, "%s: no reply\n", program);
        return std::nullopt;
    }
    auto reply = future.get();
    if (auto* error = std::get_if<ZemError>(&reply)) {
        fprintf(stderr, "%s: %s\n", program, error->description().c_str());
        return std::nullopt;
    }
    return std::get<Value>(reply);
}

}  // namespace bexil::test
