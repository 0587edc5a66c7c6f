#pragma once

// The errors of the Zem wire layer: protocol violations (connection-level events are ZemError, not these). Every
// error it returns is an Error in the domain "Zem" with one of the codes below and a message that says what was
// wrong and at which byte offset, ready to be logged by the caller. The codes are stable: docs/protocol.md lists
// them, and the connection layer decides on them (for example, to log an oversized frame by its limit) without
// parsing messages.

#include <string>
#include <string_view>
#include <utility>

#include "base/Error.h"

namespace bexil {

inline constexpr std::string_view kZemErrorDomain = "Zem";

enum class ZemErrorCode : int {
    Truncated = 1,            // the input ends inside a value
    BadTag = 2,               // a byte where a value starts is no known tag
    BadVarint = 3,            // a variable-length integer is overlong or exceeds 64 bits
    InvalidUtf8 = 4,          // a string or key is not well-formed UTF-8
    DuplicateKey = 5,         // a dictionary holds the same key twice
    TooDeep = 6,              // containers nest deeper than kMaxDepth
    CountExceedsInput = 7,    // a length or count promises more than the remaining input can hold
    TrailingBytes = 8,        // bytes follow the top-level value
    NotDictionary = 9,        // a frame's payload is not a dictionary
    BadMagic = 10,            // a frame header does not start with the magic byte
    UnsupportedVersion = 11,  // a frame header carries a format version this side does not speak
    UnknownKind = 12,         // a frame header names no known frame kind
    BadHeader = 13,           // reserved header bits set, or serials that break the rules of the kind
    FrameTooLarge = 14,       // a frame (announced or being encoded) exceeds kMaxFrameBytes
};

inline Error zemError(ZemErrorCode code, std::string message) {
    return Error(std::string(kZemErrorDomain), static_cast<int64_t>(code), std::move(message));
}

inline bool isZemError(const Error& error, ZemErrorCode code) {
    return error.domain() == kZemErrorDomain && error.code() == static_cast<int64_t>(code);
}

}  // namespace bexil
