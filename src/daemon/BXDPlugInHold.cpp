#include "daemon/BXDPlugInHold.h"

#include "daemon/BXDZemClient.h"

namespace bexil {

std::atomic<size_t> BXDPlugInHold::openUnits_{0};

BXDPlugInHold::BXDPlugInHold(std::vector<std::shared_ptr<BXDPlugIn>> plugIns, std::weak_ptr<BXDZemClient> client)
    : uuid_(Uuid::random()), created_(Date::now()), client_(std::move(client)) {
    if (std::shared_ptr<BXDZemClient> owner = client_.lock()) {
        ownerPid_ = owner->pid();
        ownerExecutable_ = owner->path();
    }
    for (std::shared_ptr<BXDPlugIn>& plugIn : plugIns) {
        if (plugIn && !blocks(*plugIn)) blocked_.push_back(std::move(plugIn));
    }
    openUnits_.fetch_add(1);
}

BXDPlugInHold::~BXDPlugInHold() { openUnits_.fetch_sub(1); }

bool BXDPlugInHold::placedBy(const BXDZemClient* client) const {
    std::shared_ptr<BXDZemClient> placer = client_.lock();
    return placer != nullptr && placer.get() == client;
}

bool BXDPlugInHold::blocks(const BXDPlugIn& plugIn) const {
    for (const std::shared_ptr<BXDPlugIn>& held : blocked_) {
        if (held->uuid() == plugIn.uuid()) return true;
    }
    return false;
}

}  // namespace bexil
