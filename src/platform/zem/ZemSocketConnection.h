#pragma once

// INTERNAL to the IPC layer: the Unix-socket implementation of ZemConnection. Every piece of its state is touched
// on its queue only (the strand of the connection's SerialQueue): reading, cutting frames, decoding, delivering
// events, encoding and writing. Sends from other threads are posted there first. The one exception is a client
// connection lent to a waiting thread (exchangeOnCallingThread): that thread then owns the I/O state alone, and the
// queue keeps its hands off until it is given back (Owner in the class). Includes Asio, so only .cpp files
// of src/platform/zem include it.

#include <asio.hpp>
#include <atomic>
#include <chrono>
#include <deque>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "base/SerialQueue.h"
#include "platform/zem/ZemConnection.h"
#include "platform/zem/ZemFrameReader.h"

namespace bexil {

class ZemSocketConnection final : public ZemConnection, public std::enable_shared_from_this<ZemSocketConnection> {
  public:
    using Socket = asio::local::stream_protocol::socket;

    // Bytes of replies and messages queued towards one peer that has not read them yet; past this the peer is
    // taken to have stopped reading and is disconnected.
    static constexpr size_t kMaxQueuedBytes = 64 * 1024 * 1024;
    // Size of one read from the socket.
    static constexpr size_t kReadChunkBytes = 64 * 1024;
    // Strings and data of at least this many bytes in a request that a waiting thread sends itself go to the socket
    // straight from the request (a gathering send), not copied into the outgoing buffer first.
    static constexpr size_t kGatherMinimum = 16 * 1024;
    // Encoded payloads of at least this many bytes (a large discovery's reply) go to the socket from their own
    // buffer when nothing is queued before them, instead of being copied into the outgoing buffer.
    static constexpr size_t kInPlaceMinimum = 64 * 1024;
    // Reads tried at once before waiting for the socket to become readable: enough for a burst of pipelined
    // requests, few enough that one peer cannot keep the loop to itself.
    static constexpr int kReadsPerTurn = 4;
    // Descriptors received ahead of the frames that announce them; a peer that sends more is violating the protocol.
    static constexpr size_t kMaxPendingDescriptors = 16;
    // Overrides ZemListener::kStalledConnectionTimeout for connections accepted from now on.
    static void setStalledConnectionTimeout(std::chrono::seconds timeout);
    // Overrides ZemListener::kQueuedReplyBytes, the replies queued towards a peer past which its requests are left
    // unread, for every connection from now on.
    static void setReadPauseBytes(size_t bytes);

    enum class Side { Peer, Client };

    // A peer connection around an accepted socket, with the peer's credentials read at accept.
    ZemSocketConnection(Socket socket, SerialQueue queue, std::string serviceName, ZemPeerCredentials peer);
    // A client connection, not yet connected.
    ZemSocketConnection(SerialQueue queue, std::string serviceName);
    ~ZemSocketConnection() override;

    // Called once when the connection ends (listener bookkeeping).
    void setClosedCallback(std::function<void()> callback) { closedCallback_ = std::move(callback); }
    // Delivers TerminationImminent to the event handler (posted to the connection's queue).
    void deliverTerminationImminent();

    void setEventHandler(EventHandler handler) override;
    void setContext(std::shared_ptr<void> context) override;
    std::shared_ptr<void> context() const override;
    void setFinalizer(Finalizer finalizer) override;
    void resume() override;
    void suspend() override;
    void cancel() override;
    void send(const Value& message) override;
    void sendReply(const ZemMessage& request, const Value& reply) override;
    void sendReplyWithDescriptors(const ZemMessage& request, const Value& reply,
                                  std::vector<UniqueFd> descriptors) override;
    void sendEncodedReply(const ZemMessage& request, std::vector<uint8_t> payload) override;
    void sendWithReply(const Value& message, SerialQueue& replyQueue, ReplyHandler handler) override;
    void sendWithMessageReply(const Value& message, SerialQueue& replyQueue, MessageReplyHandler handler) override;
    void setParkable(bool parkable) override;
    bool exchangeOnCallingThread(const Value& message, SerialQueue& replyQueue, MessageReplyHandler& handler,
                                 std::chrono::steady_clock::time_point deadline) override;
    pid_t peerPid() const override { return pid_.load(); }
    uid_t peerUid() const override { return uid_.load(); }
    gid_t peerGid() const override { return gid_.load(); }
    bool peerHasHungUp() const override;
    const ZemPeerCredentials& peerCredentials() const override { return peer_; }
    size_t queuedBytes() const override { return buffered_.load() + postedBytes_.load(); }
    const std::string& serviceName() const override { return serviceName_; }
    std::string description() const override;

  private:
    struct PendingReply {
        SerialQueue queue;
        MessageReplyHandler handler;
    };
    // Descriptors to send with the frame that starts at `offset` in outgoing_.
    struct Attachment {
        size_t offset;
        std::vector<UniqueFd> descriptors;
    };
    enum class State { Idle, Open, Interrupted, Closed };
    // Who does the I/O of a client connection. Loop: the queue, with the socket in the loop's reactor. Parked: nobody;
    // the connection is idle and its socket out of the reactor, so that data arriving on it wakes no loop thread.
    // Caller: one thread in exchangeOnCallingThread, which then owns every piece of I/O state (the socket, the
    // reader, the buffers, the serials). Returning: nobody, but the queue must take the socket back before anyone
    // else uses it (a caller left it work). Peer connections stay with the loop.
    enum class Owner { Loop, Parked, Caller, Returning };
    // How a caller leaves the connection: Idle as it found it, or with work for the queue.
    struct HandBack {
        std::optional<std::pair<uint64_t, PendingReply>> adopted;  // its request, still waiting for the reply
        std::optional<ZemError::Kind> broken;                      // the stream ended or broke under it
        bool readFirst = false;                                    // something came while the connection was parked
    };

    // All of the following run on queue_.
    void start();
    void resumeOnQueue();
    bool connectClient();
    void readMore();
    // Client side, when the connection has nothing in flight and a caller has asked for it: takes the socket out
    // of the reactor (Owner::Parked). True when it did.
    bool parkIfIdle();
    // Makes the queue read the socket again if it is parked.
    void unpark();
    enum class Reclaim { Owned, Reclaimed, Deferred };
    // Client side: makes the queue the socket's owner again before it touches the I/O state. Deferred while a caller
    // is in an exchange or has left work: `makeRetry()` then makes the block that does the work again on the queue once
    // the caller's work is done.
    template <class MakeRetry>
    Reclaim takeSocketBack(MakeRetry&& makeRetry);
    // Runs on the queue after a caller left work: adopts its unanswered request, handles the frames it read that
    // were not its reply, reads on, or ends the connection.
    void finishHandBack(HandBack work);
    // Puts the parked socket back into the reactor. REQUIRES: ownerMutex_ held, the socket parked.
    void reclaimLocked();
    // The caller's side of the hand-over (any thread but the queue's, owner_ == Caller).
    void handBack(HandBack work);
    // Waits on the calling thread until `fd` is ready for `events`; false once `deadline` has passed.
    static bool pollUntil(int fd, short events, std::chrono::steady_clock::time_point deadline);
    // One recvmsg: the bytes read (0 at the end of the stream) or -1 with errno. The bytes go to reader_,
    // descriptors to receivedFds_.
    ssize_t receive();
    // The recvmsg behind receive() on `fd`; sets `overflow` when the peer passed more descriptors than allowed (the
    // bytes then stay out of reader_).
    ssize_t receiveInto(int fd, bool& overflow);
    // Handles the frames that reader_ has completed. False when the connection ended on the way.
    bool consume();
    // The peer closed its end, or the socket failed.
    void endOfStream();
    // Peer side: arms the stall timer while no frame has come yet, part of one waits, or reading is paused for
    // replies the peer does not read; cancels it otherwise.
    void watchStall();
    void handleFrame(ZemFrame frame);
    // Handles the frames set aside in `frames` (emptied first, since handling may set more aside), in order, while
    // the connection stays open.
    void handleSetAside(std::vector<ZemFrame>& frames);
    // What a frame carries: a dictionary to encode, or one encoded already.
    struct Payload {
        Payload(const Value& dictionary) : value(dictionary) {}  // NOLINT(google-explicit-constructor)
        explicit Payload(std::shared_ptr<const std::vector<uint8_t>> bytes) : encoded(std::move(bytes)) {}
        Value value;
        std::shared_ptr<const std::vector<uint8_t>> encoded;
    };
    void enqueueFrame(ZemFrameKind kind, uint64_t inReplyTo, const Payload& payload,
                      std::optional<PendingReply> pending, std::vector<UniqueFd> descriptors = {});
    // enqueueFrame once the queue owns the socket.
    void enqueueOwnedFrame(ZemFrameKind kind, uint64_t inReplyTo, const Payload& payload,
                           std::optional<PendingReply> pending, std::vector<UniqueFd> descriptors);
    // The bytes of replies and requests this side still has to write: outgoing_ and what the write in flight has
    // not written. REQUIRES: on the connection's queue.
    size_t queuedBytesHere() const {
        return outgoing_.size() + writing_.size() - writtenAlready_ +
               (writingPayload_ ? writingPayload_->size() - payloadWrittenAlready_ : 0);
    }
    // Sends a frame whose large encoded payload nothing queued precedes from the payload's own buffer (its header
    // goes in outgoing_); false, having done nothing, when it must be copied into outgoing_ instead.
    // `pending`, when it is sent so, is taken before the send, which may fail it.
    bool sendInPlace(ZemFrameKind kind, uint64_t serial, uint64_t inReplyTo, const Payload& payload,
                     std::optional<PendingReply>& pending);
    // Writes what the socket takes now and notes what remains for queuedBytes.
    void writeMore();
    void writeMoreNow();
    // writeMore's path while descriptors wait in outgoing_: every piece is sent with the descriptors of the frame
    // it starts, and never runs into the next frame that carries some.
    void writeWithAttachments();
    // Drops the first `bytes` of outgoing_, keeping the attachments' offsets right.
    void dropSent(size_t bytes);
    void onWritten(const asio::error_code& error, size_t bytes);
    // Reads again once the replies a paused peer had not read are mostly gone.
    void resumeReadingIfDrained();
    // Ends the connection because of `why` (logged when it is a protocol violation or a limit).
    void close(ZemError::Kind kind);
    void failPendingReplies(ZemError::Kind kind);
    // Answers one request with the error that took its reply's place, on the request's reply queue.
    static void answerWithError(PendingReply& pending, ZemError::Kind kind);
    void deliver(const Event& event);

    const Side side_;
    SerialQueue queue_;
    Socket socket_;
    const std::string serviceName_;
    const ZemPeerCredentials peer_;
    std::atomic<pid_t> pid_{0};
    std::atomic<uid_t> uid_{static_cast<uid_t>(-1)};
    std::atomic<gid_t> gid_{static_cast<gid_t>(-1)};

    EventHandler handler_;
    std::shared_ptr<void> context_;
    Finalizer finalizer_;
    std::function<void()> closedCallback_;

    State state_ = State::Idle;
    bool suspended_ = true;
    bool reading_ = false;
    ZemFrameReader reader_;
    std::vector<uint8_t> readBuffer_;
    ZemBytes outgoing_;          // frames waiting for the write in flight to finish
    ZemBytes writing_;           // the frames of the write in flight
    size_t writtenAlready_ = 0;  // bytes of writing_ the socket took before the write was started
    // The payload written after writing_ by the write in flight (sendInPlace), and how much of it had gone before.
    std::shared_ptr<const std::vector<uint8_t>> writingPayload_;
    size_t payloadWrittenAlready_ = 0;
    std::deque<Attachment> attachments_;  // in the order of their offsets in outgoing_
    std::deque<UniqueFd> receivedFds_;    // received, not yet claimed by a frame
    bool writeInFlight_ = false;
    // queuedBytesHere(), for queuedBytes on other threads; and the encoded size of the messages
    // handed to send() whose frames are not in outgoing_ yet.
    std::atomic<size_t> buffered_{0};
    std::atomic<size_t> postedBytes_{0};
    asio::steady_timer stallTimer_;
    bool stallArmed_ = false;
    bool framed_ = false;      // a complete frame has arrived
    bool readPaused_ = false;  // reading stopped until the peer reads its replies
    unsigned delivering_ = 0;  // depth of event handler calls in progress on the stack
    uint64_t nextSerial_ = 1;
    std::map<uint64_t, PendingReply> pendingReplies_;
    std::vector<ZemFrame> heldFrames_;  // frames read while suspended

    // Client connections only. Guards owner_, parkedFd_ and deferred_; the I/O state itself needs no lock, since only
    // the owner touches it.
    std::mutex ownerMutex_;
    Owner owner_ = Owner::Loop;
    int parkedFd_ = -1;                            // the socket while it is out of the reactor
    std::vector<std::function<void()>> deferred_;  // queue work that came while a caller owned the I/O
    std::atomic<bool> parkWanted_{false};          // some caller wants the connection parked when idle
    std::atomic<bool> parkable_{true};             // see setParkable
    std::atomic<size_t> posted_{0};                // sends posted to the queue and not yet run there
    std::vector<ZemFrame> strayFrames_;            // frames a caller read that were not its reply

    // The socket's descriptor for peerHasHungUp, which runs on other queues: -1 until the socket is open and again
    // from the moment close() starts (then `probeClosed_`), so a probe never touches a descriptor number that has
    // been closed and perhaps reused.
    mutable std::mutex probeMutex_;
    int probeFd_ = -1;
    bool probeClosed_ = false;
};

}  // namespace bexil
