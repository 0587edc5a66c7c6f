#include <gtest/gtest.h>

#include "model/BXUtilities.h"

namespace bexil {
namespace {

Value str(const char* s) { return Value::string(s); }

TEST(ArrayWithValuesInBlock, MapsInOrderAndDropsNothing) {
    Value input = Value::array({Value::int64(1), Value::int64(2), Value::int64(3), Value::int64(4)});
    Value evensDoubled = arrayWithValuesInBlock(input, [](const Value& v) -> std::optional<Value> {
        int64_t n = *v.getInt64();
        if (n % 2) return std::nullopt;
        return Value::int64(n * 2);
    });
    EXPECT_EQ(evensDoubled, Value::array({Value::int64(4), Value::int64(8)}));
    EXPECT_EQ(input.count(), 4u);

    auto none = [](const Value&) -> std::optional<Value> { return std::nullopt; };
    EXPECT_EQ(arrayWithValuesInBlock(input, none), Value::emptyArray());
    EXPECT_EQ(arrayWithValuesInBlock(str("not an array"), [](const Value& v) { return std::optional<Value>(v); }),
              Value::emptyArray());
}

TEST(DictionaryChangingTo, SetsReplacesAndRemovesWithoutTouchingTheReceiver) {
    Value receiver = Value::dictionary({{"a", Value::int64(1)}, {"b", Value::int64(2)}});
    Value before = receiver;

    EXPECT_EQ(dictionaryChangingTo(receiver, "c", Value::int64(3)),
              Value::dictionary({{"a", Value::int64(1)}, {"b", Value::int64(2)}, {"c", Value::int64(3)}}));
    EXPECT_EQ(dictionaryChangingTo(receiver, "a", str("x")),
              Value::dictionary({{"a", str("x")}, {"b", Value::int64(2)}}));
    EXPECT_EQ(dictionaryChangingTo(receiver, "a", std::nullopt), Value::dictionary({{"b", Value::int64(2)}}));
    EXPECT_EQ(dictionaryChangingTo(receiver, "absent", std::nullopt), receiver);

    EXPECT_TRUE(receiver.identical(before));
    EXPECT_EQ(receiver, Value::dictionary({{"a", Value::int64(1)}, {"b", Value::int64(2)}}));
}

TEST(DictionaryChangingTo, NoReceiverGivesNothing) {
    EXPECT_FALSE(dictionaryChangingTo(std::nullopt, "k", Value::int64(1)));
    EXPECT_FALSE(dictionaryChangingTo(str("not a dictionary"), "k", Value::int64(1)));
}

// One pair per branch of the comparison, each also checked the other way round (the ordering is antisymmetric).
TEST(CompareVersionString, OrdersDigitRunsByValueAndEverythingElseByCode) {
    using enum ComparisonResult;
    const std::tuple<const char*, const char*, ComparisonResult> cases[] = {
        {"1.10", "1.9", Descending},  // digit runs by value, not by text
        {"1.2", "1.2", Same},
        {"", "", Same},
        {"1.2a", "1.2b", Ascending},  // other characters by code
        {"A", "a", Ascending},        // case-sensitive
        {"1a", "1.", Descending},     // a run ends where the other string has a non-digit
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
