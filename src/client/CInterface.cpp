// The C interface (bexil/bexil-c.h) over DaemonClient. Every entry point is a boundary no C++ exception may cross:
// each catches what it could throw and turns it into an error object. Requests wait with DaemonClient::wait; the
// reply comes on the library's reply queue, so a request made from an observer callback (which runs on that queue)
// would wait for itself until its time limit: a thread-local mark set around each callback refuses it at once.
//
// Observations outlive their cancellation in one way: a post seen just before bexil_stop_observing may already be
// queued. Each observation therefore has a gate (a recursive mutex and an `open` flag) that the callback runs
// under; closing it waits for a running callback, except on the callback's own thread, where the recursive mutex
// lets the callback close its own gate.

#include <unistd.h>

#include <atomic>
#include <cstdlib>
#include <cstring>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "bexil/bexil-c.h"
#include "bexil/bexil.h"
#include "client/JsonText.h"
#include "platform/zem/ZemListener.h"

struct bexil_error {
    int code = 0;
    std::string message;
    bool noReply = false;
    std::optional<std::string> replyJson;
};

namespace bexil {
namespace {

static_assert(BEXIL_DISCOVER_ALL_VERSIONS == protocol::discover::kAllVersions);
static_assert(BEXIL_DISCOVER_ALL_INSTANCES == protocol::discover::kAllInstances);
static_assert(BEXIL_DISCOVER_SYSTEM_ONLY == protocol::discover::kSystemOnly);
static_assert(BEXIL_DISCOVER_ALL == protocol::discover::kAll);
static_assert(BEXIL_HOLD_PLUGIN_PATHS == protocol::hold::kPlugInPaths);
static_assert(BEXIL_HOLD_REFUSE_BUSY == protocol::hold::kRefuseBusy);
static_assert(BEXIL_HOLD_TERMINATE == protocol::hold::kTerminate);
static_assert(BEXIL_ERROR_REGISTRY_REFUSED == protocol::codeOf(ErrorCode::RegistryRefused));
static_assert(BEXIL_ERROR_INVALID_REQUEST == protocol::codeOf(ErrorCode::InvalidRequest));
static_assert(BEXIL_ERROR_BAD_INTERFACE_SPEC == protocol::codeOf(ErrorCode::BadInterfaceSpec));
static_assert(BEXIL_ERROR_VERSION_MISMATCH == protocol::codeOf(ErrorCode::VersionMismatch));
static_assert(BEXIL_ERROR_BAD_PATH == protocol::codeOf(ErrorCode::BadPath));
static_assert(BEXIL_ERROR_NOT_ALLOWED == protocol::codeOf(ErrorCode::NotAllowed));
static_assert(BEXIL_ERROR_INVALID_CONFIGURATION == protocol::codeOf(ErrorCode::InvalidConfiguration));
static_assert(BEXIL_ERROR_PLUGINS_BUSY == protocol::codeOf(ErrorCode::PlugInsBusy));
static_assert(BEXIL_ERROR_BAD_BULK_ANNOTATION == protocol::codeOf(ErrorCode::BadBulkAnnotation));

// Set on a thread while it runs an observer callback.
thread_local bool tInCallback = false;

struct Gate {
    std::recursive_mutex mutex;
    bool open = true;

    void close() {
        std::lock_guard lock(mutex);
        open = false;
    }
};

// A refusal of the library's own, before anything is sent.
struct Refusal {
    std::string message;
};

char* copyText(const std::string& text) {
    char* copy = static_cast<char*>(std::malloc(text.size() + 1));
    if (copy == nullptr) throw std::bad_alloc();
    std::memcpy(copy, text.c_str(), text.size() + 1);
    return copy;
}

int fail(bexil_error** error, bexil_error made) {
    int code = made.code;
    if (error != nullptr) *error = new (std::nothrow) bexil_error(std::move(made));
    return code;
}
int refuse(bexil_error** error, const std::string& message) {
    return fail(error, bexil_error{BEXIL_ERROR_INVALID_REQUEST, message, false, std::nullopt});
}

// Runs one entry point's body, turning a refusal or an exception into an error object.
template <typename Body>
int guarded(const char* what, bexil_error** error, Body&& body) {
    if (error != nullptr) *error = nullptr;
    try {
        return body();
    } catch (const Refusal& refusal) {
        return refuse(error, std::string(what) + ": " + refusal.message);
    } catch (...) {
        return refuse(error,
                      std::string(what) + " failed inside the library: " + exceptionMessage(std::current_exception()));
    }
}

template <typename T>
T* required(T* pointer, const char* name) {
    if (pointer == nullptr) throw Refusal{std::string(name) + " is NULL"};
    return pointer;
}

Value jsonArgument(const char* text, const char* name) {
    Result<Value> value = parseJson(required(text, name));
    if (!value) throw Refusal{std::string(name) + ": " + value.error().localizedDescription().value_or("not JSON")};
    return std::move(*value);
}

Uuid uuidArgument(const char* text, const char* name) {
    std::optional<Uuid> uuid = Uuid::parse(required(text, name));
    if (!uuid) throw Refusal{std::string(name) + ": not a UUID: " + text};
    return *uuid;
}

std::vector<std::string> pathsArgument(const char* const* paths, size_t count) {
    if (count > 0) required(paths, "paths");
    std::vector<std::string> list;
    list.reserve(count);
    for (size_t i = 0; i < count; ++i) list.emplace_back(required(paths[i], "an entry of paths"));
    return list;
}

std::vector<Uuid> uuidsArgument(const char* const* uuids, size_t count) {
    if (count > 0) required(uuids, "uuids");
    std::vector<Uuid> list;
    list.reserve(count);
    for (size_t i = 0; i < count; ++i) list.push_back(uuidArgument(uuids[i], "an entry of uuids"));
    return list;
}

}  // namespace
}  // namespace bexil

struct bexil_client {
    explicit bexil_client(const std::string& service) : client(service) {}

    bexil::DaemonClient client;
    std::atomic<uint32_t> timeoutMs{BEXIL_DEFAULT_TIMEOUT_MS};
    std::mutex gatesMutex;
    std::map<uint64_t, std::shared_ptr<bexil::Gate>> gates;

    // Sends with `start`, waits, and hands out the reply (with `decorate`'s changes) or the error.
    int request(const std::function<void(bexil::DaemonClient::Callback)>& start, char** replyJson, bexil_error** error,
                const std::function<void(bexil::DaemonClient::Reply&, bexil::MutableDictionary&)>& decorate = {}) {
        using namespace bexil;
        if (tInCallback) throw Refusal{"not allowed in an observer callback, where it would wait for its own thread"};
        DaemonClient::Reply reply = client.wait(start, std::chrono::milliseconds(timeoutMs.load()));
        if (!reply.ok()) {
            bexil_error made{static_cast<int>(reply.error->code()), reply.error->localizedDescription().value_or(""),
                             reply.connectionFailed, std::nullopt};
            if (reply.connectionFailed) {
                made.message = "no reply from bxd on service " + client.serviceName() + " (" +
                               ZemListener::socketPathForService(client.serviceName()).string() + "): " + made.message;
            }
            if (reply.message.isDictionary()) made.replyJson = toJson(reply.message, JsonLayout::OneLine);
            return fail(error, std::move(made));
        }
        MutableDictionary dictionary(reply.message.isDictionary() ? reply.message : Value::emptyDictionary());
        if (decorate) decorate(reply, dictionary);
        if (replyJson != nullptr) *replyJson = copyText(toJson(dictionary.take(), JsonLayout::OneLine));
        return BEXIL_OK;
    }
};

using bexil::guarded;
using bexil::Refusal;
using bexil::required;
using Callback = bexil::DaemonClient::Callback;

extern "C" {

const char* bexil_version(void) { return bexil::libraryVersion(); }

int bexil_error_code(const bexil_error* error) { return error ? error->code : 0; }
const char* bexil_error_message(const bexil_error* error) { return error ? error->message.c_str() : ""; }
int bexil_error_no_reply(const bexil_error* error) { return error && error->noReply ? 1 : 0; }
const char* bexil_error_reply(const bexil_error* error) {
    return error && error->replyJson ? error->replyJson->c_str() : nullptr;
}
void bexil_error_free(bexil_error* error) { delete error; }
void bexil_free(void* text) { std::free(text); }

bexil_client* bexil_client_new(const char* service, bexil_error** error) {
    bexil_client* made = nullptr;
    guarded("bexil_client_new", error, [&] {
        made = new bexil_client(service ? service : "");
        return BEXIL_OK;
    });
    return made;
}

void bexil_client_free(bexil_client* client) {
    if (client == nullptr) return;
    std::map<uint64_t, std::shared_ptr<bexil::Gate>> gates;
    {
        std::lock_guard lock(client->gatesMutex);
        gates.swap(client->gates);
        for (const auto& [token, gate] : gates) client->client.stopObserving(token);
    }
    // As in bexil_stop_observing, the gates close outside gatesMutex.
    for (const auto& [token, gate] : gates) gate->close();
    delete client;
}

const char* bexil_client_service(const bexil_client* client) {
    return client ? client->client.serviceName().c_str() : nullptr;
}

int bexil_client_set_timeout(bexil_client* client, uint32_t milliseconds, bexil_error** error) {
    return guarded("bexil_client_set_timeout", error, [&] {
        if (milliseconds == 0) throw Refusal{"a time limit of 0 ms"};
        required(client, "client")->timeoutMs.store(milliseconds);
        return BEXIL_OK;
    });
}

int bexil_add(bexil_client* client, const char* const* paths, size_t count, char** reply_json, bexil_error** error) {
    return guarded("bexil_add", error, [&] {
        auto list = bexil::pathsArgument(paths, count);
        auto& c = required(client, "client")->client;
        return client->request([&](Callback done) { c.add(list, done); }, reply_json, error);
    });
}

int bexil_remove(bexil_client* client, const char* const* paths, size_t count, char** reply_json, bexil_error** error) {
    return guarded("bexil_remove", error, [&] {
        auto list = bexil::pathsArgument(paths, count);
        auto& c = required(client, "client")->client;
        return client->request([&](Callback done) { c.remove(list, done); }, reply_json, error);
    });
}

int bexil_bulk(bexil_client* client, uint64_t flags, char** reply_json, bexil_error** error) {
    return guarded("bexil_bulk", error, [&] {
        auto& c = required(client, "client")->client;
        return client->request([&](Callback done) { c.bulk(flags, done); }, reply_json, error);
    });
}

int bexil_ready(bexil_client* client, const char* const* uuids, size_t count, char** reply_json, bexil_error** error) {
    return guarded("bexil_ready", error, [&] {
        auto list = bexil::uuidsArgument(uuids, count);
        auto& c = required(client, "client")->client;
        return client->request([&](Callback done) { c.ready(list, done); }, reply_json, error);
    });
}

int bexil_access(bexil_client* client, const char* const* uuids, size_t count, char** reply_json, bexil_error** error) {
    return guarded("bexil_access", error, [&] {
        auto list = bexil::uuidsArgument(uuids, count);
        auto& c = required(client, "client")->client;
        return client->request([&](Callback done) { c.access(list, done); }, reply_json, error);
    });
}

int bexil_match(bexil_client* client, const char* rules_json, uint64_t flags, char** reply_json, bexil_error** error) {
    return guarded("bexil_match", error, [&] {
        bexil::Value rules = bexil::jsonArgument(rules_json, "rules_json");
        auto& c = required(client, "client")->client;
        // The reply carries the forms in the message encoding; the caller gets them decoded.
        return client->request([&](Callback done) { c.match(rules, flags, done); }, reply_json, error,
                               [&](bexil::DaemonClient::Reply& reply, bexil::MutableDictionary& dictionary) {
                                   std::optional<bexil::Value> forms = c.matches(reply);
                                   dictionary.set(bexil::protocol::key::kMatches,
                                                  forms ? *forms : bexil::Value::emptyArray());
                               });
    });
}

int bexil_annotate(bexil_client* client, const char* const* uuids, size_t count, const char* annotations_json,
                   char** reply_json, bexil_error** error) {
    return guarded("bexil_annotate", error, [&] {
        auto list = bexil::uuidsArgument(uuids, count);
        bexil::Value annotations = bexil::jsonArgument(annotations_json, "annotations_json");
        auto& c = required(client, "client")->client;
        return client->request([&](Callback done) { c.annotate(list, annotations, done); }, reply_json, error);
    });
}

int bexil_bulk_annotate(bexil_client* client, const char* annotations_json, char** reply_json, bexil_error** error) {
    return guarded("bexil_bulk_annotate", error, [&] {
        bexil::Value annotations = bexil::jsonArgument(annotations_json, "annotations_json");
        auto& c = required(client, "client")->client;
        return client->request([&](Callback done) { c.bulkAnnotate(annotations, done); }, reply_json, error);
    });
}

int bexil_hold(bexil_client* client, const char* const* paths, size_t count, uint64_t flags, char** reply_json,
               bexil_error** error) {
    return guarded("bexil_hold", error, [&] {
        auto list = bexil::pathsArgument(paths, count);
        auto& c = required(client, "client")->client;
        return client->request([&](Callback done) { c.hold(list, flags, done); }, reply_json, error);
    });
}

int bexil_release_hold(bexil_client* client, const char* hold_uuid, char** reply_json, bexil_error** error) {
    return guarded("bexil_release_hold", error, [&] {
        bexil::Uuid hold = bexil::uuidArgument(hold_uuid, "hold_uuid");
        auto& c = required(client, "client")->client;
        return client->request([&](Callback done) { c.releaseHold(hold, done); }, reply_json, error);
    });
}

int bexil_holds(bexil_client* client, char** reply_json, bexil_error** error) {
    return guarded("bexil_holds", error, [&] {
        auto& c = required(client, "client")->client;
        return client->request([&](Callback done) { c.holds(done); }, reply_json, error);
    });
}

int bexil_status(bexil_client* client, char** reply_json, bexil_error** error) {
    return guarded("bexil_status", error, [&] {
        auto& c = required(client, "client")->client;
        return client->request([&](Callback done) { c.status(done); }, reply_json, error);
    });
}

int bexil_launch(bexil_client* client, const char* uuid, int64_t* pid, int* channel, char** reply_json,
                 bexil_error** error) {
    if (channel != nullptr) *channel = -1;
    if (pid != nullptr) *pid = 0;
    return guarded("bexil_launch", error, [&] {
        bexil::Uuid plugIn = bexil::uuidArgument(uuid, "uuid");
        auto& c = required(client, "client")->client;
        return client->request([&](Callback done) { c.launch(plugIn, done); }, reply_json, error,
                               [&](bexil::DaemonClient::Reply& reply, bexil::MutableDictionary&) {
                                   if (pid != nullptr)
                                       *pid = reply.message.get(bexil::protocol::key::kPid).numberAsInt64().value_or(0);
                                   if (channel != nullptr) *channel = reply.takeChannel();
                               });
    });
}

int bexil_observe(bexil_client* client, const char* name, bexil_observer callback, void* context, uint64_t* token,
                  bexil_error** error) {
    return guarded("bexil_observe", error, [&] {
        required(client, "client");
        std::string notification = required(name, "name");
        required(callback, "callback");
        auto gate = std::make_shared<bexil::Gate>();
        std::lock_guard lock(client->gatesMutex);
        std::optional<uint64_t> made =
            client->client.observe(notification, [gate, notification, callback, context](uint64_t counter) {
                std::lock_guard entered(gate->mutex);
                if (!gate->open) return;
                bexil::tInCallback = true;
                callback(notification.c_str(), counter, context);
                bexil::tInCallback = false;
            });
        if (!made) throw Refusal{"cannot watch the notifications of " + notification};
        client->gates.emplace(*made, gate);
        if (token != nullptr) *token = *made;
        return BEXIL_OK;
    });
}

int bexil_stop_observing(bexil_client* client, uint64_t token, bexil_error** error) {
    return guarded("bexil_stop_observing", error, [&] {
        std::shared_ptr<bexil::Gate> gate;
        {
            std::lock_guard lock(required(client, "client")->gatesMutex);
            auto found = client->gates.find(token);
            if (found == client->gates.end()) throw Refusal{"no observation " + std::to_string(token)};
            gate = std::move(found->second);
            client->gates.erase(found);
            client->client.stopObserving(token);
        }
        // Outside gatesMutex: a callback running now may itself be about to take it.
        gate->close();
        return BEXIL_OK;
    });
}

}  // extern "C"
