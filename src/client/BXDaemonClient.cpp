#include "client/BXDaemonClient.h"

#include <deque>
#include <unordered_map>
#include <utility>

#include "model/MessageForm.h"
#include "platform/log/Log.h"

namespace bexil {

namespace {

namespace key = protocol::key;
using protocol::Request;

constexpr std::string_view kUnknownErrorMessage = "unknown error returned by Bexil subsystem";

// The requests made with a CallerThreadHandler inside waitOnCallingThread on this thread, waiting to be sent. A
// handler that runs on the waiting thread and asks again (the next page) only adds to the list, so a long exchange
// of pages is a loop, not a recursion.
struct CallerThreadRequests {
    struct Request {
        BXDaemonClient* client;
        Value message;
        BXDaemonClient::ReplyHandler reply;
    };
    std::deque<Request> requests;
};
thread_local CallerThreadRequests* callerThreadRequests = nullptr;

BXDaemonClient::Reply replyOf(const std::variant<ZemMessage, ZemError>& answer) {
    if (const auto* message = std::get_if<ZemMessage>(&answer)) return BXDaemonClient::Reply(message->body());
    return BXDaemonClient::Reply(std::get<ZemError>(answer));
}

void traceReply(const BXDaemonClient::Reply& answer) {
    if (const auto* error = std::get_if<ZemError>(&answer)) {
        log::traffic().debug("reply: %@", *error);
    } else {
        log::traffic().debug("reply: %@", std::get<Value>(answer));
    }
}

}  // namespace

BXDaemonClient::BXDaemonClient(const char* serviceName, EventLoop& loop)
    : serviceName_(serviceName != nullptr ? serviceName : kDefaultServiceName),
      replyQueue_(kReplyQueueLabel, loop),
      bxd_(ZemConnection::createClient(serviceName_, replyQueue_)),
      protocolVersion_(0) {
    // Replies come through their own handlers, and a failed connection answers every outstanding request with the
    // error. What remains are the messages of watches and the end of the connection, for whoever set a handler.
    // Replies are queued to the reply queue as their frames are read, while events are delivered at once: both
    // go through the queue here, so a watch's messages never overtake the reply that started the watch.
    bxd_->setEventHandler([handlers = handlers_, queue = replyQueue_](const ZemConnection::Event& event) {
        if (const auto* error = std::get_if<ZemError>(&event)) {
            log::ops().error("Communications error: %{public}@", *error);
            queue.async([handlers, error = *error] {
                ConnectionHandler handler;
                {
                    std::lock_guard lock(handlers->mutex);
                    handler = handlers->connection;
                }
                if (handler) handler(error);
            });
            return;
        }
        const ZemMessage& message = std::get<ZemMessage>(event);
        queue.async([handlers, body = message.body()] {
            MessageHandler handler;
            {
                std::lock_guard lock(handlers->mutex);
                handler = handlers->message;
            }
            if (handler)
                handler(body);
            else
                log::ops().error("Communications error: %{public}@", body);
        });
    });
    protocolVersion_.store(kProtocolVersion, std::memory_order_relaxed);
    bxd_->resume();
}

BXDaemonClient::~BXDaemonClient() {
    {
        std::lock_guard lock(life_->mutex);
        life_->alive = false;
    }
    bxd_->cancel();
}

std::shared_ptr<BXDaemonClient> BXDaemonClient::initWithServiceName(const char* serviceName) {
    return std::make_shared<BXDaemonClient>(serviceName);
}

MutableDictionary BXDaemonClient::request(protocol::Request name) const {
    MutableDictionary request;
    request.set(key::kRequest, Value::string(protocol::nameOf(name)));
    // The version travels unsigned; a negative setting goes out as its two's complement, which bxd refuses.
    request.set(key::kVersion, Value::uint64(static_cast<uint64_t>(protocolVersion())));
    return request;
}

MutableDictionary BXDaemonClient::requestPaths(protocol::Request name, const Value& paths) const {
    MutableDictionary message = request(name);
    message.set(key::kPaths, paths);
    return message;
}

void BXDaemonClient::setUuids(MutableDictionary& request, const std::vector<Uuid>& uuids) {
    MutableArray array;
    array.reserve(uuids.size());
    for (const Uuid& uuid : uuids) array.append(Value::uuid(uuid));
    request.set(key::kUuids, array.take());
}

void BXDaemonClient::sendReply(const Value& request, ReplyHandler reply) {
    if (callerThreadRequests != nullptr && reply.target<CallerThreadHandler>() != nullptr) {
        callerThreadRequests->requests.push_back({this, request, std::move(reply)});
        return;
    }
    sendOnQueue(request, std::move(reply));
}

void BXDaemonClient::sendOnQueue(const Value& request, ReplyHandler reply) {
    log::traffic().debug("request: %@", request);
    bxd_->sendWithReply(request, replyQueue_, [reply = std::move(reply)](const Reply& answer) {
        traceReply(answer);
        if (reply) reply(answer);
    });
}

void BXDaemonClient::exchangeOnCallingThread(const Value& request, ReplyHandler reply,
                                             std::chrono::steady_clock::time_point deadline) {
    log::traffic().debug("request: %@", request);
    ZemConnection::MessageReplyHandler handler =
        [reply = std::move(reply)](const std::variant<ZemMessage, ZemError>& answer) {
            Reply raw = replyOf(answer);
            traceReply(raw);
            reply(raw);
        };
    if (bxd_->exchangeOnCallingThread(request, replyQueue_, handler, deadline)) return;
    bxd_->sendWithMessageReply(request, replyQueue_, std::move(handler));
}

void BXDaemonClient::waitOnCallingThread(const std::function<void()>& start,
                                         const std::function<std::chrono::steady_clock::time_point()>& deadline) {
    CallerThreadRequests pending;
    struct Scope {
        CallerThreadRequests* outer;
        explicit Scope(CallerThreadRequests* mine) : outer(std::exchange(callerThreadRequests, mine)) {}
        ~Scope() { callerThreadRequests = outer; }
    } scope(&pending);
    start();
    while (!pending.requests.empty()) {
        CallerThreadRequests::Request next = std::move(pending.requests.front());
        pending.requests.pop_front();
        next.client->exchangeOnCallingThread(next.message, std::move(next.reply), deadline());
    }
}

void BXDaemonClient::addPlugInsReply(const Value& paths, ReplyHandler reply) {
    sendReply(requestPaths(Request::Add, paths).take(), std::move(reply));
}

void BXDaemonClient::removePlugInsReply(const Value& paths, ReplyHandler reply) {
    sendReply(requestPaths(Request::Remove, paths).take(), std::move(reply));
}

void BXDaemonClient::bulkPluginsReply(uint64_t flags, ReplyHandler reply) {
    MutableDictionary message = request(Request::Bulk);
    message.set(key::kFlags, Value::uint64(flags));
    sendReply(message.take(), std::move(reply));
}

void BXDaemonClient::readyPlugInsFlagsReply(const std::vector<Uuid>& uuids, uint64_t flags, ReplyHandler reply) {
    MutableDictionary message = request(Request::Ready);
    message.set(key::kFlags, Value::uint64(flags));
    setUuids(message, uuids);
    sendReply(message.take(), std::move(reply));
}

void BXDaemonClient::accessPlugInsFlagsReply(const std::vector<Uuid>& uuids, uint64_t flags, ReplyHandler reply) {
    MutableDictionary message = request(Request::Access);
    message.set(key::kFlags, Value::uint64(flags));
    setUuids(message, uuids);
    sendReply(message.take(), std::move(reply));
}

void BXDaemonClient::matchPlugInsFlagsReply(const Value& rules, uint64_t flags, ReplyHandler reply) {
    MutableDictionary message = request(Request::Match);
    message.set(key::kRules, rules);
    message.set(key::kFlags, Value::uint64(flags));
    sendReply(message.take(), std::move(reply));
}

void BXDaemonClient::matchPagePlugInsFlagsReply(const Value& rules, uint64_t flags, uint64_t pageSize,
                                                const Value& continuation, ReplyHandler reply) {
    MutableDictionary message = request(Request::Match);
    message.set(key::kRules, rules);
    message.set(key::kFlags, Value::uint64(flags));
    message.set(key::kPageSize, Value::uint64(pageSize));
    if (!continuation.isNull()) message.set(key::kContinuation, continuation);
    sendReply(message.take(), std::move(reply));
}

void BXDaemonClient::explainPlugInRulesFlagsReply(const Value& plugIn, const Value& rules, uint64_t flags,
                                                  ReplyHandler reply) {
    MutableDictionary message = request(Request::Explain);
    message.set(key::kPlugIn, plugIn);
    if (!rules.isNull()) message.set(key::kRules, rules);
    message.set(key::kFlags, Value::uint64(flags));
    sendReply(message.take(), std::move(reply));
}

struct BXDaemonClient::PagedWalk {
    Value rules;
    uint64_t flags;
    uint64_t pageSize;
    PageProgress progress;
    ReplyHandler reply;
    std::vector<Value> forms;
    size_t pages = 0;
    bool sawMatches = false;
    Value generation;
};

void BXDaemonClient::matchAllPagesReply(const Value& rules, uint64_t flags, uint64_t pageSize, PageProgress progress,
                                        ReplyHandler reply) {
    auto walk = std::make_shared<PagedWalk>();
    walk->rules = rules;
    walk->flags = flags;
    walk->pageSize = pageSize;
    walk->progress = std::move(progress);
    walk->reply = std::move(reply);
    continueWalk(walk, Value());
}

void BXDaemonClient::continueWalk(const std::shared_ptr<PagedWalk>& walk, const Value& continuation) {
    auto onPage = [this, walk, life = life_](const Reply& raw) {
        const Value* message = std::get_if<Value>(&raw);
        bool failed = message == nullptr;
        try {
            failed = failed || errorInReply(raw).has_value();
        } catch (const InternalInconsistency&) {
            failed = true;
        }
        if (failed) return walk->reply(raw);
        if (++walk->pages == 1) walk->generation = message->get(key::kGeneration);
        // The message form of the discovery result is the value itself, so pages join as they come.
        if (const Value* matches = message->find(key::kMatches); matches != nullptr && matches->isArray()) {
            walk->sawMatches = true;
            walk->forms.insert(walk->forms.end(), matches->items().begin(), matches->items().end());
        }
        const Value* next = message->find(key::kContinuation);
        if (next != nullptr && next->isData()) {
            if (walk->progress) walk->progress(walk->forms.size());
            {
                std::lock_guard lock(life->mutex);
                if (life->alive) return continueWalk(walk, *next);
            }
            // The client went away with this page on its way: the walk ends as its outstanding requests did.
            return walk->reply(Reply(ZemError(ZemError::Kind::ConnectionInvalid)));
        }
        MutableDictionary whole(*message);
        whole.remove(key::kContinuation);
        if (!walk->generation.isNull()) whole.set(key::kGeneration, walk->generation);
        if (walk->sawMatches) {
            if (walk->pages > 1) linkReplacements(walk->forms);
            whole.set(key::kMatches, Value::array(std::move(walk->forms)));
        }
        walk->reply(Reply(whole.take()));
    };
    // A walk for a waiting thread stays on it from page to page.
    if (walk->reply.target<CallerThreadHandler>() != nullptr)
        matchPagePlugInsFlagsReply(walk->rules, walk->flags, walk->pageSize, continuation,
                                   CallerThreadHandler{std::move(onPage)});
    else
        matchPagePlugInsFlagsReply(walk->rules, walk->flags, walk->pageSize, continuation, std::move(onPage));
}

void BXDaemonClient::linkReplacements(std::vector<Value>& forms) {
    // The entitlement a plug-in names the identifiers it replaces with: a string, or an array of strings.
    static constexpr std::string_view kReplaces = "com.quorvel.developer.replace-plugin";
    // As in the daemon, the last form to claim an identifier takes it over.
    std::unordered_map<std::string, size_t> replacing;
    for (size_t i = 0; i < forms.size(); ++i) {
        const Value* claim = forms[i].get(protocol::form::kEntitlements).find(kReplaces);
        if (claim == nullptr) continue;
        if (claim->isString()) replacing[std::string(claim->stringView())] = i;
        for (const Value& element : claim->items())
            if (element.isString()) replacing[std::string(element.stringView())] = i;
    }
    if (replacing.empty()) return;
    std::vector<std::optional<MutableDictionary>> changed(forms.size());
    auto edit = [&](size_t i) -> MutableDictionary& {
        if (!changed[i]) changed[i].emplace(forms[i]);
        return *changed[i];
    };
    for (size_t i = 0; i < forms.size(); ++i) {
        std::string identifier(forms[i].get(protocol::form::kIdentifier).stringView());
        auto claim = replacing.find(identifier);
        if (claim == replacing.end()) continue;
        Value uuid = forms[claim->second].get(protocol::form::kUuid);
        edit(i).set(protocol::form::kOverrider, uuid);
        edit(claim->second).set(protocol::form::kOverriding, Value::string(identifier));
    }
    for (size_t i = 0; i < forms.size(); ++i)
        if (changed[i]) forms[i] = changed[i]->take();
}

void BXDaemonClient::setPluginAnnotationsAnnotationsReply(const std::vector<Uuid>& uuids, const Value& annotations,
                                                          ReplyHandler reply) {
    MutableDictionary message = request(Request::Annotate);
    setUuids(message, uuids);
    message.set(key::kAnnotations, annotations);
    sendReply(message.take(), std::move(reply));
}

void BXDaemonClient::bulkSetPluginAnnotationsReply(const Value& annotations, ReplyHandler reply) {
    MutableDictionary message = request(Request::BulkAnnotate);
    message.set(key::kAnnotations, annotations);
    sendReply(message.take(), std::move(reply));
}

void BXDaemonClient::holdPluginsFlagsReply(const Value& paths, uint64_t flags, ReplyHandler reply) {
    MutableDictionary message = requestPaths(Request::Lock, paths);
    message.set(key::kFlags, Value::uint64(flags));
    sendReply(message.take(), std::move(reply));
}

void BXDaemonClient::releaseHoldReply(const Uuid& hold, ReplyHandler reply) {
    MutableDictionary message = request(Request::Lock);
    setUuids(message, {hold});
    sendReply(message.take(), std::move(reply));
}

void BXDaemonClient::listHoldsReply(ReplyHandler reply) { sendReply(request(Request::Holds).take(), std::move(reply)); }

void BXDaemonClient::statusReply(ReplyHandler reply) { sendReply(request(Request::Status).take(), std::move(reply)); }

void BXDaemonClient::changesReply(uint64_t generation, ReplyHandler reply) {
    MutableDictionary message = request(Request::Changes);
    message.set(key::kGeneration, Value::uint64(generation));
    sendReply(message.take(), std::move(reply));
}

void BXDaemonClient::launchPlugInReply(const Uuid& plugIn, MessageReplyHandler reply) {
    MutableDictionary message = request(Request::Launch);
    setUuids(message, {plugIn});
    Value request = message.take();
    log::traffic().debug("request: %@", request);
    bxd_->sendWithMessageReply(request, replyQueue_, std::move(reply));
}

void BXDaemonClient::watchPlugInsFlagsReply(const Value& rules, uint64_t flags, ReplyHandler reply) {
    MutableDictionary message = request(Request::Watch);
    if (!rules.isNull()) message.set(key::kRules, rules);
    message.set(key::kFlags, Value::uint64(flags));
    sendReply(message.take(), std::move(reply));
}

void BXDaemonClient::unwatchReply(uint64_t watch, ReplyHandler reply) {
    MutableDictionary message = request(Request::Unwatch);
    message.set(key::kWatch, Value::uint64(watch));
    sendReply(message.take(), std::move(reply));
}

void BXDaemonClient::setMessageHandler(MessageHandler handler) {
    std::lock_guard lock(handlers_->mutex);
    handlers_->message = std::move(handler);
}

void BXDaemonClient::setConnectionHandler(ConnectionHandler handler) {
    std::lock_guard lock(handlers_->mutex);
    handlers_->connection = std::move(handler);
}

std::optional<Error> BXDaemonClient::errorInReply(const Reply& reply) {
    if (const auto* error = std::get_if<ZemError>(&reply)) {
        if (error->kind() == ZemError::Kind::MessageInvalid)
            return BXError(
                ErrorCode::InvalidRequest,
                "the request cannot be sent: it holds text that is not UTF-8, nests too deep or is too large");
        return BXError(ErrorCode::OperationFailed, error->description());
    }
    const Value& dictionary = std::get<Value>(reply);
    // Only the low 32 bits of the code are looked at: the daemon widens a signed 32-bit code with its sign.
    int32_t code = 0;
    if (const Value* entry = dictionary.find(key::kErrorCode)) {
        if (auto u = entry->numberAsUInt64()) {
            code = static_cast<int32_t>(static_cast<uint32_t>(*u));
        } else if (auto i = entry->numberAsInt64()) {
            code = static_cast<int32_t>(static_cast<uint32_t>(static_cast<uint64_t>(*i)));
        }
    }
    const std::string* message = nullptr;
    if (const Value* entry = dictionary.find(key::kError)) message = entry->getString();
    if (code == 0 && message == nullptr) return std::nullopt;
    if (code == 0) throw InternalInconsistency(formatPrintf("bxd reported error without a code: %s", *message));
    if (message == nullptr) return BXError(code, kUnknownErrorMessage);
    return BXError(code, *message);
}

// The message form is shared with the daemon (model/MessageForm.h).
std::optional<Value> BXDaemonClient::convertToZEMVersion(const Value& value, int64_t version) {
    return toMessageForm(value, static_cast<uint64_t>(version));
}

std::optional<Value> BXDaemonClient::convertFromZEM(const Value& value) const {
    return fromMessageForm(value, static_cast<uint64_t>(protocolVersion()));
}

}  // namespace bexil
