#pragma once

// HostAccessClient is what the host access policy and enabling need to know of a connected host: its process, its
// executable and its entitlements. The daemon's client object implements it; tests substitute their own.
// Implementations must be usable from the queue that runs the request.

#include <sys/types.h>

#include <memory>
#include <string>
#include <string_view>

#include "base/UniqueFd.h"
#include "bexil/Value.h"

namespace bexil {

class HostAccessClient {
  public:
    virtual ~HostAccessClient() = default;
    // The value of one entitlement of the host's code signature, or a null Value.
    virtual Value entitlementValueForKey(std::string_view key) const = 0;
    // Whether the host holds the entitlement: it has a value and that value is not equal to false (nor to 0).
    virtual bool hasEntitlement(std::string_view key) const = 0;
    // The host's process id; 0 once it is unknown.
    virtual pid_t pid() const = 0;
    // The host's executable path; empty when it could not be found.
    virtual const std::string& path() const = 0;
    // A pidfd that pins the host process since it connected, or null when there is none; grants made to the host
    // are tied to it rather than to a pid that another process could get later. Shared, not copied: a grant keeps
    // the connection's own descriptor open, so however many plug-ins a host enables, they cost bxd no descriptor.
    virtual std::shared_ptr<const UniqueFd> pidfd() const { return nullptr; }
};

}  // namespace bexil
