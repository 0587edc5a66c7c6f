#pragma once

// Small operations on Values that the plug-in model and the request handlers share. All are pure functions of
// their arguments and may be called on any queue.

#include <functional>
#include <optional>
#include <string_view>

#include "bexil/Value.h"

namespace bexil {

enum class ComparisonResult : int { Ascending = -1, Same = 0, Descending = 1 };

// A new array of what `block` returns for each item of `values`, in order, skipping the items for which it returns
// nothing. A non-array gives an empty array.
Value arrayWithValuesInBlock(const Value& values, const std::function<std::optional<Value>(const Value&)>& block);

// A new dictionary equal to `receiver` with `key` set to `value`, or removed when `value` is nothing. The receiver
// is never changed; with no receiver (nothing, or not a dictionary) the result is nothing.
std::optional<Value> dictionaryChangingTo(const std::optional<Value>& receiver, std::string_view key,
                                          const std::optional<Value>& value);

// Orders version strings so that runs of decimal digits compare by their numeric value ("1.9" < "1.10") and every
// other character by its code (case-sensitive); when one string is a prefix of the other the shorter is smaller.
ComparisonResult compareVersionString(std::string_view receiver, std::string_view other);

}  // namespace bexil
