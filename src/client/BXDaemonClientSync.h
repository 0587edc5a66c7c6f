#pragma once

// A synchronous layer over BXDaemonClient for tools and simple programs: start a request, wait for its reply with
// a time limit. The callback API stays the primary one. The waiting thread sends the request and reads the reply
// itself when the connection is idle (BXDaemonClient::waitOnCallingThread), and otherwise parks on a future.
// REQUIRES: not called on the client's replyQueue (the reply could never be delivered while it waits).

#include <chrono>
#include <functional>
#include <optional>

#include "client/BXDaemonClient.h"

namespace bexil {

// How long the tools wait for any one reply before they give up on the daemon.
inline constexpr std::chrono::milliseconds kDefaultReplyTimeout = std::chrono::seconds(30);

// Calls `start` with a reply handler and waits for the reply; none when it did not come within `timeout`.
// Example: sendAndWait([&](auto reply) { client.bulkPluginsReply(0, std::move(reply)); });
std::optional<BXDaemonClient::Reply> sendAndWait(const std::function<void(BXDaemonClient::ReplyHandler)>& start,
                                                 std::chrono::milliseconds timeout = kDefaultReplyTimeout);
// The same for work of many round trips (a paged discovery): the time limit counts from the later of the start and
// `lastActivity()`, the moment the work last moved on, so only a stalled exchange gives up.
std::optional<BXDaemonClient::Reply> sendAndWait(
    const std::function<void(BXDaemonClient::ReplyHandler)>& start, std::chrono::milliseconds timeout,
    const std::function<std::chrono::steady_clock::time_point()>& lastActivity);

}  // namespace bexil
