#pragma once

// The daemon's view of one connected peer: who it is (pid, executable, bundle, code-signing identity and its
// entitlements) and the bridge from its connection to the request queue. Made by the server for each accepted
// connection and owned by that connection (as its context) and by the client's pending transactions. Connection
// events run on the connection's queue; requestCount and the requests waiting behind a write are touched only on
// the request queue.

#include <sys/types.h>

#include <atomic>
#include <deque>
#include <memory>
#include <string>
#include <string_view>

#include "base/ActingAs.h"
#include "bexil/Value.h"
#include "platform/zem/ZemConnection.h"
#include "policy/HostAccessClient.h"

namespace bexil {

class BXBundle;
class BXDServer;
class CodeSigningIdentity;
class Transaction;

class BXDZemClient : public std::enable_shared_from_this<BXDZemClient>, public HostAccessClient {
  public:
    // Size of the buffer the executable path is read into; longer paths count as unknown.
    static constexpr size_t kExecutablePathBufferSize = 2048;

    // initWithConnection:server: builds and starts the client; the connection keeps it alive from then on.
    static std::shared_ptr<BXDZemClient> initWithConnectionServer(const std::shared_ptr<ZemConnection>& connection,
                                                                  BXDServer* server);

    // The peer is about to exit (the daemon is being stopped); only logged.
    void dying();
    // The connection is gone: releases the client's holds and stops accepting work. Runs its course once, whether
    // the connection reported the end or a request found the peer gone first.
    void dead();
    // True once dead() has begun: from then on the client's holds are being, or have been, released.
    bool isDead() const { return deathNoted_.load(std::memory_order_acquire); }
    // True once the peer has closed its connection, even before the connection's own queue has seen the end.
    bool peerHasHungUp() const;

    // The entitlement's value in the peer's signature, or a null Value.
    Value entitlementValueForKey(std::string_view key) const override;
    // True when the entitlement has a value that is not equal to false (so not false and not the number 0).
    bool hasEntitlement(std::string_view key) const override;

    std::string description() const;

    std::shared_ptr<ZemConnection> connection() const { return connection_.lock(); }
    BXDServer* server() const { return server_; }
    // The peer's pid, read from the connection every time; 0 once the connection no longer exists.
    pid_t pid() const override;
    // The peer's executable path; empty when it could not be found.
    const std::string& path() const override { return path_; }
    // The peer's user and group as the transport read them at connect time; none once the connection is gone.
    std::optional<UserIdentity> user() const;
    // The pidfd the transport took when the peer connected; null when there is none or the connection is gone.
    std::shared_ptr<const UniqueFd> pidfd() const override;
    // The bundle that contains the peer's executable; null when there is none.
    const std::shared_ptr<BXBundle>& bundle() const { return bundle_; }
    bool acceptWork() const { return acceptWork_.load(std::memory_order_acquire); }
    unsigned requestCount() const { return requestCount_; }
    // The connection's number in this run of bxd: never 0, never given to another connection.
    uint64_t serial() const { return serial_; }

    // A request of this client is waiting for the disk (see Transaction::holdReply): the client's later requests
    // wait for its reply, so that each of them still sees what the ones before it did. REQUIRES: on the request
    // queue, as does endWrite, which runs the requests that waited, in order.
    void beginWrite() { writing_ = true; }
    void endWrite();

  private:
    BXDZemClient(const std::shared_ptr<ZemConnection>& connection, BXDServer* server);
    void start();
    void handleEvent(const ZemConnection::Event& event);
    // Dispatches `transaction`, or keeps it for endWrite while a write of this client is pending.
    void run(const std::shared_ptr<Transaction>& transaction);

    std::weak_ptr<ZemConnection> connection_;
    BXDServer* server_;
    std::string path_;
    std::shared_ptr<BXBundle> bundle_;
    std::atomic<bool> acceptWork_{true};
    std::atomic<bool> deathNoted_{false};
    std::shared_ptr<const CodeSigningIdentity> codeSigningIdentity_;
    unsigned requestCount_ = 0;                         // request queue only
    bool writing_ = false;                              // request queue only
    std::deque<std::shared_ptr<Transaction>> waiting_;  // request queue only
    const uint64_t serial_;
};

}  // namespace bexil
