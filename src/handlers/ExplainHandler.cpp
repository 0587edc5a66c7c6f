// "explain", an extension of ours: why a "match" with the same rules and flags returns a plug-in or not. The answer
// is made by discovery's own code, not a description of it: the registry is asked as "match" asks it, every
// candidate goes through CandidateFilter (its explaining observer records each step's outcome and details), and the
// candidates that pass compete in an AcceptedForms that records who beat whom. So an explanation cannot drift away
// from what "match" does.
//
// What a caller may learn. A plug-in that "match" would never show this caller, whatever its rules (it lives
// outside every application, is dedicated to another application, is held, or the host policy refuses it to this
// caller), is left out of the answer altogether, as if it were not registered: an entry saying "not visible to you"
// would still tell that something of that identity exists, at that path or under that UUID. So the answer for a
// hidden plug-in and for one nobody registered is the same, byte for byte: no entry, and "notFound" reading "not
// registered, or not visible to you". Only a caller with the manager entitlement, who may discover everything
// anyway, sees hidden candidates with every step, and is told plainly "not registered". Files are looked at with
// the caller's own rights (ActingAs), so "no bundle at this path" tells nothing the caller could not find out itself.
//
// Cost: the registry is asked for the explained identifier only (the rules with that identifier added when they
// name none), so explaining one plug-in among many costs about what a point match costs. Only when a candidate
// would be returned and the rules could return other identifiers too does it ask the registry with the rules alone,
// to find plug-ins that claim to replace it as a match with those rules would see them: with rules that narrow
// nothing, that walks the registry like a match without exporting forms.

#include <climits>
#include <cstdlib>
#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <unordered_map>
#include <unordered_set>
#include <vector>

#include "base/ActingAs.h"
#include "bexil/Protocol.h"
#include "daemon/BXDServer.h"
#include "daemon/BXDZemClient.h"
#include "daemon/Transaction.h"
#include "handlers/DiscoveryFilter.h"
#include "platform/log/Log.h"
#include "policy/BXDPlugIn.h"
#include "policy/BXMatchRules.h"

namespace bexil {

namespace {

namespace explain = protocol::explain;
namespace formKey = protocol::form;

using PlugIns = std::vector<std::shared_ptr<BXDPlugIn>>;

// What a manager is told about a plug-in that is registered but of which no record can be made; to anybody else
// it is one that is not registered.
constexpr std::string_view kRefusedRecord = "registered, but refused as mis-configured (the log says why)";

std::string uuidTextOf(const BXDPlugIn& plugIn) { return plugIn.uuid() ? plugIn.uuid()->string() : std::string(); }

// The plug-in a request names: exactly one of the three is set.
struct Identity {
    std::optional<std::string> identifier = std::nullopt;
    std::optional<Uuid> uuid = std::nullopt;
    std::optional<std::string> path = std::nullopt;
};

// The identity under key::kPlugIn: a UUID value, or a string that is an absolute path, UUID text or an identifier.
std::optional<Identity> identityOf(const Value& named) {
    if (const Uuid* uuid = named.getUuid()) return Identity{.uuid = *uuid};
    const std::string* text = named.getString();
    if (text == nullptr || text->empty() || text->find('\0') != std::string::npos) return std::nullopt;
    if (text->front() == '/') return Identity{.path = *text};
    if (std::optional<Uuid> uuid = Uuid::parse(*text)) return Identity{.uuid = *uuid};
    return Identity{.identifier = *text};
}

// The canonical path of `path` as the caller sees it, else the path itself with "." and ".." taken out: a registered
// bundle that is gone from the disk is still found under the path it was registered at.
std::string lookupPath(const std::string& path, std::optional<UserIdentity> caller) {
    ActingAs reader(caller);
    if (reader.ok()) {
        std::unique_ptr<char, decltype(&free)> resolved(realpath(path.c_str(), nullptr), &free);
        if (resolved) return resolved.get();
    }
    std::string normal = std::filesystem::path(path).lexically_normal().string();
    if (normal.size() > 1 && normal.back() == '/') normal.pop_back();
    return normal;
}

// Whether a bundle (its Info.vrec) is at `path`, as the caller sees it.
bool bundleAt(const std::string& path, std::optional<UserIdentity> caller) {
    ActingAs reader(caller);
    std::error_code error;
    return reader.ok() && std::filesystem::exists(std::filesystem::path(path) / "Info.vrec", error);
}

// A pattern that holds for `identifier` alone, whatever characters it begins with: the equality operator, which
// the registry's pre-selection reads as that one value.
Value exactly(const std::string& identifier) { return Value::string("=" + identifier); }

Value step(std::string_view name, bool passed, std::vector<std::pair<std::string, Value>> details = {}) {
    details.emplace_back(std::string(explain::kStep), Value::string(name));
    details.emplace_back(std::string(explain::kPassed), Value::boolean(passed));
    return Value::dictionary(std::move(details));
}

// Why the registry's answer to the rules leaves out a plug-in that is registered: the pre-selection by identifier
// or extension point, or the election filter, in the order the registry applies them.
std::string registryReason(const Value& rules, const BXDPlugIn& plugIn) {
    auto excludes = [&](std::string_view key, std::optional<std::string> value) {
        std::optional<std::vector<std::string>> wanted = BXMatchRules::requiredValues(rules, key);
        return wanted && (!value || std::find(wanted->begin(), wanted->end(), *value) == wanted->end());
    };
    if (excludes(BXMatchRules::kIdentifierKey, plugIn.identifier()))
        return "the rules' RZExtensionIdentifier names other identifiers";
    std::optional<Value> point = plugIn.attribute(BXMatchRules::kExtensionPointKey);
    if (excludes(BXMatchRules::kExtensionPointKey,
                 point && point->isString() ? std::optional<std::string>(point->stringView()) : std::nullopt))
        return "the rules' RZExtensionPointIdentifier names other extension points";
    if (BXDatabase::wantedElections(rules)) return "its election is not among the rules' RZUserElection values";
    return "the registry does not offer it for discovery (no bundle location, or its application is a placeholder)";
}

}  // namespace

void Transaction::explainPlugIn() {
    std::optional<DiscoveryQuery> query = readDiscoveryQuery(*this);
    if (!query) return;
    const Value& rules = query->rules;
    const Value* named = request().find(protocol::key::kPlugIn);
    if (named == nullptr) {
        fail(ErrorCode::InvalidRequest, "invalid request format (missing plugin)");
        return;
    }
    std::optional<Identity> identity = identityOf(*named);
    if (!identity) {
        fail(ErrorCode::InvalidRequest,
             "invalid request format (plugin must be an identifier, a UUID or an absolute path)");
        return;
    }

    BXDServer& database = *server();
    BXDZemClient& caller = *client();
    const bool manager = caller.hasEntitlement(protocol::kManagerEntitlement);
    const std::optional<UserIdentity> reader = caller.user();

    // The candidates the request asks about: every registration of an identifier, or the one plug-in at a path or
    // with a UUID.
    PlugIns explained;
    std::optional<std::string> identifier = identity->identifier;
    bool noBundle = false;
    // The registry knows the plug-in, but no record can be made of it (a bundle it refuses as mis-configured):
    // nobody discovers it.
    bool refused = false;
    if (identifier) {
        std::optional<BXDatabase::PlugInSet> found = database.findPlugIns(
            Value::dictionary({{std::string(BXMatchRules::kIdentifierKey), exactly(*identifier)}}));
        for (std::shared_ptr<BXDPlugIn>& plugIn : found.value_or(PlugIns{}))
            if (plugIn->identifier() == identifier) explained.push_back(std::move(plugIn));
    } else {
        std::shared_ptr<BXDPlugIn> plugIn;
        if (identity->uuid) {
            plugIn = database.findPlugIn(*identity->uuid);
            refused = !plugIn && database.workspace()->plugInProxyForUUID(*identity->uuid);
        } else {
            std::string path = lookupPath(*identity->path, reader);
            noBundle = !bundleAt(path, reader);
            plugIn = database.findPlugInAtPath(path);
            refused = !plugIn && database.workspace()->plugInProxyForURL(path);
        }
        if (plugIn) {
            explained.push_back(plugIn);
            identifier = plugIn->identifier();
        }
    }

    BXMatchContext context{.annotations = &database.annotationSource()};
    std::vector<Value> exclusions = BXDUserPrefs::exclusionRuleSets(database.userPrefs().exclusions());
    CandidateFilter filter{rules, exclusions, query->flags, caller, database, context};

    std::unordered_map<std::string, FilterTrace> traces;
    PlugIns shown;
    for (const std::shared_ptr<BXDPlugIn>& plugIn : explained) {
        FilterTrace trace = filter.explain(*plugIn);
        if (trace.hidden && !manager) continue;
        traces.emplace(uuidTextOf(*plugIn), std::move(trace));
        shown.push_back(plugIn);
    }
    log::ops().info("client %d asked to explain %@: %u candidates, %u shown", static_cast<int>(caller.pid()), *named,
                    static_cast<unsigned>(explained.size()), static_cast<unsigned>(shown.size()));
    if (shown.empty()) {
        std::string_view why = manager && refused ? kRefusedRecord
                               : noBundle         ? explain::kNoBundle
                               : manager          ? explain::kNotRegistered
                                                  : explain::kNotRegisteredOrHidden;
        reply().set(protocol::key::kExplanation, Value::emptyArray());
        reply().set(protocol::key::kNotFound, Value::string(why));
        done();
        return;
    }

    // The registry's answer for these rules, among the plug-ins of the identifier: what "match" would be given.
    MutableDictionary narrowed(rules.isDictionary() ? rules : Value::emptyDictionary());
    const bool rulesNameIdentifiers = narrowed.find(BXMatchRules::kIdentifierKey) != nullptr;
    if (!rulesNameIdentifiers && identifier) narrowed.set(BXMatchRules::kIdentifierKey, exactly(*identifier));
    Value narrowedQuery = narrowed.take();
    PlugIns offered = database.findPlugIns(narrowedQuery).value_or(PlugIns{});
    std::unordered_set<std::string> inAnswer;
    for (const std::shared_ptr<BXDPlugIn>& plugIn : offered) inAnswer.insert(uuidTextOf(*plugIn));

    // The competition among the forms of the identifier, as "match" holds it, recording who beat whom.
    AcceptedForms accepted(query->flags);
    AcceptedForms::Defeats defeats;
    accepted.recordDefeats(&defeats);
    std::unordered_map<std::string, std::string> exportFailures;
    auto compete = [&](BXDPlugIn& plugIn) {
        Result<MutableDictionary> exported = plugIn.exportForm();
        if (!exported) {
            exportFailures[uuidTextOf(plugIn)] = exported.error().localizedDescription().value_or("export failed");
            return false;
        }
        accepted.offer(plugIn, std::move(*exported), database);
        return true;
    };
    bool someKept = false;
    for (const std::shared_ptr<BXDPlugIn>& plugIn : offered) {
        if (plugIn->identifier() != identifier) continue;
        if (filter.admits(*plugIn) && compete(*plugIn)) someKept = true;
    }
    // Plug-ins of other identifiers that claim this one replace a kept form when the same match returns them; their
    // own duplicates compete too, as in the match. Rules that name this identifier alone leave no room for them.
    std::optional<std::vector<std::string>> namedIdentifiers =
        BXMatchRules::requiredValues(rules, BXMatchRules::kIdentifierKey);
    if (someKept && identifier && !(namedIdentifiers && *namedIdentifiers == std::vector<std::string>{*identifier})) {
        PlugIns all = database.findPlugIns(rules).value_or(PlugIns{});
        std::unordered_set<std::string> claimers;
        for (const std::shared_ptr<BXDPlugIn>& plugIn : all) {
            if (plugIn->identifier() == identifier) continue;
            for (const std::string& replaced : replacedIdentifiers(*plugIn))
                if (replaced == *identifier) claimers.insert(plugIn->identifier().value_or(""));
        }
        for (const std::shared_ptr<BXDPlugIn>& plugIn : all)
            if (claimers.contains(plugIn->identifier().value_or("")) && filter.admits(*plugIn)) compete(*plugIn);
    }
    accepted.linkReplacements();
    std::unordered_map<std::string, Value> kept;
    for (Value& form : accepted.take()) kept.emplace(std::string(form.get(formKey::kUuid).stringView()), form);

    MutableArray entries;
    for (const std::shared_ptr<BXDPlugIn>& plugIn : shown) {
        const std::string uuid = uuidTextOf(*plugIn);
        const FilterTrace& trace = traces.at(uuid);
        MutableDictionary entry;
        entry.set(formKey::kUuid, Value::string(uuid));
        entry.set(formKey::kIdentifier, Value::string(plugIn->identifier().value_or("")));
        std::optional<Value> version = plugIn->version();
        entry.set(formKey::kVersion, version && version->isString() ? *version : Value::string(""));
        entry.set(formKey::kPath, Value::string(plugIn->path().value_or("")));

        MutableArray steps;
        std::string_view outcome = explain::kRejected;
        bool found = inAnswer.contains(uuid);
        std::vector<std::pair<std::string, Value>> registry{
            {std::string(explain::kBundleOnDisk), Value::boolean(bundleAt(plugIn->path().value_or(""), reader))}};
        if (!found) registry.emplace_back(std::string(explain::kReason), Value::string(registryReason(rules, *plugIn)));
        steps.append(step(explain::kRegistry, found, std::move(registry)));
        if (found) {
            size_t shownSteps = trace.firstFailure ? *trace.firstFailure + 1 : trace.steps.size();
            for (size_t i = 0; i < shownSteps; ++i) steps.append(trace.steps[i]);
        }
        if (found && !trace.firstFailure) {
            if (auto failure = exportFailures.find(uuid); failure != exportFailures.end()) {
                steps.append(
                    step(explain::kExport, false, {{std::string(explain::kReason), Value::string(failure->second)}}));
            } else if (auto defeat = defeats.find(uuid); defeat != defeats.end()) {
                outcome = explain::kLost;
                steps.append(step(explain::kDuplicates, false,
                                  {{std::string(explain::kWinner), Value::string(defeat->second.winner)},
                                   {std::string(explain::kTieBreak), Value::string(nameOf(defeat->second.rule))},
                                   {std::string(explain::kReason),
                                    Value::string("another plug-in of its identifier is preferred")}}));
            } else if (auto form = kept.find(uuid); form != kept.end()) {
                outcome = explain::kMatched;
                std::vector<std::pair<std::string, Value>> details;
                if (const Value* overrider = form->second.find(formKey::kOverrider))
                    details.emplace_back(std::string(explain::kReplacedBy), *overrider);
                steps.append(step(explain::kDuplicates, true, std::move(details)));
            }
        }
        entry.set(explain::kOutcome, Value::string(outcome));
        entry.set(explain::kSteps, steps.take());
        entries.append(entry.take());
    }
    reply().set(protocol::key::kExplanation, entries.take());
    done();
}

}  // namespace bexil
