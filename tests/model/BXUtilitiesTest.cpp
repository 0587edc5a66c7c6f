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
    int calls = 0;
    auto count = [&](const Value& v) -> std::optional<Value> {
        ++calls;
        return v;
    };
    EXPECT_EQ(arrayWithValuesInBlock(Value::emptyArray(), count), Value::emptyArray());
    EXPECT_EQ(arrayWithValuesInBlock(str("not an array"), count), Value::emptyArray());
    EXPECT_EQ(calls, 0);
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
    EXPECT_EQ(dictionaryChangingTo(Value::emptyDictionary(), "k", Value::int64(1)),
              Value::dictionary({{"k", Value::int64(1)}}));

    EXPECT_TRUE(receiver.identical(before));
    EXPECT_EQ(receiver, Value::dictionary({{"a", Value::int64(1)}, {"b", Value::int64(2)}}));
}

TEST(DictionaryChangingTo, NoReceiverGivesNothing) {
    EXPECT_FALSE(dictionaryChangingTo(std::nullopt, "k", Value::int64(1)));
    EXPECT_FALSE(dictionaryChangingTo(std::nullopt, "k", std::nullopt));
    EXPECT_FALSE(dictionaryChangingTo(str("not a dictionary"), "k", Value::int64(1)));
}

struct VersionCase {
    const char* receiver;
    const char* other;
    ComparisonResult expected;
};

class CompareVersionString : public testing::TestWithParam<VersionCase> {};

TEST_P(CompareVersionString, OrdersDigitRunsByValue) {
    const VersionCase& c = GetParam();
    EXPECT_EQ(compareVersionString(c.receiver, c.other), c.expected) << c.receiver << " vs " << c.other;
    // The ordering is antisymmetric.
    EXPECT_EQ(static_cast<int>(compareVersionString(c.other, c.receiver)), -static_cast<int>(c.expected));
}

INSTANTIATE_TEST_SUITE_P(
    Versions, CompareVersionString,
    testing::Values(
        VersionCase{"1.10", "1.9", ComparisonResult::Descending}, VersionCase{"1.2", "1.2", ComparisonResult::Same},
        VersionCase{"1.2a", "1.2b", ComparisonResult::Ascending}, VersionCase{"10", "9", ComparisonResult::Descending},
        VersionCase{"2", "10", ComparisonResult::Ascending}, VersionCase{"1.0", "1", ComparisonResult::Descending},
        VersionCase{"A", "a", ComparisonResult::Ascending}, VersionCase{"", "", ComparisonResult::Same},
        VersionCase{"", "0", ComparisonResult::Ascending}, VersionCase{"1.9.9", "1.10", ComparisonResult::Ascending},
        VersionCase{"1a", "1.", ComparisonResult::Descending},
        // Runs longer than any integer type still compare by value.
        VersionCase{"99999999999999999999999", "100000000000000000000000", ComparisonResult::Ascending},
        VersionCase{"1.2.3-beta", "1.2.3-beta", ComparisonResult::Same}));

}  // namespace
}  // namespace bexil
