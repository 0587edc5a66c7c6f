#include "model/MessageForm.h"

#include "bexil/Protocol.h"

namespace bexil {

bool carriesMessageForms(uint64_t version) { return version == protocol::kCurrentVersion; }

std::optional<Value> toMessageForm(const Value& value, uint64_t version) {
    if (!carriesMessageForms(version)) return std::nullopt;
    return value;
}

std::optional<Value> fromMessageForm(const Value& encoded, uint64_t version) {
    if (version != protocol::kCurrentVersion) return std::nullopt;
    return encoded;
}

}  // namespace bexil
