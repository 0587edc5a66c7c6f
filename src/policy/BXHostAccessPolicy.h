#pragma once

// BXHostAccessPolicy decides whether a host may use a plug-in (the host's own restriction by rule set, then the
// plug-in's restriction by entitlement), whether a dedicated plug-in is visible to a host, and which privacy-consent
// services the user granted to a plug-in's containing application. Stateless: every operation runs on the caller's
// thread and keeps nothing.

#include <functional>
#include <optional>
#include <set>
#include <string>
#include <string_view>

#include "bexil/Value.h"
#include "model/BXBundle.h"
#include "model/BXPlugInCore.h"
#include "platform/ksn/PrivacyConsent.h"
#include "policy/HostAccessClient.h"

namespace bexil {

class BXHostAccessPolicy {
  public:
    // The host's entitlement whose value is a rule set that every plug-in it uses must satisfy.
    static constexpr std::string_view kAllowedPlugInsEntitlement = "com.quorvel.developer.bexil.allowedplugins";
    // The plug-in dictionary key naming an entitlement that every host of the plug-in must hold.
    static constexpr std::string_view kHostEntitlementKey = "RZExtensionHostEntitlement";

    static constexpr std::string_view kInvalidHostRestriction = "invalid host restriction entitlement";
    static constexpr std::string_view kHostRuleSetRefuses =
        "the host's plug-in entitlement does not allow this plug-in";

    // Whether the plug-in satisfies a rule set (the plug-in record's `match:`).
    using RuleMatcher = std::function<bool(const Value& ruleSet)>;

    // allowForClient: the reason why `client` may not use `plugIn`, or nothing when it may. `matches` answers for
    // this plug-in; it is asked only when the host restricts itself with a rule set.
    static std::optional<std::string> allowForClient(const BXPlugInCore& plugIn, const HostAccessClient& client,
                                                     const RuleMatcher& matches);

    // Whether a dedicated plug-in may be shown to a host: only when the plug-in's path begins with the plug-in
    // directory of the host's own bundle. Plug-ins that are not dedicated are visible to every host.
    static bool dedicatedPlugInVisibleToHost(const BXPlugInCore& plugIn, const BXBundle* hostBundle);

    // allowedKSNServices: the privacy-consent services that the user granted to the plug-in's containing
    // application. Never fails: no containing application, a bundle that cannot be made or a failed query all give
    // the empty set (the last two with one info line).
    static std::set<std::string> allowedKSNServices(const BXPlugInCore& plugIn, const PrivacyConsent& consent);
};

}  // namespace bexil
