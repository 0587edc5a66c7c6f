// An example host of the Hello plug-in: makes it ready for this process, launches it, binds the socket bxd hands
// over to the protocol that the plug-in's bundle names, and greets each name on the command line with a typed call.
//
//   greeting-host 2F1C...-UUID world again
//
// It uses the public client library only (bexil/bexil.h), as an application would.

#include <cstdio>
#include <string>

#include "GreetingProtocol.h"
#include "bexil/bexil.h"

int main(int argc, char** argv) {
    if (argc < 3) {
        std::fprintf(stderr, "usage: greeting-host PLUGIN-UUID NAME...\n");
        return 64;
    }
    std::optional<bexil::Uuid> plugIn = bexil::Uuid::parse(argv[1]);
    if (!plugIn) {
        std::fprintf(stderr, "greeting-host: not a UUID: %s\n", argv[1]);
        return 64;
    }
    greeting::declareProtocol();
    bexil::DaemonClient daemon;
    auto ready = daemon.wait([&](auto done) { daemon.ready({*plugIn}, done); });
    if (!ready.ok()) {
        std::fprintf(stderr, "greeting-host: ready: %s\n", ready.error->description().c_str());
        return 1;
    }
    auto launched = daemon.wait([&](auto done) { daemon.launch(*plugIn, done); });
    if (!launched.ok() || launched.channel() < 0) {
        std::fprintf(stderr, "greeting-host: launch: %s\n",
                     launched.error ? launched.error->description().c_str() : "no socket to the plug-in");
        return 1;
    }
    // The protocol the plug-in's bundle names, as its record's protocolSpec reads it.
    bexil::Value info = launched.message.get(bexil::protocol::key::kBundleInfo);
    bexil::Value protocolSpec = info.get("RZExtension").get("RZExtensionProtocol");
    auto connection = bexil::TypedConnection::bind(launched.takeChannel(), protocolSpec);
    if (!connection) {
        std::fprintf(stderr, "greeting-host: %s\n", connection.error().description().c_str());
        return 1;
    }
    for (int i = 2; i < argc; ++i) {
        auto answer = (*connection)->call(greeting::kGreet, bexil::Value::array({bexil::Value::string(argv[i])}));
        if (!answer) {
            std::fprintf(stderr, "greeting-host: greet: %s\n", answer.error().description().c_str());
            return 1;
        }
        std::printf("%s\n", std::string(answer->items()[0].stringView()).c_str());
    }
    return 0;
}
