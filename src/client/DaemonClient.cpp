// The public facade over BXDaemonClient. It keeps the private types (the Zem connection, queues, the log) out of
// the installed headers and turns raw replies into Reply values, so that an application never sees a connection
// error object or an exception from a reply callback.

#include "bexil/DaemonClient.h"

#include <fcntl.h>
#include <unistd.h>

#include <future>
#include <mutex>
#include <utility>

#include "bexil/bexil.h"
#include "client/BXDaemonClient.h"
#include "client/BXDaemonWatches.h"
#include "platform/log/Log.h"
#include "platform/notify/SystemNotifications.h"

namespace bexil {

const char* libraryVersion() { return BEXIL_LIBRARY_VERSION; }

struct DaemonClient::Impl {
    explicit Impl(const std::string& serviceName) : client(serviceName.empty() ? nullptr : serviceName.c_str()) {}

    BXDaemonClient client;
    BXDaemonWatches watches{client};
    std::unique_ptr<SystemNotifications> notifications;
    std::mutex notificationsMutex;
};

namespace {

Value pathArray(const std::vector<std::string>& paths) {
    MutableArray array;
    array.reserve(paths.size());
    for (const std::string& path : paths) array.append(Value::string(path));
    return array.take();
}

DaemonClient::Reply makeReply(const BXDaemonClient::Reply& raw) {
    DaemonClient::Reply reply;
    if (const Value* message = std::get_if<Value>(&raw)) {
        reply.message = *message;
    } else {
        reply.connectionFailed = std::get<ZemError>(raw).kind() != ZemError::Kind::MessageInvalid;
    }
    try {
        reply.error = BXDaemonClient::errorInReply(raw);
    } catch (const InternalInconsistency& inconsistency) {
        // A reply with a message but no code breaks the protocol; an application callback is no place to throw.
        log::ops().fault("%s", inconsistency.what());
        reply.error = BXError(ErrorCode::OperationFailed, inconsistency.what());
    }
    return reply;
}

// wait()'s own callback: it only fulfils the waiting thread's promise.
struct WaitDone {
    std::shared_ptr<std::promise<DaemonClient::Reply>> promise;
    void operator()(const DaemonClient::Reply& reply) const { promise->set_value(reply); }
};

BXDaemonClient::ReplyHandler adapt(DaemonClient::Callback done) {
    const bool forWait = done.target<WaitDone>() != nullptr;
    auto handler = [done = std::move(done)](const BXDaemonClient::Reply& raw) {
        if (done) done(makeReply(raw));
    };
    // wait()'s callback runs no application code: its reply may be read on the thread that waits for it. Every
    // other callback runs on the client's queue.
    if (forWait) return BXDaemonClient::CallerThreadHandler{std::move(handler)};
    return handler;
}

}  // namespace

DaemonClient::DaemonClient(const std::string& serviceName) : impl_(std::make_unique<Impl>(serviceName)) {}
DaemonClient::~DaemonClient() = default;

const std::string& DaemonClient::serviceName() const { return impl_->client.serviceName(); }

void DaemonClient::add(const std::vector<std::string>& paths, Callback done) {
    impl_->client.addPlugInsReply(pathArray(paths), adapt(std::move(done)));
}
void DaemonClient::remove(const std::vector<std::string>& paths, Callback done) {
    impl_->client.removePlugInsReply(pathArray(paths), adapt(std::move(done)));
}
void DaemonClient::bulk(uint64_t flags, Callback done) {
    impl_->client.bulkPluginsReply(flags, adapt(std::move(done)));
}
void DaemonClient::ready(const std::vector<Uuid>& plugIns, Callback done) {
    impl_->client.readyPlugInsFlagsReply(plugIns, 0, adapt(std::move(done)));
}
void DaemonClient::access(const std::vector<Uuid>& plugIns, Callback done) {
    impl_->client.accessPlugInsFlagsReply(plugIns, 0, adapt(std::move(done)));
}
void DaemonClient::match(const Value& rules, uint64_t flags, Callback done) {
    impl_->client.matchAllPagesReply(rules, flags, protocol::page::kDefaultForms, nullptr, adapt(std::move(done)));
}
void DaemonClient::matchPage(const Value& rules, uint64_t flags, uint64_t pageSize, const Value& continuation,
                             Callback done) {
    impl_->client.matchPagePlugInsFlagsReply(rules, flags, pageSize, continuation, adapt(std::move(done)));
}
void DaemonClient::annotate(const std::vector<Uuid>& plugIns, const Value& annotations, Callback done) {
    impl_->client.setPluginAnnotationsAnnotationsReply(plugIns, annotations, adapt(std::move(done)));
}
void DaemonClient::bulkAnnotate(const Value& annotations, Callback done) {
    impl_->client.bulkSetPluginAnnotationsReply(annotations, adapt(std::move(done)));
}
void DaemonClient::hold(const std::vector<std::string>& paths, uint64_t flags, Callback done) {
    impl_->client.holdPluginsFlagsReply(pathArray(paths), flags, adapt(std::move(done)));
}
void DaemonClient::releaseHold(const Uuid& hold, Callback done) {
    impl_->client.releaseHoldReply(hold, adapt(std::move(done)));
}
void DaemonClient::holds(Callback done) { impl_->client.listHoldsReply(adapt(std::move(done))); }

void DaemonClient::status(Callback done) { impl_->client.statusReply(adapt(std::move(done))); }
void DaemonClient::changes(uint64_t generation, Callback done) {
    impl_->client.changesReply(generation, adapt(std::move(done)));
}
void DaemonClient::explain(const Value& rules, uint64_t flags, const Value& plugIn, Callback done) {
    impl_->client.explainPlugInRulesFlagsReply(plugIn, rules, flags, adapt(std::move(done)));
}
void DaemonClient::launch(const Uuid& plugIn, Callback done) {
    impl_->client.launchPlugInReply(plugIn, [done = std::move(done)](const std::variant<ZemMessage, ZemError>& raw) {
        if (!done) return;
        if (const auto* error = std::get_if<ZemError>(&raw)) return done(makeReply(BXDaemonClient::Reply(*error)));
        const ZemMessage& message = std::get<ZemMessage>(raw);
        Reply reply = makeReply(BXDaemonClient::Reply(message.body()));
        if (reply.ok() && message.descriptorCount() == 1) {
            int fd = fcntl(message.descriptor(0), F_DUPFD_CLOEXEC, 0);
            if (fd >= 0)
                reply.channel_ = std::shared_ptr<int>(new int(fd), [](int* owned) {
                    if (*owned >= 0) ::close(*owned);
                    delete owned;
                });
        }
        done(reply);
    });
}

int DaemonClient::Reply::takeChannel() {
    if (!channel_) return -1;
    return std::exchange(*channel_, -1);
}

std::optional<uint64_t> DaemonClient::watch(const Value& rules, uint64_t flags, WatchCallbacks callbacks) {
    return impl_->watches.watch(rules, flags, std::move(callbacks));
}

void DaemonClient::unwatch(uint64_t handle, Callback done) { impl_->watches.unwatch(handle, adapt(std::move(done))); }

DaemonClient::Reply DaemonClient::wait(const std::function<void(Callback)>& start, std::chrono::milliseconds timeout) {
    // Shared with the callback: a reply that arrives after the wait gave up must still find its promise.
    auto promise = std::make_shared<std::promise<Reply>>();
    std::future<Reply> future = promise->get_future();
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    BXDaemonClient::waitOnCallingThread([&] { start(WaitDone{promise}); }, [deadline] { return deadline; });
    if (future.wait_until(deadline) == std::future_status::ready) return future.get();
    log::ops().error("no reply from bxd within %lld ms", static_cast<long long>(timeout.count()));
    Reply reply;
    reply.connectionFailed = true;
    reply.error = BXError(ErrorCode::OperationFailed, "no reply from bxd within the time limit");
    return reply;
}

std::optional<Value> DaemonClient::matches(const Reply& reply) const {
    if (!reply.ok()) return std::nullopt;
    const Value* encoded = reply.message.find(protocol::key::kMatches);
    if (encoded == nullptr) return std::nullopt;
    std::optional<Value> decoded = impl_->client.convertFromZEM(*encoded);
    if (!decoded || !decoded->isArray()) return std::nullopt;
    return decoded;
}

std::optional<uint64_t> DaemonClient::observe(const std::string& name, std::function<void(uint64_t counter)> callback) {
    std::lock_guard lock(impl_->notificationsMutex);
    if (!impl_->notifications) impl_->notifications = std::make_unique<SystemNotifications>();
    auto token = impl_->notifications->observe(
        name, [callback = std::move(callback)](const std::string&, uint64_t counter) { callback(counter); },
        impl_->client.replyQueue());
    if (!token) {
        log::ops().error("cannot observe %s: %@", name.c_str(), token.error());
        return std::nullopt;
    }
    return *token;
}

void DaemonClient::stopObserving(uint64_t token) {
    std::lock_guard lock(impl_->notificationsMutex);
    if (impl_->notifications) impl_->notifications->cancel(token);
}

}  // namespace bexil
