#include <gtest/gtest.h>

#include "model/BXUtilities.h"

namespace bexil {
namespace {

// Annotations are shared between threads as values: a change must give a new dictionary and never edit the one a
// reader may hold; no receiver gives nothing rather than a new dictionary.
TEST(DictionaryChangingTo, SetsAndRemovesWithoutTouchingTheReceiver) {
    Value receiver = Value::dictionary({{"a", Value::int64(1)}, {"b", Value::int64(2)}});
    Value before = receiver;
    EXPECT_EQ(dictionaryChangingTo(receiver, "a", Value::string("x")),
              Value::dictionary({{"a", Value::string("x")}, {"b", Value::int64(2)}}));
    EXPECT_EQ(dictionaryChangingTo(receiver, "a", std::nullopt), Value::dictionary({{"b", Value::int64(2)}}));
    EXPECT_TRUE(receiver.identical(before));
    EXPECT_FALSE(dictionaryChangingTo(std::nullopt, "k", Value::int64(1)));
    EXPECT_FALSE(dictionaryChangingTo(Value::string("not a dictionary"), "k", Value::int64(1)));
}

// Version resolution picks the best version with this ordering, so a wrong order serves the wrong plug-in. Each pair
// is also checked the other way round (the ordering is antisymmetric).
TEST(CompareVersionString, OrdersDigitRunsByValueAndEverythingElseByCode) {
    using enum ComparisonResult;
    const std::tuple<const char*, const char*, ComparisonResult> cases[] = {
        {"1.10", "1.9", Descending},  // digit runs by value, not by text
        {"1.2", "1.2", Same},
        {"1.2a", "1.2b", Ascending},  // other characters by code
        {"1.0", "1", Descending},     // a prefix orders first
        {"", "0", Ascending},
        {"01", "1", Descending},  // equal values: the longer run orders last, keeping the order total
        // Runs longer than any integer type still compare by value.
        {"99999999999999999999999", "100000000000000000000000", Ascending},
    };
    for (const auto& [receiver, other, expected] : cases) {
        EXPECT_EQ(compareVersionString(receiver, other), expected) << receiver << " vs " << other;
        EXPECT_EQ(static_cast<int>(compareVersionString(other, receiver)), -static_cast<int>(expected));
    }
}

}  // namespace
}  // namespace bexil
