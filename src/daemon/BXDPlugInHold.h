#pragma once

// A hold that keeps plug-ins out of use while their applications change. Placed by a client, owned by the
// server's hold list (read and written only inside the server's syncQueue), and released when its client dies.

#include <memory>
#include <vector>

#include "base/Value.h"
#include "policy/BXDPlugIn.h"

namespace bexil {

class BXDZemClient;

class BXDPlugInHold {
  public:
    BXDPlugInHold(Uuid token, std::weak_ptr<BXDZemClient> client, std::vector<std::shared_ptr<BXDPlugIn>> blocked = {})
        : token_(token), client_(std::move(client)), blocked_(std::move(blocked)) {}

    const Uuid& token() const { return token_; }
    // The client that placed the hold, referred to weakly: a hold never keeps a dead client alive.
    std::shared_ptr<BXDZemClient> client() const { return client_.lock(); }
    bool belongsTo(const BXDZemClient* client) const { return client_.lock().get() == client || client_.expired(); }

    // The held plug-ins; no two with the same UUID.
    const std::vector<std::shared_ptr<BXDPlugIn>>& blocked() const { return blocked_; }
    // Whether the hold names the plug-in; records are the same plug-in exactly when their UUIDs are equal.
    bool blocks(const BXDPlugIn& plugIn) const {
        for (const std::shared_ptr<BXDPlugIn>& held : blocked_) {
            if (held->uuid() == plugIn.uuid()) return true;
        }
        return false;
    }

  private:
    Uuid token_;
    std::weak_ptr<BXDZemClient> client_;
    std::vector<std::shared_ptr<BXDPlugIn>> blocked_;
};

}  // namespace bexil
