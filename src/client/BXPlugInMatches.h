#pragma once

// Turns the "matches" of a discovery reply back into plug-in records: each form is decoded from the message form
// with the client's convertFromZEM and read with BXPlugInCore::initWithForm. A plain function over values; any
// thread may call it (typically a reply callback on the client's replyQueue).

#include <memory>
#include <vector>

#include "base/Error.h"
#include "client/BXDaemonClient.h"
#include "model/BXPlugInCore.h"

namespace bexil {

// The records of a successful "match" reply, in reply order. The reply's own error when it failed; code 7 when the
// client's protocol version has no message form; code 4 when "matches" is missing or not an array. A form that
// cannot be read is left out and logged.
Result<std::vector<std::shared_ptr<BXPlugInCore>>> plugInsFromMatchReply(const BXDaemonClient& client,
                                                                         const BXDaemonClient::Reply& reply);

}  // namespace bexil
