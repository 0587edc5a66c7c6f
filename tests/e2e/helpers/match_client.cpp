// A discovery client for end-to-end tests: sends one "match" request without rules, with the flag word given as
// its first argument (default 0), and prints the identifier of every plug-in in the reply, one per line, or the
// daemon's error. Tests copy it into example bundles, so the daemon sees a real client inside an application.

#include <cstdlib>

#include "OneRequest.h"

int main(int argc, char** argv) {
    using namespace bexil;
    uint64_t flags = argc > 1 ? std::strtoull(argv[1], nullptr, 0) : 0;
    std::optional<Value> reply = test::sendOneRequest(
        "match_client", "com.quorvel.bexil.bxd",
        Value::dictionary(
            {{"request", Value::string("match")}, {"version", Value::uint64(3)}, {"flags", Value::uint64(flags)}}));
    if (!reply) return 2;
    if (int64_t code = reply->get("errorcode").numberAsInt64().value_or(0)) {
        printf("error %lld: %s\n", static_cast<long long>(code), std::string(reply->get("error").stringView()).c_str());
        return 1;
    }
    for (const Value& form : reply->get("matches").items())
        printf("%s\n", std::string(form.get("identifier").stringView()).c_str());
    return 0;
}
