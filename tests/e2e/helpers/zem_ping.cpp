// A minimal Zem client for end-to-end tests: sends one request named by its first argument to the service named
// by its second (default com.quorvel.bexil.bxd) and prints the reply. Tests copy it into example bundles, so the
// daemon sees a real client executable inside an application.

#include <cstdio>
#include <future>

#include "base/EventLoop.h"
#include "base/SerialQueue.h"
#include "platform/zem/ZemConnection.h"

int main(int argc, char** argv) {
    using namespace bexil;
    const char* name = argc > 1 ? argv[1] : "ping";
    const char* service = argc > 2 ? argv[2] : "com.quorvel.bexil.bxd";
    EventLoop loop(1);
    SerialQueue queue("zem-ping", loop);
    auto connection = ZemConnection::createClient(service, queue);
    connection->setEventHandler([](const ZemConnection::Event&) {});
    connection->resume();
    std::promise<std::variant<Value, ZemError>> promise;
    connection->sendWithReply(Value::dictionary({{"request", Value::string(name)}, {"version", Value::uint64(3)}}),
                              queue, [&](const std::variant<Value, ZemError>& reply) { promise.set_value(reply); });
    auto future = promise.get_future();
    if (future.wait_for(std::chrono::seconds(10)) != std::future_status::ready) {
        fprintf(stderr, "zem_ping: no reply\n");
        return 2;
    }
    auto reply = future.get();
    connection->cancel();
    if (auto* error = std::get_if<ZemError>(&reply)) {
        fprintf(stderr, "zem_ping: %s\n", error->description().c_str());
        return 1;
    }
    printf("%s\n", std::get<Value>(reply).description().c_str());
    return 0;
}
