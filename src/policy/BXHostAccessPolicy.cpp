#include "policy/BXHostAccessPolicy.h"

#include "platform/log/Log.h"

namespace bexil {

std::optional<std::string> BXHostAccessPolicy::allowForClient(const BXPlugInCore& plugIn,
                                                              const HostAccessClient& client,
                                                              const RuleMatcher& matches) {
    // The host's own restriction comes first, so a host that fails both learns about its own entitlement.
    Value ruleSet = client.entitlementValueForKey(kAllowedPlugInsEntitlement);
    if (!ruleSet.isNull()) {
        // A malformed restriction must never widen what the host may use: it refuses everything.
        if (!ruleSet.isDictionary()) return std::string(kInvalidHostRestriction);
        if (!matches(ruleSet)) return std::string(kHostRuleSetRefuses);
    }

    std::optional<Value> required = plugIn.pluginKey(kHostEntitlementKey);
    if (required && !required->isNull()) {
        // A name that is not a string cannot be held by any host; the plug-in stays restricted rather than open.
        const std::string* name = required->getString();
        if (name == nullptr || !client.hasEntitlement(*name))
            return formatPrintf("the host does not have the \"%@\" entitlement", *required);
    }
    return std::nullopt;
}

bool BXHostAccessPolicy::dedicatedPlugInVisibleToHost(const BXPlugInCore& plugIn, const BXBundle* hostBundle) {
    if (!plugIn.isDedicated()) return true;
    if (hostBundle == nullptr) return false;
    std::optional<std::string> plugInsPath = hostBundle->plugInsPath();
    std::optional<std::string> path = plugIn.path();
    if (!plugInsPath || !path) return false;
    return path->starts_with(*plugInsPath);
}

std::set<std::string> BXHostAccessPolicy::allowedKSNServices(const BXPlugInCore& plugIn,
                                                             const PrivacyConsent& consent) {
    std::set<std::string> services;
    std::optional<std::string> containingUrl = plugIn.containingUrl();
    if (!containingUrl) return services;

    // Bundles are read from disk on every creation, so a fresh bundle object is also a flushed one.
    std::shared_ptr<BXBundle> bundle = BXBundle::initWithURL(*containingUrl);
    if (!bundle || !bundle->path()) {
        log::ops().info("failed to create bundle for %@", plugIn.url().value_or(""));
        return services;
    }

    std::optional<std::vector<ConsentRecord>> records = consent.copyInformationForBundle(*bundle->bundle());
    if (!records) {
        log::ops().info("KSNAccessCopyInformationForBundle failed for %@", *bundle);
        return services;
    }
    for (const ConsentRecord& record : *records)
        if (record.granted == true) services.insert(record.service);
    return services;
}

}  // namespace bexil
