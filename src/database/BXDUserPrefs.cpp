#include "database/BXDUserPrefs.h"

#include "platform/log/Log.h"

namespace bexil {

BXDUserPrefs::BXDUserPrefs(PreferencesStore& store) : store_(store) {}

Value BXDUserPrefs::exclusions() const { return store_.copyValueAfterSync(kDomain, kExclusionsKey); }

std::vector<Value> BXDUserPrefs::exclusionRuleSets(const Value& exclusions) {
    std::vector<Value> ruleSets;
    if (exclusions.isNull()) return ruleSets;
    if (!exclusions.isArray()) {
        log::ops().debug("exclusions preference is not an array, ignoring it: %@", exclusions);
        return ruleSets;
    }
    size_t index = 0;
    for (const Value& element : exclusions.items()) {
        if (element.isDictionary())
            ruleSets.push_back(element);
        else
            log::ops().debug("exclusion %zu is not a rule dictionary, passing it over: %@", index, element);
        ++index;
    }
    return ruleSets;
}

}  // namespace bexil
