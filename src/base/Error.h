#pragma once

// Error objects of the system and the small value-or-error type that operations return. An Error is an immutable
// value (domain, code, optional message) and may be copied and passed between queues freely.

#include <cstdint>
#include <exception>
#include <optional>
#include <stdexcept>
#include <string>
#include <string_view>
#include <utility>
#include <variant>

#include "base/Format.h"
#include "bexil/Protocol.h"

namespace bexil {

// The domain of every error the system makes itself.
inline constexpr std::string_view BXErrorDomain = "Bexil";

class Error {
  public:
    Error(std::string domain, int64_t code, std::optional<std::string> message = std::nullopt)
        : domain_(std::move(domain)), code_(code), message_(std::move(message)) {}

    const std::string& domain() const { return domain_; }
    int64_t code() const { return code_; }
    // The message given when the error was made; none when it was made without one.
    const std::optional<std::string>& localizedDescription() const { return message_; }
    bool isBexil() const { return domain_ == BXErrorDomain; }

    // "Error Domain=Bexil Code=9 \"absolute path required: x\"" (the quoted part only when there is a message).
    std::string description() const;

    bool operator==(const Error&) const = default;

  private:
    std::string domain_;
    int64_t code_;
    std::optional<std::string> message_;
};

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

// A value or the error that prevented it. Expected failures travel this way, never as exceptions.
template <typename T>
class Result {
  public:
    Result(T value) : v_(std::move(value)) {}
    Result(Error error) : v_(std::move(error)) {}

    bool ok() const { return v_.index() == 0; }
    explicit operator bool() const { return ok(); }
    T& value() & { return std::get<0>(v_); }
    const T& value() const& { return std::get<0>(v_); }
    T&& value() && { return std::get<0>(std::move(v_)); }
    const Error& error() const { return std::get<1>(v_); }
    T* operator->() { return &value(); }
    const T* operator->() const { return &value(); }
    T& operator*() & { return value(); }
    const T& operator*() const& { return value(); }

  private:
    std::variant<T, Error> v_;
};

// A broken invariant (a registry answer of the wrong kind, a reply with a message but no code). The request
// boundary catches it, logs at fault level and answers code 4; nothing else should catch it.
class InternalInconsistency : public std::logic_error {
  public:
    using std::logic_error::logic_error;
};

// The message of an exception caught as a pointer: what() of a std::exception, else "unknown exception".
std::string exceptionMessage(const std::exception_ptr& exception);

}  // namespace bexil
