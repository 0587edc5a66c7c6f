// "status", an extension of ours: what bxd is doing now, for administrators and monitoring. It names no plug-in and
// no client, only counts, so any client may ask.

#include <chrono>

#include "daemon/BXDServer.h"
#include "daemon/Transaction.h"
#include "platform/ledgerix/LXApplicationWorkspace.h"
#include "platform/zem/ZemListener.h"

namespace bexil {

void Transaction::reportStatus() {
    BXDServer& daemon = *server();
    auto uptime = std::chrono::duration_cast<std::chrono::seconds>(std::chrono::steady_clock::now() - daemon.started());
    MutableDictionary served;
    for (const protocol::RequestInfo& info : protocol::kRequests)
        served.set(info.name, Value::uint64(daemon.served(info.request)));
    size_t holds = daemon.syncQueue().sync([&] { return daemon.holds().size(); });

    reply().set(protocol::key::kUptime, Value::uint64(static_cast<uint64_t>(uptime.count())));
    reply().set(protocol::key::kConnections, Value::uint64(daemon.service().connectionCount()));
    reply().set(protocol::key::kServed, served.take());
    reply().set(protocol::key::kCachedRecords, Value::uint64(daemon.cachedCount()));
    reply().set(protocol::key::kCacheLimit, Value::uint64(daemon.cacheLimit()));
    reply().set(protocol::key::kHoldCount, Value::uint64(holds));
    StandingQueries* watches = daemon.standingQueries();
    reply().set(protocol::key::kWatchCount, Value::uint64(watches != nullptr ? watches->count() : 0));
    // Left out when the registry cannot be read: a status must answer even then.
    if (std::optional<size_t> registered = daemon.workspace()->plugInCount())
        reply().set(protocol::key::kRegistered, Value::uint64(*registered));
    done();
}

}  // namespace bexil
