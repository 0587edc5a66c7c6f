// Standing queries. A watch keeps, per identifier, the forms its result holds for it: discovery decides everything
// about a plug-in within its identifier (the filter looks at the plug-in alone, the competition is among the forms
// of one identifier), so a change that names identifiers is answered by computing those identifiers again for each
// watch and comparing with what the watch held. The cost of a change is the identifiers it touched times the watches
// whose rules any plug-in of those identifiers can meet, whatever the size of the registry. An exclusions change can
// touch any identifier: each watch is computed again in full.
//
// Two things cross identifiers. Replacement links ("overrider", "overriding") are written from the forms in the
// watch's result, as the client library writes them across the pages of a discovery: when several forms claim one
// identifier, the last in the walk's order (identifier, then registration) wins. They are written again for every
// identifier whose links may have moved with the forms computed. The election a replacing plug-in takes over from
// the identifier it replaces is the other: see the FIXME in apply().
//
// A watcher that does not read is not allowed to make bxd hold its backlog: before each message the bytes waiting
// towards its connection are looked at, and past protocol::watch::kMaxQueuedBytes the watch ends with one "resync"
// message in place of everything it missed.

#include "handlers/WatchRegistry.h"

#include <algorithm>

#include "daemon/BXDServer.h"
#include "daemon/BXDZemClient.h"
#include "handlers/DiscoveryFilter.h"
#include "platform/log/Log.h"
#include "platform/zem/ZemCodec.h"
#include "platform/zem/ZemConnection.h"
#include "platform/zem/ZemFrame.h"
#include "policy/BXDPlugIn.h"

namespace bexil {

namespace {

namespace key = protocol::key;
namespace formKey = protocol::form;
namespace limits = protocol::watch;

std::string textOf(const Value& form, std::string_view entry) {
    const Value* value = form.find(entry);
    return value != nullptr && value->isString() ? std::string(value->stringView()) : std::string();
}

// The identifiers a form's plug-in says it replaces, read from its entitlements as the client library reads them.
std::vector<std::string> claimsOf(const Value& form) {
    std::vector<std::string> claims;
    const Value* claim = form.get(formKey::kEntitlements).find(BXDPlugIn::kReplacePlugInEntitlement);
    if (claim == nullptr) return claims;
    if (claim->isString()) claims.emplace_back(claim->stringView());
    for (const Value& element : claim->items())
        if (element.isString()) claims.emplace_back(element.stringView());
    return claims;
}

}  // namespace

struct WatchRegistry::Watch {
    uint64_t id = 0;
    std::shared_ptr<BXDZemClient> client;
    Value rules;
    uint64_t flags = 0;
    FormsByIdentifier forms;
    // Claimed identifier -> the identifiers whose forms in `forms` claim it.
    std::map<std::string, std::set<std::string>> claimants;
};

WatchRegistry& WatchRegistry::of(BXDServer& server) {
    if (server.standingQueries() == nullptr) server.setStandingQueries(std::make_unique<WatchRegistry>(server));
    return static_cast<WatchRegistry&>(*server.standingQueries());
}

WatchRegistry::WatchRegistry(BXDServer& server) : server_(server) {
    subscription_ = server_.changeFeed().subscribe([this](const Change& change) { apply(change); });
}

WatchRegistry::~WatchRegistry() { server_.changeFeed().unsubscribe(subscription_); }

std::optional<std::vector<WatchRegistry::Form>> WatchRegistry::computeIdentifier(Watch& watch,
                                                                                 const std::string& identifier,
                                                                                 const std::vector<Value>& exclusions) {
    std::optional<BXDatabase::PlugInSet> candidates = server_.findPlugInsWithIdentifier(watch.rules, identifier);
    if (!candidates) return std::nullopt;
    BXMatchContext context{.annotations = &server_.annotationSource()};
    CandidateFilter filter{watch.rules, exclusions, watch.flags, *watch.client, server_, context};
    AcceptedForms accepted(watch.flags);
    for (const std::shared_ptr<BXDPlugIn>& plugIn : *candidates) {
        if (!filter.admits(*plugIn)) continue;
        Result<MutableDictionary> exported = plugIn->exportForm();
        if (!exported) {
            log::ops().error("failed to export watched plug-in %{public}@: %{public}@",
                             plugIn->uuid() ? plugIn->uuid()->string() : std::string(), exported.error());
            continue;
        }
        accepted.offer(*plugIn, std::move(*exported), server_);
    }
    std::vector<Form> forms;
    for (Value& value : accepted.take()) {
        Form form{.uuid = textOf(value, formKey::kUuid), .raw = value, .linked = value, .claims = claimsOf(value)};
        forms.push_back(std::move(form));
    }
    return forms;
}

std::optional<WatchRegistry::FormsByIdentifier> WatchRegistry::computeAll(Watch& watch,
                                                                          const std::vector<Value>& exclusions) {
    std::optional<BXDatabase::PlugInSet> candidates = server_.findPlugIns(watch.rules);
    if (!candidates) return std::nullopt;
    // The registry's order within each identifier is kept: the competition among forms depends on it.
    std::map<std::string, BXDatabase::PlugInSet> grouped;
    for (std::shared_ptr<BXDPlugIn>& plugIn : *candidates)
        grouped[plugIn->identifier().value_or("")].push_back(std::move(plugIn));
    BXMatchContext context{.annotations = &server_.annotationSource()};
    CandidateFilter filter{watch.rules, exclusions, watch.flags, *watch.client, server_, context};
    FormsByIdentifier result;
    for (auto& [identifier, plugIns] : grouped) {
        AcceptedForms accepted(watch.flags);
        for (const std::shared_ptr<BXDPlugIn>& plugIn : plugIns) {
            if (!filter.admits(*plugIn)) continue;
            Result<MutableDictionary> exported = plugIn->exportForm();
            if (!exported) continue;
            accepted.offer(*plugIn, std::move(*exported), server_);
        }
        if (accepted.count() == 0) continue;
        std::vector<Form>& forms = result[identifier];
        for (Value& value : accepted.take())
            forms.push_back(
                Form{.uuid = textOf(value, formKey::kUuid), .raw = value, .linked = value, .claims = claimsOf(value)});
    }
    return result;
}

bool WatchRegistry::mayMatch(Watch& watch, const std::vector<std::shared_ptr<BXDPlugIn>>& plugIns) {
    BXMatchContext context{.annotations = &server_.annotationSource()};
    return std::any_of(plugIns.begin(), plugIns.end(),
                       [&](const std::shared_ptr<BXDPlugIn>& plugIn) { return plugIn->match(watch.rules, context); });
}

WatchRegistry::Difference WatchRegistry::update(Watch& watch, FormsByIdentifier replaced) {
    // Which identifiers' links may move: those computed, those their old and new forms claim, and every other
    // claimant of those (a new claimant can only be one of the identifiers computed).
    std::set<std::string> claimed;
    for (const auto& [identifier, forms] : replaced) {
        claimed.insert(identifier);
        if (auto held = watch.forms.find(identifier); held != watch.forms.end())
            for (const Form& form : held->second) claimed.insert(form.claims.begin(), form.claims.end());
        for (const Form& form : forms) claimed.insert(form.claims.begin(), form.claims.end());
    }
    std::set<std::string> affected = claimed;
    for (const std::string& identifier : claimed)
        if (auto found = watch.claimants.find(identifier); found != watch.claimants.end())
            affected.insert(found->second.begin(), found->second.end());

    std::map<std::string, Value> before;
    for (const std::string& identifier : affected)
        if (auto held = watch.forms.find(identifier); held != watch.forms.end())
            for (const Form& form : held->second) before.emplace(form.uuid, form.linked);

    for (auto& [identifier, forms] : replaced) {
        if (auto held = watch.forms.find(identifier); held != watch.forms.end()) {
            for (const Form& form : held->second)
                for (const std::string& claim : form.claims) {
                    auto found = watch.claimants.find(claim);
                    if (found == watch.claimants.end()) continue;
                    found->second.erase(identifier);
                    if (found->second.empty()) watch.claimants.erase(found);
                }
            watch.forms.erase(held);
        }
        for (const Form& form : forms)
            for (const std::string& claim : form.claims) watch.claimants[claim].insert(identifier);
        if (!forms.empty()) watch.forms.emplace(identifier, std::move(forms));
    }

    // The form of `claimed`'s winner, or null.
    auto winner = [&watch](const std::string& claimedIdentifier) -> const Form* {
        auto found = watch.claimants.find(claimedIdentifier);
        if (found == watch.claimants.end()) return nullptr;
        for (auto claimant = found->second.rbegin(); claimant != found->second.rend(); ++claimant) {
            auto held = watch.forms.find(*claimant);
            if (held == watch.forms.end()) continue;
            for (auto form = held->second.rbegin(); form != held->second.rend(); ++form)
                if (std::find(form->claims.begin(), form->claims.end(), claimedIdentifier) != form->claims.end())
                    return &*form;
        }
        return nullptr;
    };

    Difference difference;
    std::set<std::string> present;
    for (const std::string& identifier : affected) {
        auto held = watch.forms.find(identifier);
        if (held == watch.forms.end()) continue;
        const Form* overrider = winner(identifier);
        for (Form& form : held->second) {
            std::optional<std::string> overriding;
            for (const std::string& claim : form.claims) {
                if (watch.forms.count(claim) == 0 || winner(claim) != &form) continue;
                if (!overriding || claim > *overriding) overriding = claim;
            }
            if (overrider == nullptr && !overriding) {
                form.linked = form.raw;
            } else {
                MutableDictionary linked(form.raw);
                if (overrider != nullptr) linked.set(formKey::kOverrider, Value::string(overrider->uuid));
                if (overriding) linked.set(formKey::kOverriding, Value::string(*overriding));
                form.linked = linked.take();
            }
            present.insert(form.uuid);
            auto old = before.find(form.uuid);
            if (old == before.end())
                difference.added.push_back(form.linked);
            else if (!(old->second == form.linked))
                difference.changed.push_back(form.linked);
        }
    }
    for (const auto& [uuid, form] : before)
        if (present.count(uuid) == 0) difference.removed.push_back(Value::string(uuid));
    return difference;
}

void WatchRegistry::send(Watch& watch, Difference difference, uint64_t generation) {
    if (difference.added.empty() && difference.removed.empty() && difference.changed.empty()) return;
    MutableDictionary message;
    message.set(key::kEvent, Value::string(limits::kUpdate));
    message.set(key::kWatch, Value::uint64(watch.id));
    message.set(key::kGeneration, Value::uint64(generation));
    message.set(key::kAdded, Value::array(std::move(difference.added)));
    message.set(key::kRemoved, Value::array(std::move(difference.removed)));
    message.set(key::kChanged, Value::array(std::move(difference.changed)));
    deliver(watch, message.take(), generation);
}

bool WatchRegistry::deliver(Watch& watch, Value message, uint64_t generation) {
    std::shared_ptr<ZemConnection> connection = watch.client->connection();
    const uint64_t id = watch.id;
    if (!connection) {
        // Gone: the client's death releases its watches; nothing can reach it meanwhile.
        end(id);
        return false;
    }
    const int pid = static_cast<int>(watch.client->pid());
    const size_t queued = connection->queuedBytes();
    Result<size_t> size = ZemCodec::encodedSize(message);
    if (queued < limits::kMaxQueuedBytes && size && *size <= ZemFrame::kMaxPayloadBytes) {
        connection->send(message);
        return true;
    }
    if (queued >= limits::kMaxQueuedBytes)
        log::ops().error(
            "watcher %d has %zu bytes unread, over the limit of %llu (watch::kMaxQueuedBytes): watch "
            "%llu ends with a resync",
            pid, queued, static_cast<unsigned long long>(limits::kMaxQueuedBytes), static_cast<unsigned long long>(id));
    else
        log::ops().error("change of watch %llu for client %d does not fit a frame: the watch ends with a resync",
                         static_cast<unsigned long long>(id), pid);
    resync(watch, generation);
    return false;
}

void WatchRegistry::resync(Watch& watch, uint64_t generation) {
    const uint64_t id = watch.id;
    if (std::shared_ptr<ZemConnection> connection = watch.client->connection()) {
        MutableDictionary message;
        message.set(key::kEvent, Value::string(limits::kResync));
        message.set(key::kWatch, Value::uint64(id));
        message.set(key::kGeneration, Value::uint64(generation));
        connection->send(message.take());
    }
    end(id);
}

void WatchRegistry::end(uint64_t id) {
    auto found = watches_.find(id);
    if (found == watches_.end()) return;
    auto mine = byClient_.find(found->second->client->serial());
    if (mine != byClient_.end()) {
        mine->second.erase(id);
        if (mine->second.empty()) byClient_.erase(mine);
    }
    watches_.erase(found);
}

std::variant<WatchRegistry::Started, WatchRegistry::Refused> WatchRegistry::start(
    const std::shared_ptr<BXDZemClient>& client, const Value& rules, uint64_t flags) {
    const int pid = static_cast<int>(client->pid());
    // A client whose death has been noted has had its watches released already; one started now would outlive it.
    if (client->isDead()) return Refused{ErrorCode::OperationFailed, "the client is gone"};
    auto mine = byClient_.find(client->serial());
    if (mine != byClient_.end() && mine->second.size() >= limits::kMaxPerClient) {
        log::ops().error("client %d keeps %llu watches already (watch::kMaxPerClient): watch refused", pid,
                         static_cast<unsigned long long>(limits::kMaxPerClient));
        return Refused{ErrorCode::WatchLimit, formatPrintf("too many watches on this connection (at most %llu)",
                                                           static_cast<unsigned long long>(limits::kMaxPerClient))};
    }
    if (watches_.size() >= limits::kMaxTotal) {
        log::ops().error("bxd keeps %llu watches already (watch::kMaxTotal): watch of client %d refused",
                         static_cast<unsigned long long>(limits::kMaxTotal), pid);
        return Refused{ErrorCode::WatchLimit, formatPrintf("too many watches in bxd (at most %llu)",
                                                           static_cast<unsigned long long>(limits::kMaxTotal))};
    }

    auto watch = std::make_unique<Watch>();
    watch->client = client;
    watch->rules = rules;
    watch->flags = flags;
    // Read through the server, so that an exclusions change not yet published reaches the other watches first.
    std::vector<Value> exclusions = BXDUserPrefs::exclusionRuleSets(server_.currentExclusions());
    std::optional<FormsByIdentifier> all = computeAll(*watch, exclusions);
    if (!all) return Refused{ErrorCode::OperationFailed, "the registry cannot be read"};
    // Against the empty result every form is added, in the order of identifiers, with its links written.
    Difference initial = update(*watch, std::move(*all));
    Result<size_t> size = ZemCodec::encodedSize(Value::array(initial.added));
    if (!size || *size > protocol::page::kMaxBytes) {
        log::ops().error("watch of client %d refused: its %zu forms exceed %llu bytes (page::kMaxBytes)", pid,
                         initial.added.size(), static_cast<unsigned long long>(protocol::page::kMaxBytes));
        return Refused{
            ErrorCode::InvalidRequest,
            formatPrintf("the result of %zu plug-ins is too large to watch; narrow the rules", initial.added.size())};
    }
    watch->id = ++lastId_;
    const uint64_t id = watch->id;
    watches_.emplace(id, std::move(watch));
    byClient_[client->serial()].insert(id);
    log::ops().info("client %d watches %zu plug-ins as watch %llu", pid, initial.added.size(),
                    static_cast<unsigned long long>(id));
    return Started{.id = id, .forms = std::move(initial.added), .generation = server_.changeFeed().current()};
}

bool WatchRegistry::stop(const BXDZemClient& client, uint64_t id) {
    auto found = watches_.find(id);
    if (found == watches_.end() || found->second->client.get() != &client) return false;
    end(id);
    return true;
}

void WatchRegistry::releaseClient(const BXDZemClient& client) {
    auto mine = byClient_.find(client.serial());
    if (mine == byClient_.end()) return;
    std::set<uint64_t> ids = std::move(mine->second);
    byClient_.erase(mine);
    for (uint64_t id : ids) watches_.erase(id);
    log::ops().info("released %zu watches of client %d", ids.size(), static_cast<int>(client.pid()));
}

void WatchRegistry::apply(const Change& change) {
    if (watches_.empty()) return;
    std::vector<Value> exclusions = BXDUserPrefs::exclusionRuleSets(server_.userPrefs().exclusions());
    std::vector<uint64_t> ids;
    ids.reserve(watches_.size());
    for (const auto& [id, watch] : watches_) ids.push_back(id);

    if (change.kind == Change::Kind::ExclusionsChanged) {
        for (uint64_t id : ids) {
            auto found = watches_.find(id);
            if (found == watches_.end()) continue;
            guarded(*found->second, change.generation, [&](Watch& watch) {
                std::optional<FormsByIdentifier> all = computeAll(watch, exclusions);
                if (!all) {
                    log::ops().error("watch %llu not brought up to date: the registry cannot be read",
                                     static_cast<unsigned long long>(id));
                    return;
                }
                for (const auto& [identifier, forms] : watch.forms) all->try_emplace(identifier);
                send(watch, update(watch, std::move(*all)), change.generation);
            });
        }
        return;
    }

    // FIXME: a plug-in that replaces another identifier takes its election from that identifier's annotation, so
    // annotating the replaced identifier can change whether the replacing plug-in passes an election query; such a
    // change names the replaced identifier only and the replacing plug-in's watchers hear of it at its next change.
    std::set<std::string> identifiers(change.identifiers.begin(), change.identifiers.end());
    // Every plug-in of each identifier, whatever the rules, to tell which watches the change can reach at all.
    std::map<std::string, BXDatabase::PlugInSet> records;
    for (const std::string& identifier : identifiers)
        records[identifier] = server_.findPlugInsWithIdentifier(Value(), identifier).value_or(BXDatabase::PlugInSet{});

    for (uint64_t id : ids) {
        auto found = watches_.find(id);
        if (found == watches_.end()) continue;
        guarded(*found->second, change.generation,
                [&](Watch& watch) { applyToWatch(watch, identifiers, records, exclusions, change.generation); });
    }
}

void WatchRegistry::applyToWatch(Watch& watch, const std::set<std::string>& identifiers,
                                 std::map<std::string, BXDatabase::PlugInSet>& records,
                                 const std::vector<Value>& exclusions, uint64_t generation) {
    {
        const uint64_t id = watch.id;
        FormsByIdentifier replaced;
        for (const std::string& identifier : identifiers) {
            // A watch that holds no form of the identifier and whose rules none of its plug-ins meets cannot gain
            // one: the filter asks the same rules first.
            if (watch.forms.count(identifier) == 0 && !mayMatch(watch, records[identifier])) continue;
            std::optional<std::vector<Form>> forms = computeIdentifier(watch, identifier, exclusions);
            if (!forms) {
                log::ops().error(
                    "watch %llu: identifier %{public}@ not brought up to date: the registry cannot be read",
                    static_cast<unsigned long long>(id), identifier);
                continue;
            }
            replaced.emplace(identifier, std::move(*forms));
        }
        if (!replaced.empty()) send(watch, update(watch, std::move(replaced)), generation);
    }
}

void WatchRegistry::guarded(Watch& watch, uint64_t generation, const std::function<void(Watch&)>& work) {
    try {
        work(watch);
    } catch (...) {
        // The watch's result is no longer known to be right: the watcher starts again rather than trusting it.
        log::ops().fault("watch %llu not brought up to date: %s", static_cast<unsigned long long>(watch.id),
                         exceptionMessage(std::current_exception()).c_str());
        resync(watch, generation);
    }
}

}  // namespace bexil
