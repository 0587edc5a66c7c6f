#pragma once

// PrivacyConsent is the privacy-consent service as the policy sees it: for an application bundle, one record per
// privacy-consent service known for it, saying whether the user granted it. ConsentStore is the implementation over
// a per-user document; tests substitute their own. Implementations may be called from any thread.

#include <optional>
#include <string>
#include <vector>

#include "platform/bundles/PlatformBundle.h"

namespace bexil {

// One privacy-consent service of a bundle. `granted` is absent when the store holds no yes-or-no answer for it.
struct ConsentRecord {
    std::string service;
    std::optional<bool> granted;
    bool operator==(const ConsentRecord&) const = default;
};

class PrivacyConsent {
  public:
    virtual ~PrivacyConsent() = default;
    // The records of the bundle, in a stable order; nothing when the query fails (the bundle has no identifier, or
    // the store cannot be read). An empty list means no service is known for the bundle.
    virtual std::optional<std::vector<ConsentRecord>> copyInformationForBundle(const PlatformBundle& bundle) const = 0;
};

}  // namespace bexil
