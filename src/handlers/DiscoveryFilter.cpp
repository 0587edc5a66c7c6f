// What discovery shares: the filter a candidate passes and the competition among forms of one identifier.

#include "handlers/DiscoveryFilter.h"

#include "bexil/Protocol.h"
#include "daemon/BXDPlugInHold.h"
#include "daemon/BXDServer.h"
#include "daemon/BXDZemClient.h"
#include "daemon/Transaction.h"
#include "model/BXUtilities.h"
#include "platform/log/Log.h"
#include "platform/sandbox/ProcessSandbox.h"
#include "policy/BXDPlugIn.h"
#include "policy/BXHostAccessPolicy.h"

namespace bexil {

namespace {

namespace discover = protocol::discover;
namespace explain = protocol::explain;
namespace formKey = protocol::form;

std::string textOf(const MutableDictionary& form, std::string_view key) {
    const Value* value = form.find(key);
    return value != nullptr && value->isString() ? std::string(value->stringView()) : std::string();
}

std::string versionOf(const BXDPlugIn& plugIn) {
    std::optional<Value> version = plugIn.version();
    return version && version->isString() ? std::string(version->stringView()) : std::string();
}

std::string uuidTextOf(const BXDPlugIn& plugIn) { return plugIn.uuid() ? plugIn.uuid()->string() : std::string(); }

// Whether the new plug-in wins against an accepted form of the same identifier and version, and by which rule: a
// system plug-in beats one that is not, otherwise the later registration wins and equal times keep what was
// accepted first.
std::pair<bool, DuplicateRule> tieBreak(const BXDPlugIn& plugIn, const MutableDictionary& form) {
    const Value* resident = form.find(formKey::kSystemResident);
    bool formResident = resident != nullptr && resident->getBool().value_or(false);
    if (plugIn.onSystemVolume() && !formResident) return {true, DuplicateRule::SystemVolume};
    const Value* modified = form.find(formKey::kLastModified);
    int32_t formModified = modified != nullptr ? static_cast<int32_t>(modified->numberAsInt64().value_or(0)) : 0;
    if (plugIn.lastModified() != formModified)
        return {plugIn.lastModified() > formModified, DuplicateRule::LaterRegistration};
    return {false, DuplicateRule::FoundFirst};
}

// The observer of discovery: it only hears whether a step passed, and the filter stops at the first that failed.
struct Deciding {
    template <class Detail>
    bool step(std::string_view, bool passed, Detail&&) {
        return passed;
    }
    void skipped(std::string_view) {}
};

// The observer of "explain": it keeps every step with its details and lets the filter go on after a failure, so
// that whether the caller may see the plug-in at all is known even when an earlier step failed.
struct Tracing {
    FilterTrace trace;

    template <class Detail>
    bool step(std::string_view name, bool passed, Detail&& detail) {
        MutableDictionary entry;
        entry.set(explain::kStep, Value::string(name));
        entry.set(explain::kPassed, Value::boolean(passed));
        detail(entry);
        if (!passed) {
            if (!trace.firstFailure) trace.firstFailure = trace.steps.size();
            // Living outside every application is hidden; being left out by the system-only flag is the caller's
            // own choice.
            const Value* onSystem = entry.find(explain::kSystemVolume);
            bool outside = name == explain::kResidence && !entry.find(explain::kContainingApplication) &&
                           !(onSystem != nullptr && onSystem->getBool().value_or(false));
            if (outside || name == explain::kDedication || name == explain::kHold || name == explain::kHostPolicy)
                trace.hidden = true;
        }
        trace.steps.push_back(entry.take());
        return true;
    }
    void skipped(std::string_view name) {
        trace.steps.push_back(Value::dictionary({{std::string(explain::kStep), Value::string(name)},
                                                 {std::string(explain::kPassed), Value::boolean(true)},
                                                 {std::string(explain::kSkipped), Value::boolean(true)}}));
    }
};

}  // namespace

std::vector<std::string> replacedIdentifiers(const BXDPlugIn& plugIn) {
    std::vector<std::string> identifiers;
    std::optional<Value> value = plugIn.valueForEntitlement(BXDPlugIn::kReplacePlugInEntitlement);
    if (!value) return identifiers;
    if (value->isString()) {
        identifiers.emplace_back(value->stringView());
    } else if (value->isArray()) {
        for (const Value& element : value->items()) {
            if (element.isString()) identifiers.emplace_back(element.stringView());
        }
    }
    return identifiers;
}

std::string_view nameOf(DuplicateRule rule) {
    switch (rule) {
        case DuplicateRule::HigherVersion:
            return explain::kHigherVersion;
        case DuplicateRule::SystemVolume:
            return explain::kSystemVolumeWins;
        case DuplicateRule::LaterRegistration:
            return explain::kLaterRegistration;
        case DuplicateRule::FoundFirst:
            return explain::kFoundFirst;
    }
    return {};
}

std::optional<DiscoveryQuery> readDiscoveryQuery(Transaction& transaction) {
    const Value* rulesEntry = transaction.request().find(protocol::key::kRules);
    if (rulesEntry != nullptr && !rulesEntry->isDictionary()) {
        transaction.fail(ErrorCode::InvalidRequest, "invalid request format (bad rules dictionary)");
        return std::nullopt;
    }
    DiscoveryQuery query{.rules = rulesEntry != nullptr ? *rulesEntry : Value(),
                         .flags = transaction.request().get(protocol::key::kFlags).numberAsUInt64().value_or(0)};
    if ((query.flags & discover::kAll) && (!transaction.client()->hasEntitlement(protocol::kManagerEntitlement) ||
                                           processIsSandboxed(transaction.client()->pid()))) {
        transaction.fail(ErrorCode::NotAllowed, "unauthorized discovery flag (BXDiscoverAll)");
        return std::nullopt;
    }
    return query;
}

bool CandidateFilter::all() const { return (flags & discover::kAll) != 0; }

bool CandidateFilter::admits(BXDPlugIn& plugIn) const {
    Deciding deciding;
    return run(plugIn, deciding);
}

FilterTrace CandidateFilter::explain(BXDPlugIn& plugIn) const {
    Tracing tracing;
    run(plugIn, tracing);
    return std::move(tracing.trace);
}

// Each step hands the observer its outcome and a function that writes its details; only an explaining observer
// calls it, so discovery builds no text for a step that passed or failed.
template <class Observer>
bool CandidateFilter::run(BXDPlugIn& plugIn, Observer& observer) const {
    // Only the logs name the candidate, and they are rare: the text is made when one is written.
    auto uuidText = [&plugIn] { return uuidTextOf(plugIn); };
    const pid_t pid = client.pid();
    if (!all()) {
        // Plug-ins outside the system volume are visible only inside an application, and not at all when the
        // caller asked for system plug-ins only.
        bool resident = plugIn.onSystemVolume() || (plugIn.containingUrl() && !(flags & discover::kSystemOnly));
        if (!observer.step(explain::kResidence, resident, [&](MutableDictionary& detail) {
                detail.set(explain::kSystemVolume, Value::boolean(plugIn.onSystemVolume()));
                if (std::optional<std::string> application = plugIn.containingPath())
                    detail.set(explain::kContainingApplication, Value::string(*application));
                if (resident) return;
                detail.set(explain::kReason,
                           Value::string(plugIn.containingUrl()
                                             ? "outside the system volume, and the flags ask for system plug-ins only"
                                             : "outside the system volume and inside no application"));
            }))
            return false;
        bool shown = BXHostAccessPolicy::dedicatedPlugInVisibleToHost(plugIn, client.bundle().get());
        if (!observer.step(explain::kDedication, shown, [&](MutableDictionary& detail) {
                detail.set(explain::kDedicated, Value::boolean(plugIn.isDedicated()));
                if (client.bundle() && client.bundle()->path())
                    detail.set(explain::kHost, Value::string(*client.bundle()->path()));
                if (!shown) detail.set(explain::kReason, Value::string("dedicated to another application"));
            }))
            return false;
        std::shared_ptr<BXDPlugInHold> hold = database.holdNamingPlugIn(plugIn);
        if (!observer.step(explain::kHold, !hold, [&](MutableDictionary& detail) {
                if (!hold) return;
                detail.set(explain::kHoldUuid, Value::uuid(hold->uuid()));
                detail.set(
                    explain::kPlacedBy,
                    Value::dictionary(
                        {{std::string(protocol::key::kPid), Value::uint64(static_cast<uint64_t>(hold->ownerPid()))},
                         {std::string(explain::kExecutable), Value::string(hold->ownerExecutable())}}));
                detail.set(explain::kReason, Value::string("held out of use"));
            }))
            return false;
    } else {
        observer.skipped(explain::kResidence);
        observer.skipped(explain::kDedication);
        observer.skipped(explain::kHold);
    }
    bool matched = plugIn.match(rules, context);
    if (!observer.step(explain::kRulesStep, matched, [&](MutableDictionary& detail) {
            detail.set(explain::kFindings, BXMatchRules::explainMatch(rules, plugIn, context));
        }))
        return false;
    std::optional<size_t> excludedBy;
    for (size_t i = 0; i < exclusions.size(); ++i) {
        if (plugIn.match(exclusions[i], context)) {
            log::ops().debug("client %d plugin %{public}@ globally excluded", pid, uuidText());
            excludedBy = i;
            break;
        }
    }
    if (!observer.step(explain::kExclusions, !excludedBy, [&](MutableDictionary& detail) {
            detail.set(explain::kCount, Value::uint64(exclusions.size()));
            if (!excludedBy) return;
            const Value& exclusion = exclusions[*excludedBy];
            detail.set(explain::kExclusion, Value::uint64(*excludedBy));
            detail.set(explain::kExclusionRules, exclusion);
            detail.set(explain::kFindings, BXMatchRules::explainMatch(exclusion, plugIn, context));
            detail.set(explain::kReason, Value::string("a global exclusion matches it"));
        }))
        return false;
    if (!all()) {
        std::optional<std::string> reason = plugIn.allowForClient(client, context);
        if (reason) log::ops().debug("client %d cannot use plugin %{public}@: %{public}@", pid, uuidText(), *reason);
        if (!observer.step(explain::kHostPolicy, !reason, [&](MutableDictionary& detail) {
                if (reason) detail.set(explain::kReason, Value::string(*reason));
            }))
            return false;
    } else {
        observer.skipped(explain::kHostPolicy);
    }
    return true;
}

template bool CandidateFilter::run<Deciding>(BXDPlugIn&, Deciding&) const;
template bool CandidateFilter::run<Tracing>(BXDPlugIn&, Tracing&) const;

namespace {

// What the competition and the replacement links read of an accepted form: its record's answers when it has one
// (the form was offered encoded), else the form's own entries, which exportForm took from the same answers.
template <class Form>
std::string versionOfForm(const Form& form) {
    return form.record ? versionOf(*form.record) : textOf(form.entries, formKey::kVersion);
}
template <class Form>
std::string uuidTextOfForm(const Form& form) {
    return form.record ? uuidTextOf(*form.record) : textOf(form.entries, formKey::kUuid);
}
template <class Form>
std::string identifierOfForm(const Form& form) {
    return form.record ? form.record->identifier().value_or("") : textOf(form.entries, formKey::kIdentifier);
}
template <class Form>
std::pair<bool, DuplicateRule> tieBreakWithForm(const BXDPlugIn& plugIn, const Form& form) {
    if (!form.record) return tieBreak(plugIn, form.entries);
    if (plugIn.onSystemVolume() && !form.record->onSystemVolume()) return {true, DuplicateRule::SystemVolume};
    if (plugIn.lastModified() != form.record->lastModified())
        return {plugIn.lastModified() > form.record->lastModified(), DuplicateRule::LaterRegistration};
    return {false, DuplicateRule::FoundFirst};
}

// The level of a form in a reply: reply, matches array, form.
constexpr size_t kFormDepth = 2;

}  // namespace

std::vector<size_t>* AcceptedForms::compete(const BXDPlugIn& plugIn) {
    std::string version = versionOf(plugIn);
    std::vector<size_t>& sameIdentifier = positions_[plugIn.identifier().value_or("")];
    for (auto at = sameIdentifier.begin(); at != sameIdentifier.end(); ++at) {
        const Form& other = *forms_[*at];
        ComparisonResult order = compareVersionString(version, versionOfForm(other));
        bool same = order == ComparisonResult::Same;
        if ((flags_ & discover::kAllVersions) && (!same || (flags_ & discover::kAllInstances))) continue;
        auto [wins, rule] = same ? tieBreakWithForm(plugIn, other)
                                 : std::pair{order == ComparisonResult::Descending, DuplicateRule::HigherVersion};
        if (!wins) {
            if (defeats_ != nullptr) (*defeats_)[uuidTextOf(plugIn)] = {uuidTextOfForm(other), rule};
            return nullptr;
        }
        if (defeats_ != nullptr) (*defeats_)[uuidTextOfForm(other)] = {uuidTextOf(plugIn), rule};
        if (other.kept) keptEntryBytes_ -= other.kept->bytes.size();
        forms_[*at].reset();
        sameIdentifier.erase(at);
        --kept_;
        break;
    }
    return &sameIdentifier;
}

void AcceptedForms::keep(const BXDPlugIn& plugIn, std::vector<size_t>& sameIdentifier, FormPointer form) {
    sameIdentifier.push_back(forms_.size());
    if (form->kept) keptEntryBytes_ += form->kept->bytes.size();
    forms_.push_back(form);
    ++kept_;
    // A later plug-in naming the same identifier takes the entry over.
    for (const std::string& replaced : replacedIdentifiers(plugIn)) replacements_[replaced] = form;
}

void AcceptedForms::offer(const BXDPlugIn& plugIn, MutableDictionary exported, BXDServer& database) {
    std::vector<size_t>* sameIdentifier = compete(plugIn);
    if (sameIdentifier == nullptr) return;
    auto form = std::make_shared<Form>();
    form->entries = std::move(exported);
    database.addAnnotationForPlugInIn(plugIn, form->entries);
    plugIn.augmentForm(form->entries);
    keep(plugIn, *sameIdentifier, std::move(form));
}

bool AcceptedForms::offerEncoded(const std::shared_ptr<BXDPlugIn>& plugIn, BXDServer& database) {
    std::shared_ptr<const ZemCodec::Entries> kept = plugIn->keptFormEntries();
    if (!kept) return false;
    std::vector<size_t>* sameIdentifier = compete(*plugIn);
    if (sameIdentifier == nullptr) return true;
    auto form = std::make_shared<Form>();
    form->record = plugIn;
    form->kept = std::move(kept);
    database.addAnnotationForPlugInIn(*plugIn, form->entries);
    plugIn->addChangingFormEntries(form->entries);
    plugIn->augmentForm(form->entries);
    keep(*plugIn, *sameIdentifier, std::move(form));
    return true;
}

void AcceptedForms::linkReplacements() {
    if (replacements_.empty()) return;
    for (const FormPointer& form : forms_) {
        if (!form) continue;
        std::string identifier = identifierOfForm(*form);
        auto replacing = replacements_.find(identifier);
        if (replacing == replacements_.end()) continue;
        std::string replacingUuid = uuidTextOfForm(*replacing->second);
        form->entries.set(formKey::kOverrider, Value::string(replacingUuid));
        replacing->second->entries.set(formKey::kOverriding, Value::string(identifier));
        log::ops().info("plug-in %{public}@ overrides %{public}@", replacingUuid, uuidTextOfForm(*form));
    }
}

void AcceptedForms::absorb(AcceptedForms&& group) {
    for (FormPointer& form : group.forms_) {
        if (!form) continue;
        forms_.push_back(std::move(form));
        ++kept_;
    }
    for (auto& [identifier, form] : group.replacements_) replacements_[identifier] = std::move(form);
    keptEntryBytes_ += group.keptEntryBytes_;
}

std::vector<Value> AcceptedForms::take() {
    std::vector<Value> values;
    values.reserve(kept_);
    for (const FormPointer& form : forms_)
        if (form) values.push_back(form->entries.take());
    return values;
}

std::vector<AcceptedForms::EncodedForm> AcceptedForms::takeEncoded() {
    std::vector<EncodedForm> encoded;
    encoded.reserve(kept_);
    for (const FormPointer& form : forms_)
        if (form) encoded.push_back(EncodedForm{form->kept, form->entries.take()});
    return encoded;
}

std::optional<AcceptedForms::EncodedForm> AcceptedForms::takeEncodedAt(size_t slot) {
    FormPointer form = std::move(forms_[slot]);
    if (!form) return std::nullopt;
    return EncodedForm{form->kept, form->entries.take()};
}

std::optional<Error> AcceptedForms::appendForm(const EncodedForm& form, std::vector<uint8_t>& out) {
    return ZemCodec::encodeMerged(*form.kept, form.changing, out, kFormDepth);
}

}  // namespace bexil
