#pragma once

// What the plug-in database tells its owner: plug-ins installed, plug-ins about to be uninstalled and elections made
// automatically. The registry's events are passed on the thread on which the registry reported them, after the
// database has left its lock; an automatic election is passed inside the database's lock, so its receiver must only
// take note.

#include <memory>
#include <vector>

namespace bexil {

class BXDPlugIn;
class LXBexilProxy;

class BXDatabaseDelegate {
  public:
    virtual ~BXDatabaseDelegate() = default;
    // The registry records about to be uninstalled, as the registry reported them.
    virtual void removedPlugIns(const std::vector<std::shared_ptr<const LXBexilProxy>>& plugIns) = 0;
    // The registry records just installed (their registration is committed).
    virtual void installedPlugIns(const std::vector<std::shared_ptr<const LXBexilProxy>>& /*plugIns*/) {}
    // The plug-in's election was just made automatically (in memory; its save is queued on the writer).
    virtual void electedAutomatically(const BXDPlugIn& /*plugIn*/) {}
};

}  // namespace bexil
