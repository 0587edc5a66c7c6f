#pragma once

// A hold keeps plug-ins out of use while the client that placed it wants: discovery leaves them out and they are
// not made ready. Made by the "lock" request, owned by the server's hold list (read and written only inside the
// server's syncQueue), and released by its UUID or when its client dies. Immutable after creation.

#include <sys/types.h>

#include <atomic>
#include <cstddef>
#include <memory>
#include <string>
#include <vector>

#include "bexil/Value.h"
#include "policy/BXDPlugIn.h"

namespace bexil {

class BXDZemClient;

class BXDPlugInHold {
  public:
    // A new hold with a fresh random UUID over `plugIns` (a plug-in named twice is held once), placed now by
    // `client`, which it refers to weakly. Opens one keep-alive unit until the hold is destroyed.
    BXDPlugInHold(std::vector<std::shared_ptr<BXDPlugIn>> plugIns, std::weak_ptr<BXDZemClient> client);
    ~BXDPlugInHold();
    BXDPlugInHold(const BXDPlugInHold&) = delete;
    BXDPlugInHold& operator=(const BXDPlugInHold&) = delete;

    // The hold's identity, handed to the client; two holds are the same hold when their UUIDs are equal.
    const Uuid& uuid() const { return uuid_; }
    const Date& created() const { return created_; }
    // Who placed the hold, as it was when the hold was placed (for listings; the client may be gone since).
    pid_t ownerPid() const { return ownerPid_; }
    const std::string& ownerExecutable() const { return ownerExecutable_; }
    // Whether `client` placed this hold. A hold whose client object is gone belongs to nobody: it stays until it
    // is released by its UUID.
    bool placedBy(const BXDZemClient* client) const;

    // The held plug-ins; no two with the same UUID.
    const std::vector<std::shared_ptr<BXDPlugIn>>& blocked() const { return blocked_; }
    // Whether the hold names the plug-in; records are the same plug-in exactly when their UUIDs are equal.
    bool blocks(const BXDPlugIn& plugIn) const;

    bool operator==(const BXDPlugInHold& other) const { return uuid_ == other.uuid_; }

    // The keep-alive units open now: one per hold alive. While any is open the daemon must not end for being idle
    // (bxd has no idle exit today; the count is logged with every change of the holds, so it can be checked).
    static size_t openKeepAliveUnits() { return openUnits_.load(); }

  private:
    static std::atomic<size_t> openUnits_;

    Uuid uuid_;
    Date created_;
    std::weak_ptr<BXDZemClient> client_;
    pid_t ownerPid_ = 0;
    std::string ownerExecutable_;
    std::vector<std::shared_ptr<BXDPlugIn>> blocked_;
};

}  // namespace bexil
