// A discovery client for end-to-end tests: sends one "match" request without rules, with the flag word given as
// its first argument (default 0), and prints the identifier of every plug-in in the reply, one per line, or the
// daemon's error. Tests copy it into example bundles, so the daemon sees a real client inside an application.

#include <cstdio>
#include <cstdlib>
#include <future>

#include "base/EventLoop.h"
#include "base/SerialQueue.h"
#include "platform/zem/ZemConnection.h"

int main(int argc, char** argv) {
    using namespace bexil;
    uint64_t flags = argc > 1 ? std::strtoull(argv[1], nullptr, 0) : 0;
    EventLoop loop(1);
    SerialQueue queue("match-client", loop);
    auto connection = ZemConnection::createClient("com.quorvel.bexil.bxd", queue);
    connection->setEventHandler([](const ZemConnection::Event&) {});
    connection->resume();
    std::promise<std::variant<Value, ZemError>> promise;
    Value request = Value::dictionary(
        {{"request", Value::string("match")}, {"version", Value::uint64(3)}, {"flags", Value::uint64(flags)}});
    connection->sendWithReply(request, queue,
                              [&](const std::variant<Value, ZemError>& reply) { promise.set_value(reply); });
    auto future = promise.get_future();
    if (future.wait_for(std::chrono::seconds(10)) != std::future_status::ready) {
        fprintf(stderr, "match_client: no reply\n");
        return 2;
    }
    auto reply = future.get();
    connection->cancel();
    if (auto* error = std::get_if<ZemError>(&reply)) {
        fprintf(stderr, "match_client: %s\n", error->description().c_str());
        return 1;
    }
    const Value& message = std::get<Value>(reply);
    if (int64_t code = message.get("errorcode").numberAsInt64().value_or(0)) {
        printf("error %lld: %s\n", static_cast<long long>(code),
               std::string(message.get("error").stringView()).c_str());
        return 1;
    }
    for (const Value& form : message.get("matches").items())
        printf("%s\n", std::string(form.get("identifier").stringView()).c_str());
    return 0;
}
