// The "ready" request: makes the plug-ins named by UUID runnable for the calling host. Every plug-in is checked
// first (holds, then the host access policy), so that a refusal leaves nothing enabled; only then is each plug-in
// that carries code enabled, once however often it is named. An enabling failure answers the request, but the other
// plug-ins are still enabled, as a host retrying the request would have them anyway.

#include <memory>
#include <string>
#include <vector>

#include "daemon/BXDServer.h"
#include "daemon/BXDZemClient.h"
#include "daemon/Transaction.h"
#include "platform/log/Log.h"
#include "platform/trace/Probes.h"
#include "policy/BXDPlugIn.h"

namespace bexil {

void Transaction::readyPlugIns() {
    std::vector<std::shared_ptr<BXDPlugIn>> toEnable;
    const BXDZemClient& host = *client();
    bool walked = processUuidList([&](const std::shared_ptr<BXDPlugIn>& plugIn) {
        std::string uuidText = plugIn->uuid() ? plugIn->uuid()->string() : std::string();
        trace::pluginReady(uuidText.c_str());
        if (server()->holdOnPlugIn(*plugIn)) {
            log::ops().notice("denied access to %d for plugin %@(%{public}@): %s", static_cast<int>(host.pid()),
                              plugIn->identifier(), uuidText, kOnHoldReason.data());
            denyAccess(*plugIn, kOnHoldReason);
            return false;
        }
        if (plugIn->isData()) return true;
        BXMatchContext context{.annotations = &server()->annotationSource()};
        if (std::optional<std::string> reason = plugIn->allowForClient(host, context)) {
            log::ops().notice("denied access to %d for plugin %@(%{public}@): %{public}@", static_cast<int>(host.pid()),
                              plugIn->identifier(), uuidText, *reason);
            denyAccess(*plugIn, *reason);
            return false;
        }
        for (const std::shared_ptr<BXDPlugIn>& already : toEnable)
            if (already == plugIn) return true;
        toEnable.push_back(plugIn);
        return true;
    });
    if (!walked) return;

    BXEnableServices services{server()->serviceManager(), server()->privacyConsent()};
    std::optional<Error> firstFailure;
    for (const std::shared_ptr<BXDPlugIn>& plugIn : toEnable) {
        std::optional<Error> error = plugIn->enableForClient(host, services);
        if (error && !firstFailure) firstFailure = std::move(error);
    }
    if (firstFailure) {
        fail(ErrorCode::OperationFailed, *firstFailure);
        return;
    }
    done();
}

}  // namespace bexil
