#pragma once

// The identity of the process at the other end of a connection, built by the daemon from what the transport read at
// accept (credentials and a pidfd that pins the very process) and bound to the connection for its whole life: its
// executable and the entitlements the trusted directory grants that executable. Immutable after creation; any thread
// may read. Whenever some step of establishing the identity fails the identity grants no entitlements, never more.

#include <sys/types.h>

#include <memory>
#include <string>
#include <string_view>

#include "base/Error.h"
#include "bexil/Value.h"
#include "platform/zem/ZemPeerCredentials.h"

namespace bexil {

class EntitlementsDirectory;

class CodeSigningIdentity {
  public:
    // The identity of the peer whose credentials the transport read; `entitlements` may be null (no entitlements).
    static std::shared_ptr<CodeSigningIdentity> ofPeer(const ZemPeerCredentials& peer,
                                                       EntitlementsDirectory* entitlements);

    CodeSigningIdentity(const CodeSigningIdentity&) = delete;
    CodeSigningIdentity& operator=(const CodeSigningIdentity&) = delete;

    // Credentials as the kernel recorded them at connect time (-1 when they could not be read).
    pid_t pid() const { return pid_; }
    uid_t uid() const { return uid_; }
    gid_t gid() const { return gid_; }
    // A pidfd for the peer taken at accept time; -1 when none could be had.
    int pidfd() const { return pidfd_ ? pidfd_->get() : -1; }
    // The peer's executable, resolved; empty when it could not be established.
    const std::string& executablePath() const { return executablePath_; }
    // True when the executable was read and the process was confirmed alive afterwards through the pidfd.
    bool established() const { return established_; }
    // Why the identity is not established (empty when it is).
    const std::string& failureReason() const { return failureReason_; }

    // The value of one entitlement: a null Value when the program does not have it. An error when the identity
    // could not be established or its entitlements could not be read; the value is then none as well.
    Result<Value> entitlementValueForKey(std::string_view key) const;
    // Every entitlement of the peer (an empty dictionary when it has none).
    const Value& entitlements() const { return entitlements_; }

    std::string description() const;

  private:
    CodeSigningIdentity() = default;

    pid_t pid_ = -1;
    uid_t uid_ = static_cast<uid_t>(-1);
    gid_t gid_ = static_cast<gid_t>(-1);
    std::shared_ptr<const UniqueFd> pidfd_;
    bool established_ = false;
    std::string executablePath_;
    std::string failureReason_;
    std::optional<Error> entitlementsError_;
    Value entitlements_ = Value::emptyDictionary();
};

}  // namespace bexil
