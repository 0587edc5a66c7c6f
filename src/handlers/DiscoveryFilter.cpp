// What discovery shares: the filter a candidate passes and the competition among forms of one identifier.

#include "handlers/DiscoveryFilter.h"

#include "bexil/Protocol.h"
#include "daemon/BXDServer.h"
#include "daemon/BXDZemClient.h"
#include "model/BXUtilities.h"
#include "platform/log/Log.h"
#include "policy/BXDPlugIn.h"
#include "policy/BXHostAccessPolicy.h"

namespace bexil {

namespace {

namespace discover = protocol::discover;
namespace formKey = protocol::form;

std::string textOf(const MutableDictionary& form, std::string_view key) {
    const Value* value = form.find(key);
    return value != nullptr && value->isString() ? std::string(value->stringView()) : std::string();
}

std::string versionOf(const BXDPlugIn& plugIn) {
    std::optional<Value> version = plugIn.version();
    return version && version->isString() ? std::string(version->stringView()) : std::string();
}

// Whether the new plug-in wins against an accepted form of the same identifier and version: a system plug-in beats
// one that is not, otherwise the later registration wins and equal times keep what was accepted first.
bool winsTieBreak(const BXDPlugIn& plugIn, const MutableDictionary& form) {
    const Value* resident = form.find(formKey::kSystemResident);
    bool formResident = resident != nullptr && resident->getBool().value_or(false);
    if (plugIn.onSystemVolume() && !formResident) return true;
    const Value* modified = form.find(formKey::kLastModified);
    int32_t formModified = modified != nullptr ? static_cast<int32_t>(modified->numberAsInt64().value_or(0)) : 0;
    return plugIn.lastModified() > formModified;
}

// The identifiers a plug-in says it replaces: a string names one, an array every string in it.
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

}  // namespace

bool CandidateFilter::all() const { return (flags & discover::kAll) != 0; }

bool CandidateFilter::admits(BXDPlugIn& plugIn) const {
    // Only the logs name the candidate, and they are rare: the text is made when one is written.
    auto uuidText = [&plugIn] { return plugIn.uuid() ? plugIn.uuid()->string() : std::string(); };
    const pid_t pid = client.pid();
    if (!all()) {
        // Plug-ins outside the system volume are visible only inside an application, and not at all when the
        // caller asked for system plug-ins only.
        if (!plugIn.onSystemVolume() && (!plugIn.containingUrl() || (flags & discover::kSystemOnly))) return false;
        if (!BXHostAccessPolicy::dedicatedPlugInVisibleToHost(plugIn, client.bundle().get())) return false;
        if (database.holdOnPlugIn(plugIn)) return false;
    }
    if (!plugIn.match(rules, context)) return false;
    for (const Value& exclusion : exclusions) {
        if (plugIn.match(exclusion, context)) {
            log::ops().debug("client %d plugin %{public}@ globally excluded", pid, uuidText());
            return false;
        }
    }
    if (!all()) {
        if (std::optional<std::string> reason = plugIn.allowForClient(client, context)) {
            log::ops().debug("client %d cannot use plugin %{public}@: %{public}@", pid, uuidText(), *reason);
            return false;
        }
    }
    return true;
}

void AcceptedForms::offer(const BXDPlugIn& plugIn, MutableDictionary exported, BXDServer& database) {
    std::string version = versionOf(plugIn);
    std::vector<size_t>& sameIdentifier = positions_[plugIn.identifier().value_or("")];
    for (auto at = sameIdentifier.begin(); at != sameIdentifier.end(); ++at) {
        Form& other = forms_[*at];
        ComparisonResult order = compareVersionString(version, textOf(*other, formKey::kVersion));
        bool same = order == ComparisonResult::Same;
        if ((flags_ & discover::kAllVersions) && (!same || (flags_ & discover::kAllInstances))) continue;
        bool wins = same ? winsTieBreak(plugIn, *other) : order == ComparisonResult::Descending;
        if (!wins) return;
        other.reset();
        sameIdentifier.erase(at);
        --kept_;
        break;
    }
    Form form = std::make_shared<MutableDictionary>(std::move(exported));
    database.addAnnotationForPlugInIn(plugIn, *form);
    plugIn.augmentForm(*form);
    sameIdentifier.push_back(forms_.size());
    forms_.push_back(form);
    ++kept_;
    // A later plug-in naming the same identifier takes the entry over.
    for (const std::string& replaced : replacedIdentifiers(plugIn)) replacements_[replaced] = form;
}

void AcceptedForms::linkReplacements() {
    if (replacements_.empty()) return;
    for (const Form& form : forms_) {
        if (!form) continue;
        std::string identifier = textOf(*form, formKey::kIdentifier);
        auto replacing = replacements_.find(identifier);
        if (replacing == replacements_.end()) continue;
        std::string replacingUuid = textOf(*replacing->second, formKey::kUuid);
        form->set(formKey::kOverrider, Value::string(replacingUuid));
        replacing->second->set(formKey::kOverriding, Value::string(identifier));
        log::ops().info("plug-in %{public}@ overrides %{public}@", replacingUuid, textOf(*form, formKey::kUuid));
    }
}

void AcceptedForms::absorb(AcceptedForms&& group) {
    for (Form& form : group.forms_) {
        if (!form) continue;
        forms_.push_back(std::move(form));
        ++kept_;
    }
    for (auto& [identifier, form] : group.replacements_) replacements_[identifier] = std::move(form);
}

std::vector<Value> AcceptedForms::take() {
    std::vector<Value> values;
    values.reserve(kept_);
    for (const Form& form : forms_)
        if (form) values.push_back(form->take());
    return values;
}

}  // namespace bexil
