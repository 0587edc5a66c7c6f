#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <vector>

#include "TestSupport.h"
#include "platform/log/CaptureSink.h"
#include "policy/BXMatchRules.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;

using test::dict;
using test::str;
Value arr(std::vector<Value> items) { return Value::array(std::move(items)); }

class FixedAnnotations : public BXAnnotationSource {
  public:
    Value annotationForPlugIn(const BXPlugInCore&) const override {
        ++calls;
        return annotation;
    }
    Value annotation;
    mutable int calls = 0;
};

// A plug-in "com.example.greeter.hello" inside /Apps/Greeter.app with a few attributes and information keys, a type
// registry over a small private MIME database, and sources the tests can change.
class BXMatchRulesTest : public ::testing::Test {
  protected:
    void SetUp() override {
        fs::create_directories(mimeRoot_ / "mime");
        std::ofstream(mimeRoot_ / "mime" / "subclasses")
            << "image/png image/x-raster\nimage/x-raster image/x-picture\n";
        std::ofstream(mimeRoot_ / "mime" / "aliases") << "image/x-png image/png\n";
        types_ = std::make_unique<TypeRegistry>(std::vector<fs::path>{mimeRoot_.path()});
        context_.annotations = &annotations_;
        context_.types = types_.get();
        plugIn_ = makePlugIn(dict({{"Language", str("en")},
                                   {"Zero", Value::int64(0)},
                                   {"ZeroText", str("0")},
                                   {"Shown", str("from attributes")},
                                   {"Languages", arr({str("de"), Value::int64(7), str("fr")})},
                                   {"Images", str("image/png")},
                                   {"Picture", str("image/x-picture")},
                                   {"ActivationRule", dict({{"image/x-raster", Value::int64(1)}})}}),
                             "/Apps/Greeter.app");
    }

    static std::shared_ptr<BXPlugInCore> makePlugIn(Value attributes, std::optional<std::string> containing) {
        Value info = dict({{"BDBundleIdentifier", str("com.example.greeter.hello")},
                           {"Shown", str("from information")},
                           {"InfoOnly", str("information")},
                           {"RZExtension", dict({{"RZExtensionAttributes", std::move(attributes)},
                                                 {"RZExtensionProtocol", str("GreetingProvider")}})}});
        auto uuid = Uuid::parse("6f1c2a7e-3b4d-4e5f-8a9b-0c1d2e3f4a5b");
        auto record = BXPlugInCore::initWithNameUrlBundleInfoInfoUuid(
            "com.example.greeter.hello", "/Apps/Greeter.app/PlugIns/Hello.bxplugin", info, std::nullopt, uuid);
        record->setContainingUrl(std::move(containing));
        return record;
    }

    bool rule(std::string_view key, const Value& pattern) const {
        return BXMatchRules::matchKeyPattern(key, pattern, *plugIn_, context_);
    }
    bool value(const char* value, const Value& patterns) const {
        return BXMatchRules::matchValuePatterns(str(value), patterns, context_);
    }
    // Each row: a key of the test plug-in, a pattern, and whether the rule matches.
    void expectRules(std::initializer_list<std::tuple<const char*, Value, bool>> rows) const {
        for (const auto& [key, pattern, matches] : rows)
            EXPECT_EQ(rule(key, pattern), matches) << key << " against " << pattern.description();
    }

    test::TempDir mimeRoot_{"bexil-match"};
    std::unique_ptr<TypeRegistry> types_;
    FixedAnnotations annotations_;
    BXMatchContext context_;
    std::shared_ptr<BXPlugInCore> plugIn_;
};

// ---- Rule sets ----

// A null or empty rule set matches every plug-in, any other non-dictionary none; the rules are taken in the
// dictionary's order and the first failure ends the evaluation before the election is read.
TEST_F(BXMatchRulesTest, RuleSetsMatchWhenEveryRuleDoesAndStopAtTheFirstFailure) {
    EXPECT_TRUE(BXMatchRules::match(Value(), *plugIn_, context_));
    EXPECT_TRUE(BXMatchRules::match(Value::emptyDictionary(), *plugIn_, context_));
    EXPECT_FALSE(BXMatchRules::match(arr({str("Language")}), *plugIn_, context_));

    EXPECT_FALSE(
        BXMatchRules::match(dict({{"Language", str("de")}, {"RZUserElection", str("0")}}), *plugIn_, context_));
    EXPECT_EQ(annotations_.calls, 0);
    EXPECT_TRUE(BXMatchRules::match(dict({{"Language", str("en")}, {"RZUserElection", str("0")}}), *plugIn_, context_));
    EXPECT_EQ(annotations_.calls, 1);
}

// ---- Keys and presence ----

// Special keys read the record; other keys the attributes, then the information dictionary. A pattern equal to true
// means "present and not equal to false", false the opposite; equality is numeric, so a string is neither.
TEST_F(BXMatchRulesTest, KeysFindTheirValueAndBooleanPatternsTestItsPresence) {
    expectRules({
        {"RZExtensionIdentifier", str("com.example.greeter.hello"), true},
        // The UUID in canonical text: upper case, whatever case it was written in.
        {"com.quorvel.uuid", str("6F1C2A7E-3B4D-4E5F-8A9B-0C1D2E3F4A5B"), true},
        {"com.quorvel.uuid", str("6f1c2a7e-3b4d-4e5f-8a9b-0c1d2e3f4a5b"), false},
        {"RZExtensionContainingApp", str("/Apps/Greeter.app"), true},
        {"Shown", str("from attributes"), true},
        {"InfoOnly", str("information"), true},
        {"Language", Value::boolean(true), true},
        {"Missing", Value::boolean(true), false},
        {"Zero", Value::boolean(true), false},
        {"ZeroText", Value::boolean(true), true},
        {"Missing", Value::boolean(false), true},
        // Other patterns never match an absent value, a value that is no string, or a pattern that is no string.
        {"Zero", str("0"), false},
        {"Language", Value::int64(2), false},
    });
    // Outside any application the containing-app rule fails whatever the pattern, even false.
    auto outside = makePlugIn(Value::emptyDictionary(), std::nullopt);
    EXPECT_FALSE(BXMatchRules::matchKeyPattern("RZExtensionContainingApp", Value::boolean(false), *outside, context_));
}

// The election is read as a signed 32-bit number (clamped, or cut to its low 32 bits) with bits 8 to 15 cleared, in
// decimal; being a string, it is always present.
TEST_F(BXMatchRulesTest, ElectionIsAStringReadWithBitsEightToFifteenCleared) {
    EXPECT_TRUE(rule("RZUserElection", str("0")));  // never elected
    const std::pair<Value, const char*> elections[] = {
        {Value::int64(256), "0"},
        {Value::int64(-1), "-65281"},
        {Value::int64(int64_t{1} << 32 | 5), "5"},
        {Value::real(1e12), "2147418367"},
        {str("-99999999999"), "-2147483648"},
        {arr({Value::int64(1)}), "0"},
    };
    for (const auto& [election, expected] : elections) {
        annotations_.annotation = dict({{"election", election}});
        EXPECT_EQ(BXMatchRules::userElectionValue(*plugIn_, context_), expected) << election.description();
    }
    EXPECT_FALSE(rule("RZUserElection", Value::boolean(false)));
    EXPECT_EQ(BXMatchRules::userElectionValue(*plugIn_, {}), "0") << "no annotation source, no election";
}

// Entitlement keys read the plug-in's own entitlements (present and not equal to false counts as held) and never
// fall back to its attributes, which the plug-in's author controls.
TEST_F(BXMatchRulesTest, EntitlementKeysReadThePlugInsOwnEntitlementsAndNeverFallBack) {
    plugIn_->setEntitlements(dict({{"com.example.off", Value::int64(0)}, {"com.example.granted", str("yes")}}));
    expectRules({
        {"ENTITLEMENT:com.example.off", Value::boolean(false), true},
        {"ENTITLEMENT:com.example.absent", Value::boolean(true), false},
        {"ENTITLEMENT:com.example.granted", str("yes"), true},
        {"ENTITLEMENT:Language", str("en"), false},
    });
}

// ---- String patterns ----

// The value is on the left; two-character operators are read before one-character ones and only one is stripped;
// digit runs compare by value (long runs: CompareVersionString and the match_rules fuzzer).
TEST_F(BXMatchRulesTest, OperatorsCompareNumericAwareWithTheValueOnTheLeft) {
    const std::tuple<const char*, const char*, bool> cases[] = {
        {"1.10", ">=1.9", true}, {"1.9", "<=1.8", false}, {"1.10", ">1.9", true},
        {"1.9", "<1.10", true},  {"abd", "<>abc", true},  {"1.10", "1.1", false},
        {"abc", "==abc", false}, {"=abc", "==abc", true}, {"ABC", "abc", false}};
    for (const auto& [value, pattern, matches] : cases)
        EXPECT_EQ(this->value(value, str(pattern)), matches) << value << " against " << pattern;
}

// A pattern array lists alternatives (never flattened; elements that are no string never match); a value array
// matches when any of its string elements does.
TEST_F(BXMatchRulesTest, PatternArraysAreAlternativesAndValueArraysMatchAnyStringElement) {
    EXPECT_TRUE(value("5", arr({str("<3"), str(">4")})));
    EXPECT_FALSE(value("1", arr({Value::int64(1), Value::boolean(true)})));
    EXPECT_FALSE(value("y", arr({arr({str("y")})})));
    expectRules({
        {"Languages", arr({str("it"), str("de")}), true},
        {"Languages", str("7"), false},  // the number element is skipped
    });
    // Deep nesting is harmless: nested arrays are never descended into.
    Value nested = str("en");
    for (int i = 0; i < 10000; ++i) nested = arr({nested});
    EXPECT_FALSE(rule("Language", nested));
}

// ---- What a rule set pins for the registry ----

// The registry narrows its candidates with requiredValues, so it must never leave out a value that the rule
// accepts: for each pattern, every sample value the rule accepts is one of the required values, and a pattern that
// accepts values other than equal ones pins nothing.
TEST_F(BXMatchRulesTest, RequiredValuesNeverLeaveOutAValueTheRuleAccepts) {
    const char* samples[] = {
        "com.example.a", "com.example.b", "com.example.v1", "com.example.v01", "=com.example.a", "", "com.example.A"};
    auto accepted = [&](const Value& pattern) {
        std::vector<std::string> values;
        for (const char* sample : samples)
            if (value(sample, pattern)) values.emplace_back(sample);
        return values;
    };
    const Value pinning[] = {str("com.example.a"), str("=com.example.v1"), str("==com.example.a"),
                             arr({str("com.example.b"), str("=com.example.v01")}), str("")};
    for (const Value& pattern : pinning) {
        auto required = BXMatchRules::requiredValues(dict({{"K", pattern}}), "K");
        ASSERT_TRUE(required) << pattern.description();
        for (const std::string& sample : accepted(pattern))
            EXPECT_NE(std::find(required->begin(), required->end(), sample), required->end())
                << sample << " is accepted by " << pattern.description() << " but not pinned";
    }
    EXPECT_EQ(BXMatchRules::requiredValues(dict({{"K", str("==com.example.a")}}), "K"),
              std::vector<std::string>{"=com.example.a"});

    const Value open[] = {str("<>com.example.a"),
                          str("<=com.example.b"),
                          str(">com.example.a"),
                          str("?ZQ-CONFORMS:public.data"),
                          Value::boolean(true),
                          Value::boolean(false),
                          Value::emptyArray(),
                          arr({str("com.example.a"), str("<com.example.b")}),
                          arr({str("com.example.a"), Value::int64(1)}),
                          dict({{"image/png", Value::int64(1)}})};
    for (const Value& pattern : open)
        EXPECT_FALSE(BXMatchRules::requiredValues(dict({{"K", pattern}}), "K")) << pattern.description();
    EXPECT_FALSE(BXMatchRules::requiredValues(dict({{"Other", str("x")}}), "K")) << "no rule on the key";
    EXPECT_FALSE(BXMatchRules::requiredValues(str("K"), "K")) << "not a rule set";
}

// The explaining variant decides with the same code: over every kind of pattern and key (presence, comparisons,
// lists, type tests, activation rules, the containing application of a plug-in inside none) it passes exactly when
// the rule matches, reports the value the rule read and names the operator that the pattern's text carries.
TEST_F(BXMatchRulesTest, ExplanationsDecideAsMatchAndNameTheValueAndOperator) {
    auto outside = makePlugIn(Value::emptyDictionary(), std::nullopt);
    const std::pair<const char*, Value> rules[] = {
        {"Language", str("en")},
        {"Language", str("<>en")},
        {"Language", str("<=dz")},
        {"Language", str(">=fr")},
        {"Language", str("<fr")},
        {"Language", str(">a")},
        {"Language", str("==en")},
        {"Language", Value::boolean(true)},
        {"Missing", Value::boolean(false)},
        {"Missing", str("x")},
        {"Zero", Value::boolean(true)},
        {"Languages", arr({str("it"), str("fr")})},
        {"Languages", Value::emptyArray()},
        {"Images", str("?ZQ-CONFORMS:image/x-raster")},
        {"Picture", str("?ZQ-IS:image/png")},
        {"Language", str("?ZQ-NOPE:x")},
        {"ActivationRule", dict({{"image/png", Value::int64(1)}})},
        {"RZExtensionContainingApp", Value::boolean(false)},
        {"RZUserElection", str("0")},
        {"Language", Value::int64(3)},
    };
    for (const auto* record : {plugIn_.get(), outside.get()}) {
        for (const auto& [key, pattern] : rules) {
            Value finding = BXMatchRules::explainKeyPattern(key, pattern, *record, context_);
            EXPECT_EQ(finding.get("passed"),
                      Value::boolean(BXMatchRules::matchKeyPattern(key, pattern, *record, context_)))
                << key << " " << pattern.description();
            EXPECT_EQ(finding.get("key").stringView(), key);
            EXPECT_EQ(finding.get("pattern"), pattern);
        }
    }
    auto operatorOf = [&](const Value& pattern) {
        return std::string(
            BXMatchRules::explainKeyPattern("Language", pattern, *plugIn_, context_).get("operator").stringView());
    };
    EXPECT_EQ(operatorOf(str("<>en")), "<>");
    EXPECT_EQ(operatorOf(str("<=en")), "<=");
    EXPECT_EQ(operatorOf(str(">=en")), ">=");
    EXPECT_EQ(operatorOf(str("<en")), "<");
    EXPECT_EQ(operatorOf(str(">en")), ">");
    EXPECT_EQ(operatorOf(str("en")), "=");
    EXPECT_EQ(operatorOf(str("?ZQ-CONFORMS:a")), "conforms to");
    EXPECT_EQ(operatorOf(arr({str("a")})), "any of");
    Value compared = BXMatchRules::explainKeyPattern("Language", str("==en"), *plugIn_, context_);
    EXPECT_EQ(compared.get("operand"), str("=en")) << "only one operator is stripped";
    EXPECT_EQ(compared.get("value"), str("en"));

    // A rule set is explained up to its first failing rule, in order.
    Value findings = BXMatchRules::explainMatch(
        dict({{"Language", str("en")}, {"Missing", str("x")}, {"Shown", Value::boolean(true)}}), *plugIn_, context_);
    ASSERT_EQ(findings.count(), 2u) << findings.description();
    EXPECT_FALSE(findings.items()[1].contains("value")) << "a key the plug-in lacks has no value";
    EXPECT_EQ(BXMatchRules::explainMatch(Value(), *plugIn_, context_), Value::emptyArray());
}

// "?ZQ-CONFORMS:" matches a more specific type, "?ZQ-IS:" a more general one. The prefixes are exact: any other
// question-mark operator fails (and is logged for the operator).
TEST_F(BXMatchRulesTest, ConformanceOperatorsAndUnknownOperators) {
    expectRules({
        {"Images", str("?ZQ-CONFORMS:image/x-picture"), true},
        {"Images", str("?ZQ-CONFORMS:image/x-png"), true},  // alias of the value itself
        {"Picture", str("?ZQ-CONFORMS:image/png"), false},
        {"Picture", str("?ZQ-IS:image/png"), true},
        {"Images", str("?ZQ-IS:image/x-picture"), false},
    });
    log::CaptureSink capture;
    EXPECT_FALSE(rule("Language", str("?ZQ-LIKE:en")));
    EXPECT_TRUE(capture.contains("unrecognized match operator:?ZQ-LIKE:en"));
    EXPECT_FALSE(rule("Images", str("?zq-is:image/png")));
}

// ---- Activation-rule patterns ----

// A dictionary pattern runs the value (an activation rule) against it; a value that is no rule does not match.
TEST_F(BXMatchRulesTest, DictionaryPatternsRunTheActivationRule) {
    log::CaptureSink capture;
    Value onePng = dict({{"attachments", arr({str("image/png")})}});
    Value twoPngs = dict({{"attachments", arr({str("image/png"), str("image/x-png")})}});
    EXPECT_TRUE(rule("ActivationRule", onePng));
    EXPECT_FALSE(rule("ActivationRule", twoPngs));
    EXPECT_FALSE(rule("Language", onePng));
    EXPECT_FALSE(rule("Missing", onePng));
    // Each evaluated pair is traced on the extension channel (what a developer turns on to see why a rule failed);
    // an absent value is not evaluated at all.
    auto lines = capture.matching("evaluating RZExtension filter: ");
    ASSERT_EQ(lines.size(), 3u);
    EXPECT_EQ(lines[0].category, "extension");
}

}  // namespace
}  // namespace bexil
