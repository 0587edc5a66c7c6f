#include "client/BXDaemonClientSync.h"

#include <future>
#include <memory>

#include "platform/log/Log.h"

namespace bexil {

std::optional<BXDaemonClient::Reply> sendAndWait(const std::function<void(BXDaemonClient::ReplyHandler)>& start,
                                                 std::chrono::milliseconds timeout) {
    // The promise is shared with the handler: a reply that arrives after the wait gave up must still find it.
    auto promise = std::make_shared<std::promise<BXDaemonClient::Reply>>();
    std::future<BXDaemonClient::Reply> future = promise->get_future();
    start([promise](const BXDaemonClient::Reply& reply) { promise->set_value(reply); });
    if (future.wait_for(timeout) != std::future_status::ready) {
        log::ops().error("no reply from bxd within %lld ms", static_cast<long long>(timeout.count()));
        return std::nullopt;
    }
    return future.get();
}

}  // namespace bexil
