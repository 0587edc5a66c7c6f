#pragma once

// DiscoveryContinuation makes and checks the continuations of paged discovery: the opaque data a "match" reply
// carries when more pages follow, and which the next "match" hands back. A continuation names where the walk
// stopped (the last identifier served) and is bound to the connection that asked, to the request's rules and flags
// and to this run of bxd: an HMAC-SHA-256 under a key drawn at start covers all of it, so a client can neither
// forge a position nor use another client's continuation, and one from an earlier run is recognised by its run
// number and refused as expired. Owned by the server; immutable once built, so safe from any thread.

#include <sys/types.h>

#include <array>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <variant>

namespace bexil {

class DiscoveryContinuation {
  public:
    // The first byte of every continuation; a reader refuses any other.
    static constexpr uint8_t kFormat = 1;
    static constexpr size_t kKeyBytes = 32;
    static constexpr size_t kRunBytes = 8;
    static constexpr size_t kMacBytes = 16;
    // The longest position a continuation carries; an identifier is far shorter (it names a data container).
    static constexpr size_t kMaxPositionBytes = 0xffff;
    // format, run, position length (u16), MAC; the position's bytes come between length and MAC.
    static constexpr size_t kFixedBytes = 1 + kRunBytes + 2 + kMacBytes;

    // What a continuation is bound to besides its position.
    struct Binding {
        // The connection's number in this run (BXDZemClient::serial) and its peer.
        uint64_t connection = 0;
        uid_t uid = 0;
        pid_t pid = 0;
        uint64_t flags = 0;
        // The request's rules in the Zem encoding (canonical: equal rules encode equally); empty for none.
        std::string rules;
    };

    enum class Problem {
        // Not a continuation at all: wrong length, format or layout.
        Malformed,
        // Made by an earlier run of bxd.
        Expired,
        // Made by this run, but not for this connection, rules and flags, or altered since.
        Foreign,
    };

    // A fresh key and run number, from the system's random source.
    DiscoveryContinuation();
    // A given key and run number (tests and fuzzing).
    DiscoveryContinuation(const std::array<uint8_t, kKeyBytes>& key, const std::array<uint8_t, kRunBytes>& run);

    // The continuation that resumes after `position`. REQUIRES: position.size() <= kMaxPositionBytes.
    std::string issue(std::string_view position, const Binding& binding) const;
    // The position `bytes` names, if it is a continuation this run issued for `binding`. Reads untrusted bytes.
    std::variant<std::string, Problem> read(std::string_view bytes, const Binding& binding) const;

  private:
    std::array<uint8_t, kMacBytes> mac(std::string_view signedBytes, const Binding& binding) const;

    std::array<uint8_t, kKeyBytes> key_{};
    std::array<uint8_t, kRunBytes> run_{};
};

}  // namespace bexil
