#pragma once

// The standing queries of every client ("watch"): per watch its client, rules and flags and the forms of its result
// set by identifier, and the bookkeeping that keeps that set equal to what a "match" of the same rules by the same
// client would answer after every change. Made by the first "watch" and owned by the server; every member runs on
// the request queue. The change feed's observer calls apply() once per change, after the change is applied.

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <unordered_map>
#include <variant>
#include <vector>

#include "bexil/Protocol.h"
#include "bexil/Value.h"
#include "daemon/ChangeFeed.h"
#include "daemon/StandingQueries.h"

namespace bexil {

class BXDPlugIn;
class BXDServer;
class BXDZemClient;

class WatchRegistry final : public StandingQueries {
  public:
    // The registry of `server`, made (and subscribed to its change feed) on first use.
    static WatchRegistry& of(BXDServer& server);

    explicit WatchRegistry(BXDServer& server);
    ~WatchRegistry() override;
    WatchRegistry(const WatchRegistry&) = delete;
    WatchRegistry& operator=(const WatchRegistry&) = delete;

    struct Started {
        uint64_t id;
        std::vector<Value> forms;  // the current result, in the order of identifiers
        uint64_t generation;
    };
    struct Refused {
        protocol::ErrorCode code;
        std::string message;
    };
    // Registers a watch of `rules` (a dictionary or null) and `flags` for `client`, already checked as "match"
    // checks them, and computes its result. Refused when a limit is reached or the client is gone.
    std::variant<Started, Refused> start(const std::shared_ptr<BXDZemClient>& client, const Value& rules,
                                         uint64_t flags);
    // Ends the watch `id` of `client`; false when the client has no such watch.
    bool stop(const BXDZemClient& client, uint64_t id);

    void releaseClient(const BXDZemClient& client) override;
    size_t count() const override { return watches_.size(); }

    // Brings every watch the change may affect up to date and sends each its message.
    void apply(const Change& change);

  private:
    struct Form {
        std::string uuid;
        Value raw;     // as exported, without replacement links
        Value linked;  // as the watcher has it
        std::vector<std::string> claims;
    };
    struct Watch;
    using FormsByIdentifier = std::map<std::string, std::vector<Form>>;

    // The result of `watch` for one identifier (the forms that win, without links); none when the registry gave
    // nothing.
    std::optional<std::vector<Form>> computeIdentifier(Watch& watch, const std::string& identifier,
                                                       const std::vector<Value>& exclusions);
    // The result of `watch` for every identifier.
    std::optional<FormsByIdentifier> computeAll(Watch& watch, const std::vector<Value>& exclusions);
    // Whether any plug-in of an identifier (its records `plugIns`) passes the watch's rules, so that recomputing it
    // can give a form.
    bool mayMatch(Watch& watch, const std::vector<std::shared_ptr<BXDPlugIn>>& plugIns);
    // What a watcher's result gained, lost (UUID texts) and saw change.
    struct Difference {
        std::vector<Value> added;
        std::vector<Value> removed;
        std::vector<Value> changed;
    };
    // Replaces the forms of the `replaced` identifiers (an empty list removes one), writes the links again where
    // they may have moved, and answers how the watcher's result differs from before.
    Difference update(Watch& watch, FormsByIdentifier replaced);
    // Brings `watch` up to date with a change that touched `identifiers`; `records` holds every plug-in of each.
    void applyToWatch(Watch& watch, const std::set<std::string>& identifiers,
                      std::map<std::string, std::vector<std::shared_ptr<BXDPlugIn>>>& records,
                      const std::vector<Value>& exclusions, uint64_t generation);
    // Runs `work` on the watch; anything it throws ends the watch with a resync, never the daemon.
    void guarded(Watch& watch, uint64_t generation, const std::function<void(Watch&)>& work);
    // Sends the difference as one update message, unless it is empty.
    void send(Watch& watch, Difference difference, uint64_t generation);
    // Sends `message` unless the watcher has fallen too far behind; then it gets a resync and the watch ends.
    bool deliver(Watch& watch, Value message, uint64_t generation);
    // Sends the watcher a resync and ends the watch.
    void resync(Watch& watch, uint64_t generation);
    void end(uint64_t id);

    BXDServer& server_;
    uint64_t subscription_ = 0;
    uint64_t lastId_ = 0;
    std::map<uint64_t, std::unique_ptr<Watch>> watches_;
    // The watches of each client, by the client's connection serial.
    std::unordered_map<uint64_t, std::set<uint64_t>> byClient_;
};

}  // namespace bexil
