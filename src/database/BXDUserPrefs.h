#pragma once

// The daemon's preferences (domain "com.quorvel.bexil.userprefs") for the current user and host, read afresh on
// every use so that a change made by another process is seen without a restart. Owned by the server; holds no state
// of its own, so any queue or thread may use it.

#include <vector>

#include "bexil/Protocol.h"
#include "bexil/Value.h"
#include "platform/prefs/PreferencesStore.h"

namespace bexil {

class BXDUserPrefs {
  public:
    static constexpr const char* kDomain = protocol::kUserPrefsDomain.data();
    static constexpr const char* kExclusionsKey = "exclusions";

    // `init`: reads the domain from `store` (the process's shared store by default), which must outlive this object.
    explicit BXDUserPrefs(PreferencesStore& store = PreferencesStore::shared());

    const char* domain() const { return kDomain; }

    // The current value of "exclusions" as stored, with no type check, or a null Value when it is not set. The
    // domain is synchronised with the store first.
    Value exclusions() const;

    // The rule sets of an exclusions value, for the discovery request: a value that is not an array is no
    // exclusions, and elements that are not dictionaries are passed over (both logged at debug level).
    static std::vector<Value> exclusionRuleSets(const Value& exclusions);

  private:
    PreferencesStore& store_;
};

}  // namespace bexil
