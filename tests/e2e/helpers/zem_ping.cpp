// A minimal Zem client for end-to-end tests: sends one request named by its first argument to the service named
// by its second (default com.quorvel.bexil.bxd) and prints the reply.

#include "OneRequest.h"

int main(int argc, char** argv) {
    using namespace bexil;
    const char* name = argc > 1 ? argv[1] : "ping";
    const char* service = argc > 2 ? argv[2] : "com.quorvel.bexil.bxd";
    std::optional<Value> reply = test::sendOneRequest(
        "zem_ping", service, Value::dictionary({{"request", Value::string(name)}, {"version", Value::uint64(3)}}));
    if (!reply) return 1;
    printf("%s\n", reply->description().c_str());
    return 0;
}
