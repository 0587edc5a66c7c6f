#pragma once

// The daemon's preferences (domain "com.quorvel.bexil.userprefs"), read afresh on every use. Owned by the server;
// safe on any queue.

#include <string>

namespace bexil {

class BXDUserPrefs {
  public:
    static constexpr const char* kDomain = "com.quorvel.bexil.userprefs";

    BXDUserPrefs() = default;
    const char* domain() const { return kDomain; }
};

}  // namespace bexil
