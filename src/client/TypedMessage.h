#pragma once

// The form of typed messages between a host and its plug-in (docs/interfaces.md), apart from any socket: the
// dictionaries a call and its reply travel as, and the reading of a received payload, which is untrusted bytes from
// the peer. Plain functions without state; any thread may call them.
//
//   call:  Request frame  {"selector": string, "arguments": array}
//   reply: Reply frame    {"arguments": array}  or  {"errorcode": uint64, "error": string}
//
// The call id is the Request frame's serial; the Reply frame names it in inReplyTo.

#include <cstdint>
#include <span>
#include <string>
#include <string_view>

#include "base/Error.h"
#include "bexil/Interface.h"
#include "bexil/Value.h"

namespace bexil::typed {

inline constexpr std::string_view kSelector = "selector";
inline constexpr std::string_view kArguments = "arguments";

Value callMessage(std::string_view selector, const Value& arguments);
Value replyMessage(const Value& arguments);
Value errorReply(const Error& error);

struct Call {
    std::string selector;
    Value arguments;
};

// The call in a Request frame's payload, checked against `interface`; the error (code 4) says what was wrong and is
// what the receiver sends back.
Result<Call> readCall(std::span<const uint8_t> payload, const BXInterface& interface);

// The answer in a Reply frame's payload to a call of `selector`: its arguments, checked against `interface`, or the
// error the peer sent (code 4 when the payload is no reply at all).
Result<Value> readReply(std::span<const uint8_t> payload, const BXInterface& interface, std::string_view selector);

}  // namespace bexil::typed
