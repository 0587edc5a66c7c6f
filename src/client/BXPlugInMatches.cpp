#include "client/BXPlugInMatches.h"

#include "platform/log/Log.h"

namespace bexil {

Result<std::vector<std::shared_ptr<BXPlugInCore>>> plugInsFromMatchReply(const BXDaemonClient& client,
                                                                         const BXDaemonClient::Reply& reply) {
    if (auto error = BXDaemonClient::errorInReply(reply)) return *error;
    const Value* encoded = std::get<Value>(reply).find(protocol::key::kMatches);
    // A daemon answering another protocol version leaves "matches" out rather than send what we cannot read.
    if (encoded == nullptr && client.protocolVersion() != BXDaemonClient::kProtocolVersion)
        return BXErrorWithFormat(ErrorCode::VersionMismatch, "no discovery result for protocol version %lld",
                                 static_cast<long long>(client.protocolVersion()));
    if (encoded == nullptr) return BXError(ErrorCode::OperationFailed, "discovery reply without matches");
    std::optional<Value> matches = client.convertFromZEM(*encoded);
    if (!matches)
        return BXErrorWithFormat(ErrorCode::VersionMismatch, "no discovery result for protocol version %lld",
                                 static_cast<long long>(client.protocolVersion()));
    if (!matches->isArray()) return BXError(ErrorCode::OperationFailed, "discovery reply with malformed matches");

    std::vector<std::shared_ptr<BXPlugInCore>> plugIns;
    plugIns.reserve(matches->count());
    for (const Value& form : matches->items()) {
        if (auto plugIn = BXPlugInCore::initWithForm(form)) {
            plugIns.push_back(std::move(plugIn));
        } else {
            log::ops().error("unreadable plug-in form in discovery reply: %@", form.description(512));
        }
    }
    return plugIns;
}

}  // namespace bexil
