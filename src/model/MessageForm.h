#pragma once

// The message form of discovery results, shared by the daemon that encodes a "match" result and the clients that
// decode it. Zem carries every kind a property-list value can have (null, booleans, both integer kinds, reals,
// strings, data, dates, UUIDs, arrays, dictionaries) and keeps them apart on the wire, so the message form of a
// value is the value itself. Only the version gate is left, so that a daemon and a client that speak another
// protocol version never mistake a result for one they could read. Pure functions; any thread.

#include <cstdint>
#include <optional>

#include "bexil/Value.h"

namespace bexil {

// Whether a reply for protocol `version` carries message forms at all: only the current version's does.
bool carriesMessageForms(uint64_t version);
// The message form of `value` for protocol `version`; none for every version but the current one.
std::optional<Value> toMessageForm(const Value& value, uint64_t version);
// The value decoded from its message form by a client speaking `version`; none for every version but the current.
std::optional<Value> fromMessageForm(const Value& encoded, uint64_t version);

}  // namespace bexil
