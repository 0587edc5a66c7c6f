#pragma once

// The error of a failed request or operation, and the value-or-error type that operations return. An Error is an
// immutable value (domain, code, optional message) and may be copied and passed between threads freely.

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <variant>

namespace bexil {

// The domain of every error the system makes itself; its codes are those of protocol::ErrorCode (bexil/Protocol.h).
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

}  // namespace bexil
