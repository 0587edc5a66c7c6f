// The feed keeps its log as a deque of changes whose generations run without gaps from windowStart_ + 1 to
// current_, so the changes after a generation start at a computed index. Folding them per plug-in looks at the
// presence of the plug-in before the first change and after the last: a registration can only be a plug-in's first
// appearance (the registry announces the removal of the record it replaces first), so "registered first" means it
// was absent before, and the last registration or unregistration says whether it is there now.

#include "daemon/ChangeFeed.h"

#include <algorithm>
#include <unordered_map>

#include "base/QueueAssert.h"
#include "daemon/GenerationStore.h"
#include "platform/log/Log.h"

namespace bexil {

std::string_view nameOf(Change::Kind kind) {
    switch (kind) {
        case Change::Kind::Registered:
            return "registration";
        case Change::Kind::Unregistered:
            return "unregistration";
        case Change::Kind::Annotated:
            return "annotation";
        case Change::Kind::HoldPlaced:
            return "hold";
        case Change::Kind::HoldReleased:
            return "release";
        case Change::Kind::ExclusionsChanged:
            return "exclusions";
    }
    return "unknown";
}

ChangeFeed::ChangeFeed(std::unique_ptr<GenerationStore> store, std::optional<SerialQueue> queue, size_t capacity)
    : store_(std::move(store)), queue_(std::move(queue)), capacity_(std::max<size_t>(capacity, 1)) {
    if (store_) current_ = store_->start();
    windowStart_ = current_;
}

ChangeFeed::~ChangeFeed() = default;

void ChangeFeed::assertOnQueue() const {
    if (queue_) BX_ASSERT_ON_QUEUE(*queue_);
}

uint64_t ChangeFeed::subscribe(Observer observer) {
    assertOnQueue();
    uint64_t token = nextToken_++;
    observers_.emplace(token, std::move(observer));
    return token;
}

void ChangeFeed::unsubscribe(uint64_t token) {
    assertOnQueue();
    observers_.erase(token);
}

uint64_t ChangeFeed::current() const {
    assertOnQueue();
    return current_;
}

uint64_t ChangeFeed::publish(Change::Kind kind, std::vector<Uuid> plugIns, std::vector<std::string> identifiers) {
    assertOnQueue();
    const uint64_t generation = current_ + 1;
    // The store makes the generation durable before anyone hears of it.
    if (store_) store_->reserveThrough(generation);
    current_ = generation;
    if (log_.size() >= capacity_) {
        // Dropping one at a time keeps the window as long as it can be; the log says so at the first drop and
        // then once per log's worth, not for every change.
        if (dropped_++ % capacity_ == 0)
            log::ops().info(
                "change log full (%zu changes, kLogCapacity): dropping the oldest; \"changes\" before "
                "generation %llu now answers too old",
                capacity_, static_cast<unsigned long long>(log_.front().generation));
        windowStart_ = log_.front().generation;
        log_.pop_front();
    }
    log_.push_back(Change{generation, kind, std::move(plugIns), std::move(identifiers)});
    const Change& change = log_.back();
    // An observer may subscribe or unsubscribe others: each is looked up again just before it is called, and one
    // that subscribes now first hears of the next change.
    std::vector<uint64_t> tokens;
    tokens.reserve(observers_.size());
    for (const auto& [token, observer] : observers_) tokens.push_back(token);
    const Change copy = change;  // the log may move while observers run (one could publish)
    for (uint64_t token : tokens) {
        auto found = observers_.find(token);
        if (found == observers_.end()) continue;
        Observer observer = found->second;  // it may unsubscribe itself while running
        observer(copy);
    }
    return generation;
}

void ChangeFeed::note(Change::Kind kind, std::vector<Uuid> plugIns, std::vector<std::string> identifiers) {
    std::lock_guard lock(notedMutex_);
    noted_.push_back(Noted{kind, std::move(plugIns), std::move(identifiers)});
}

void ChangeFeed::publishPending() {
    assertOnQueue();
    std::vector<Noted> pending;
    {
        std::lock_guard lock(notedMutex_);
        pending.swap(noted_);
    }
    for (Noted& change : pending) publish(change.kind, std::move(change.plugIns), std::move(change.identifiers));
}

uint64_t ChangeFeed::oldestAnswerable() const {
    assertOnQueue();
    return windowStart_;
}

ChangeFeed::Since ChangeFeed::changesSince(uint64_t generation) const {
    assertOnQueue();
    Since since;
    if (generation > current_) {
        since.outcome = Since::Outcome::Ahead;
        return since;
    }
    if (generation < windowStart_) {
        since.outcome = Since::Outcome::TooOld;
        return since;
    }
    struct Folding {
        bool absentBefore = false;
        std::optional<bool> presentAfter;
        std::vector<Change::Kind> kinds;
        uint64_t generation = 0;
        std::string identifier;
    };
    std::unordered_map<std::string, size_t> byUuid;
    std::vector<std::pair<Uuid, Folding>> folded;
    for (auto change = log_.begin() + static_cast<std::ptrdiff_t>(generation - windowStart_); change != log_.end();
         ++change) {
        if (change->kind == Change::Kind::ExclusionsChanged) {
            since.exclusions = change->generation;
            continue;
        }
        for (size_t i = 0; i < change->plugIns.size(); ++i) {
            const Uuid& uuid = change->plugIns[i];
            auto [at, fresh] = byUuid.emplace(uuid.string(), folded.size());
            if (fresh) {
                folded.emplace_back(uuid, Folding{});
                folded.back().second.absentBefore = change->kind == Change::Kind::Registered;
            }
            Folding& entry = folded[at->second].second;
            if (change->kind == Change::Kind::Registered) entry.presentAfter = true;
            if (change->kind == Change::Kind::Unregistered) entry.presentAfter = false;
            if (std::find(entry.kinds.begin(), entry.kinds.end(), change->kind) == entry.kinds.end())
                entry.kinds.push_back(change->kind);
            entry.generation = change->generation;
            if (i < change->identifiers.size()) entry.identifier = change->identifiers[i];
        }
    }
    std::stable_sort(folded.begin(), folded.end(),
                     [](const auto& a, const auto& b) { return a.second.generation < b.second.generation; });
    for (auto& [uuid, entry] : folded) {
        const bool before = !entry.absentBefore;
        const bool after = entry.presentAfter.value_or(before);
        // A plug-in that came and went since the generation was never seen by a client that synced there.
        if (!before && !after) continue;
        PlugInChange change{uuid, PlugInChange::Effect::Changed, {}, entry.generation, std::move(entry.identifier)};
        if (!before)
            change.effect = PlugInChange::Effect::Added;
        else if (!after)
            change.effect = PlugInChange::Effect::Removed;
        else
            change.kinds = std::move(entry.kinds);
        since.plugIns.push_back(std::move(change));
    }
    return since;
}

}  // namespace bexil
