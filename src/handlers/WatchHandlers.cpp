// "watch" and "unwatch", extensions of ours: a standing query on the client's connection. "watch" takes the rules
// and flags of a "match", checked the same way, and answers with the watch's id, the current result and its
// generation; WatchRegistry then sends the connection one message per change of that result.

#include "bexil/Protocol.h"
#include "daemon/BXDServer.h"
#include "daemon/BXDZemClient.h"
#include "daemon/Transaction.h"
#include "handlers/WatchRegistry.h"
#include "model/MessageForm.h"
#include "platform/log/Log.h"
#include "platform/sandbox/ProcessSandbox.h"

namespace bexil {

void Transaction::watchPlugIns() {
    const Value* rulesEntry = request().find(protocol::key::kRules);
    if (rulesEntry != nullptr && !rulesEntry->isDictionary()) {
        fail(ErrorCode::InvalidRequest, "invalid request format (bad rules dictionary)");
        return;
    }
    Value rules = rulesEntry != nullptr ? *rulesEntry : Value();
    uint64_t flags = request().get(protocol::key::kFlags).numberAsUInt64().value_or(0);
    if ((flags & protocol::discover::kAll) &&
        (!client()->hasEntitlement(protocol::kManagerEntitlement) || processIsSandboxed(client()->pid()))) {
        fail(ErrorCode::NotAllowed, "unauthorized discovery flag (BXDiscoverAll)");
        return;
    }
    // Every message of the watch goes to this connection: a one-way "watch" has nobody to tell its id to.
    if (!requestMessage().expectsReply()) {
        log::ops().error("client %d sent \"watch\" as a message; no watch started", static_cast<int>(client()->pid()));
        fail(ErrorCode::InvalidRequest, "invalid request format (watch expects a reply)");
        return;
    }

    auto outcome = WatchRegistry::of(*server()).start(client(), rules, flags);
    if (auto* refused = std::get_if<WatchRegistry::Refused>(&outcome)) {
        fail(refused->code, refused->message);
        return;
    }
    auto& started = std::get<WatchRegistry::Started>(outcome);
    reply().set(protocol::key::kWatch, Value::uint64(started.id));
    reply().set(protocol::key::kGeneration, Value::uint64(started.generation));
    if (std::optional<Value> encoded = toMessageForm(Value::array(std::move(started.forms)), version()))
        reply().set(protocol::key::kMatches, std::move(*encoded));
    done();
}

void Transaction::unwatchPlugIns() {
    const Value& entry = request().get(protocol::key::kWatch);
    std::optional<uint64_t> id = entry.getUInt64();
    if (!id) {
        std::optional<int64_t> signedId = entry.getInt64();
        if (signedId && *signedId > 0) id = static_cast<uint64_t>(*signedId);
    }
    if (!id) {
        fail(ErrorCode::InvalidRequest, "invalid request format (watch id)");
        return;
    }
    StandingQueries* queries = server()->standingQueries();
    if (queries == nullptr || !static_cast<WatchRegistry*>(queries)->stop(*client(), *id)) {
        fail(ErrorCode::InvalidRequest, "no such watch on this connection");
        return;
    }
    done();
}

}  // namespace bexil
