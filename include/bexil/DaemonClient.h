#pragma once

// The public connection of an application to bxd, the plug-in registry daemon. A DaemonClient holds one connection
// to the daemon's service for its whole life; every request method sends at once and calls back later, on the
// client's own serial queue, with the outcome (one callback at a time, in delivery order). Request methods may be
// called from any thread; wait() blocks the calling thread for one reply and must not be called from a callback.
//
// Values are bexil::Value (bexil/Value.h): immutable, shared property-list values with MutableDictionary and
// MutableArray builders. Errors are bexil::Error in the domain "Bexil" with the daemon's codes.

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "bexil/Error.h"
#include "bexil/Protocol.h"
#include "bexil/Value.h"

namespace bexil {

class DaemonClient {
  public:
    // The outcome of one request.
    struct Reply {
        // The reply dictionary; null when the connection failed in its place.
        Value message;
        // None on success; the daemon's code and message otherwise (code 4 for a failed connection or a reply
        // that never came within wait()'s time limit, and also for a request that could not be sent as it stands,
        // such as one holding text that is not UTF-8: connectionFailed then stays false).
        std::optional<Error> error;
        // True when no reply dictionary came: the daemon is not running, went away or did not answer in time.
        bool connectionFailed = false;
        // launch(): the host's end of the connected socket to the started plug-in; -1 otherwise. Owned by the
        // Reply (and its copies): dup it, or take it with takeChannel, to keep it beyond the Reply.
        int channel() const { return channel_ ? *channel_ : -1; }
        // Gives the socket up to the caller, who closes it; -1 when there is none or it was taken already.
        int takeChannel();
        std::shared_ptr<int> channel_;

        bool ok() const { return !error.has_value(); }
    };
    using Callback = std::function<void(const Reply&)>;

    // Discovery flags of match() (bexil/Protocol.h says what each does).
    static constexpr uint64_t kDiscoverAllVersions = protocol::discover::kAllVersions;
    static constexpr uint64_t kDiscoverAllInstances = protocol::discover::kAllInstances;
    static constexpr uint64_t kDiscoverSystemOnly = protocol::discover::kSystemOnly;
    static constexpr uint64_t kDiscoverAll = protocol::discover::kAll;
    // Hold flags of hold().
    static constexpr uint64_t kHoldPlugInPaths = protocol::hold::kPlugInPaths;
    static constexpr uint64_t kHoldRefuseBusy = protocol::hold::kRefuseBusy;
    static constexpr uint64_t kHoldTerminate = protocol::hold::kTerminate;

    // Connects to `serviceName`, or to the daemon's default service when it is empty.
    explicit DaemonClient(const std::string& serviceName = {});
    ~DaemonClient();
    DaemonClient(const DaemonClient&) = delete;
    DaemonClient& operator=(const DaemonClient&) = delete;

    const std::string& serviceName() const;

    // Requests; paths are absolute file-system paths.
    void add(const std::vector<std::string>& paths, Callback done);
    void remove(const std::vector<std::string>& paths, Callback done);
    void bulk(uint64_t flags, Callback done);
    void ready(const std::vector<Uuid>& plugIns, Callback done);
    void access(const std::vector<Uuid>& plugIns, Callback done);
    // Discovery. Pages through bxd (pages of protocol::page::kDefaultForms) and answers once with every form, in
    // the walk's order (identifier, then registration), with replacement links across pages, and with "generation",
    // the change generation from which changes() follows it.
    void match(const Value& rules, uint64_t flags, Callback done);
    // One page of discovery for callers that stream: at most `pageSize` forms after `continuation` (null for the
    // first page); unless it is the last page, the reply carries "continuation", to pass to the next call.
    void matchPage(const Value& rules, uint64_t flags, uint64_t pageSize, const Value& continuation, Callback done);
    void annotate(const std::vector<Uuid>& plugIns, const Value& annotations, Callback done);
    void bulkAnnotate(const Value& annotations, Callback done);
    void hold(const std::vector<std::string>& paths, uint64_t flags, Callback done);
    void releaseHold(const Uuid& hold, Callback done);
    // The holds in force, under "holds": per hold its "uuid", the "pid" and "executable" of its placer, "created"
    // and "plugins" ("identifier", "uuid", "path"). Needs the manager entitlement.
    void holds(Callback done);
    // What bxd is doing now: "uptime" (seconds), "connections", "served" (request name -> count since start),
    // "cachedRecords", "cacheLimit", "holdCount" and "registered" (absent when the registry cannot be read). Any
    // client may ask. An extension of the protocol (docs/protocol.md).
    void status(Callback done);
    // What changed since `generation` (a "generation" of an earlier match() or changes() reply): "generation", the
    // current one, and "changes", per plug-in its "uuid", "effect" ("added", "removed", "changed"), "kinds" (for
    // "changed"), "generation" and "identifier"; "resync" true when the exclusions changed. A generation older than
    // bxd keeps fails with code 20 (ErrorCode::GenerationTooOld): match() again. An extension of the protocol
    // (docs/protocol.md).
    void changes(uint64_t generation, Callback done);
    // Why match(rules, flags) returns a plug-in or not, step by step. `plugIn` names it: an identifier (string), a
    // UUID (value or text) or an absolute path. The reply's "explanation" holds one entry per candidate ("uuid",
    // "identifier", "version", "path", "outcome", "steps"); when there is none, "notFound" says why. A plug-in this
    // client could never discover is answered as one that is not registered. An extension of the protocol
    // (docs/protocol.md).
    void explain(const Value& rules, uint64_t flags, const Value& plugIn, Callback done);
    // Starts a plug-in that ready() made runnable for this process, in its sandbox; the reply carries "pid" and
    // the socket to the plug-in (Reply::channel). An extension of the protocol (docs/protocol.md).
    void launch(const Uuid& plugIn, Callback done);

    // A standing query (an extension of the protocol, docs/protocol.md): the result of a match() of `rules` and
    // `flags`, kept up to date by bxd, one change at a time, for as long as the watch lasts. Every callback runs on
    // the client's queue, in order; any may be empty.
    struct WatchChange {
        uint64_t generation = 0;
        std::vector<Value> added;          // forms that entered the result
        std::vector<std::string> removed;  // UUID texts of the plug-ins that left it
        std::vector<Value> changed;        // forms that replace the ones held for the same UUIDs
    };
    struct WatchCallbacks {
        // The whole result: when the watch starts, and again after a resync (it replaces everything held before).
        std::function<void(const std::vector<Value>& forms, uint64_t generation)> result;
        // One change of the result.
        std::function<void(const WatchChange& change)> change;
        // The watcher fell behind and bxd dropped what it missed; the library asks for the result again, and
        // `result` follows (or `ended`, when that fails).
        std::function<void(uint64_t generation)> resync;
        // The watch is over without unwatch(): it could not start, or the connection to bxd was lost. Nothing
        // follows.
        std::function<void(const Error& error)> ended;
    };
    // Starts a watch and answers its handle for unwatch(); none, calling nothing, when `rules` is neither null nor
    // a dictionary. A refusal by bxd (code 21 past the limits of watches, the codes of match()) comes to `ended`.
    std::optional<uint64_t> watch(const Value& rules, uint64_t flags, WatchCallbacks callbacks);
    // Ends the watch: no callback of it runs after `done` (which may be empty) has been called.
    void unwatch(uint64_t handle, Callback done = nullptr);

    // Runs `start` with a callback and waits for its reply at most `timeout`:
    //     auto reply = client.wait([&](auto done) { client.bulk(0, done); });
    // When the connection has nothing else in flight, the waiting thread sends the request and reads the reply
    // itself; a callback of the application's own that `start` passes instead still runs on the client's queue.
    Reply wait(const std::function<void(Callback)>& start,
               std::chrono::milliseconds timeout = std::chrono::seconds(30));

    // The plug-in forms of a successful match() reply (dictionaries with "identifier", "uuid", "path", "version",
    // "annotations" ...), or none when the reply has no readable result.
    std::optional<Value> matches(const Reply& reply) const;

    // Calls `callback` on the client's queue with the notification's counter each time `name` is posted (for
    // example "com.quorvel.bexil.annotation-change"). Returns a token for stopObserving, or none when the
    // notification folder cannot be watched.
    std::optional<uint64_t> observe(const std::string& name, std::function<void(uint64_t counter)> callback);
    void stopObserving(uint64_t token);

  private:
    struct Impl;
    std::unique_ptr<Impl> impl_;
};

}  // namespace bexil
