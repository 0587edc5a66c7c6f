// The bexil tool's argument checks and its JSON reader, which stand between a user's typing and the daemon.

#include <gtest/gtest.h>

#include <filesystem>

#include "TestSupport.h"
#include "ToolArguments.h"
#include "base/Document.h"
#include "client/JsonText.h"

namespace bexil::tool {
namespace {

namespace fs = std::filesystem;

// Guards the arguments checked before anything is sent: every one, and the bad one is named. (A bad UUID:
// ClientToolTest.ExitStatusesAndOneLineErrors.)
TEST(ToolArgumentsTest, PathsMustBeAbsolute) {
    EXPECT_TRUE(absolutePaths({"/a", "/b/c"}).ok());
    auto relative = absolutePaths({"/a", "b"});
    ASSERT_FALSE(relative.ok());
    EXPECT_EQ(relative.error().localizedDescription(), std::optional<std::string>("absolute path required: b"));
}

// Guards rules typed as KEY=PATTERN: only the first '=' separates, an empty key or a repeated one is refused.
TEST(ToolArgumentsTest, RulesAreKeyEqualsPattern) {
    auto rules = rulesFromArguments({"Empty=", "K=a=b"});
    ASSERT_TRUE(rules.ok());
    EXPECT_EQ(rules->get("Empty").stringView(), "");
    EXPECT_EQ(rules->get("K").stringView(), "a=b");
    EXPECT_FALSE(rulesFromArguments({"=pattern"}).ok());
    EXPECT_FALSE(rulesFromArguments({"K=1", "K=2"}).ok());
}

// Guards flag names and the exit status, which must never be mistaken for the tool's own statuses.
TEST(ToolArgumentsTest, FlagsByNameAndExitStatusIsTheCodeWhenItFits) {
    EXPECT_EQ(*discoveryFlags({"all-versions", "all-instances", "system-only", "all"}), 0x20Du);
    EXPECT_FALSE(discoveryFlags({"all-versions", "everything"}).ok());

    EXPECT_EQ(exitStatusForCode(18), 18);
    EXPECT_EQ(exitStatusForCode(0), 1);
    EXPECT_EQ(exitStatusForCode(-2), 1);
    EXPECT_EQ(exitStatusForCode(kExitUnavailable), 1);
}

class RuleFileTest : public ::testing::Test {
  protected:
    fs::path write(const std::string& name, const std::string& text) {
        test::writeText(dir_ / name, text);
        return dir_ / name;
    }
    test::TempDir dir_{"bexil-rules"};
};

// Guards rule files: JSON and documents read as dictionaries with their kinds; bad files are refused, named.
TEST_F(RuleFileTest, JsonAndVrecFilesReadAsDictionariesAndBadFilesAreRefusedWithTheirName) {
    auto json = readDictionaryFile(write("r.json", R"({"A": "x*", "B": ["1", "2"], "N": -3, "R": 1.5})"));
    ASSERT_TRUE(json.ok()) << json.error().description();
    EXPECT_EQ(*json, Value::dictionary({{"A", Value::string("x*")},
                                        {"B", Value::array({Value::string("1"), Value::string("2")})},
                                        {"N", Value::int64(-3)},
                                        {"R", Value::real(1.5)}}));
    EXPECT_TRUE(json->get("N").getInt64().has_value());
    auto vrec =
        readDictionaryFile(write("r.vrec", Document::write(Value::dictionary({{"A", Value::string("y")}})).value()));
    ASSERT_TRUE(vrec.ok()) << vrec.error().description();
    EXPECT_EQ(vrec->get("A").stringView(), "y");

    // A missing file named in the error: ClientToolTest.ExitStatusesAndOneLineErrors.
    EXPECT_FALSE(readDictionaryFile(write("array.json", "[1, 2]")).ok());
    EXPECT_FALSE(readDictionaryFile(write("dup.json", "{\"A\": 1, \"A\": 2}")).ok());
    EXPECT_FALSE(readDictionaryFile(write("junk.json", "{} x")).ok());
}

// Guards the JSON reader against hostile input (deep nesting, lone surrogates) and its escapes and big numbers.
TEST(JsonTextTest, EscapesAndUnicodeRoundTripAndDeepNestingIsRefusedNotACrash) {
    std::string deep(100000, '[');
    EXPECT_FALSE(parseJson(deep).ok());

    auto value =
        parseJson(R"({"s": "a\"b\\c\n\u00e9\ud83d\ude00", "t": true, "n": null, "big": 18446744073709551615})");
    ASSERT_TRUE(value.ok()) << value.error().description();
    EXPECT_EQ(value->get("s").stringView(), "a\"b\\c\n\xC3\xA9\xF0\x9F\x98\x80");
    EXPECT_EQ(value->get("big").getUInt64(), std::optional<uint64_t>(UINT64_MAX));
    auto again = parseJson(toJson(*value));
    ASSERT_TRUE(again.ok());
    EXPECT_EQ(*again, *value);
    EXPECT_FALSE(parseJson(R"("\ud83d")").ok()) << "unpaired surrogate";
}

// Guards --json output of kinds JSON lacks: UUIDs as their text, data as base64.
TEST(JsonTextTest, KindsJsonLacksBecomeText) {
    Value uuid = Value::uuid(*Uuid::parse("11111111-2222-4333-8444-555555555555"));
    EXPECT_EQ(toJson(Value::array({uuid, Value::data(std::vector<uint8_t>{'h', 'i'})}), JsonLayout::OneLine),
              R"(["11111111-2222-4333-8444-555555555555","aGk="])");
}

// Guards what the JSON library is trusted with: the Value kind each number becomes and keeps when written and read
// again, where reading stops (nesting, a key given twice, text that is not UTF-8) and that it says where, and the
// layouts that scripts and tests search.
TEST(JsonTextTest, NumberKindsLimitsAndLayouts) {
    auto numbers = parseJson(
        "[9223372036854775807, -9223372036854775808, 9223372036854775808, -0, "
        "18446744073709551616, -9223372036854775809, 1.5, 1e2, 3.0]");
    ASSERT_TRUE(numbers.ok()) << numbers.error().description();
    auto kinds = [](const Value& array) {
        std::vector<ValueKind> kinds;
        for (const Value& item : array.items()) kinds.push_back(item.kind());
        return kinds;
    };
    const auto I = ValueKind::Int64, U = ValueKind::UInt64, R = ValueKind::Real;
    EXPECT_EQ(kinds(*numbers), (std::vector<ValueKind>{I, I, U, I, R, R, R, R, R}));
    EXPECT_EQ(numbers->items()[1].getInt64(), std::optional<int64_t>(INT64_MIN));
    auto again = parseJson(toJson(*numbers, JsonLayout::OneLine));
    ASSERT_TRUE(again.ok()) << again.error().description();
    EXPECT_EQ(kinds(*again), kinds(*numbers)) << "a whole real is written as one";
    EXPECT_EQ(*again, *numbers);

    auto refusal = [](const std::string& text) -> std::string {
        auto value = parseJson(text);
        return value.ok() ? "accepted" : value.error().localizedDescription().value_or("");
    };
    EXPECT_EQ(refusal(std::string(128, '[') + std::string(128, ']')), "accepted");
    EXPECT_EQ(refusal(std::string(129, '[') + std::string(129, ']')),
              "JSON line 1, column 129: nested more than 128 deep");
    EXPECT_EQ(refusal("{\"a\": 1,\n \"a\": 2}"), "JSON line 2, column 4: key \"a\" given twice");
    EXPECT_EQ(refusal("[\"ok\",\n \"\xc3(\"]"), "JSON line 2, column 3: text is not UTF-8 (bad byte 0xc3)");
    EXPECT_EQ(refusal("{\"a\" 1}"), "JSON line 1, column 6: unexpected number literal; expected ':'");
    EXPECT_EQ(refusal("[1e999]"), "JSON line 1, column 6: number overflow parsing '1e999'");
    EXPECT_EQ(refusal("[1,\n tru]"), "JSON line 2, column 5: invalid literal");

    Value value = Value::dictionary(
        {{"b", Value::string("\t\"\xC3\xA9\x01")}, {"a", Value::array({Value::int64(1), Value::emptyDictionary()})}});
    EXPECT_EQ(toJson(value), "{\n  \"a\": [\n    1,\n    {}\n  ],\n  \"b\": \"\\t\\\"\xC3\xA9\\u0001\"\n}");
    EXPECT_EQ(toJson(value, JsonLayout::OneLine), "{\"a\":[1,{}],\"b\":\"\\t\\\"\xC3\xA9\\u0001\"}");
}

}  // namespace
}  // namespace bexil::tool
