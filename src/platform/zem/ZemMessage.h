#pragma once

// A received message: its dictionary body, the file descriptors passed with it, and the envelope needed to answer
// it. Immutable and cheap to copy (the body and the descriptors are shared); any queue may hold one. The
// descriptors stay open as long as some copy of the message lives.

#include <cstdint>
#include <memory>
#include <vector>

#include "base/UniqueFd.h"
#include "bexil/Value.h"

namespace bexil {

class ZemMessage {
  public:
    ZemMessage() = default;
    ZemMessage(Value body, uint64_t serial, bool expectsReply, std::vector<UniqueFd> descriptors = {})
        : body_(std::move(body)), serial_(serial), expectsReply_(expectsReply) {
        if (!descriptors.empty()) descriptors_ = std::make_shared<const std::vector<UniqueFd>>(std::move(descriptors));
    }

    // The dictionary that was sent.
    const Value& body() const { return body_; }
    // The sender's serial for this message; a reply names it.
    uint64_t serial() const { return serial_; }
    // True when the sender waits for exactly one reply to this message.
    bool expectsReply() const { return expectsReply_; }

    // The descriptors that came with the message, in the order sent; borrowed (dup one to keep it longer).
    size_t descriptorCount() const { return descriptors_ ? descriptors_->size() : 0; }
    int descriptor(size_t index) const { return index < descriptorCount() ? (*descriptors_)[index].get() : -1; }

    std::string description() const { return body_.description(); }

  private:
    Value body_;
    uint64_t serial_ = 0;
    bool expectsReply_ = false;
    std::shared_ptr<const std::vector<UniqueFd>> descriptors_;
};

}  // namespace bexil
