// The "lock" request: places a hold over plug-ins (named by their bundles, or as all plug-ins of applications),
// optionally refusing busy ones and terminating running instances afterwards, or releases holds by UUID. A hold is
// in force from the moment it is added, so with termination the reply comes later, from the termination waiter,
// while the request queue goes on with other requests.

#include <memory>
#include <string>
#include <vector>

#include "bexil/Protocol.h"
#include "daemon/BXDPlugInHold.h"
#include "daemon/BXDServer.h"
#include "daemon/BXDZemClient.h"
#include "daemon/Transaction.h"
#include "platform/log/Log.h"

namespace bexil {

namespace {

namespace hold = protocol::hold;

// The plug-ins as a list of their UUIDs, for the log.
std::string uuidList(const std::vector<std::shared_ptr<BXDPlugIn>>& plugIns) {
    std::string text = "(";
    for (const std::shared_ptr<BXDPlugIn>& plugIn : plugIns) {
        if (text.size() > 1) text += ", ";
        text += plugIn->uuid() ? plugIn->uuid()->string() : std::string("(no uuid)");
    }
    return text + ")";
}

}  // namespace

void Transaction::lockDownPlugIns() {
    // The release form: every UUID is released in turn; unknown ones, and elements that are not UUIDs, are passed
    // over, so that a client can always release what it holds without first asking what still exists.
    if (std::optional<Value> uuids = zem_dictionary_get_array(request(), protocol::key::kUuids)) {
        for (const Value& element : uuids->items()) {
            if (const Uuid* uuid = element.getUuid()) server()->unholdToken(*uuid);
        }
        done();
        return;
    }

    const uint64_t flags = request().get(protocol::key::kFlags).numberAsUInt64().value_or(0);
    std::vector<std::shared_ptr<BXDPlugIn>> plugIns;
    bool walked = marshalPaths([&](const std::string& path, bool resolved) {
        if (!resolved) {
            fail(ErrorCode::BadPath, formatPrintf("invalid path: %@", path));
            return false;
        }
        if (flags & hold::kPlugInPaths) {
            std::shared_ptr<BXDPlugIn> plugIn = server()->findPlugInAtPath(path);
            if (!plugIn) {
                fail(ErrorCode::BadPath, formatPrintf("no plug-in at path:%@", path));
                return false;
            }
            plugIns.push_back(std::move(plugIn));
        } else if (auto within = server()->plugInsWithinApplication(path)) {
            plugIns.insert(plugIns.end(), within->begin(), within->end());
        }
        return true;
    });
    if (!walked) return;
    log::ops().info("processing hold request for plug-ins:%@", uuidList(plugIns));

    if (flags & hold::kRefuseBusy) {
        std::vector<std::shared_ptr<BXDPlugIn>> busy;
        MutableArray conflicts;
        for (const std::shared_ptr<BXDPlugIn>& plugIn : plugIns) {
            if (std::optional<Value> conflict = plugIn->checkBusy(server()->processAssertions())) {
                busy.push_back(plugIn);
                conflicts.append(std::move(*conflict));
            }
        }
        if (!busy.empty()) {
            log::ops().debug("hold refused. Busy plug-ins:%@", uuidList(busy));
            reply().set(protocol::key::kConflicts, conflicts.take());
            fail(ErrorCode::PlugInsBusy, "plug-ins are busy");
            return;
        }
    }

    auto placed = std::make_shared<BXDPlugInHold>(plugIns, client());
    const Uuid holdUuid = placed->uuid();
    const std::string uuid = holdUuid.string();
    // The server's list is the hold's only owner from here: the reply below can end the connection and release the
    // hold at once, and its keep-alive unit must close with that release, not when this handler returns.
    if (!server()->addHold(std::move(placed), client().get())) {
        // The client died while its request waited: nobody is left to hold for, or to answer.
        log::ops().debug("hold for departed client %d not placed", static_cast<int>(client()->pid()));
        return;
    }
    reply().set(protocol::key::kUuids, Value::uuid(holdUuid));

    if (!(flags & hold::kTerminate)) {
        log::ops().info("hold request granted uuid:%{public}@", uuid);
        done();
        return;
    }
    std::vector<std::shared_ptr<const LXBexilProxy>> records;
    for (const std::shared_ptr<BXDPlugIn>& plugIn : plugIns)
        if (plugIn->lxproxy()) records.push_back(plugIn->lxproxy());
    // The transaction stays alive in the callback until the answer has gone out.
    server()->terminatePlugInsReply(records, [self = shared_from_this(), uuid] {
        log::ops().info("forced termination complete; hold request granted uuid:%{public}@", uuid);
        self->done();
    });
}

// "holds", an extension of ours: what holds plug-ins out of use, for administrators. Each hold is described by its
// UUID, the pid and executable of the client that placed it (as they were then), when, and its plug-ins.
void Transaction::listHolds() {
    if (!client()->hasEntitlement(protocol::kManagerEntitlement)) {
        log::ops().notice("client %d may not list holds: it lacks the manager entitlement",
                          static_cast<int>(client()->pid()));
        fail(ErrorCode::NotAllowed, "caller lacks entitlement for this operation");
        return;
    }
    MutableArray holds;
    server()->syncQueue().sync([&] {
        for (const std::shared_ptr<BXDPlugInHold>& hold : server()->holds()) {
            MutableArray plugIns;
            for (const std::shared_ptr<BXDPlugIn>& plugIn : hold->blocked())
                plugIns.append(
                    Value::dictionary({{"identifier", Value::string(plugIn->identifier().value_or(""))},
                                       {"uuid", plugIn->uuid() ? Value::uuid(*plugIn->uuid()) : Value::null()},
                                       {"path", Value::string(plugIn->path().value_or(""))}}));
            holds.append(Value::dictionary({{"uuid", Value::uuid(hold->uuid())},
                                            {"pid", Value::uint64(static_cast<uint64_t>(hold->ownerPid()))},
                                            {"executable", Value::string(hold->ownerExecutable())},
                                            {"created", Value::date(hold->created())},
                                            {"plugins", plugIns.take()}}));
        }
    });
    reply().set(protocol::key::kHolds, holds.take());
    done();
}

}  // namespace bexil
