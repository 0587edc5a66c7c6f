#pragma once

// What the plug-in database tells its owner: plug-ins that are about to be uninstalled. Called on the database's
// queue after it has left its lock.

#include "base/Value.h"

namespace bexil {

class BXDatabaseDelegate {
  public:
    virtual ~BXDatabaseDelegate() = default;
    // `plugIns` is an array describing the registry records about to be uninstalled.
    virtual void removedPlugIns(const Value& plugIns) = 0;
};

}  // namespace bexil
