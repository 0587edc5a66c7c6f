#include "platform/zem/ZemSocketConnection.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/uio.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cinttypes>
#include <climits>
#include <cstring>

#include "base/EventLoopAsio.h"
#include "platform/log/Log.h"
#include "platform/zem/ZemCodec.h"
#include "platform/zem/ZemFrame.h"
#include "platform/zem/ZemListener.h"

// Design. A connection is a small state machine that lives on its serial queue. Reads are always outstanding while
// the connection is open and resumed; every chunk read is cut into frames, decoded and delivered before the next
// read is issued, so a peer that floods us is throttled by our own pace. Writes are double-buffered: frames are
// encoded straight into `outgoing_` and sent at once with a non-blocking send; what the socket does not take is
// swapped into `writing_` for an asynchronous write, and replies produced meanwhile gather in `outgoing_` to leave
// together when it completes. A large reply encoded already (a discovery's) that nothing queued precedes is not
// copied: its header goes in `outgoing_` and the payload leaves from its own buffer, which the write in flight keeps
// (megabytes copied into fresh memory would hold the loop's thread for tens of milliseconds). Replies are handed over
// with SerialQueue::dispatch, so a request answered on the loop's thread is written from inside the request's own
// handling, possibly while this connection is still delivering the request further out on the stack: every member
// function is safe to enter that way. The queued-bytes limit bounds what a peer that stops reading can cost us. Every
// pending operation holds a strong reference, so the object lives exactly as long as it has I/O in flight or an owner
// outside.
//
// A client connection may also be driven by the thread that waits for a reply. Handing every request to the loop's
// thread and every reply back costs two wake-ups per round trip, more than the rest of a small request. So once a
// waiting caller has asked for it (exchangeOnCallingThread) and the connection is idle, the queue parks it: the
// socket leaves the reactor, so data arriving on it wakes nobody. A later caller that finds it parked, with no send
// of its own thread still queued, takes it over, writes its request and reads the reply itself, then parks it again;
// while it does, any work that reaches the queue waits in `deferred_`. A caller that leaves anything behind (a
// request whose reply did not come before its deadline, frames that were not its reply, a broken stream) gives the
// socket back to the queue (Owner::Returning), which takes over from where the caller stopped. Peer connections are
// never parked.

namespace bexil {

namespace {

asio::io_context& ioContextOf(const SerialQueue& queue) { return *detail::QueueInternals::state(queue)->core; }

std::atomic<long> stalledTimeoutSeconds{ZemListener::kStalledConnectionTimeout.count()};
std::atomic<size_t> readPauseBytes{ZemListener::kQueuedReplyBytes};

}  // namespace

ZemSocketConnection::ZemSocketConnection(Socket socket, SerialQueue queue, std::string serviceName,
                                         ZemPeerCredentials peer)
    : side_(Side::Peer),
      queue_(std::move(queue)),
      socket_(std::move(socket)),
      serviceName_(std::move(serviceName)),
      peer_(std::move(peer)),
      pid_(peer_.pid > 0 ? peer_.pid : 0),
      uid_(peer_.uid),
      gid_(peer_.gid),
      state_(State::Open),
      stallTimer_(ioContextOf(queue_)),
      probeFd_(socket_.native_handle()) {}

ZemSocketConnection::ZemSocketConnection(SerialQueue queue, std::string serviceName)
    : side_(Side::Client),
      queue_(queue),
      socket_(ioContextOf(queue)),
      serviceName_(std::move(serviceName)),
      stallTimer_(ioContextOf(queue)) {}

void ZemSocketConnection::setStalledConnectionTimeout(std::chrono::seconds timeout) {
    stalledTimeoutSeconds.store(timeout.count());
}

void ZemSocketConnection::setReadPauseBytes(size_t bytes) { readPauseBytes.store(bytes); }

void ZemSocketConnection::watchStall() {
    if (side_ != Side::Peer || state_ != State::Open) return;
    const bool waiting = !framed_ || reader_.hasPartialFrame() || readPaused_;
    if (!waiting) {
        if (stallArmed_) {
            stallArmed_ = false;
            stallTimer_.cancel();
        }
        return;
    }
    if (stallArmed_) return;  // the first moment of waiting counts, not the latest byte
    stallArmed_ = true;
    const std::chrono::seconds timeout(stalledTimeoutSeconds.load());
    stallTimer_.expires_after(timeout);
    stallTimer_.async_wait(
        detail::bindToQueue(queue_, [self = shared_from_this(), timeout](const asio::error_code& error) {
            if (error || !self->stallArmed_ || self->state_ != State::Open) return;
            self->stallArmed_ = false;
            if (self->readPaused_) {
                log::ops().error(
                    "peer %d has not read its replies for %lld s (%zu bytes queued, "
                    "kStalledConnectionTimeout): disconnecting",
                    static_cast<int>(self->pid_), static_cast<long long>(timeout.count()), self->queuedBytesHere());
                self->close(ZemError::Kind::ConnectionInvalid);
                return;
            }
            if (self->framed_ && !self->reader_.hasPartialFrame()) return;
            log::ops().error("peer %d sent %s for %lld s (kStalledConnectionTimeout): disconnecting",
                             static_cast<int>(self->pid_),
                             self->reader_.hasPartialFrame() ? "part of a frame and no more" : "no complete frame",
                             static_cast<long long>(timeout.count()));
            self->close(ZemError::Kind::ConnectionInvalid);
        }));
}

ZemSocketConnection::~ZemSocketConnection() {
    if (parkedFd_ >= 0) ::close(parkedFd_);
    if (finalizer_) finalizer_(std::move(context_));
}

void ZemConnection::sendEncodedReply(const ZemMessage& request, std::vector<uint8_t> payload) {
    Result<Value> reply = ZemCodec::decode(payload);
    if (!reply) {
        log::ops().error("cannot send reply to message #%llu: %@", static_cast<unsigned long long>(request.serial()),
                         reply.error());
        return;
    }
    sendReply(request, *reply);
}

std::shared_ptr<ZemConnection> ZemConnection::createClient(const std::string& serviceName, SerialQueue& queue) {
    return std::make_shared<ZemSocketConnection>(queue, serviceName);
}

void ZemSocketConnection::setEventHandler(EventHandler handler) { handler_ = std::move(handler); }
void ZemSocketConnection::setContext(std::shared_ptr<void> context) { context_ = std::move(context); }
std::shared_ptr<void> ZemSocketConnection::context() const { return context_; }
void ZemSocketConnection::setFinalizer(Finalizer finalizer) { finalizer_ = std::move(finalizer); }

void ZemSocketConnection::resume() {
    queue_.async([self = shared_from_this()] { self->resumeOnQueue(); });
}

void ZemSocketConnection::resumeOnQueue() {
    if (!suspended_) return;
    if (takeSocketBack([this] { return [self = shared_from_this()] { self->resumeOnQueue(); }; }) == Reclaim::Deferred)
        return;
    suspended_ = false;
    if (side_ == Side::Client && state_ == State::Idle && !connectClient()) return;
    handleSetAside(heldFrames_);
    readMore();
    writeMore();
}

void ZemSocketConnection::handleSetAside(std::vector<ZemFrame>& frames) {
    std::vector<ZemFrame> taken = std::move(frames);
    frames.clear();
    for (ZemFrame& frame : taken) {
        if (state_ != State::Open) break;
        handleFrame(std::move(frame));
    }
}

void ZemSocketConnection::suspend() {
    queue_.async([self = shared_from_this()] { self->suspended_ = true; });
}

void ZemSocketConnection::cancel() {
    queue_.async([self = shared_from_this()] { self->close(ZemError::Kind::ConnectionInvalid); });
}

void ZemSocketConnection::deliverTerminationImminent() {
    queue_.async([self = shared_from_this()] {
        if (self->state_ == State::Open) self->deliver(ZemError(ZemError::Kind::TerminationImminent));
    });
}

void ZemSocketConnection::send(const Value& message) {
    if (side_ == Side::Client) posted_.fetch_add(1, std::memory_order_acq_rel);
    // Counted from here, so that a sender that hands over many messages in one turn sees them in queuedBytes before
    // this queue has encoded any.
    Result<size_t> size = ZemCodec::encodedSize(message);
    const size_t bytes = (size ? *size : 0) + ZemFrame::kHeaderBytes;
    postedBytes_.fetch_add(bytes);
    queue_.async([self = shared_from_this(), message, bytes] {
        self->enqueueFrame(ZemFrameKind::Message, 0, message, std::nullopt);
        self->postedBytes_.fetch_sub(bytes);
        if (self->side_ == Side::Client) self->posted_.fetch_sub(1, std::memory_order_acq_rel);
    });
}

void ZemSocketConnection::sendReply(const ZemMessage& request, const Value& reply) {
    if (!request.expectsReply()) {
        log::ops().error("reply to message #%llu, which expects none, dropped",
                         static_cast<unsigned long long>(request.serial()));
        return;
    }
    // Usually called from the request queue on the loop's own thread: the reply is then encoded and written at once
    // instead of taking another turn of the loop (which costs a reactor poll, more than the whole reply).
    queue_.dispatch([self = shared_from_this(), serial = request.serial(), reply] {
        self->enqueueFrame(ZemFrameKind::Reply, serial, reply, std::nullopt);
    });
}

void ZemSocketConnection::sendEncodedReply(const ZemMessage& request, std::vector<uint8_t> payload) {
    if (!request.expectsReply()) {
        log::ops().error("reply to message #%llu, which expects none, dropped",
                         static_cast<unsigned long long>(request.serial()));
        return;
    }
    queue_.dispatch([self = shared_from_this(), serial = request.serial(),
                     bytes = std::make_shared<const std::vector<uint8_t>>(std::move(payload))] {
        self->enqueueFrame(ZemFrameKind::Reply, serial, Payload(bytes), std::nullopt);
    });
}

void ZemSocketConnection::sendReplyWithDescriptors(const ZemMessage& request, const Value& reply,
                                                   std::vector<UniqueFd> descriptors) {
    if (!request.expectsReply()) {
        log::ops().error("reply to message #%llu, which expects none, dropped",
                         static_cast<unsigned long long>(request.serial()));
        return;
    }
    auto owned = std::make_shared<std::vector<UniqueFd>>(std::move(descriptors));
    queue_.dispatch([self = shared_from_this(), serial = request.serial(), reply, owned] {
        self->enqueueFrame(ZemFrameKind::Reply, serial, reply, std::nullopt, std::move(*owned));
    });
}

void ZemSocketConnection::sendWithReply(const Value& message, SerialQueue& replyQueue, ReplyHandler handler) {
    sendWithMessageReply(message, replyQueue,
                         [handler = std::move(handler)](const std::variant<ZemMessage, ZemError>& answer) {
                             if (const auto* reply = std::get_if<ZemMessage>(&answer))
                                 handler(std::variant<Value, ZemError>(reply->body()));
                             else
                                 handler(std::variant<Value, ZemError>(std::get<ZemError>(answer)));
                         });
}

void ZemSocketConnection::sendWithMessageReply(const Value& message, SerialQueue& replyQueue,
                                               MessageReplyHandler handler) {
    // Counted until it has run, so that a caller on this thread waiting for a later request cannot overtake it.
    if (side_ == Side::Client) posted_.fetch_add(1, std::memory_order_acq_rel);
    queue_.async([self = shared_from_this(), message, pending = PendingReply{replyQueue, std::move(handler)}] {
        self->enqueueFrame(ZemFrameKind::Request, 0, message, pending);
        if (self->side_ == Side::Client) self->posted_.fetch_sub(1, std::memory_order_acq_rel);
    });
}

template <class MakeRetry>
ZemSocketConnection::Reclaim ZemSocketConnection::takeSocketBack(MakeRetry&& makeRetry) {
    if (side_ != Side::Client) return Reclaim::Owned;
    std::lock_guard lock(ownerMutex_);
    switch (owner_) {
        case Owner::Loop:
            return Reclaim::Owned;
        case Owner::Caller:
        case Owner::Returning:
            deferred_.emplace_back(makeRetry());
            return Reclaim::Deferred;
        case Owner::Parked:
            break;
    }
    reclaimLocked();
    return Reclaim::Reclaimed;
}

void ZemSocketConnection::reclaimLocked() {
    asio::error_code error;
    socket_.assign(asio::local::stream_protocol(), parkedFd_, error);
    if (error) {
        // The socket cannot be watched again (the reactor is out of memory): what uses it next fails and ends the
        // connection the usual way.
        log::ops().error("cannot watch the connection to %s again: %s", serviceName_.c_str(), error.message().c_str());
        ::close(parkedFd_);
    }
    parkedFd_ = -1;
    owner_ = Owner::Loop;
}

void ZemSocketConnection::setParkable(bool parkable) {
    parkable_.store(parkable, std::memory_order_relaxed);
    if (!parkable) queue_.async([self = shared_from_this()] { self->unpark(); });
}

void ZemSocketConnection::unpark() {
    if (takeSocketBack([this] { return [self = shared_from_this()] { self->unpark(); }; }) == Reclaim::Reclaimed)
        readMore();
}

bool ZemSocketConnection::parkIfIdle() {
    if (side_ != Side::Client || !parkWanted_.load(std::memory_order_relaxed) ||
        !parkable_.load(std::memory_order_relaxed))
        return false;
    if (!pendingReplies_.empty() || !outgoing_.empty() || !writing_.empty() || writeInFlight_ ||
        !attachments_.empty() || reader_.hasPartialFrame() || !receivedFds_.empty() || !heldFrames_.empty())
        return false;
    std::lock_guard lock(ownerMutex_);
    if (owner_ != Owner::Loop || !deferred_.empty()) return false;
    asio::error_code error;
    int fd = socket_.release(error);
    if (error) return false;
    parkedFd_ = fd;
    owner_ = Owner::Parked;
    return true;
}

bool ZemSocketConnection::pollUntil(int fd, short events, std::chrono::steady_clock::time_point deadline) {
    for (;;) {
        auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
        pollfd probe{.fd = fd, .events = events, .revents = 0};
        int ready = ::poll(&probe, 1, static_cast<int>(std::clamp<int64_t>(left.count(), 0, INT32_MAX)));
        if (ready > 0) return true;
        if (ready < 0 && errno == EINTR) continue;
        if (ready < 0 || left.count() <= 0) return false;
    }
}

bool ZemSocketConnection::exchangeOnCallingThread(const Value& message, SerialQueue& replyQueue,
                                                  MessageReplyHandler& handler,
                                                  std::chrono::steady_clock::time_point deadline) {
    if (side_ != Side::Client || !parkable_.load(std::memory_order_relaxed)) return false;
    {
        std::lock_guard lock(ownerMutex_);
        if (owner_ != Owner::Parked || posted_.load(std::memory_order_acquire) != 0) {
            parkWanted_.store(true, std::memory_order_relaxed);
            return false;
        }
        owner_ = Owner::Caller;
    }
    // From here on this thread owns the socket, the reader, the buffers and the serials, until handBack.
    const int fd = parkedFd_;
    // What came while the connection was parked (a message, the end of the stream) is the queue's to handle before
    // this request, which then goes the usual way.
    pollfd probe{.fd = fd, .events = POLLIN | POLLRDHUP, .revents = 0};
    if (::poll(&probe, 1, 0) != 0) {
        HandBack work;
        work.readFirst = true;
        handBack(std::move(work));
        return false;
    }
    const uint64_t serial = nextSerial_++;
    std::vector<ZemCodec::Reference> references;
    if (std::optional<Error> error = ZemFrame::encodeReferencing(ZemFrameKind::Request, serial, 0, message, outgoing_,
                                                                 references, kGatherMinimum)) {
        log::ops().error("cannot send %s to peer %d: %@", zemFrameKindName(ZemFrameKind::Request),
                         static_cast<int>(pid_), *error);
        handBack({});
        handler(std::variant<ZemMessage, ZemError>(ZemError(ZemError::Kind::MessageInvalid)));
        return true;
    }
    // The frame in the pieces a gathering send takes: outgoing_, with the referenced bytes of `message` between its
    // parts. Pieces before `first` have gone; the one at `first` may have gone in part.
    std::vector<iovec> pieces;
    size_t from = 0;
    for (const ZemCodec::Reference& reference : references) {
        if (reference.offset > from) pieces.push_back({outgoing_.data() + from, reference.offset - from});
        pieces.push_back({const_cast<uint8_t*>(reference.bytes.data()), reference.bytes.size()});
        from = reference.offset;
    }
    if (outgoing_.size() > from) pieces.push_back({outgoing_.data() + from, outgoing_.size() - from});
    size_t first = 0;
    auto answer = [&](std::variant<ZemMessage, ZemError> reply, HandBack work) {
        handBack(std::move(work));
        handler(reply);
        return true;
    };
    auto fail = [&](ZemError::Kind kind) {
        outgoing_.clear();
        HandBack work;
        work.broken = kind;
        return answer(ZemError(kind), std::move(work));
    };
    // The deadline came first: the queue sends the rest, which `message` will not outlive, and waits for the reply
    // in this thread's place.
    auto adopt = [&] {
        ZemBytes rest;
        for (size_t i = first; i < pieces.size(); ++i) {
            const auto* bytes = static_cast<const uint8_t*>(pieces[i].iov_base);
            rest.insert(rest.end(), bytes, bytes + pieces[i].iov_len);
        }
        outgoing_.swap(rest);
        HandBack work;
        work.adopted.emplace(serial, PendingReply{replyQueue, std::move(handler)});
        handBack(std::move(work));
        return true;
    };
    while (first < pieces.size()) {
        msghdr gathered{};
        gathered.msg_iov = pieces.data() + first;
        gathered.msg_iovlen = std::min<size_t>(pieces.size() - first, IOV_MAX);
        ssize_t bytes = gathered.msg_iovlen == 1
                            ? ::send(fd, pieces[first].iov_base, pieces[first].iov_len, MSG_DONTWAIT | MSG_NOSIGNAL)
                            : ::sendmsg(fd, &gathered, MSG_DONTWAIT | MSG_NOSIGNAL);
        if (bytes >= 0) {
            for (auto left = static_cast<size_t>(bytes); left > 0;) {
                iovec& piece = pieces[first];
                if (left < piece.iov_len) {
                    piece.iov_base = static_cast<uint8_t*>(piece.iov_base) + left;
                    piece.iov_len -= left;
                    break;
                }
                left -= piece.iov_len;
                ++first;
            }
            continue;
        }
        if (errno == EINTR) continue;
        if (errno != EAGAIN && errno != EWOULDBLOCK) return fail(ZemError::Kind::ConnectionInterrupted);
        if (!pollUntil(fd, POLLOUT, deadline)) return adopt();
    }
    outgoing_.clear();
    for (;;) {
        while (std::optional<ZemFrame> frame = reader_.next()) {
            if (frame->kind() != ZemFrameKind::Reply || frame->inReplyTo() != serial) {
                strayFrames_.push_back(std::move(*frame));
                continue;
            }
            Result<Value> body = frame->decodePayload();
            if (!body) {
                log::ops().error("protocol violation by peer %d in %s: %@; disconnecting", static_cast<int>(pid_),
                                 frame->description().c_str(), body.error());
                return fail(ZemError::Kind::ConnectionInvalid);
            }
            const size_t announced = frame->header().descriptorCount;
            if (receivedFds_.size() < announced) {
                log::ops().error(
                    "protocol violation by peer %d: %s announces %zu descriptors but %zu arrived; disconnecting",
                    static_cast<int>(pid_), frame->description().c_str(), announced, receivedFds_.size());
                return fail(ZemError::Kind::ConnectionInvalid);
            }
            std::vector<UniqueFd> descriptors;
            for (size_t i = 0; i < announced; ++i) {
                descriptors.push_back(std::move(receivedFds_.front()));
                receivedFds_.pop_front();
            }
            // Frames behind the reply that came with it are the queue's.
            while (std::optional<ZemFrame> behind = reader_.next()) strayFrames_.push_back(std::move(*behind));
            return answer(ZemMessage(std::move(*body), frame->serial(), false, std::move(descriptors)), {});
        }
        if (reader_.error()) {
            log::ops().error("protocol violation by peer %d: %@; disconnecting", static_cast<int>(pid_),
                             *reader_.error());
            return fail(ZemError::Kind::ConnectionInvalid);
        }
        if (!pollUntil(fd, POLLIN, deadline)) return adopt();
        bool overflow = false;
        ssize_t bytes = receiveInto(fd, overflow);
        if (overflow) {
            log::ops().error(
                "protocol violation by peer %d: more descriptors than its frames may carry "
                "(kMaxPendingDescriptors %zu); disconnecting",
                static_cast<int>(pid_), kMaxPendingDescriptors);
            return fail(ZemError::Kind::ConnectionInvalid);
        }
        if (bytes == 0) {
            if (reader_.hasPartialFrame())
                log::ops().error("peer %d closed its connection in the middle of a frame", static_cast<int>(pid_));
            return fail(ZemError::Kind::ConnectionInterrupted);
        }
        if (bytes < 0) {
            if (errno == EINTR || errno == EAGAIN || errno == EWOULDBLOCK) continue;
            return fail(ZemError::Kind::ConnectionInterrupted);
        }
    }
}

void ZemSocketConnection::handBack(HandBack work) {
    const bool leftovers = work.adopted || work.broken || work.readFirst || !strayFrames_.empty() ||
                           reader_.hasPartialFrame() || !receivedFds_.empty() || !outgoing_.empty();
    {
        std::lock_guard lock(ownerMutex_);
        if (!leftovers && deferred_.empty()) {
            owner_ = Owner::Parked;
            return;
        }
        owner_ = Owner::Returning;
    }
    queue_.async(
        [self = shared_from_this(), work = std::move(work)]() mutable { self->finishHandBack(std::move(work)); });
}

void ZemSocketConnection::finishHandBack(HandBack work) {
    std::vector<std::function<void()>> deferred;
    {
        std::lock_guard lock(ownerMutex_);
        deferred.swap(deferred_);
        reclaimLocked();
    }
    if (work.adopted) {
        if (state_ == State::Open)
            pendingReplies_.emplace(work.adopted->first, std::move(work.adopted->second));
        else
            answerWithError(work.adopted->second, ZemError::Kind::ConnectionInvalid);
    }
    if (work.broken) {
        close(*work.broken);
    } else if (state_ == State::Open) {
        handleSetAside(strayFrames_);
        writeMore();
        readMore();
    }
    for (std::function<void()>& block : deferred) block();
}

bool ZemSocketConnection::connectClient() {
    std::filesystem::path path = ZemListener::socketPathForService(serviceName_);
    asio::error_code error;
    socket_ = Socket(ioContextOf(queue_));
    socket_.connect(asio::local::stream_protocol::endpoint(path.string()), error);
    if (error) {
        log::ops().debug("cannot connect to service %s at %s: %s", serviceName_.c_str(), path.c_str(),
                         error.message().c_str());
        state_ = State::Open;  // so that close() runs its course
        close(ZemError::Kind::ConnectionInvalid);
        return false;
    }
    struct ucred cred {};
    socklen_t len = sizeof cred;
    if (getsockopt(socket_.native_handle(), SOL_SOCKET, SO_PEERCRED, &cred, &len) == 0) {
        pid_ = cred.pid;
        uid_ = cred.uid;
        gid_ = cred.gid;
    }
    state_ = State::Open;
    std::lock_guard lock(probeMutex_);
    probeFd_ = socket_.native_handle();
    return true;
}

void ZemSocketConnection::readMore() {
    for (int turn = 0; turn < kReadsPerTurn; ++turn) {
        if (suspended_ || reading_ || state_ != State::Open) return;
        if (side_ == Side::Peer && queuedBytesHere() >= readPauseBytes.load(std::memory_order_relaxed)) {
            // The peer does not read what it asked for: its next requests wait until it does.
            if (!readPaused_)
                log::ops().notice(
                    "peer %d has %zu bytes of replies unread, over the limit (kQueuedReplyBytes): its "
                    "requests wait until it reads",
                    static_cast<int>(pid_), queuedBytesHere());
            readPaused_ = true;
            watchStall();
            return;
        }
        ssize_t bytes = receive();
        if (bytes > 0) {
            if (!consume()) return;
            continue;
        }
        if (bytes == 0) return endOfStream();
        if (errno == EINTR) continue;
        if (errno == EAGAIN || errno == EWOULDBLOCK) break;
        return endOfStream();
    }
    if (suspended_ || reading_ || state_ != State::Open) return;
    if (parkIfIdle()) return;
    watchStall();
    reading_ = true;
    socket_.async_wait(Socket::wait_read,
                       detail::bindToQueue(queue_, [self = shared_from_this()](const asio::error_code& error) {
                           self->reading_ = false;
                           if (self->state_ != State::Open) return;
                           if (error) return self->endOfStream();
                           self->readMore();
                       }));
}

ssize_t ZemSocketConnection::receive() {
    bool overflow = false;
    ssize_t bytes = receiveInto(socket_.native_handle(), overflow);
    if (overflow) {
        log::ops().error(
            "protocol violation by peer %d: more descriptors than its frames may carry "
            "(kMaxPendingDescriptors %zu); disconnecting",
            static_cast<int>(pid_), kMaxPendingDescriptors);
        close(ZemError::Kind::ConnectionInvalid);
        errno = ECONNABORTED;
        return -1;
    }
    return bytes;
}

ssize_t ZemSocketConnection::receiveInto(int fd, bool& overflow) {
    // On the daemon's side the bulk of a large payload goes straight into the frame; anything else into the read
    // buffer, from which one read may cut several frames. A client reads its replies through the buffer: in a
    // client process that decodes a large reply and lets it go again, reading in place measured many times slower,
    // since the heap was then given back to the system and faulted in again on every reply.
    std::span<uint8_t> into = side_ == Side::Peer ? reader_.payloadRoom() : std::span<uint8_t>();
    const bool inPlace = !into.empty();
    if (!inPlace) {
        if (readBuffer_.size() != kReadChunkBytes) readBuffer_.resize(kReadChunkBytes);
        into = readBuffer_;
    }
    iovec chunk{into.data(), into.size()};
    // Room for one frame's descriptors: the kernel never joins the descriptors of two sends in one read.
    alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int) * ZemFrame::kMaxDescriptorsPerFrame)];
    msghdr message{};
    message.msg_iov = &chunk;
    message.msg_iovlen = 1;
    message.msg_control = control;
    message.msg_controllen = sizeof control;
    ssize_t bytes = ::recvmsg(fd, &message, MSG_DONTWAIT | MSG_CMSG_CLOEXEC);
    if (bytes < 0) return bytes;
    for (cmsghdr* header = CMSG_FIRSTHDR(&message); header != nullptr; header = CMSG_NXTHDR(&message, header)) {
        if (header->cmsg_level != SOL_SOCKET || header->cmsg_type != SCM_RIGHTS) continue;
        size_t count = (header->cmsg_len - CMSG_LEN(0)) / sizeof(int);
        for (size_t i = 0; i < count; ++i) {
            int fd;
            std::memcpy(&fd, CMSG_DATA(header) + i * sizeof(int), sizeof fd);
            receivedFds_.emplace_back(fd);
        }
    }
    overflow = (message.msg_flags & MSG_CTRUNC) != 0 || receivedFds_.size() > kMaxPendingDescriptors;
    if (bytes > 0 && !overflow) {
        if (inPlace)
            reader_.receivedInPlace(static_cast<size_t>(bytes));
        else
            reader_.feed(std::span<const uint8_t>(readBuffer_.data(), static_cast<size_t>(bytes)));
    }
    return bytes;
}

void ZemSocketConnection::endOfStream() {
    if (state_ != State::Open) return;
    if (reader_.hasPartialFrame())
        log::ops().error("peer %d closed its connection in the middle of a frame", static_cast<int>(pid_));
    close(side_ == Side::Client ? ZemError::Kind::ConnectionInterrupted : ZemError::Kind::ConnectionInvalid);
}

bool ZemSocketConnection::consume() {
    std::optional<Error> broken = reader_.error();
    // Frames completed before a bad header are still whole and are handled; then the stream is dropped.
    while (std::optional<ZemFrame> frame = reader_.next()) {
        if (state_ != State::Open) return false;
        if (suspended_)
            heldFrames_.push_back(std::move(*frame));
        else
            handleFrame(std::move(*frame));
    }
    if (broken) {
        log::ops().error("protocol violation by peer %d: %@; disconnecting", static_cast<int>(pid_), *broken);
        close(ZemError::Kind::ConnectionInvalid);
        return false;
    }
    return state_ == State::Open;
}

void ZemSocketConnection::handleFrame(ZemFrame frame) {
    framed_ = true;
    Result<Value> body = frame.decodePayload();
    // A well-formed value that is not a dictionary breaks no framing: a message or request carrying one is handed
    // on for the receiver to log and drop, and the stream goes on. A reply must be a dictionary.
    if (!body && isZemError(body.error(), ZemErrorCode::NotDictionary) && frame.kind() != ZemFrameKind::Reply)
        body = ZemCodec::decode(frame.payload());
    if (!body) {
        log::ops().error("protocol violation by peer %d in %s: %@; disconnecting", static_cast<int>(pid_),
                         frame.description().c_str(), body.error());
        close(ZemError::Kind::ConnectionInvalid);
        return;
    }
    // The frame's descriptors came with its first byte, so they have arrived by now, after those of earlier frames.
    const size_t announced = frame.header().descriptorCount;
    if (receivedFds_.size() < announced) {
        log::ops().error("protocol violation by peer %d: %s announces %zu descriptors but %zu arrived; disconnecting",
                         static_cast<int>(pid_), frame.description().c_str(), announced, receivedFds_.size());
        close(ZemError::Kind::ConnectionInvalid);
        return;
    }
    std::vector<UniqueFd> descriptors;
    for (size_t i = 0; i < announced; ++i) {
        descriptors.push_back(std::move(receivedFds_.front()));
        receivedFds_.pop_front();
    }
    switch (frame.kind()) {
        case ZemFrameKind::Message:
        case ZemFrameKind::Request:
            deliver(ZemMessage(std::move(*body), frame.serial(), frame.kind() == ZemFrameKind::Request,
                               std::move(descriptors)));
            return;
        case ZemFrameKind::Reply: {
            auto it = pendingReplies_.find(frame.inReplyTo());
            if (it == pendingReplies_.end()) {
                log::ops().error("reply from peer %d to unknown request #%llu dropped", static_cast<int>(pid_),
                                 static_cast<unsigned long long>(frame.inReplyTo()));
                return;
            }
            PendingReply pending = std::move(it->second);
            pendingReplies_.erase(it);
            pending.queue.async([handler = std::move(pending.handler),
                                 reply = ZemMessage(std::move(*body), frame.serial(), false, std::move(descriptors))] {
                handler(std::variant<ZemMessage, ZemError>(reply));
            });
            return;
        }
    }
}

void ZemSocketConnection::enqueueFrame(ZemFrameKind kind, uint64_t inReplyTo, const Payload& payload,
                                       std::optional<PendingReply> pending, std::vector<UniqueFd> descriptors) {
    const Reclaim reclaim = takeSocketBack([&] {
        auto owned = std::make_shared<std::vector<UniqueFd>>(std::move(descriptors));
        return [self = shared_from_this(), kind, inReplyTo, payload, pending = std::move(pending), owned] {
            self->enqueueFrame(kind, inReplyTo, payload, pending, std::move(*owned));
        };
    });
    if (reclaim == Reclaim::Deferred) return;
    const bool reconnecting = side_ == Side::Client && state_ == State::Interrupted;
    enqueueOwnedFrame(kind, inReplyTo, payload, std::move(pending), std::move(descriptors));
    // A socket back from a park, or a new one, must be read again.
    if (reclaim == Reclaim::Reclaimed || reconnecting) readMore();
}

void ZemSocketConnection::enqueueOwnedFrame(ZemFrameKind kind, uint64_t inReplyTo, const Payload& payload,
                                            std::optional<PendingReply> pending, std::vector<UniqueFd> descriptors) {
    if (side_ == Side::Client && state_ == State::Interrupted) {
        // The service went away earlier; a new message tries to reach it again.
        state_ = State::Idle;
        if (!suspended_ && !connectClient()) {
            if (pending) answerWithError(*pending, ZemError::Kind::ConnectionInvalid);
            return;
        }
        // enqueueFrame reads the new socket once this frame is queued (an idle connection might park at once).
    }
    if (state_ == State::Closed) {
        if (pending) answerWithError(*pending, ZemError::Kind::ConnectionInvalid);
        return;
    }
    // Every frame this side sends takes the next serial, replies too, so a peer can tell our frames apart by it.
    const uint64_t serial = nextSerial_++;
    const size_t start = outgoing_.size();
    if (descriptors.size() > ZemFrame::kMaxDescriptorsPerFrame) {
        log::ops().error("cannot send %s to peer %d with %zu descriptors (at most %u)", zemFrameKindName(kind),
                         static_cast<int>(pid_), descriptors.size(), unsigned{ZemFrame::kMaxDescriptorsPerFrame});
        if (pending) answerWithError(*pending, ZemError::Kind::MessageInvalid);
        return;
    }
    const auto descriptorCount = static_cast<uint8_t>(descriptors.size());
    if (descriptors.empty() && sendInPlace(kind, serial, inReplyTo, payload, pending)) {
        buffered_.store(queuedBytesHere());
        return;
    }
    if (std::optional<Error> error =
            payload.encoded
                ? ZemFrame::encodeEncoded(kind, serial, inReplyTo, *payload.encoded, outgoing_, descriptorCount)
                : ZemFrame::encode(kind, serial, inReplyTo, payload.value, outgoing_, descriptorCount)) {
        log::ops().error("cannot send %s to peer %d: %@", zemFrameKindName(kind), static_cast<int>(pid_), *error);
        if (pending) answerWithError(*pending, ZemError::Kind::MessageInvalid);
        return;
    }
    if (pending) pendingReplies_.emplace(serial, std::move(*pending));
    if (!descriptors.empty()) attachments_.push_back(Attachment{start, std::move(descriptors)});
    size_t queued = queuedBytesHere();
    if (queued > kMaxQueuedBytes) {
        log::ops().error("peer %d has %zu bytes queued, over the limit of %zu (kMaxQueuedBytes): disconnecting",
                         static_cast<int>(pid_), queued, kMaxQueuedBytes);
        close(ZemError::Kind::ConnectionInvalid);
        return;
    }
    writeMore();
}

bool ZemSocketConnection::sendInPlace(ZemFrameKind kind, uint64_t serial, uint64_t inReplyTo, const Payload& payload,
                                      std::optional<PendingReply>& pending) {
    if (!payload.encoded || payload.encoded->size() < kInPlaceMinimum || !outgoing_.empty() || writeInFlight_ ||
        !attachments_.empty() || state_ != State::Open)
        return false;
    const std::vector<uint8_t>& bytes = *payload.encoded;
    outgoing_.resize(ZemFrame::kHeaderBytes);
    if (ZemFrame::encodeEncodedHeader(
            kind, serial, inReplyTo, bytes,
            std::span<uint8_t, ZemFrame::kHeaderBytes>(outgoing_.data(), ZemFrame::kHeaderBytes))) {
        // Copied like any other frame, it meets the same fault, which is reported there.
        outgoing_.clear();
        return false;
    }
    if (pending) pendingReplies_.emplace(serial, std::move(*pending));
    iovec pieces[2] = {{outgoing_.data(), outgoing_.size()}, {const_cast<uint8_t*>(bytes.data()), bytes.size()}};
    msghdr gathered{};
    gathered.msg_iov = pieces;
    gathered.msg_iovlen = 2;
    ssize_t sent = ::sendmsg(socket_.native_handle(), &gathered, MSG_DONTWAIT | MSG_NOSIGNAL);
    if (sent < 0 && errno != EAGAIN && errno != EWOULDBLOCK && errno != EINTR) {
        outgoing_.clear();
        close(side_ == Side::Client ? ZemError::Kind::ConnectionInterrupted : ZemError::Kind::ConnectionInvalid);
        return true;
    }
    const size_t taken = sent > 0 ? static_cast<size_t>(sent) : 0;
    if (taken == outgoing_.size() + bytes.size()) {
        outgoing_.clear();
        return true;
    }
    writing_.swap(outgoing_);
    outgoing_.clear();
    writtenAlready_ = std::min(taken, writing_.size());
    writingPayload_ = payload.encoded;
    payloadWrittenAlready_ = taken - writtenAlready_;
    writeInFlight_ = true;
    const std::array<asio::const_buffer, 2> rest{asio::buffer(writing_) + writtenAlready_,
                                                 asio::buffer(bytes) + payloadWrittenAlready_};
    asio::async_write(
        socket_, rest,
        detail::bindToQueue(queue_, [self = shared_from_this()](const asio::error_code& error, size_t written) {
            self->onWritten(error, written);
        }));
    return true;
}

void ZemSocketConnection::writeMore() {
    writeMoreNow();
    buffered_.store(queuedBytesHere());
}

void ZemSocketConnection::writeMoreNow() {
    if (writeInFlight_ || outgoing_.empty() || state_ != State::Open) return;
    if (!attachments_.empty()) return writeWithAttachments();
    // The socket buffer almost always has room: try a non-blocking send first, so that a reply costs one system
    // call and no completion handler; only what does not fit waits for the socket to drain.
    ssize_t sent = ::send(socket_.native_handle(), outgoing_.data(), outgoing_.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
    if (sent < 0 && errno != EAGAIN && errno != EWOULDBLOCK && errno != EINTR) {
        close(side_ == Side::Client ? ZemError::Kind::ConnectionInterrupted : ZemError::Kind::ConnectionInvalid);
        return;
    }
    if (sent > 0 && static_cast<size_t>(sent) == outgoing_.size()) {
        outgoing_.clear();
        return;
    }
    // The write goes on from where the send stopped: moving the rest to the front first would copy most of a large
    // reply once more.
    writing_.swap(outgoing_);
    outgoing_.clear();
    writtenAlready_ = sent > 0 ? static_cast<size_t>(sent) : 0;
    writeInFlight_ = true;
    asio::async_write(
        socket_, asio::buffer(writing_) + writtenAlready_,
        detail::bindToQueue(queue_, [self = shared_from_this()](const asio::error_code& error, size_t bytes) {
            self->onWritten(error, bytes);
        }));
}

void ZemSocketConnection::writeWithAttachments() {
    while (!outgoing_.empty()) {
        Attachment* here = attachments_.empty() || attachments_.front().offset != 0 ? nullptr : &attachments_.front();
        // A piece ends where the next frame with descriptors starts, so those always leave with that frame's first
        // byte.
        size_t end = outgoing_.size();
        for (const Attachment& attachment : attachments_)
            if (attachment.offset > 0) {
                end = attachment.offset;
                break;
            }
        iovec piece{outgoing_.data(), end};
        msghdr message{};
        message.msg_iov = &piece;
        message.msg_iovlen = 1;
        alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int) * ZemFrame::kMaxDescriptorsPerFrame)];
        if (here != nullptr) {
            size_t count = here->descriptors.size();
            message.msg_control = control;
            message.msg_controllen = CMSG_SPACE(sizeof(int) * count);
            cmsghdr* header = CMSG_FIRSTHDR(&message);
            header->cmsg_level = SOL_SOCKET;
            header->cmsg_type = SCM_RIGHTS;
            header->cmsg_len = CMSG_LEN(sizeof(int) * count);
            for (size_t i = 0; i < count; ++i) {
                int fd = here->descriptors[i].get();
                std::memcpy(CMSG_DATA(header) + i * sizeof(int), &fd, sizeof fd);
            }
        }
        ssize_t sent = ::sendmsg(socket_.native_handle(), &message, MSG_DONTWAIT | MSG_NOSIGNAL);
        if (sent < 0) {
            if (errno == EINTR) continue;
            if (errno != EAGAIN && errno != EWOULDBLOCK) {
                close(side_ == Side::Client ? ZemError::Kind::ConnectionInterrupted
                                            : ZemError::Kind::ConnectionInvalid);
                return;
            }
            writeInFlight_ = true;
            socket_.async_wait(Socket::wait_write,
                               detail::bindToQueue(queue_, [self = shared_from_this()](const asio::error_code& error) {
                                   self->writeInFlight_ = false;
                                   if (self->state_ != State::Open) return;
                                   if (error) {
                                       self->close(self->side_ == Side::Client ? ZemError::Kind::ConnectionInterrupted
                                                                               : ZemError::Kind::ConnectionInvalid);
                                       return;
                                   }
                                   self->writeMore();
                                   self->resumeReadingIfDrained();
                               }));
            return;
        }
        // The kernel holds its own references to the descriptors once any byte has gone with them.
        if (here != nullptr && sent > 0) attachments_.pop_front();
        dropSent(static_cast<size_t>(sent));
    }
}

void ZemSocketConnection::dropSent(size_t bytes) {
    outgoing_.erase(outgoing_.begin(), outgoing_.begin() + static_cast<std::ptrdiff_t>(bytes));
    for (Attachment& attachment : attachments_) attachment.offset -= bytes;
}

void ZemSocketConnection::onWritten(const asio::error_code& error, size_t) {
    writeInFlight_ = false;
    writing_.clear();
    writtenAlready_ = 0;
    writingPayload_.reset();
    payloadWrittenAlready_ = 0;
    buffered_.store(outgoing_.size());
    if (state_ != State::Open) return;
    if (error) {
        close(side_ == Side::Client ? ZemError::Kind::ConnectionInterrupted : ZemError::Kind::ConnectionInvalid);
        return;
    }
    writeMore();
    resumeReadingIfDrained();
}

void ZemSocketConnection::resumeReadingIfDrained() {
    if (!readPaused_ || state_ != State::Open || queuedBytesHere() >= readPauseBytes.load(std::memory_order_relaxed))
        return;
    readPaused_ = false;
    watchStall();
    readMore();
}

void ZemSocketConnection::failPendingReplies(ZemError::Kind kind) {
    auto pending = std::move(pendingReplies_);
    pendingReplies_.clear();
    for (auto& [serial, reply] : pending) answerWithError(reply, kind);
}

void ZemSocketConnection::answerWithError(PendingReply& pending, ZemError::Kind kind) {
    pending.queue.async(
        [handler = std::move(pending.handler), kind] { handler(std::variant<ZemMessage, ZemError>(ZemError(kind))); });
}

bool ZemSocketConnection::peerHasHungUp() const {
    std::lock_guard lock(probeMutex_);
    if (probeClosed_) return true;
    if (probeFd_ < 0) return false;  // a client connection not connected yet
    // A peer that closed its socket shuts down both directions of ours (POLLHUP); one that only stopped writing
    // (POLLRDHUP alone) may still be waiting for its replies.
    pollfd probe{.fd = probeFd_, .events = 0, .revents = 0};
    return ::poll(&probe, 1, 0) == 1 && (probe.revents & (POLLHUP | POLLERR)) != 0;
}

void ZemSocketConnection::close(ZemError::Kind kind) {
    if (state_ == State::Closed) return;
    if (takeSocketBack([this, kind] { return [self = shared_from_this(), kind] { self->close(kind); }; }) ==
        Reclaim::Deferred)
        return;
    bool interrupted = side_ == Side::Client && kind == ZemError::Kind::ConnectionInterrupted;
    state_ = interrupted ? State::Interrupted : State::Closed;
    {
        std::lock_guard lock(probeMutex_);
        probeFd_ = -1;
        probeClosed_ = true;
    }
    asio::error_code ignored;
    socket_.close(ignored);
    stallArmed_ = false;
    stallTimer_.cancel();
    reader_ = ZemFrameReader();
    outgoing_.clear();
    buffered_.store(queuedBytesHere());
    attachments_.clear();
    receivedFds_.clear();
    heldFrames_.clear();
    failPendingReplies(kind);
    deliver(ZemError(kind));
    if (!interrupted) {
        // Nothing follows an invalid connection: let go of the handler (and what it captured) now, or, when the
        // handler is running further out on this stack (a reply sent from inside it can end the connection), as
        // soon as this block is over.
        if (delivering_ > 0) queue_.async([handler = std::move(handler_)] {});
        handler_ = nullptr;
        if (closedCallback_) std::exchange(closedCallback_, nullptr)();
    }
}

void ZemSocketConnection::deliver(const Event& event) {
    if (!handler_) return;
    ++delivering_;
    handler_(event);
    --delivering_;
}

std::string ZemSocketConnection::description() const {
    return "<zem connection " + serviceName_ + (side_ == Side::Peer ? " peer pid " : " service pid ") +
           std::to_string(pid_.load()) + ">";
}

}  // namespace bexil
