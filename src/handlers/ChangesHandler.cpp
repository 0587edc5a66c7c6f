// The "changes" request, an extension of ours: what changed since a generation, folded per plug-in by the change
// feed, and told only about plug-ins the caller could see with "match". A plug-in that still exists is shown when it
// passes the visibility part of discovery's filter as it stands now (where it lives, dedication, host policy); one
// that is gone is answered as its bare UUID, which tells a caller nothing it could not have known, since UUIDs are
// random and a caller that never saw it has no use for it. The global exclusions are not per plug-in: a change of
// them sets "resync", and the client discovers again.

#include <memory>
#include <optional>
#include <string>

#include "bexil/Protocol.h"
#include "daemon/BXDServer.h"
#include "daemon/BXDZemClient.h"
#include "daemon/ChangeFeed.h"
#include "daemon/Transaction.h"
#include "platform/log/Log.h"
#include "platform/sandbox/ProcessSandbox.h"
#include "policy/BXDPlugIn.h"
#include "policy/BXHostAccessPolicy.h"

namespace bexil {

namespace {

namespace discover = protocol::discover;
namespace changeKey = protocol::change;

std::string_view effectName(ChangeFeed::PlugInChange::Effect effect) {
    switch (effect) {
        case ChangeFeed::PlugInChange::Effect::Added:
            return changeKey::kAdded;
        case ChangeFeed::PlugInChange::Effect::Removed:
            return changeKey::kRemoved;
        case ChangeFeed::PlugInChange::Effect::Changed:
            return changeKey::kChanged;
    }
    return changeKey::kChanged;
}

// Whether "match" would let the client see the plug-in at all, whatever its rules: the checks discovery makes
// before and after the rules, less holds and exclusions, which are what a change may have altered.
bool visibleTo(BXDPlugIn& plugIn, uint64_t flags, BXDZemClient& client, const BXMatchContext& context) {
    if (flags & discover::kAll) return true;
    if (!plugIn.onSystemVolume() && (!plugIn.containingUrl() || (flags & discover::kSystemOnly))) return false;
    if (!BXHostAccessPolicy::dedicatedPlugInVisibleToHost(plugIn, client.bundle().get())) return false;
    return !plugIn.allowForClient(client, context).has_value();
}

}  // namespace

void Transaction::changesSince() {
    const Value* generationEntry = request().find(protocol::key::kGeneration);
    std::optional<uint64_t> generation = generationEntry != nullptr ? generationEntry->getUInt64() : std::nullopt;
    if (!generation && generationEntry != nullptr) {
        std::optional<int64_t> signedGeneration = generationEntry->getInt64();
        if (signedGeneration && *signedGeneration >= 0) generation = static_cast<uint64_t>(*signedGeneration);
    }
    if (!generation) {
        fail(ErrorCode::InvalidRequest, "invalid request format (generation must be an unsigned integer)");
        return;
    }
    const uint64_t flags = request().get(protocol::key::kFlags).numberAsUInt64().value_or(0);
    const pid_t pid = client()->pid();
    if ((flags & discover::kAll) &&
        (!client()->hasEntitlement(protocol::kManagerEntitlement) || processIsSandboxed(pid))) {
        fail(ErrorCode::NotAllowed, "unauthorized discovery flag (BXDiscoverAll)");
        return;
    }

    BXDServer* database = server();
    // An exclusions change that the folder watch has not reported yet is counted before the answer.
    database->currentExclusions();
    ChangeFeed& feed = database->changeFeed();
    const uint64_t current = feed.current();
    ChangeFeed::Since since = feed.changesSince(*generation);
    switch (since.outcome) {
        case ChangeFeed::Since::Outcome::TooOld:
            log::ops().debug("client %d asked for changes since %llu, before %llu", static_cast<int>(pid),
                             static_cast<unsigned long long>(*generation),
                             static_cast<unsigned long long>(feed.oldestAnswerable()));
            reply().set(protocol::key::kGeneration, Value::uint64(current));
            fail(ErrorCode::GenerationTooOld,
                 formatPrintf("generation %llu is older than the changes bxd keeps; match again",
                              static_cast<unsigned long long>(*generation)));
            return;
        case ChangeFeed::Since::Outcome::Ahead:
            reply().set(protocol::key::kGeneration, Value::uint64(current));
            fail(ErrorCode::InvalidRequest,
                 formatPrintf("generation %llu is ahead of bxd's current generation %llu",
                              static_cast<unsigned long long>(*generation), static_cast<unsigned long long>(current)));
            return;
        case ChangeFeed::Since::Outcome::Answered:
            break;
    }

    BXMatchContext context{.annotations = &database->annotationSource()};
    MutableArray changes;
    for (ChangeFeed::PlugInChange& change : since.plugIns) {
        MutableDictionary entry;
        entry.set(changeKey::kUuid, Value::uuid(change.uuid));
        entry.set(changeKey::kEffect, Value::string(effectName(change.effect)));
        entry.set(changeKey::kGeneration, Value::uint64(change.generation));
        if (change.effect != ChangeFeed::PlugInChange::Effect::Removed) {
            // A plug-in gone since its last published change has its unregistration on the way to the feed; it
            // is left out now and comes as removed with that change.
            std::shared_ptr<BXDPlugIn> plugIn = database->findPlugIn(change.uuid);
            if (!plugIn || !visibleTo(*plugIn, flags, *client(), context)) continue;
            entry.set(changeKey::kIdentifier, Value::string(plugIn->identifier().value_or(change.identifier)));
        }
        if (change.effect == ChangeFeed::PlugInChange::Effect::Changed) {
            MutableArray kinds;
            for (Change::Kind kind : change.kinds) kinds.append(Value::string(nameOf(kind)));
            entry.set(changeKey::kKinds, kinds.take());
        }
        changes.append(entry.take());
    }
    reply().set(protocol::key::kGeneration, Value::uint64(current));
    reply().set(protocol::key::kChanges, changes.take());
    if (since.exclusions) reply().set(protocol::key::kResync, Value::boolean(true));
    done();
}

}  // namespace bexil
