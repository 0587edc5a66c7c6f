#include <gtest/gtest.h>

#include "bexil/Value.h"
#include "database/BXDUserPrefs.h"

namespace bexil {
namespace {

Value rule(const char* key, const char* pattern) { return Value::dictionary({{key, Value::string(pattern)}}); }

// Guards against malformed exclusions an administrator may have stored: only the dictionaries of an array are rule
// sets; anything else means none rather than a failure or everything excluded. (Exclusions set by another process
// while the daemon runs: DiscoveryTest.ToolExclusionsApplyToTheNextMatchAndMatchPrintsATable.)
TEST(BXDUserPrefsTest, RuleSetsOfAMalformedValue) {
    EXPECT_TRUE(BXDUserPrefs::exclusionRuleSets(Value()).empty());
    EXPECT_TRUE(BXDUserPrefs::exclusionRuleSets(Value::string("x")).empty());
    EXPECT_TRUE(BXDUserPrefs::exclusionRuleSets(rule("RZExtensionIdentifier", "a")).empty())
        << "a single dictionary is not an array of them";
    Value a = rule("RZExtensionIdentifier", "a");
    Value b = Value::emptyDictionary();
    Value mixed = Value::array({Value::int64(1), a, Value::string("rule"), b, Value::array({a})});
    std::vector<Value> sets = BXDUserPrefs::exclusionRuleSets(mixed);
    ASSERT_EQ(sets.size(), 2u);
    EXPECT_EQ(sets[0], a);
    EXPECT_EQ(sets[1], b);
}

}  // namespace
}  // namespace bexil
