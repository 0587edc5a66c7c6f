#include "client/TypedMessage.h"

#include "bexil/Protocol.h"
#include "platform/zem/ZemCodec.h"

namespace bexil::typed {

Value callMessage(std::string_view selector, const Value& arguments) {
    return Value::dictionary({{std::string(kSelector), Value::string(selector)}, {std::string(kArguments), arguments}});
}

Value replyMessage(const Value& arguments) { return Value::dictionary({{std::string(kArguments), arguments}}); }

Value errorReply(const Error& error) {
    // A code that is not positive would read back as success; the peer must see a failure.
    uint64_t code =
        error.code() > 0 ? static_cast<uint64_t>(error.code()) : protocol::codeOf(ErrorCode::OperationFailed);
    return Value::dictionary({{std::string(protocol::key::kErrorCode), Value::uint64(code)},
                              {std::string(protocol::key::kError),
                               Value::string(error.localizedDescription().value_or(error.description()))}});
}

namespace {

Result<Value> decode(std::span<const uint8_t> payload) {
    Result<Value> decoded = ZemCodec::decode(payload);
    if (!decoded) return BXErrorWithFormat(ErrorCode::InvalidRequest, "unreadable message: %@", decoded.error());
    if (!decoded->isDictionary())
        return BXErrorWithFormat(ErrorCode::InvalidRequest, "the message is a %s, not a dictionary",
                                 valueKindName(decoded->kind()));
    return decoded;
}

}  // namespace

Result<Call> readCall(std::span<const uint8_t> payload, const BXInterface& interface) {
    Result<Value> message = decode(payload);
    if (!message) return message.error();
    const Value& selector = message->get(kSelector);
    if (!selector.isString()) return BXError(ErrorCode::InvalidRequest, "the call names no selector");
    Call call{std::string(selector.stringView()), message->get(kArguments)};
    if (auto refused = interface.checkArguments(call.selector, MessageDirection::Request, call.arguments))
        return *refused;
    return call;
}

Result<Value> readReply(std::span<const uint8_t> payload, const BXInterface& interface, std::string_view selector) {
    Result<Value> message = decode(payload);
    if (!message) return message.error();
    if (const Value* code = message->find(protocol::key::kErrorCode)) {
        std::optional<int64_t> number = code->numberAsInt64();
        const Value& text = message->get(protocol::key::kError);
        return BXError(number && *number > 0 && *number <= INT32_MAX ? static_cast<int>(*number)
                                                                     : protocol::codeOf(ErrorCode::OperationFailed),
                       text.isString() ? std::optional<std::string_view>(text.stringView())
                                       : std::optional<std::string_view>("the peer refused the call"));
    }
    Value arguments = message->get(kArguments);
    if (auto refused = interface.checkArguments(selector, MessageDirection::Reply, arguments))
        return BXErrorWithFormat(ErrorCode::InvalidRequest, "ill-typed answer: %s",
                                 refused->localizedDescription().value_or(""));
    return arguments;
}

}  // namespace bexil::typed
