#pragma once

// A hold that keeps plug-ins out of use while their applications change. Placed by a client, owned by the
// server's hold list (read and written only inside the server's syncQueue), and released when its client dies.

#include <memory>

#include "base/Value.h"

namespace bexil {

class BXDZemClient;

class BXDPlugInHold {
  public:
    BXDPlugInHold(Uuid token, std::weak_ptr<BXDZemClient> client) : token_(token), client_(std::move(client)) {}

    const Uuid& token() const { return token_; }
    // The client that placed the hold, referred to weakly: a hold never keeps a dead client alive.
    std::shared_ptr<BXDZemClient> client() const { return client_.lock(); }
    bool belongsTo(const BXDZemClient* client) const { return client_.lock().get() == client || client_.expired(); }

  private:
    Uuid token_;
    std::weak_ptr<BXDZemClient> client_;
};

}  // namespace bexil
