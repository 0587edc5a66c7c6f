#pragma once

// What the plug-in database tells its owner: plug-ins that are about to be uninstalled. Called on the thread on which
// the registry reported the uninstall, after the database has left its lock.

#include <memory>
#include <vector>

namespace bexil {

class LXBexilProxy;

class BXDatabaseDelegate {
  public:
    virtual ~BXDatabaseDelegate() = default;
    // The registry records about to be uninstalled, as the registry reported them.
    virtual void removedPlugIns(const std::vector<std::shared_ptr<const LXBexilProxy>>& plugIns) = 0;
};

}  // namespace bexil
