#pragma once

// The daemon's record of every change a client could observe through "match": each change gets the next
// generation, goes into a bounded in-memory log (what "changes" answers from) and is handed to the subscribed
// observers. Owned by BXDServer and used on its request queue only, except note(), which any thread may call to
// queue a change that the request queue publishes with publishPending().
//
// Generations come from a GenerationStore when one is given, which reserves them on disk before they are handed out
// so that no generation is ever handed out twice, not across restarts and crashes either.

#include <cstddef>
#include <cstdint>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/SerialQueue.h"
#include "bexil/Uuid.h"

namespace bexil {

class GenerationStore;

// One change a client could observe through "match", as bxd applied it (on the request queue).
struct Change {
    enum class Kind { Registered, Unregistered, Annotated, HoldPlaced, HoldReleased, ExclusionsChanged };
    uint64_t generation;  // the generation this change produced
    Kind kind;
    std::vector<Uuid> plugIns;             // the plug-ins it touched (empty for ExclusionsChanged: it may touch any)
    std::vector<std::string> identifiers;  // their identifiers, for recomputing per identifier
                                           // (identifiers[i] is plugIns[i]'s; empty text when it had none)
};

// The name of a kind as "changes" answers it ("registration", "annotation", ...).
std::string_view nameOf(Change::Kind kind);

class ChangeFeed {
  public:
    using Observer = std::function<void(const Change&)>;

    // The most changes the log keeps; older ones are dropped (logged once per drop) and "changes" for a generation
    // before the oldest kept answers "too old".
    static constexpr size_t kLogCapacity = 65536;

    // Generations from `store` (none: counted in memory from 0, for tests). `queue` (none: unchecked) is the queue
    // every member but note() must be called on. `capacity` bounds the log (tests use small ones).
    explicit ChangeFeed(std::unique_ptr<GenerationStore> store = nullptr, std::optional<SerialQueue> queue = {},
                        size_t capacity = kLogCapacity);
    ~ChangeFeed();
    ChangeFeed(const ChangeFeed&) = delete;
    ChangeFeed& operator=(const ChangeFeed&) = delete;

    uint64_t subscribe(Observer observer);  // token
    void unsubscribe(uint64_t token);
    uint64_t current() const;  // the generation now

    // Applies the next generation to a change that has just been applied (and made durable where it must be), logs
    // it and calls every observer with it, in the order of subscription. Returns the new generation.
    uint64_t publish(Change::Kind kind, std::vector<Uuid> plugIns, std::vector<std::string> identifiers);

    // Queues a change made on another thread (the database's writer) for publishPending; safe from any thread.
    void note(Change::Kind kind, std::vector<Uuid> plugIns, std::vector<std::string> identifiers);
    // Publishes what note() queued, in the order it was noted.
    void publishPending();

    // What "changes" answers for one plug-in: its changes since a generation, folded into one entry.
    struct PlugInChange {
        enum class Effect { Added, Removed, Changed };
        Uuid uuid;
        Effect effect;
        // The kinds of change it went through, each once, in the order first seen (Changed entries only).
        std::vector<Change::Kind> kinds;
        // The generation of its latest change, and its identifier as that change named it.
        uint64_t generation;
        std::string identifier;
    };
    struct Since {
        enum class Outcome { Answered, TooOld, Ahead };
        Outcome outcome = Outcome::Answered;
        std::vector<PlugInChange> plugIns;  // in the order of each plug-in's latest change
        // The generation of the latest exclusions change since, if any: every plug-in may have changed.
        std::optional<uint64_t> exclusions;
    };
    // The changes after `generation`, folded per plug-in (see docs/protocol.md for the rules).
    Since changesSince(uint64_t generation) const;
    // The oldest generation changesSince answers for: the one before the oldest change kept.
    uint64_t oldestAnswerable() const;

  private:
    struct Noted {
        Change::Kind kind;
        std::vector<Uuid> plugIns;
        std::vector<std::string> identifiers;
    };

    void assertOnQueue() const;

    std::unique_ptr<GenerationStore> store_;
    std::optional<SerialQueue> queue_;
    size_t capacity_;
    uint64_t current_ = 0;
    // The generation before the oldest change in log_ (current_ while nothing was ever dropped in this run).
    uint64_t windowStart_ = 0;
    std::deque<Change> log_;
    uint64_t dropped_ = 0;
    uint64_t nextToken_ = 1;
    std::map<uint64_t, Observer> observers_;
    std::mutex notedMutex_;
    std::vector<Noted> noted_;
};

}  // namespace bexil
