// TypedConnection: typed calls over a plain stream socket, framed as Zem frames (docs/interfaces.md).
//
// The connection is deliberately synchronous and free of the event loop: a plug-in that serves one host needs no
// more than a read loop, and a host's call is one write and the reads up to its reply. Framing errors (a bad header,
// an oversized frame) cannot be resynchronised, so they end the connection; everything inside a well-formed frame
// (an unreadable payload, an unknown selector, an ill-typed argument) is answered with an error reply and the
// connection carries on.

#include "bexil/TypedConnection.h"

#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <mutex>
#include <vector>

#include "client/TypedMessage.h"
#include "platform/zem/ZemFrame.h"
#include "platform/zem/ZemFrameReader.h"

namespace bexil {

namespace {

Error connectionError(std::string_view what) { return BXError(ErrorCode::OperationFailed, what); }

}  // namespace

struct TypedConnection::Impl {
    int socket = -1;
    std::shared_ptr<const BXInterface> interface;
    ZemFrameReader reader;
    uint64_t nextSerial = 1;
    bool ended = false;
    std::mutex mutex;

    std::optional<Error> sendFrame(ZemFrameKind kind, uint64_t serial, uint64_t inReplyTo, const Value& payload) {
        std::vector<uint8_t> bytes;
        if (auto error = ZemFrame::encode(kind, serial, inReplyTo, payload, bytes)) return error;
        size_t done = 0;
        while (done < bytes.size()) {
            ssize_t n = ::send(socket, bytes.data() + done, bytes.size() - done, MSG_NOSIGNAL);
            if (n < 0 && errno == EINTR) continue;
            if (n <= 0) {
                ended = true;
                return connectionError(formatPrintf("the connection ended: %s", std::strerror(errno)));
            }
            done += static_cast<size_t>(n);
        }
        return std::nullopt;
    }

    using Deadline = std::optional<std::chrono::steady_clock::time_point>;

    // The next frame, waiting until `deadline` (none: for ever). None with no error: the peer closed its end.
    Result<std::optional<ZemFrame>> nextFrame(Deadline deadline) {
        for (;;) {
            if (auto frame = reader.next()) return std::optional<ZemFrame>(std::move(*frame));
            if (reader.error()) return *reader.error();
            if (ended) return std::optional<ZemFrame>();
            int wait = -1;
            if (deadline) {
                auto left =
                    std::chrono::duration_cast<std::chrono::milliseconds>(*deadline - std::chrono::steady_clock::now());
                if (left.count() <= 0) return connectionError("no answer in time");
                wait = static_cast<int>(std::min<int64_t>(left.count(), INT32_MAX));
            }
            // Waiting for ever needs no poll: the blocking read is the wait, one system call instead of two.
            if (wait >= 0) {
                pollfd ready{socket, POLLIN, 0};
                int polled = ::poll(&ready, 1, wait);
                if (polled < 0 && errno == EINTR) continue;
                if (polled < 0) return connectionError(formatPrintf("poll: %s", std::strerror(errno)));
                if (polled == 0) continue;
            }
            uint8_t buffer[64 * 1024];
            ssize_t n = ::read(socket, buffer, sizeof buffer);
            if (n < 0 && errno == EINTR) continue;
            if (n < 0 && errno != ECONNRESET) return connectionError(formatPrintf("read: %s", std::strerror(errno)));
            if (n <= 0) {
                ended = true;
                if (reader.hasPartialFrame()) return connectionError("the peer cut a frame short");
                continue;
            }
            if (auto broken = reader.feed(std::span<const uint8_t>(buffer, static_cast<size_t>(n)))) {
                // Frames completed before the break are still delivered; the break comes after them.
                if (auto frame = reader.next()) return std::optional<ZemFrame>(std::move(*frame));
                return *broken;
            }
        }
    }
};

TypedConnection::TypedConnection(int socket, std::shared_ptr<const BXInterface> interface)
    : impl_(std::make_unique<Impl>()) {
    impl_->socket = socket;
    impl_->interface = std::move(interface);
}

TypedConnection::~TypedConnection() {
    if (impl_->socket >= 0) ::close(impl_->socket);
}

Result<std::unique_ptr<TypedConnection>> TypedConnection::bind(int socket, const Value& protocolSpec,
                                                               const std::map<std::string, std::string>& specs) {
    auto refuse = [socket](Error error) -> Result<std::unique_ptr<TypedConnection>> {
        if (socket >= 0) ::close(socket);
        return error;
    };
    if (socket < 0) return refuse(connectionError("no socket to bind"));
    Error missing = BXErrorWithFormat(ErrorCode::InvalidConfiguration, "no protocol named by %@", protocolSpec);
    auto protocol = compoundProtocol(protocolSpec, &missing);
    if (!protocol) return refuse(missing);
    auto interface = BXInterface::interfaceWithProtocol(protocol);
    for (const auto& [selector, spec] : specs)
        if (auto error = applyInterfaceSpec(*interface, selector, spec)) return refuse(*error);
    return std::make_unique<TypedConnection>(socket, std::move(interface));
}

const BXInterface& TypedConnection::interface() const { return *impl_->interface; }

Result<Value> TypedConnection::call(std::string_view selector, const Value& arguments,
                                    std::chrono::milliseconds timeout) {
    std::lock_guard lock(impl_->mutex);
    if (auto refused = impl_->interface->checkArguments(selector, MessageDirection::Request, arguments))
        return *refused;
    if (impl_->ended) return connectionError("the connection has ended");
    // One time limit for the whole call, so that a peer sending other frames cannot keep it waiting.
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    const uint64_t serial = impl_->nextSerial++;
    if (auto error = impl_->sendFrame(ZemFrameKind::Request, serial, 0, typed::callMessage(selector, arguments)))
        return *error;
    for (;;) {
        auto frame = impl_->nextFrame(deadline);
        if (!frame) return frame.error();
        if (!*frame) return connectionError("the peer closed the connection without answering");
        const ZemFrame& got = **frame;
        if (got.kind() == ZemFrameKind::Reply && got.inReplyTo() == serial)
            return typed::readReply(got.payload(), *impl_->interface, selector);
        // This end calls and does not serve: a call from the peer is refused, anything else is not ours.
        if (got.kind() == ZemFrameKind::Request)
            impl_->sendFrame(ZemFrameKind::Reply, 0, got.serial(),
                             typed::errorReply(BXError(ErrorCode::InvalidRequest, "this end answers no calls")));
    }
}

std::optional<Error> TypedConnection::serve(const Handler& handler) {
    std::lock_guard lock(impl_->mutex);
    for (;;) {
        auto frame = impl_->nextFrame(std::nullopt);
        if (!frame) return frame.error();
        if (!*frame) return std::nullopt;
        const ZemFrame& got = **frame;
        if (got.kind() != ZemFrameKind::Request) continue;  // one-way messages and stray replies ask nothing
        Value answer;
        Result<typed::Call> call = typed::readCall(got.payload(), *impl_->interface);
        if (!call) {
            answer = typed::errorReply(call.error());
        } else {
            Result<Value> result = handler ? handler(call->selector, call->arguments)
                                           : Result<Value>(BXError(ErrorCode::InvalidRequest, "no handler"));
            if (!result) {
                answer = typed::errorReply(result.error());
            } else if (auto refused =
                           impl_->interface->checkArguments(call->selector, MessageDirection::Reply, *result)) {
                answer = typed::errorReply(BXErrorWithFormat(ErrorCode::OperationFailed, "ill-typed answer: %s",
                                                             refused->localizedDescription().value_or("")));
            } else {
                answer = typed::replyMessage(*result);
            }
        }
        if (auto error = impl_->sendFrame(ZemFrameKind::Reply, 0, got.serial(), answer)) {
            // An answer that cannot be encoded (text that is not UTF-8, too large) is replaced by an error reply.
            if (impl_->ended) return std::nullopt;
            if (auto again = impl_->sendFrame(ZemFrameKind::Reply, 0, got.serial(), typed::errorReply(*error)))
                return impl_->ended ? std::nullopt : again;
        }
    }
}

}  // namespace bexil
