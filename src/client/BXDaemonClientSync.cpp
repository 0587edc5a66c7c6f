#include "client/BXDaemonClientSync.h"

#include <algorithm>
#include <future>
#include <memory>

#include "platform/log/Log.h"

namespace bexil {

std::optional<BXDaemonClient::Reply> sendAndWait(const std::function<void(BXDaemonClient::ReplyHandler)>& start,
                                                 std::chrono::milliseconds timeout) {
    return sendAndWait(start, timeout, nullptr);
}

std::optional<BXDaemonClient::Reply> sendAndWait(
    const std::function<void(BXDaemonClient::ReplyHandler)>& start, std::chrono::milliseconds timeout,
    const std::function<std::chrono::steady_clock::time_point()>& lastActivity) {
    // The promise is shared with the handler: a reply that arrives after the wait gave up must still find it.
    auto promise = std::make_shared<std::promise<BXDaemonClient::Reply>>();
    std::future<BXDaemonClient::Reply> future = promise->get_future();
    auto deadline = std::chrono::steady_clock::now() + timeout;
    // The handler only fulfils the promise, so the reply may be read on this thread, which waits for it anyway.
    BXDaemonClient::waitOnCallingThread(
        [&] {
            start(BXDaemonClient::CallerThreadHandler{
                [promise](const BXDaemonClient::Reply& reply) { promise->set_value(reply); }});
        },
        [&] { return lastActivity ? std::max(deadline, lastActivity() + timeout) : deadline; });
    while (future.wait_until(deadline) != std::future_status::ready) {
        auto extended = lastActivity ? lastActivity() + timeout : deadline;
        if (extended > deadline) {
            deadline = extended;
            continue;
        }
        log::ops().error("no reply from bxd within %lld ms", static_cast<long long>(timeout.count()));
        return std::nullopt;
    }
    return future.get();
}

}  // namespace bexil
