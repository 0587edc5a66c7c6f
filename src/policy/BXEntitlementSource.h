#pragma once

// BXEntitlementSource gives the match rules the value of one of a plug-in's own code-signing entitlements. The
// default reads the record's entitlements dictionary; the daemon's record may answer from the registry instead.
// Stateless; any thread may use it.

#include <optional>
#include <string_view>

#include "bexil/Value.h"
#include "model/BXPlugInCore.h"

namespace bexil {

class BXEntitlementSource {
  public:
    virtual ~BXEntitlementSource() = default;

    // The value of entitlement `key` of the plug-in, or nothing.
    virtual std::optional<Value> valueForEntitlement(const BXPlugInCore& plugIn, std::string_view key) const {
        std::optional<Value> entitlements = plugIn.entitlements();
        if (!entitlements) return std::nullopt;
        const Value* value = entitlements->find(key);
        if (value == nullptr) return std::nullopt;
        return *value;
    }

    // The source that reads the record's own entitlements dictionary.
    static const BXEntitlementSource& recordEntitlements() {
        static const BXEntitlementSource source;
        return source;
    }
};

}  // namespace bexil
