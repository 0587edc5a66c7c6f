// The "launch" request, an extension of ours: starts one plug-in that the calling host made ready, in the sandbox
// of its profile and as the host's user, and hands the host its end of a socket to the plug-in. The grant that
// "ready" left with the service manager is the only way in: it names the host process (not merely its pid) and the
// executable, so a host that never asked, or a later process that inherited the pid, starts nothing.

#include <signal.h>

#include <memory>
#include <string>

#include "daemon/BXDServer.h"
#include "daemon/BXDZemClient.h"
#include "daemon/Transaction.h"
#include "platform/ledgerix/LXBexilProxy.h"
#include "platform/log/Log.h"
#include "policy/BXDPlugIn.h"

namespace bexil {

namespace {

constexpr std::string_view kServiceKey = "ZEMService";

}  // namespace

void Transaction::launchPlugIn() {
    if (const Value* uuids = request().find(protocol::key::kUuids);
        uuids != nullptr && uuids->isArray() && uuids->count() != 1) {
        fail(ErrorCode::InvalidRequest, "invalid request format (launch takes one uuid)");
        return;
    }
    std::shared_ptr<BXDPlugIn> plugIn;
    if (!processUuidList([&](const std::shared_ptr<BXDPlugIn>& named) {
            plugIn = named;
            return true;
        }))
        return;

    const BXDZemClient& host = *client();
    std::string uuidText = plugIn->uuid() ? plugIn->uuid()->string() : std::string();
    if (server()->holdOnPlugIn(*plugIn)) {
        denyAccess(*plugIn, kOnHoldReason);
        return;
    }
    std::optional<std::string> executable = plugIn->isData() ? std::nullopt : plugIn->startableExecutable();
    if (!executable) {
        fail(ErrorCode::OperationFailed,
             formatPrintf("cannot obtain executable path for plug-in %@(%@)", plugIn->identifier(), uuidText));
        return;
    }
    std::optional<Value> overlay = server()->serviceManager().grantedOverlay(host.pid(), *executable);
    if (!overlay) {
        log::ops().notice("refused to launch plug-in %@(%{public}@) for %d %@: not made ready for it",
                          plugIn->identifier(), uuidText, static_cast<int>(host.pid()), host.path());
        fail(ErrorCode::NotAllowed, formatPrintf("plug-in %@ was not made ready for this host", plugIn->identifier()));
        return;
    }

    std::shared_ptr<ZemConnection> connection = host.connection();
    if (!connection) return;  // the host is gone: nobody to start anything for
    const std::shared_ptr<const LXBexilProxy>& proxy = plugIn->lxproxy();
    ServiceManager::ServiceLaunch launch{
        .bundleIdentifier =
            proxy && proxy->bundleIdentifier() ? *proxy->bundleIdentifier() : plugIn->identifier().value_or(""),
        .bundlePath = *plugIn->url(),
        .executablePath = *executable,
        .container = proxy ? proxy->dataContainerURL() : std::nullopt,
        .serviceDescription = overlay->get(kServiceKey),
        .uid = connection->peerUid(),
        .gid = connection->peerGid(),
    };
    Result<ServiceManager::LaunchedService> launched =
        server()->serviceManager().startService(launch, server()->mainQueue());
    if (!launched) {
        log::ops().error("%@", launched.error());
        fail(ErrorCode::OperationFailed, launched.error());
        return;
    }
    // A host that left while its plug-in started would leave it running with nobody on the other end.
    if (host.peerHasHungUp()) {
        log::ops().notice("host %d left during the launch of plug-in %@; ending instance %d",
                          static_cast<int>(host.pid()), plugIn->identifier(), static_cast<int>(launched->pid));
        kill(launched->pid, SIGKILL);
        return;
    }
    reply().set(protocol::key::kPid, Value::uint64(static_cast<uint64_t>(launched->pid)));
    // What was started, as the registry knows the bundle, without the entries that only say how it was built.
    if (std::optional<Value> info = plugIn->bundleInfoDictionary(); info && info->isDictionary())
        reply().set(protocol::key::kBundleInfo, BXDPlugIn::prunedInfoDictionaryFor(*info));
    std::vector<UniqueFd> descriptors;
    descriptors.push_back(std::move(launched->hostEnd));
    doneWithDescriptors(std::move(descriptors));
}

}  // namespace bexil
