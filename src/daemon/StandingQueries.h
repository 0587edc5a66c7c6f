#pragma once

// What the server needs of the standing queries ("watch"), which live with the request handlers: a way to release
// every watch of a client that has gone, so that a client's death frees what it owned in one place, as its holds
// are. The server owns the one instance once the first watch has made it; used on the request queue only.

#include <cstddef>

namespace bexil {

class BXDZemClient;

class StandingQueries {
  public:
    virtual ~StandingQueries() = default;
    // Ends every watch of `client`; nothing more is sent for them. REQUIRES: on the request queue.
    virtual void releaseClient(const BXDZemClient& client) = 0;
    // The watches in force, over all clients.
    virtual size_t count() const = 0;
};

}  // namespace bexil
