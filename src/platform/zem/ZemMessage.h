#pragma once

// A received message: its dictionary body plus the envelope needed to answer it. Immutable and cheap to copy
// (the body is a shared Value); any queue may hold one.

#include <cstdint>

#include "base/Value.h"

namespace bexil {

class ZemMessage {
  public:
    ZemMessage() = default;
    ZemMessage(Value body, uint64_t serial, bool expectsReply)
        : body_(std::move(body)), serial_(serial), expectsReply_(expectsReply) {}

    // The dictionary that was sent.
    const Value& body() const { return body_; }
    // The sender's serial for this message; a reply names it.
    uint64_t serial() const { return serial_; }
    // True when the sender waits for exactly one reply to this message.
    bool expectsReply() const { return expectsReply_; }

    std::string description() const { return body_.description(); }

  private:
    Value body_;
    uint64_t serial_ = 0;
    bool expectsReply_ = false;
};

}  // namespace bexil
