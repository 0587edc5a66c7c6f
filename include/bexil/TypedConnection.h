#pragma once

// Typed messages between a host and its plug-in over the socket that DaemonClient::launch hands the host (and that
// the plug-in finds as BEXIL_PLUGIN_FD). Both ends bind the socket to the plug-in's protocol; every message is
// checked against that interface on the sending side (an ill-typed call is refused and nothing is sent) and again
// on the receiving side (an ill-typed message gets an error reply and the connection carries on). The message form
// is in docs/interfaces.md: Zem frames whose dictionaries hold the "selector" and the "arguments" array, the frame's
// serial as the call id, and a reply with the answer's "arguments" or "errorcode" and "error".
//
// A host calls, a plug-in serves:
//
//     auto connection = bexil::TypedConnection::bind(reply.takeChannel(), protocolSpec);  // the plug-in's spec
//     auto greeting = (*connection)->call("greet", bexil::Value::array({bexil::Value::string("world")}));
//
//     // in the plug-in
//     connection->serve([](std::string_view selector, const bexil::Value& arguments) -> bexil::Result<bexil::Value> {
//         return bexil::Value::array({bexil::Value::string("Hello, " +
//         std::string(arguments.items()[0].stringView()))});
//     });
//
// A connection owns its socket. Its calls block the calling thread; use one connection from one thread at a time.

#include <chrono>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "bexil/Error.h"
#include "bexil/Interface.h"
#include "bexil/Value.h"

namespace bexil {

class TypedConnection {
  public:
    // Answers one call: the reply's arguments (an array), or the error to send back in their place.
    using Handler = std::function<Result<Value>(std::string_view selector, const Value& arguments)>;

    // Binds `socket` (a connected stream socket, owned from now on and closed on failure too) to the protocol that
    // `protocolSpec` names (a name or an array of names, as compoundProtocol takes them), refined per selector by
    // `interfaceSpecs` (selector -> spec string). Fails with code 12 when the protocol is not there, with code 6
    // for a malformed spec string.
    static Result<std::unique_ptr<TypedConnection>> bind(int socket, const Value& protocolSpec,
                                                         const std::map<std::string, std::string>& interfaceSpecs = {});
    // The same with an interface the caller built.
    TypedConnection(int socket, std::shared_ptr<const BXInterface> interface);
    ~TypedConnection();
    TypedConnection(const TypedConnection&) = delete;
    TypedConnection& operator=(const TypedConnection&) = delete;

    const BXInterface& interface() const;

    // Calls `selector` with `arguments` (an array) and waits at most `timeout` for the answer: the reply's arguments,
    // checked against the interface. Errors: code 4 for ill-typed arguments (nothing sent) or an ill-typed answer,
    // for a connection that ended or broke, or a timeout; the peer's own error when it refused the call.
    Result<Value> call(std::string_view selector, const Value& arguments,
                       std::chrono::milliseconds timeout = std::chrono::seconds(30));

    // Answers the peer's calls with `handler` until the peer closes its end (none) or the stream breaks (the error).
    // Calls that are ill-typed, or whose handler answers with ill-typed arguments, get an error reply instead.
    std::optional<Error> serve(const Handler& handler);

  private:
    struct Impl;
    std::unique_ptr<Impl> impl_;
};

}  // namespace bexil
