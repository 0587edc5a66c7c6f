#pragma once

// The daemon's and the library's ways of making errors in the Bexil domain, on top of the public Error and Result
// (bexil/Error.h), and the exception that marks a broken invariant.

#include <exception>
#include <optional>
#include <stdexcept>
#include <string>
#include <string_view>
#include <utility>

#include "base/Format.h"
#include "bexil/Error.h"
#include "bexil/Protocol.h"

namespace bexil {

using protocol::ErrorCode;

// An error in the Bexil domain; with a message it carries it as its localized description, without one it has none.
// The code is one of ErrorCode; the plain number is for codes that arrive from elsewhere (a reply's "errorcode").
Error BXError(int code, std::optional<std::string_view> message);
inline Error BXError(ErrorCode code, std::optional<std::string_view> message) {
    return BXError(protocol::codeOf(code), message);
}

// The same, the message built from a printf-style format (see Format.h); a null format gives no message.
template <typename... Args>
Error BXErrorWithFormat(ErrorCode code, FormatString<std::type_identity_t<Args>...> format, Args&&... args) {
    if (format.text() == nullptr) return BXError(code, std::nullopt);
    return BXError(code, formatPrintf(format, std::forward<Args>(args)...));
}
inline Error BXErrorWithFormat(ErrorCode code, std::nullptr_t) { return BXError(code, std::nullopt); }

// A broken invariant (a registry answer of the wrong kind, a reply with a message but no code). The request
// boundary catches it, logs at fault level and answers code 4; nothing else should catch it.
class InternalInconsistency : public std::logic_error {
  public:
    using std::logic_error::logic_error;
};

// The message of an exception caught as a pointer: what() of a std::exception, else "unknown exception".
std::string exceptionMessage(const std::exception_ptr& exception);

}  // namespace bexil
