// A host for end-to-end tests that need hosts in processes of their own: for each argument "ready:UUID" or
// "launch:UUID", in order, sends that request and prints "CODE TEXT" of the reply (0 and nothing on success), one
// line each, after a first line with its own pid. Each request goes on its own connection, as separate programs'
// would; the grant of "ready" belongs to this process, whichever connection asked.

#include <unistd.h>

#include <cstdio>
#include <string>

#include "OneRequest.h"

int main(int argc, char** argv) {
    using namespace bexil;
    printf("%d\n", static_cast<int>(getpid()));
    for (int i = 1; i < argc; ++i) {
        std::string argument = argv[i];
        size_t colon = argument.find(':');
        std::optional<Uuid> uuid = colon == std::string::npos ? std::nullopt : Uuid::parse(argument.substr(colon + 1));
        if (!uuid) {
            fprintf(stderr, "host_client: expected ready:UUID or launch:UUID, not %s\n", argument.c_str());
            return 64;
        }
        std::optional<Value> reply =
            test::sendOneRequest("host_client", "com.quorvel.bexil.bxd",
                                 Value::dictionary({{"request", Value::string(argument.substr(0, colon))},
                                                    {"version", Value::uint64(3)},
                                                    {"uuids", Value::array({Value::uuid(*uuid)})}}));
        if (!reply) return 2;
        printf("%lld %s\n", static_cast<long long>(reply->get("errorcode").numberAsInt64().value_or(0)),
               std::string(reply->get("error").stringView()).c_str());
    }
    return 0;
}
