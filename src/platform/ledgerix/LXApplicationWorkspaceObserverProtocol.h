#pragma once

// The observer of the application registry: told after plug-ins were installed and before plug-ins are removed.
// The registry calls it on the thread that made the change, never while holding its own lock, so an observer may
// look records up again (but must not expect the change it is told about to be visible yet in pluginsWillUninstall).

#include <memory>
#include <vector>

namespace bexil {

class LXBexilProxy;

class LXApplicationWorkspaceObserverProtocol {
  public:
    virtual ~LXApplicationWorkspaceObserverProtocol() = default;

    // The records that were just installed, as they are now registered.
    virtual void pluginsDidInstall(const std::vector<std::shared_ptr<const LXBexilProxy>>& plugIns) = 0;
    // The records that are about to be removed, as they were registered; they are still registered now.
    virtual void pluginsWillUninstall(const std::vector<std::shared_ptr<const LXBexilProxy>>& plugIns) = 0;
};

}  // namespace bexil
