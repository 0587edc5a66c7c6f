#include "daemon/Transaction.h"

#include <fmt/format.h>

#include <array>

#include "daemon/BXDServer.h"
#include "daemon/BXDZemClient.h"
#include "platform/log/Log.h"
#include "platform/trace/Probes.h"
#include "platform/zem/ZemCodec.h"
#include "platform/zem/ZemConnection.h"
#include "platform/zem/ZemFrame.h"
#include "policy/BXDPlugIn.h"

namespace bexil {

std::optional<Value> zem_dictionary_get_array(const Value& dictionary, std::string_view key) {
    const Value* v = dictionary.find(key);
    if (v && v->isArray()) return *v;
    return std::nullopt;
}

std::optional<Value> zem_dictionary_get_dictionary(const Value& dictionary, std::string_view key) {
    const Value* v = dictionary.find(key);
    if (v && v->isDictionary()) return *v;
    return std::nullopt;
}

namespace {

using protocol::Request;

struct HandlerEntry {
    Request request;
    void (Transaction::*handler)();
};

// One handler per request of the protocol, in the protocol's order and at the index of its enum value (dispatch
// indexes the table by it); the build stops when they drift apart (an entry left out shows as a request out of
// order, since the array has exactly one slot per request).
constexpr std::array<HandlerEntry, protocol::kRequests.size()> kHandlers{{
    {Request::Add, &Transaction::addPlugIns},
    {Request::Remove, &Transaction::removePlugIns},
    {Request::Bulk, &Transaction::bulkPlugIns},
    {Request::Match, &Transaction::matchPlugIns},
    {Request::Ready, &Transaction::readyPlugIns},
    {Request::Access, &Transaction::accessPlugIns},
    {Request::Annotate, &Transaction::annotatePlugIns},
    {Request::BulkAnnotate, &Transaction::bulkAnnotatePlugIns},
    {Request::Lock, &Transaction::lockDownPlugIns},
    {Request::Launch, &Transaction::launchPlugIn},
    {Request::Holds, &Transaction::listHolds},
    {Request::Status, &Transaction::reportStatus},
    {Request::Changes, &Transaction::changesSince},
    {Request::Explain, &Transaction::explainPlugIn},
    {Request::Watch, &Transaction::watchPlugIns},
    {Request::Unwatch, &Transaction::unwatchPlugIns},
}};

constexpr bool handlersFollowTheProtocol() {
    for (size_t i = 0; i < kHandlers.size(); ++i)
        if (kHandlers[i].request != protocol::kRequests[i].request || static_cast<size_t>(kHandlers[i].request) != i)
            return false;
    return true;
}
static_assert(handlersFollowTheProtocol(), "every request of bexil/Protocol.h needs its handler, in the same order");

}  // namespace

Transaction::Transaction(ZemMessage request, std::shared_ptr<BXDZemClient> client)
    : request_(std::move(request)), client_(std::move(client)) {}

BXDServer* Transaction::server() const { return client_->server(); }

std::shared_ptr<ZemConnection> Transaction::connection() const { return client_->connection(); }

void Transaction::dispatch() {
    const Value& body = request_.body();
    const Value* nameValue = body.find(protocol::key::kRequest);
    const std::string* name = nameValue ? nameValue->getString() : nullptr;
    const Value* versionValue = body.find(protocol::key::kVersion);
    version_ = versionValue && versionValue->getUInt64() ? *versionValue->getUInt64() : 0;

    // The version is checked before anything else, so even a dying client learns that it speaks the wrong one.
    if (version_ != protocol::kAcceptedOldVersion && version_ != protocol::kCurrentVersion) {
        fail(ErrorCode::VersionMismatch, formatPrintf("unsupported protocol version %d (current %d)",
                                                      static_cast<int32_t>(static_cast<uint32_t>(version_)),
                                                      static_cast<int>(protocol::kCurrentVersion)));
        return;
    }
    // A client that hung up while its requests waited behind other clients' gets none of them run: its connection
    // would see the end only when its own turn comes, after them, so the death is taken note of here first.
    if (client_->acceptWork() && client_->peerHasHungUp()) client_->dead();
    if (!client_->acceptWork()) return;

    const int pid = client_->pid();
    log::ops().debug("client %d requested %{public}s", pid, name ? name->c_str() : "(null)");
    trace::request(pid, name ? name->c_str() : "");

    if (!name) {
        fail(ErrorCode::InvalidRequest, "invalid request format (missing type)");
        return;
    }
    std::optional<Request> request = protocol::requestNamed(*name);
    if (!request) {
        fail(ErrorCode::InvalidRequest, "unrecognized request");
        return;
    }
    server()->countRequest(*request);
    runHandler(*request);
}

void Transaction::runHandler(Request request) {
    handling_ = request;
    guarded([this, request] { (this->*kHandlers[static_cast<size_t>(request)].handler)(); });
}

void Transaction::guarded(const std::function<void()>& step) {
    try {
        step();
    } catch (const InternalInconsistency& broken) {
        // One bad record must not take the daemon down for every client: this request fails, the rest go on.
        log::ops().fault("internal inconsistency while handling %{public}s: %s", protocol::nameOf(handling_).data(),
                         broken.what());
        if (!answered()) fail(ErrorCode::OperationFailed, broken.what());
    } catch (...) {
        // Anything else that escapes a handler (an allocation failure, a library's exception) is answered the same
        // way, so that the client never waits for a reply that cannot come.
        std::string what = exceptionMessage(std::current_exception());
        log::ops().fault("exception while handling %{public}s: %s", protocol::nameOf(handling_).data(), what.c_str());
        if (!answered()) fail(ErrorCode::OperationFailed, "internal error: " + what);
    }
}

void Transaction::holdReply() {
    if (holding_) return;
    holding_ = true;
    client_->beginWrite();
}

void Transaction::releaseReply() {
    holding_ = false;
    if (heldReply_) {
        HeldReply held = std::move(*heldReply_);
        heldReply_.reset();
        send(std::move(held));
    }
    client_->endWrite();
}

void Transaction::continueOnWriter(std::function<void()> work, std::function<void()> finish) {
    holdReply();
    // The request queue is a handle: a copy stays usable whatever happens to the server meanwhile.
    SerialQueue requests = server()->mainQueue();
    server()->writer().async(
        [self = shared_from_this(), requests, work = std::move(work), finish = std::move(finish)]() mutable {
            self->guarded(work);
            // What the work changed is published before the reply goes out, so a client that has its answer and
            // then asks for changes sees its own.
            self->server()->noteWriterChanges();
            requests.async([self = std::move(self), finish = std::move(finish)] {
                self->server()->changeFeed().publishPending();
                if (finish) self->guarded(finish);
                if (!self->answered()) {
                    log::ops().fault("%{public}s left unanswered for client %d",
                                     protocol::nameOf(self->handling_).data(), self->client_->pid());
                    self->fail(ErrorCode::OperationFailed, "internal error: no reply");
                }
                self->releaseReply();
            });
        });
}

void Transaction::resumeLater(std::function<void()> step) {
    holdReply();
    resumed_ = true;
    server()->mainQueue().asyncInBulk([self = shared_from_this(), step = std::move(step)] {
        self->resumed_ = false;
        self->guarded(step);
        if (!self->answered() && !self->resumed_) {
            log::ops().fault("%{public}s left unanswered for client %d", protocol::nameOf(self->handling_).data(),
                             self->client_->pid());
            self->fail(ErrorCode::OperationFailed, "internal error: no reply");
        }
        if (self->answered()) self->releaseReply();
    });
}

// The code travels as an unsigned 64-bit number: the signed 32-bit code widened with its sign.
static Value wireErrorCode(int64_t code) {
    return Value::uint64(static_cast<uint64_t>(static_cast<int64_t>(static_cast<int32_t>(code))));
}

void Transaction::done() { doneWithDescriptors({}); }

void Transaction::doneWithDescriptors(std::vector<UniqueFd> descriptors) {
    if (answered_.exchange(true)) {
        log::ops().fault("transaction answered twice for client %d", client_->pid());
        return;
    }
    Value reply = reply_.take();
    // A reply larger than a frame can carry would be dropped by the connection and leave the client waiting for
    // ever; it is answered as an internal failure instead. Measuring walks the reply once without allocating.
    if (Result<size_t> size = ZemCodec::encodedSize(reply); size && *size > ZemFrame::kMaxPayloadBytes)
        reply = tooLargeReply(*size);
    answer(HeldReply{std::move(reply), std::move(descriptors), {}});
}

void Transaction::doneWithEncodedEntries(const ZemCodec::Entries& entries) {
    if (answered_.exchange(true)) {
        log::ops().fault("transaction answered twice for client %d", client_->pid());
        return;
    }
    std::vector<uint8_t> encoded;
    if (std::optional<Error> error = ZemCodec::encodeMerged(entries, reply_.take(), encoded)) {
        log::ops().error("cannot encode the reply to client %d: %@", client_->pid(), *error);
        answer(HeldReply{
            Value::dictionary(
                {{std::string(protocol::key::kErrorCode), wireErrorCode(protocol::codeOf(ErrorCode::OperationFailed))},
                 {std::string(protocol::key::kError), Value::string("cannot encode the reply")}}),
            {},
            {}});
        return;
    }
    if (encoded.size() > ZemFrame::kMaxPayloadBytes) {
        answer(HeldReply{tooLargeReply(encoded.size()), {}, {}});
        return;
    }
    answer(HeldReply{Value(), {}, std::move(encoded)});
}

void Transaction::doneWithEncodedReply(std::vector<uint8_t> payload) {
    if (answered_.exchange(true)) {
        log::ops().fault("transaction answered twice for client %d", client_->pid());
        return;
    }
    if (payload.size() > ZemFrame::kMaxPayloadBytes) {
        answer(HeldReply{tooLargeReply(payload.size()), {}, {}});
        return;
    }
    answer(HeldReply{Value(), {}, std::move(payload)});
}

void Transaction::doneWithOversizedReply(size_t size) {
    if (answered_.exchange(true)) {
        log::ops().fault("transaction answered twice for client %d", client_->pid());
        return;
    }
    answer(HeldReply{tooLargeReply(size), {}, {}});
}

Value Transaction::tooLargeReply(size_t size) const {
    log::ops().error("reply of %zu bytes to client %d exceeds the frame limit of %zu bytes (kMaxFrameBytes)", size,
                     client_->pid(), ZemFrame::kMaxPayloadBytes);
    return Value::dictionary(
        {{std::string(protocol::key::kErrorCode), wireErrorCode(protocol::codeOf(ErrorCode::OperationFailed))},
         {std::string(protocol::key::kError),
          Value::string(fmt::format("reply of {} bytes exceeds the frame limit of {} bytes", size,
                                    ZemFrame::kMaxPayloadBytes))}});
}

void Transaction::answer(HeldReply reply) {
    if (holding_) {
        heldReply_ = std::move(reply);
        return;
    }
    send(std::move(reply));
}

void Transaction::send(HeldReply reply) {
    if (trace::requestOutputEnabled()) {
        Value shown = reply.reply;
        if (!reply.encoded.empty()) {
            Result<Value> decoded = ZemCodec::decode(reply.encoded);
            shown = decoded ? *decoded : Value();
        }
        trace::requestOutput(client_->pid(), shown.description().c_str());
    }
    std::shared_ptr<ZemConnection> connection = client_->connection();
    if (!connection) return;  // the peer is gone: there is nobody to answer
    if (!reply.encoded.empty())
        connection->sendEncodedReply(request_, std::move(reply.encoded));
    else if (reply.descriptors.empty())
        connection->sendReply(request_, reply.reply);
    else
        connection->sendReplyWithDescriptors(request_, reply.reply, std::move(reply.descriptors));
}

void Transaction::denyAccess(const BXDPlugIn& plugIn, std::string_view reason) {
    fail(ErrorCode::NotAllowed, formatPrintf("access to plugin %@ denied: %@", plugIn.identifier(), reason));
}

void Transaction::fail(ErrorCode code, std::string_view message) { failWithCode(protocol::codeOf(code), message); }

void Transaction::failWithCode(int64_t code, std::string_view message) {
    reply_.set(protocol::key::kErrorCode, wireErrorCode(code));
    reply_.set(protocol::key::kError, Value::string(message));
    done();
}

void Transaction::fail(ErrorCode code, const Error& error) {
    if (error.isBexil()) {
        // A Bexil error made without a message answers with its code alone.
        if (!error.localizedDescription()) {
            reply_.set(protocol::key::kErrorCode, wireErrorCode(error.code()));
            done();
            return;
        }
        failWithCode(error.code(), *error.localizedDescription());
        return;
    }
    fail(code, error.localizedDescription().value_or(error.description()));
}

}  // namespace bexil
