#pragma once

// The protocol that Hello's bundle names under RZExtensionProtocol, declared alike by the plug-in and by its host:
// "greet" takes the name to greet and answers with the greeting and the pid of the plug-in instance that made it.

#include "bexil/Interface.h"

namespace greeting {

inline constexpr const char* kProtocol = "GreetingProvider";
inline constexpr const char* kGreet = "greet";

// Registers the protocol in this process (once; later calls find it registered).
inline bool declareProtocol() {
    auto& registry = bexil::BXProtocolRegistry::shared();
    if (registry.lookup(kProtocol)) return true;
    auto protocol = registry.createProtocol(kProtocol);
    if (!protocol) return registry.lookup(kProtocol) != nullptr;
    protocol->addMethod(kGreet, {"{BXString}"}, {"{BXString}", "{BXInteger}"});
    return protocol->registerProtocol().ok() || registry.lookup(kProtocol);
}

}  // namespace greeting
