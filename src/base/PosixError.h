#pragma once

// Errors made from errno values, one way for every layer: the code is the errno value and the message is what was
// being done, a colon and the system's text for the value ("cannot open /x: No such file or directory"). Pure
// functions; any thread.

#include <string>
#include <string_view>

#include "base/Error.h"

namespace bexil {

// The domain of errors whose code is an errno value.
inline constexpr std::string_view BXPosixErrorDomain = "POSIX";

// "<what>: <strerror(error)>".
std::string posixMessage(int error, std::string_view what);
// An error in BXPosixErrorDomain with `error` as its code and posixMessage as its message.
Error posixError(int error, std::string_view what);

}  // namespace bexil
