#pragma once

// The listening end of a Zem service: accepts peer connections on `<service dir>/<name>` (or on the socket systemd
// passed for it) and hands each, suspended, to the connection handler on the listener's queue. It also turns
// SIGTERM into a termination-imminent event on every open peer connection, and counts keep-alive units for idle
// accounting. Created and controlled on one queue; counters may be read anywhere.

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <functional>
#include <memory>
#include <string>

#include "base/Error.h"

namespace bexil {

class SerialQueue;
class ZemConnection;

class ZemListener {
  public:
    using ConnectionHandler = std::function<void(std::shared_ptr<ZemConnection>)>;
    using ErrorHandler = std::function<void(const Error&)>;

    // Largest number of peer connections open at once; further ones are refused (and logged) until some close.
    static constexpr size_t kMaxConnections = 4096;
    // Largest number of connections of one user (uid), so that one user cannot lock every other client out.
    static constexpr size_t kMaxConnectionsPerUser = 256;
    // Connections below kMaxConnections that only root may take, so that administrators can always get in.
    static constexpr size_t kConnectionsReservedForRoot = 64;

    // How long a peer may keep a connection without a first complete frame, or with part of one, before it is
    // dropped (logged). A peer that has sent a frame may stay silent between frames for as long as it likes.
    static constexpr std::chrono::seconds kStalledConnectionTimeout{30};
    // Replies queued towards a peer past which its further requests are not read until it reads some: a client
    // that pipelines without reading is served as fast as it reads, and one that never reads is dropped once it
    // has not read for the stall time.
    static constexpr size_t kQueuedReplyBytes = 1024 * 1024;

    // The connection limits in force; the defaults are the constants above.
    struct Limits {
        size_t maxConnections = kMaxConnections;
        size_t maxConnectionsPerUser = kMaxConnectionsPerUser;
        size_t reservedForRoot = kConnectionsReservedForRoot;
        std::chrono::seconds stalledConnectionTimeout = kStalledConnectionTimeout;
        size_t queuedReplyBytes = kQueuedReplyBytes;
    };

    virtual ~ZemListener() = default;

    // Binds the service. A socket file left by a dead daemon is replaced; one that a live process still accepts on
    // is never taken over: that is an error naming the service. Each accepted connection carries the peer's
    // credentials (ZemPeerCredentials); who the peer is, is for the user of the listener to decide.
    // The listener starts suspended: nothing is accepted before resume().
    static Result<std::shared_ptr<ZemListener>> create(const std::string& serviceName, SerialQueue& queue);

    // $BX_SERVICE_DIR, else /run/bexil for root, else $XDG_RUNTIME_DIR/bexil.
    static std::filesystem::path serviceDirectory();
    static std::filesystem::path socketPathForService(const std::string& serviceName);

    // REQUIRES: before resume().
    virtual void setConnectionHandler(ConnectionHandler handler) = 0;
    // A connection over a limit is closed at accept, logged once until its count is below the limit again.
    // REQUIRES: before resume().
    virtual void setLimits(Limits limits) = 0;
    // Errors of the listening socket itself; they are never taken for a connection.
    virtual void setErrorHandler(ErrorHandler handler) = 0;
    // What happens after SIGTERM has been turned into termination-imminent events (default: the process exits).
    virtual void setTerminationHandler(std::function<void()> handler) = 0;
    virtual void resume() = 0;
    virtual void cancel() = 0;

    // Keep-alive units: while any is open the process is busy for the platform's idle accounting.
    virtual void keepAliveOpen() = 0;
    virtual void keepAliveClose() = 0;
    virtual uint64_t keepAliveCount() const = 0;

    virtual size_t connectionCount() const = 0;
    virtual const std::string& serviceName() const = 0;
    // True when the socket came from systemd socket activation rather than from bind().
    virtual bool activatedBySystemd() const = 0;
};

}  // namespace bexil
