#pragma once

// JSON text of Values, as users see it: the bexil tool reads rule and annotation files and prints replies with --json
// through it, and the C interface of libbexil takes and gives values in the same form. Numbers
// without a fraction or exponent read as int64 (uint64 above its range), others as reals; null, booleans,
// strings, arrays and objects map to the Value kinds of the same name. Writing renders data as base64 text, dates
// as ISO 8601 text and UUIDs as their canonical text, since JSON has none of those kinds; a whole real keeps its
// ".0", so that it reads back as a real. Errors name the line and column (in bytes). Stateless; any thread.

#include <string>
#include <string_view>

#include "base/Error.h"
#include "bexil/Value.h"

namespace bexil {

// Most arrays and objects a JSON file may nest inside one another; deeper input is refused rather than risk the stack.
inline constexpr int kMaxJsonDepth = 128;

Result<Value> parseJson(std::string_view text);
enum class JsonLayout { Pretty, OneLine };
std::string toJson(const Value& value, JsonLayout layout = JsonLayout::Pretty);

}  // namespace bexil
