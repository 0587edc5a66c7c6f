// A minimal application of libbexil: asks bxd for its plug-ins and prints what it got.
// Build: make (uses pkg-config bexil). Exit status 0 when the daemon answered, whatever the answer.

#include <bexil/bexil.h>

#include <cstdio>

int main() {
    bexil::DaemonClient client;
    std::printf("libbexil %s, service %s\n", bexil::libraryVersion(), client.serviceName().c_str());
    auto reply = client.wait([&](auto done) { client.match(bexil::Value::emptyDictionary(), 0, done); },
                             std::chrono::seconds(10));
    if (reply.connectionFailed) {
        std::printf("bxd is not reachable: %s\n", reply.error->description().c_str());
        return 1;
    }
    if (!reply.ok()) {
        std::printf("match: code %lld: %s\n", static_cast<long long>(reply.error->code()),
                    reply.error->localizedDescription().value_or("").c_str());
        return 0;
    }
    auto matches = client.matches(reply);
    std::printf("match: %zu plug-ins\n", matches ? matches->count() : 0);
    for (const bexil::Value& form : matches ? matches->items() : std::span<const bexil::Value>())
        std::printf("  %s %s\n", form.get("identifier").stringView().data(), form.get("path").stringView().data());
    return 0;
}
