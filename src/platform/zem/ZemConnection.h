#pragma once

// One end of a Zem connection: a Unix-domain stream socket carrying length-prefixed frames, each holding one
// dictionary. Incoming messages and connection errors are delivered, one at a time and in order, to the event
// handler on the connection's serial queue; sends may be made from any thread. The connection object is shared:
// its pending I/O keeps it alive while it is open, and the finalizer runs once it is closed and unreferenced.
// A client connection is made with createClient; peer connections come from a ZemListener.

#include <sys/types.h>

#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <variant>
#include <vector>

#include "base/UniqueFd.h"
#include "bexil/Value.h"
#include "platform/zem/ZemError.h"
#include "platform/zem/ZemMessage.h"
#include "platform/zem/ZemPeerCredentials.h"

namespace bexil {

class SerialQueue;

class ZemConnection {
  public:
    using Event = std::variant<ZemMessage, ZemError>;
    using EventHandler = std::function<void(const Event&)>;
    // The reply's dictionary, or the connection error that took its place; called exactly once.
    using ReplyHandler = std::function<void(const std::variant<Value, ZemError>&)>;
    // The same with the whole reply message, for requests whose reply passes file descriptors.
    using MessageReplyHandler = std::function<void(const std::variant<ZemMessage, ZemError>&)>;
    using Finalizer = std::function<void(std::shared_ptr<void> context)>;

    virtual ~ZemConnection() = default;

    // A client connection to `<service dir>/<serviceName>` delivering on `queue` (which must outlive it). It starts
    // suspended; nothing is sent until resume(). When the service is not there, the connection ends with
    // ConnectionInvalid and every request sent on it is answered with that error.
    static std::shared_ptr<ZemConnection> createClient(const std::string& serviceName, SerialQueue& queue);

    // REQUIRES: before resume().
    virtual void setEventHandler(EventHandler handler) = 0;
    virtual void setContext(std::shared_ptr<void> context) = 0;
    virtual std::shared_ptr<void> context() const = 0;
    virtual void setFinalizer(Finalizer finalizer) = 0;

    // Starts or restarts delivery of events; suspend() holds them (and stops reading) until the next resume().
    virtual void resume() = 0;
    virtual void suspend() = 0;
    // Closes the connection: the handler gets ConnectionInvalid once, pending replies get it too.
    virtual void cancel() = 0;

    // One-way message.
    virtual void send(const Value& message) = 0;
    // The answer to `request`, which the peer receives as the reply it waits for.
    virtual void sendReply(const ZemMessage& request, const Value& reply) = 0;
    // The same, passing `descriptors` (at most ZemFrame::kMaxDescriptorsPerFrame) with it; they are closed here
    // once sent, or when the connection ends first.
    virtual void sendReplyWithDescriptors(const ZemMessage& request, const Value& reply,
                                          std::vector<UniqueFd> descriptors) = 0;
    // The answer to `request` already encoded: `payload` is one dictionary as ZemCodec writes it. The connection
    // only frames it. This one decodes it and sends it as sendReply would.
    virtual void sendEncodedReply(const ZemMessage& request, std::vector<uint8_t> payload);
    // A message that expects one reply; `handler` runs on `replyQueue` with the reply or the error in its place.
    virtual void sendWithReply(const Value& message, SerialQueue& replyQueue, ReplyHandler handler) = 0;
    // The same, handing over the whole reply message with any descriptors it carries.
    virtual void sendWithMessageReply(const Value& message, SerialQueue& replyQueue, MessageReplyHandler handler) = 0;
    // Client side, for a thread that would otherwise only block until the reply has come: sends `message` and reads
    // its reply on the calling thread, with no trip through the connection's queue, when the connection is idle
    // (nothing of it in flight or queued, as after an earlier exchange of this kind). Returns false, having sent
    // nothing and kept `handler`, when it is not; the caller then sends as usual and later calls may succeed. When
    // it returns true `handler` has run here with the reply or the error in its place, or, when `deadline` came
    // first, it has been handed over to run on `replyQueue` once the reply comes, as sendWithMessageReply's would.
    // `handler` runs no application code (the library's own hand-back to the waiting thread).
    // Client side: whether the connection may stop reading while it is idle, so that waiting threads read their own
    // replies (exchangeOnCallingThread). True by default. A client that expects messages it did not ask for turns it
    // off; they then reach the event handler as they come, not only once the next request is made.
    virtual void setParkable(bool parkable) { (void)parkable; }
    virtual bool exchangeOnCallingThread(const Value& message, SerialQueue& replyQueue, MessageReplyHandler& handler,
                                         std::chrono::steady_clock::time_point deadline) {
        (void)message, (void)replyQueue, (void)handler, (void)deadline;
        return false;
    }

    // The peer's credentials taken when the connection was accepted (peer connections) or made (client side:
    // the service's). A pid of 0 when they are unknown.
    virtual pid_t peerPid() const = 0;
    virtual uid_t peerUid() const = 0;
    virtual gid_t peerGid() const = 0;
    // True once the peer has closed its end or the connection is closed, even while frames it sent before that are
    // still waiting to be handled: the daemon runs no request of a peer that is gone. Safe from any thread.
    virtual bool peerHasHungUp() const = 0;
    // Bytes of frames this side has been handed to send (replies and messages) that the socket has not taken yet,
    // messages still on their way to the connection's queue included. Safe from any thread; a snapshot.
    virtual size_t queuedBytes() const = 0;
    // What the kernel said about the peer at accept (peer connections only; empty with a failure on client ones).
    virtual const ZemPeerCredentials& peerCredentials() const = 0;

    virtual const std::string& serviceName() const = 0;
    virtual std::string description() const = 0;
};

}  // namespace bexil
