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

struct HandlerEntry {
    std::string_view name;
    void (Transaction::*handler)();
};

// Looked up in this order, byte for byte; the first match wins.
constexpr std::array<HandlerEntry, 9> kHandlers{{
    {"add", &Transaction::addPlugIns},
    {"remove", &Transaction::removePlugIns},
    {"bulk", &Transaction::bulkPlugIns},
    {"match", &Transaction::matchPlugIns},
    {"ready", &Transaction::readyPlugIns},
    {"access", &Transaction::accessPlugIns},
    {"annotate", &Transaction::annotatePlugIns},
    {"bulk-annotate", &Transaction::bulkAnnotatePlugIns},
    {"lock", &Transaction::lockDownPlugIns},
}};

}  // namespace

Transaction::Transaction(ZemMessage request, std::shared_ptr<BXDZemClient> client)
    : request_(std::move(request)), client_(std::move(client)) {}

BXDServer* Transaction::server() const { return client_->server(); }

std::shared_ptr<ZemConnection> Transaction::connection() const { return client_->connection(); }

void Transaction::dispatch() {
    const Value& body = request_.body();
    const std::string* name = body.find("request") ? body.find("request")->getString() : nullptr;
    const Value* versionValue = body.find("version");
    version_ = versionValue && versionValue->getUInt64() ? *versionValue->getUInt64() : 0;

    // The version is checked before anything else, so even a dying client learns that it speaks the wrong one.
    if (version_ != 2 && version_ != kCurrentProtocolVersion) {
        fail(7, formatPrintf("unsupported protocol version %d (current %d)",
                             static_cast<int32_t>(static_cast<uint32_t>(version_)),
                             static_cast<int>(kCurrentProtocolVersion)));
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
        fail(4, "invalid request format (missing type)");
        return;
    }
    runHandler(*name);
}

void Transaction::runHandler(std::string_view name) {
    for (const HandlerEntry& entry : kHandlers) {
        if (entry.name != name) continue;
        try {
            (this->*entry.handler)();
        } catch (const InternalInconsistency& broken) {
            // One bad record must not take the daemon down for every client: this request fails, the rest go on.
            log::ops().fault("internal inconsistency while handling %{public}s: %s", entry.name.data(), broken.what());
            if (!answered()) fail(4, broken.what());
        }
        return;
    }
    fail(4, "unrecognized request");
}

// The code travels as an unsigned 64-bit number: the signed 32-bit code widened with its sign.
static Value wireErrorCode(int code) { return Value::uint64(static_cast<uint64_t>(static_cast<int64_t>(code))); }

void Transaction::done() {
    if (answered_.exchange(true)) {
        log::ops().fault("transaction answered twice for client %d", client_->pid());
        return;
    }
    Value reply = reply_.take();
    // A reply larger than a frame can carry would be dropped by the connection and leave the client waiting for
    // ever; it is answered as an internal failure instead. Measuring walks the reply once without allocating.
    if (Result<size_t> size = ZemCodec::encodedSize(reply); size && *size > ZemFrame::kMaxPayloadBytes) {
        log::ops().error("reply of %zu bytes to client %d exceeds the frame limit of %zu bytes (kMaxFrameBytes)", *size,
                         client_->pid(), ZemFrame::kMaxPayloadBytes);
        reply =
            Value::dictionary({{"errorcode", wireErrorCode(4)},
                               {"error", Value::string(fmt::format("reply of {} bytes exceeds the frame limit of {} "
                                                                   "bytes",
                                                                   *size, ZemFrame::kMaxPayloadBytes))}});
    }
    if (trace::requestOutputEnabled()) trace::requestOutput(client_->pid(), reply.description().c_str());
    std::shared_ptr<ZemConnection> connection = client_->connection();
    if (!connection) return;  // the peer is gone: there is nobody to answer
    connection->sendReply(request_, reply);
}

void Transaction::fail(int code, std::string_view message) {
    reply_.set("errorcode", wireErrorCode(code));
    reply_.set("error", Value::string(message));
    done();
}

void Transaction::fail(int code, const Error& error) {
    if (error.isBexil()) {
        // A Bexil error made without a message answers with its code alone.
        if (!error.localizedDescription()) {
            reply_.set("errorcode", wireErrorCode(static_cast<int>(error.code())));
            done();
            return;
        }
        fail(static_cast<int>(error.code()), *error.localizedDescription());
        return;
    }
    fail(code, error.localizedDescription().value_or(error.description()));
}

}  // namespace bexil
