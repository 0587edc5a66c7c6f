#include "client/BXDaemonWatches.h"

#include "platform/log/Log.h"

namespace bexil {

namespace key = protocol::key;

BXDaemonWatches::~BXDaemonWatches() {
    client_.setMessageHandler(nullptr);
    client_.setConnectionHandler(nullptr);
    // Blocks already queued find the object gone; one running now finishes first.
    std::lock_guard lock(life_->mutex);
    life_->alive = false;
}

std::optional<uint64_t> BXDaemonWatches::watch(const Value& rules, uint64_t flags, Callbacks callbacks) {
    if (!rules.isNull() && !rules.isDictionary()) return std::nullopt;
    auto watch = std::make_shared<Watch>();
    watch->rules = rules;
    watch->flags = flags;
    watch->callbacks = std::move(callbacks);
    {
        std::lock_guard lock(mutex_);
        watch->handle = ++lastHandle_;
        watches_.emplace(watch->handle, watch);
        if (!routing_) {
            routing_ = true;
            client_.setMessageHandler([this, life = life_](const Value& body) {
                std::lock_guard alive(life->mutex);
                if (life->alive) message(body);
            });
            client_.setConnectionHandler([this, life = life_](const ZemError& error) {
                std::lock_guard alive(life->mutex);
                if (life->alive) connectionLost(error);
            });
        }
    }
    start(watch);
    return watch->handle;
}

void BXDaemonWatches::start(const std::shared_ptr<Watch>& watch) {
    client_.watchPlugInsFlagsReply(
        watch->rules, watch->flags, [this, watch, life = life_](const BXDaemonClient::Reply& raw) {
            std::lock_guard alive(life->mutex);
            if (!life->alive) return;
            std::optional<Error> error;
            try {
                error = BXDaemonClient::errorInReply(raw);
            } catch (const InternalInconsistency& broken) {
                error = BXError(ErrorCode::OperationFailed, broken.what());
            }
            // A watch that could not reach bxd ends as one whose connection was lost later does.
            if (const auto* lost = std::get_if<ZemError>(&raw); lost && lost->kind() != ZemError::Kind::MessageInvalid)
                error = BXError(ErrorCode::OperationFailed, std::string(kConnectionLost) + lost->description());
            const Value* reply = std::get_if<Value>(&raw);
            std::optional<uint64_t> id =
                !error && reply != nullptr ? reply->get(key::kWatch).getUInt64() : std::optional<uint64_t>();
            bool wanted = false;
            {
                std::lock_guard lock(mutex_);
                wanted = !watch->cancelled;
                if (wanted && id) {
                    watch->id = id;
                    ids_[*id] = watch;
                } else if (wanted) {
                    watches_.erase(watch->handle);
                }
            }
            if (!wanted) {
                // Unwatched while bxd was starting it: end it there too.
                if (id) client_.unwatchReply(*id, nullptr);
                return;
            }
            if (!id) {
                if (watch->callbacks.ended)
                    watch->callbacks.ended(
                        error.value_or(BXError(ErrorCode::OperationFailed, "bxd answered a watch without id")));
                return;
            }
            std::vector<Value> forms;
            if (std::optional<Value> decoded = client_.convertFromZEM(reply->get(key::kMatches));
                decoded && decoded->isArray())
                forms.assign(decoded->items().begin(), decoded->items().end());
            uint64_t generation = reply->get(key::kGeneration).getUInt64().value_or(0);
            if (watch->callbacks.result) watch->callbacks.result(forms, generation);
        });
}

std::shared_ptr<BXDaemonWatches::Watch> BXDaemonWatches::withId(uint64_t id) {
    std::lock_guard lock(mutex_);
    auto found = ids_.find(id);
    if (found == ids_.end() || found->second->cancelled) return nullptr;
    return found->second;
}

void BXDaemonWatches::message(const Value& body) {
    std::optional<uint64_t> id = body.get(key::kWatch).getUInt64();
    // Messages of a watch that has just ended are dropped: bxd may have sent them before it saw the unwatch.
    std::shared_ptr<Watch> watch = id ? withId(*id) : nullptr;
    if (!watch) {
        if (!id) log::ops().error("message from bxd that belongs to no watch: %@", body);
        return;
    }
    uint64_t generation = body.get(key::kGeneration).getUInt64().value_or(0);
    const std::string* event = body.get(key::kEvent).getString();
    if (event != nullptr && *event == protocol::watch::kResync) {
        // bxd has ended the watch; it starts again here, and its result replaces what the caller held.
        {
            std::lock_guard lock(mutex_);
            ids_.erase(*id);
            watch->id.reset();
        }
        if (watch->callbacks.resync) watch->callbacks.resync(generation);
        start(watch);
        return;
    }
    if (event == nullptr || *event != protocol::watch::kUpdate) {
        log::ops().error("message of watch %llu that is not understood: %@", static_cast<unsigned long long>(*id),
                         body);
        return;
    }
    Change change;
    change.generation = generation;
    const Value& added = body.get(key::kAdded);
    const Value& changed = body.get(key::kChanged);
    change.added.assign(added.items().begin(), added.items().end());
    change.changed.assign(changed.items().begin(), changed.items().end());
    for (const Value& uuid : body.get(key::kRemoved).items())
        if (uuid.isString()) change.removed.emplace_back(uuid.stringView());
    if (watch->callbacks.change) watch->callbacks.change(change);
}

void BXDaemonWatches::connectionLost(const ZemError& error) {
    std::vector<std::shared_ptr<Watch>> ended;
    {
        std::lock_guard lock(mutex_);
        // A watch still starting learns of the end from its own reply.
        for (auto at = watches_.begin(); at != watches_.end();) {
            if (!at->second->id) {
                ++at;
                continue;
            }
            ended.push_back(at->second);
            ids_.erase(*at->second->id);
            at->second->id.reset();
            at = watches_.erase(at);
        }
    }
    Error reason = BXError(ErrorCode::OperationFailed, std::string(kConnectionLost) + error.description());
    for (const std::shared_ptr<Watch>& watch : ended)
        if (watch->callbacks.ended) watch->callbacks.ended(reason);
}

void BXDaemonWatches::unwatch(uint64_t handle, BXDaemonClient::ReplyHandler done) {
    std::optional<uint64_t> id;
    {
        std::lock_guard lock(mutex_);
        auto found = watches_.find(handle);
        if (found != watches_.end()) {
            found->second->cancelled = true;
            id = found->second->id;
            if (id) ids_.erase(*id);
            watches_.erase(found);
        }
    }
    if (id) {
        client_.unwatchReply(*id, std::move(done));
        return;
    }
    // Nothing to ask bxd now (an unknown handle, or a watch still starting, which its reply ends): answered on the
    // reply queue like any reply.
    client_.replyQueue().async([done = std::move(done)] {
        if (done) done(BXDaemonClient::Reply(Value::emptyDictionary()));
    });
}

}  // namespace bexil
