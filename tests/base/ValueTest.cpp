#include <gtest/gtest.h>

#include <cmath>
#include <limits>
#include <thread>

#include "TestSupport.h"
#include "bexil/Value.h"

namespace bexil {
namespace {

using test::dict;

// Guards copy-on-write: a builder started from a shared value never edits what others hold.
TEST(ValueSharing, BuildersNeverEditTheirSource) {
    Value original = dict({{"a", Value::string("one")}, {"b", Value::int64(2)}});
    MutableDictionary builder(original);
    builder.set("a", Value::string("changed"));
    builder.remove("b");
    EXPECT_EQ(builder.take(), dict({{"a", Value::string("changed")}}));
    EXPECT_EQ(original, dict({{"a", Value::string("one")}, {"b", Value::int64(2)}}));
}

// Guards the shared storage's reference counts against races (the sanitizers of the debug build watch).
TEST(ValueSharing, SharedAcrossThreadsWithoutRaces) {
    Value shared = dict({{"list", Value::array({Value::string("x"), Value::data(std::vector<uint8_t>{1, 2})})}});
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t) {
        threads.emplace_back([shared] {
            for (int i = 0; i < 10000; ++i) {
                Value local = shared;
                Value item = local.get("list");
                ASSERT_EQ(item.count(), 2u);
            }
        });
    }
    for (auto& t : threads) t.join();
    EXPECT_EQ(shared.get("list").count(), 2u);
}

// Guards dictionaries: the last duplicate wins, and look-ups find every key however the keys were inserted (the
// sorted order itself shows in DocumentRoundTrip.WritesTheDocumentedLayout), in order or not.
TEST(ValueDictionary, LastDuplicateWinsAndTheBuilderLookupMatchesTheBuiltValue) {
    Value d = dict({{"zeta", Value::int64(1)}, {"alpha", Value::int64(2)}, {"alpha", Value::int64(4)}});
    EXPECT_EQ(d.count(), 2u);
    EXPECT_EQ(d.get("alpha"), Value::int64(4));
    // Look-ups on non-dictionaries answer nothing rather than failing.
    EXPECT_EQ(Value::string("x").find("x"), nullptr);

    // Inserted in reverse, so every set lands before what is there.
    MutableDictionary b;
    for (int i = 999; i >= 0; --i) b.set("key" + std::to_string(i), Value::int64(i));
    Value built = b.value();
    for (int i = 0; i < 1000; ++i) ASSERT_EQ(built.get("key" + std::to_string(i)), Value::int64(i));
    for (size_t i = 1; i < built.count(); ++i) ASSERT_LT(built.entries()[i - 1].key, built.entries()[i].key);
    // The builder stays usable after value().
    EXPECT_EQ(b.take(), built);

    // Inserted in order, so every set lands after what is there; setting the last key or an earlier one again
    // replaces its value.
    MutableDictionary ascending;
    for (std::string key : {"a", "b", "c", "c", "a"}) ascending.set(key, Value::string(key + "'"));
    ascending.set("c", Value::int64(3));
    EXPECT_EQ(ascending.take(), dict({{"a", Value::string("a'")}, {"b", Value::string("b'")}, {"c", Value::int64(3)}}));
}

// Guards equality, which matching and the annotation merge rely on: numbers by value across kinds (exactly, also
// at 2^63), never equal to other kinds, containers deeply.
TEST(ValueEquality, NumbersCompareByValueAcrossKindsNonNumbersNeverEqualThem) {
    EXPECT_EQ(Value::boolean(true), Value::real(1.0));
    EXPECT_EQ(Value::int64(42), Value::uint64(42));
    EXPECT_NE(Value::int64(42), Value::real(42.5));
    EXPECT_NE(Value::int64(-1), Value::uint64(std::numeric_limits<uint64_t>::max()));
    // 2^63 is exactly representable as a double but not as an int64.
    EXPECT_EQ(Value::uint64(uint64_t{1} << 63), Value::real(9223372036854775808.0));
    EXPECT_NE(Value::int64(std::numeric_limits<int64_t>::max()), Value::real(9223372036854775808.0));
    EXPECT_NE(Value::real(std::nan("")), Value::real(std::nan("")));

    EXPECT_NE(Value::string("1"), Value::int64(1));
    EXPECT_NE(Value::date(Date{0}), Value::real(0));

    // Containers compare deeply, by the same rules.
    Value a = dict({{"list", Value::array({Value::int64(1), dict({{"k", Value::boolean(true)}})})}});
    EXPECT_EQ(a, dict({{"list", Value::array({Value::real(1.0), dict({{"k", Value::uint64(1)}})})}}));
    EXPECT_NE(a, dict({{"list", Value::array({Value::int64(1), dict({{"k", Value::string("true")}})})}}));
}

// Guards hashed sets of values: whatever compares equal must hash alike.
TEST(ValueHashing, EqualValuesHashAlike) {
    std::vector<std::vector<Value>> groups = {
        {Value::boolean(true), Value::int64(1), Value::uint64(1), Value::real(1.0)},
        {Value::uint64(uint64_t{1} << 63), Value::real(9223372036854775808.0)},
        {dict({{"x", Value::int64(3)}}), dict({{"x", Value::real(3.0)}})},
    };
    for (const auto& group : groups)
        for (const Value& v : group) {
            EXPECT_EQ(v, group.front()) << v.description();
            EXPECT_EQ(v.hash(), group.front().hash()) << v.description();
        }
}

// Guards number conversions against silent wrap-around or truncation.
TEST(ValueNumbers, ConversionsRefuseWhatDoesNotFit) {
    EXPECT_EQ(Value::uint64(5).numberAsInt64(), 5);
    EXPECT_FALSE(Value::uint64(std::numeric_limits<uint64_t>::max()).numberAsInt64());
    EXPECT_FALSE(Value::int64(-1).numberAsUInt64());
    EXPECT_FALSE(Value::real(1.5).numberAsInt64());
    EXPECT_FALSE(Value::real(1e300).numberAsUInt64());
    EXPECT_FALSE(Value::real(std::nan("")).numberAsInt64());
}

// Guards the text form of UUIDs that clients send and the registry stores.
TEST(Uuid, CanonicalTextIsUpperCase8_4_4_4_12AndParsingAcceptsEitherCaseOnly) {
    Uuid u = Uuid::random();
    EXPECT_EQ(u.string()[14], '4');  // version 4
    EXPECT_EQ(Uuid::parse(u.string()), u);
    EXPECT_NE(Uuid::random(), Uuid::random());

    auto upper = Uuid::parse("0F1E2D3C-4B5A-6978-8796-A5B4C3D2E1F0");
    ASSERT_TRUE(upper);
    EXPECT_EQ(upper, Uuid::parse("0f1e2d3c-4b5a-6978-8796-a5b4c3d2e1f0"));
    EXPECT_EQ(upper->string(), "0F1E2D3C-4B5A-6978-8796-A5B4C3D2E1F0");
    for (const char* bad : {"", "0F1E2D3C4B5A69788796A5B4C3D2E1F0", "{0F1E2D3C-4B5A-6978-8796-A5B4C3D2E1F0}",
                            "0F1E2D3C-4B5A-6978-8796-A5B4C3D2E1F", "0F1E2D3C-4B5A-6978-8796-A5B4C3D2E1F00",
                            "0F1E2D3C-4B5A-6978-8796_A5B4C3D2E1F0", "0G1E2D3C-4B5A-6978-8796-A5B4C3D2E1F0"})
        EXPECT_FALSE(Uuid::parse(bad)) << bad;
}

// Guards the containers' storage, which keeps the elements in the node itself: whatever goes in (nothing, keys and
// strings long enough to live apart from their string object, non-ASCII bytes, embedded zeros, nesting) comes back
// equal through every way of building and copying a container, and a copy outlives the builder and the original.
TEST(ValueStorage, ContainersGiveBackWhatWentInThroughEveryBuilder) {
    const std::string longKey(300, 'k');
    const std::string accented = "cl\xc3\xa9 \xe2\x9c\x93";
    const std::string withZero("a\0b", 3);
    std::vector<std::pair<std::string, Value>> pairs = {
        {"", Value::string("")},
        {longKey, Value::string(std::string(1000, 's'))},
        {accented, Value::string(accented)},
        {withZero, Value::string(withZero)},
        {"nested", Value::array({Value::array({}), Value::array({Value::string(longKey), Value::emptyDictionary()}),
                                 Value::uuid(Uuid::random()), Value::data(std::vector<uint8_t>{0, 255})})},
        {"number", Value::int64(-7)},
    };
    std::optional<Value> built;
    {
        std::vector<std::pair<std::string, Value>> copy = pairs;
        built = Value::dictionary(std::move(copy));
    }
    ASSERT_EQ(built->count(), pairs.size());
    for (const auto& [key, value] : pairs) {
        const Value* found = built->find(key);
        ASSERT_NE(found, nullptr) << key;
        EXPECT_EQ(*found, value) << key;
    }
    EXPECT_EQ(built->get(withZero).stringView().size(), 3u);
    EXPECT_EQ(built->find("a"), nullptr);
    EXPECT_EQ(built->get("nested").items()[1].items()[0].stringView(), longKey);

    std::optional<Value> viaBuilder;
    {
        MutableDictionary builder;
        for (auto it = pairs.rbegin(); it != pairs.rend(); ++it) builder.set(it->first, it->second);
        Value copied = builder.value();
        viaBuilder = builder.take();
        EXPECT_EQ(copied, *viaBuilder);
        EXPECT_FALSE(copied.identical(*viaBuilder));
    }
    EXPECT_EQ(*viaBuilder, *built);
    Value edited = [&] {
        MutableDictionary builder(*built);
        builder.remove(longKey);
        return builder.value();
    }();
    built.reset();
    EXPECT_EQ(edited.count(), pairs.size() - 1);
    EXPECT_EQ(edited.get(accented), Value::string(accented));
    EXPECT_EQ(viaBuilder->get(longKey).stringView().size(), 1000u);

    MutableArray items;
    for (const auto& [key, value] : pairs) items.append(value);
    Value array = items.value();
    items.append(Value::string("one more"));
    EXPECT_EQ(array.count(), pairs.size());
    EXPECT_EQ(items.take().count(), pairs.size() + 1);
    EXPECT_EQ(MutableArray(array).take(), array);
    EXPECT_EQ(Value::emptyArray().count(), 0u);
    EXPECT_TRUE(Value::emptyDictionary().entries().empty());
    EXPECT_EQ(Value::emptyDictionary(), Value::dictionary({}));
}

// Guards the log against huge values: descriptions are cut at a bound and say so.
TEST(ValueDescription, Bounded) {
    MutableArray huge;
    for (int i = 0; i < 100000; ++i) huge.append(Value::string("element number " + std::to_string(i)));
    std::string text = huge.take().description();
    EXPECT_LE(text.size(), Value::kDescriptionLimit + 32);
    EXPECT_NE(text.find("(truncated)"), std::string::npos);
}

}  // namespace
}  // namespace bexil
