#include "platform/ledgerix/LXApplicationWorkspace.h"

#include <mutex>

#include "platform/ledgerix/LedgerixWorkspace.h"

namespace bexil {

Result<std::shared_ptr<LXApplicationWorkspace>> LXApplicationWorkspace::defaultWorkspace() {
    static std::mutex mutex;
    static std::shared_ptr<LXApplicationWorkspace> shared;
    std::lock_guard lock(mutex);
    if (shared) return shared;
    LedgerixWorkspace::Options options;
    options.stateDirectory = LedgerixWorkspace::defaultStateDirectory();
    Result<std::shared_ptr<LedgerixWorkspace>> opened = LedgerixWorkspace::open(std::move(options));
    if (!opened.ok()) return opened.error();
    shared = std::move(opened).value();
    return shared;
}

}  // namespace bexil
