#pragma once

// The connection-level errors that a Zem connection delivers in place of a message or a reply. A ZemError is a
// small immutable value; it never travels over the wire.

#include <string>

namespace bexil {

class ZemError {
  public:
    enum class Kind {
        // The peer is gone, or the connection was cancelled: nothing more will arrive.
        ConnectionInvalid,
        // Client side: the service went away; a new connection to it may succeed later.
        ConnectionInterrupted,
        // The daemon is being stopped (SIGTERM); the connection still works until it is closed.
        TerminationImminent,
        // This message was not sent: it cannot be encoded (a text that is not UTF-8, too deep, too large) or carries
        // too many descriptors. Only a reply handler gets it; the connection stays usable.
        MessageInvalid,
    };

    explicit ZemError(Kind kind) : kind_(kind) {}

    Kind kind() const { return kind_; }
    // "Connection invalid", "Connection interrupted", "Termination imminent", "Message invalid".
    std::string description() const;

    bool operator==(const ZemError&) const = default;

  private:
    Kind kind_;
};

}  // namespace bexil
