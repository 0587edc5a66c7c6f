// A client that places a hold and keeps it: sends "lock" for the plug-in bundle given as its argument, prints the
// reply's error code (0 when the hold is placed), and then waits, connection open, until it is killed.

#include <unistd.h>

#include <cstdio>
#include <future>

#include "base/EventLoop.h"
#include "base/SerialQueue.h"
#include "platform/zem/ZemConnection.h"

int main(int argc, char** argv) {
    using namespace bexil;
    if (argc != 2) return 64;
    EventLoop loop(1);
    SerialQueue queue("hold_client", loop);
    auto connection = ZemConnection::createClient("com.quorvel.bexil.bxd", queue);
    connection->setEventHandler([](const ZemConnection::Event&) {});
    connection->resume();
    std::promise<long long> code;
    connection->sendWithReply(Value::dictionary({{"request", Value::string("lock")},
                                                 {"version", Value::uint64(3)},
                                                 {"flags", Value::uint64(1)},
                                                 {"paths", Value::array({Value::string(argv[1])})}}),
                              queue, [&code](const std::variant<Value, ZemError>& reply) {
                                  const Value* answer = std::get_if<Value>(&reply);
                                  code.set_value(answer ? answer->get("errorcode").numberAsInt64().value_or(0) : -1);
                              });
    printf("%lld\n", code.get_future().get());
    fflush(stdout);
    for (;;) pause();
}
