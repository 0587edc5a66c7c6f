// The bexil tool's argument checks and its JSON reader, which stand between a user's typing and the daemon.

#include <gtest/gtest.h>

#include <filesystem>

#include "JsonText.h"
#include "TestSupport.h"
#include "ToolArguments.h"
#include "base/Document.h"

namespace bexil::tool {
namespace {

namespace fs = std::filesystem;

TEST(ToolArgumentsTest, UuidsMustBeCanonicalAndPathsAbsolute) {
    // Which texts are uuids is the uuid parser's business; here: all are parsed, and the bad one is named.
    auto good = parseUuids({"11111111-2222-4333-8444-555555555555", "aaaaaaaa-bbbb-4ccc-8ddd-eeeeeeeeeeee"});
    ASSERT_TRUE(good.ok());
    EXPECT_EQ(good->size(), 2u);
    auto bad = parseUuids({"11111111-2222-4333-8444-555555555555", "{11111111-2222-4333-8444-555555555555}"});
    ASSERT_FALSE(bad.ok());
    EXPECT_NE(bad.error().localizedDescription()->find("{11111111-2222-4333-8444-555555555555}"), std::string::npos);

    EXPECT_TRUE(absolutePaths({"/a", "/b/c"}).ok());
    auto relative = absolutePaths({"/a", "b"});
    ASSERT_FALSE(relative.ok());
    EXPECT_EQ(relative.error().localizedDescription(), std::optional<std::string>("absolute path required: b"));
    EXPECT_FALSE(absolutePaths({""}).ok());
}

TEST(ToolArgumentsTest, RulesAreKeyEqualsPattern) {
    auto rules = rulesFromArguments({"RZExtensionPointIdentifier=com.example.*", "Empty=", "K=a=b"});
    ASSERT_TRUE(rules.ok());
    EXPECT_EQ(rules->get("RZExtensionPointIdentifier").stringView(), "com.example.*");
    EXPECT_EQ(rules->get("Empty").stringView(), "");
    EXPECT_EQ(rules->get("K").stringView(), "a=b") << "only the first '=' separates";
    EXPECT_FALSE(rulesFromArguments({"noequals"}).ok());
    EXPECT_FALSE(rulesFromArguments({"=pattern"}).ok());
    EXPECT_FALSE(rulesFromArguments({"K=1", "K=2"}).ok());
}

TEST(ToolArgumentsTest, FlagsByNameAndExitStatusIsTheCodeWhenItFits) {
    EXPECT_EQ(*discoveryFlags({}), 0u);
    EXPECT_EQ(*discoveryFlags({"all-versions", "all-instances", "system-only", "all"}), 0x20Du);
    EXPECT_FALSE(discoveryFlags({"all-versions", "everything"}).ok());

    EXPECT_EQ(exitStatusForCode(11), 11);
    EXPECT_EQ(exitStatusForCode(18), 18);
    EXPECT_EQ(exitStatusForCode(0), 1);
    EXPECT_EQ(exitStatusForCode(-2), 1);
    EXPECT_EQ(exitStatusForCode(kExitUnavailable), 1) << "codes must not be mistaken for the tool's own statuses";
}

class RuleFileTest : public ::testing::Test {
  protected:
    fs::path write(const std::string& name, const std::string& text) {
        test::writeText(dir_ / name, text);
        return dir_ / name;
    }
    test::TempDir dir_{"bexil-rules"};
};

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

    auto missing = readDictionaryFile(dir_ / "absent.json");
    ASSERT_FALSE(missing.ok());
    EXPECT_NE(missing.error().localizedDescription()->find("absent.json"), std::string::npos);
    EXPECT_FALSE(readDictionaryFile(write("array.json", "[1, 2]")).ok());
    EXPECT_FALSE(readDictionaryFile(write("trunc.json", "{\"A\": ")).ok());
    EXPECT_FALSE(readDictionaryFile(write("dup.json", "{\"A\": 1, \"A\": 2}")).ok());
    EXPECT_FALSE(readDictionaryFile(write("junk.json", "{} x")).ok());
    EXPECT_FALSE(readDictionaryFile(write("bad.vrec", "<not a document")).ok());
}

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

TEST(JsonTextTest, KindsJsonLacksBecomeText) {
    Value uuid = Value::uuid(*Uuid::parse("11111111-2222-4333-8444-555555555555"));
    EXPECT_EQ(toJson(Value::array({uuid, Value::data(std::vector<uint8_t>{'h', 'i'})}), false),
              R"(["11111111-2222-4333-8444-555555555555","aGk="])");
}

TEST(ToolPreferencesTest, PreferencesFileHonoursTheOverrideDirectory) {
    test::ScopedEnv dir("BX_PREFERENCES_DIR", "/tmp/prefs-test");
    fs::path file = preferencesFile();
    EXPECT_EQ(file.parent_path(), fs::path("/tmp/prefs-test"));
    EXPECT_EQ(file.filename().string().rfind("com.quorvel.bexil.userprefs.", 0), 0u);
    EXPECT_EQ(file.extension(), ".vrec");
}

}  // namespace
}  // namespace bexil::tool
