#include <gtest/gtest.h>
#include <unistd.h>

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

class FixedEntitlements : public BXEntitlementSource {
  public:
    std::optional<Value> valueForEntitlement(const BXPlugInCore&, std::string_view key) const override {
        if (const Value* value = entitlements.find(key)) return *value;
        return std::nullopt;
    }
    Value entitlements = Value::emptyDictionary();
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
                                   {"RZExtensionVersion", str("1.10")},
                                   {"Zero", Value::int64(0)},
                                   {"FalseFlag", Value::boolean(false)},
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
                           {"BDBundleShortVersionString", str("1.2")},
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
    void elect(Value election) { annotations_.annotation = dict({{"election", std::move(election)}}); }

    test::TempDir mimeRoot_{"bexil-match"};
    std::unique_ptr<TypeRegistry> types_;
    FixedAnnotations annotations_;
    BXMatchContext context_;
    std::shared_ptr<BXPlugInCore> plugIn_;
};

// ---- Rule sets ----

TEST_F(BXMatchRulesTest, NullOrEmptyRuleSetsMatchEveryPlugInAndOtherKindsNothing) {
    EXPECT_TRUE(BXMatchRules::match(Value(), *plugIn_, context_));
    EXPECT_TRUE(BXMatchRules::match(Value::emptyDictionary(), *plugIn_, context_));

    for (const Value& rules : {str("Language"), arr({str("Language")}), Value::int64(1), Value::boolean(true)}) {
        EXPECT_FALSE(BXMatchRules::match(rules, *plugIn_, context_)) << rules.description();
    }
}

TEST_F(BXMatchRulesTest, EveryRuleMustMatchAndTheFirstFailureStopsEvaluation) {
    EXPECT_TRUE(
        BXMatchRules::match(dict({{"Language", str("en")}, {"InfoOnly", Value::boolean(true)}}), *plugIn_, context_));
    // "Language" sorts before "RZUserElection": its failure means the election is never read.
    EXPECT_FALSE(
        BXMatchRules::match(dict({{"Language", str("de")}, {"RZUserElection", str("0")}}), *plugIn_, context_));
    EXPECT_EQ(annotations_.calls, 0);
    EXPECT_TRUE(BXMatchRules::match(dict({{"Language", str("en")}, {"RZUserElection", str("0")}}), *plugIn_, context_));
    EXPECT_EQ(annotations_.calls, 1);
}

// ---- Key forms ----

TEST_F(BXMatchRulesTest, IdentifierAndUuidKeysReadTheRecord) {
    EXPECT_TRUE(rule("RZExtensionIdentifier", str("com.example.greeter.hello")));
    EXPECT_FALSE(rule("RZExtensionIdentifier", str("com.example.greeter")));
    // Canonical text: upper case, whatever case the UUID was written in.
    EXPECT_TRUE(rule("com.quorvel.uuid", str("6F1C2A7E-3B4D-4E5F-8A9B-0C1D2E3F4A5B")));
    EXPECT_FALSE(rule("com.quorvel.uuid", str("6f1c2a7e-3b4d-4e5f-8a9b-0c1d2e3f4a5b")));
}

TEST_F(BXMatchRulesTest, OtherKeysReadAttributesFirstThenTheInformationDictionary) {
    EXPECT_TRUE(rule("Shown", str("from attributes")));
    EXPECT_TRUE(rule("InfoOnly", str("information")));
    EXPECT_TRUE(rule("BDBundleShortVersionString", str("1.2")));
    EXPECT_FALSE(rule("Missing", str("")));
}

TEST_F(BXMatchRulesTest, ElectionIsAStringReadWithBitsEightToFifteenCleared) {
    EXPECT_TRUE(rule("RZUserElection", str("0")));  // never elected
    annotations_.annotation = dict({{"extension", dict({})}});
    EXPECT_TRUE(rule("RZUserElection", str("0")));
    elect(Value::int64(1));
    EXPECT_TRUE(rule("RZUserElection", str("1")));
    elect(Value::int64(255));
    EXPECT_TRUE(rule("RZUserElection", str("255")));
    elect(Value::int64(256));
    EXPECT_TRUE(rule("RZUserElection", str("0")));
    elect(Value::int64(-1));
    EXPECT_TRUE(rule("RZUserElection", str("-65281")));
    elect(Value::int64(0x10203));  // bit 16 and the low byte survive
    EXPECT_TRUE(rule("RZUserElection", str("65539")));
    elect(Value::int64(int64_t{1} << 32 | 5));  // read as 32 bits
    EXPECT_TRUE(rule("RZUserElection", str("5")));
    elect(Value::boolean(true));
    EXPECT_TRUE(rule("RZUserElection", str("1")));
    elect(Value::real(2.9));
    EXPECT_TRUE(rule("RZUserElection", str("2")));
    elect(str(" 3 elections"));
    EXPECT_TRUE(rule("RZUserElection", str("3")));
    elect(arr({Value::int64(1)}));
    EXPECT_TRUE(rule("RZUserElection", str("0")));

    // Always a string, so boolean patterns treat it as present.
    EXPECT_FALSE(rule("RZUserElection", Value::boolean(false)));
    EXPECT_TRUE(rule("RZUserElection", Value::boolean(true)));
    EXPECT_TRUE(rule("RZUserElection", str(">=0")));

    // Without an annotation source it is zero.
    BXMatchContext bare;
    bare.types = types_.get();
    EXPECT_TRUE(BXMatchRules::matchKeyPattern("RZUserElection", str("0"), *plugIn_, bare));
}

TEST_F(BXMatchRulesTest, ContainingAppFailsOutsideApplicationsWhateverThePattern) {
    EXPECT_TRUE(rule("RZExtensionContainingApp", str("/Apps/Greeter.app")));
    EXPECT_TRUE(rule("RZExtensionContainingApp", Value::boolean(true)));
    auto outside = makePlugIn(Value::emptyDictionary(), std::nullopt);
    EXPECT_FALSE(BXMatchRules::matchKeyPattern("RZExtensionContainingApp", Value::boolean(false), *outside, context_));
    EXPECT_FALSE(BXMatchRules::matchKeyPattern("RZExtensionContainingApp", Value::boolean(true), *outside, context_));
}

TEST_F(BXMatchRulesTest, EntitlementKeysReadThePlugInsOwnEntitlementsOrTheRecordsAndNeverFallBack) {
    FixedEntitlements entitlements;
    entitlements.entitlements = dict({{"com.example.granted", Value::boolean(true)},
                                      {"com.example.name", str("reader")},
                                      {"com.example.off", Value::int64(0)}});
    context_.entitlements = &entitlements;
    EXPECT_TRUE(rule("ENTITLEMENT:com.example.granted", Value::boolean(true)));
    EXPECT_TRUE(rule("ENTITLEMENT:com.example.name", str("reader")));
    EXPECT_TRUE(rule("ENTITLEMENT:com.example.off", Value::boolean(false)));
    EXPECT_FALSE(rule("ENTITLEMENT:com.example.off", Value::boolean(true)));
    EXPECT_TRUE(rule("ENTITLEMENT:com.example.absent", Value::boolean(false)));
    EXPECT_FALSE(rule("ENTITLEMENT:com.example.absent", Value::boolean(true)));
    // "Language" is an attribute, but an entitlement key never looks there.
    EXPECT_FALSE(rule("ENTITLEMENT:Language", str("en")));
    EXPECT_TRUE(rule("ENTITLEMENT:", Value::boolean(false)));

    // Without an entitlement source, the record's own dictionary.
    context_.entitlements = nullptr;
    plugIn_->setEntitlements(dict({{"com.example.granted", str("yes")}}));
    EXPECT_TRUE(rule("ENTITLEMENT:com.example.granted", str("yes")));
    EXPECT_TRUE(rule("ENTITLEMENT:com.example.other", Value::boolean(false)));
}

// ---- Presence patterns ----

TEST_F(BXMatchRulesTest, TrueMeansPresentAndNotANumberEqualToZeroFalseTheOpposite) {
    EXPECT_TRUE(rule("Language", Value::boolean(true)));
    EXPECT_TRUE(rule("Language", Value::int64(1)));
    EXPECT_TRUE(rule("Language", Value::real(1.0)));
    EXPECT_FALSE(rule("Missing", Value::boolean(true)));
    EXPECT_TRUE(rule("ZeroText", Value::boolean(true)));  // a string is never equal to false
    EXPECT_FALSE(rule("Zero", Value::boolean(true)));
    EXPECT_FALSE(rule("FalseFlag", Value::boolean(true)));

    EXPECT_TRUE(rule("Missing", Value::boolean(false)));
    EXPECT_TRUE(rule("Missing", Value::uint64(0)));
    EXPECT_TRUE(rule("Zero", Value::boolean(false)));
    EXPECT_TRUE(rule("FalseFlag", Value::int64(0)));
    EXPECT_FALSE(rule("ZeroText", Value::boolean(false)));
    EXPECT_FALSE(rule("Language", Value::boolean(false)));
}

TEST_F(BXMatchRulesTest, OtherPatternsNeverMatchAnAbsentValueOrANonStringOne) {
    for (const char* key : {"Language", "Zero", "Missing", "ActivationRule"}) {
        EXPECT_FALSE(rule(key, Value::int64(2))) << key;
        EXPECT_FALSE(rule(key, Value::real(0.5))) << key;
        EXPECT_FALSE(rule(key, Value::date(Date{0}))) << key;
    }
    EXPECT_FALSE(rule("Missing", str("")));
    EXPECT_FALSE(rule("Zero", str("0")));  // a number value never matches a string pattern
}

// ---- Comparison operators ----

struct OperatorCase {
    const char* value;
    const char* pattern;
    bool matches;
};

TEST_F(BXMatchRulesTest, OperatorsCompareNumericAwareWithTheValueOnTheLeftEvenForHugeDigitRuns) {
    const OperatorCase cases[] = {
        {"1.10", ">=1.9", true}, {"1.10", "=1.10", true}, {"1.10", "1.1", false},  {"1.10", ">1.9", true},
        {"1.9", "<1.10", true},  {"1.9", "<=1.9", true},  {"1.9", "<=1.8", false}, {"10", ">9", true},
        {"9", ">=10", false},    {"abc", "<>abc", false}, {"abd", "<>abc", true},  {"", "<>abc", true},
        {"abc", "==abc", false}, {"=abc", "==abc", true}, {"abc", "abc", true},    {"ABC", "abc", false},
        {"abc", "<abd", true},   {"abc", ">ab", true},    {"ab", "<abc", true},    {"a<b", "a<b", true},
        {"", "", true},          {"", "=", true},         {"x", "<>", true},       {"x", ">", true},
        {"07", "<8", true},      {"1.0", "=1", false},    {"<", "<<", false},      {"<", "=<", true},
    };
    for (const auto& c : cases) {
        EXPECT_EQ(value(c.value, str(c.pattern)), c.matches) << c.value << " against " << c.pattern;
    }

    EXPECT_TRUE(rule("RZExtensionVersion", str(">=1.9")));
    EXPECT_FALSE(rule("RZExtensionVersion", str("<1.9")));

    std::string big(100000, '9');
    std::string bigger = "1" + std::string(100000, '0');
    EXPECT_TRUE(BXMatchRules::matchValuePattern(big, str(("<" + bigger).c_str()), context_));
    EXPECT_TRUE(BXMatchRules::matchValuePattern(bigger, Value::string(">" + big), context_));
    EXPECT_TRUE(BXMatchRules::matchValuePattern(big, Value::string(big), context_));
}

// ---- Pattern lists and value arrays ----

TEST_F(BXMatchRulesTest, PatternArraysAreAlternativesAndElementsOfTheWrongKindDoNotMatch) {
    EXPECT_TRUE(value("y", arr({str("x"), str("y")})));
    EXPECT_FALSE(value("z", arr({str("x"), str("y")})));
    EXPECT_FALSE(value("y", arr({})));
    EXPECT_TRUE(value("5", arr({str("<3"), str(">4")})));

    EXPECT_FALSE(value("1", arr({Value::int64(1), Value::boolean(true)})));
    EXPECT_FALSE(value("y", arr({arr({str("y")})})));  // nested arrays are not flattened
    EXPECT_TRUE(value("y", arr({Value::int64(1), arr({str("y")}), str("y")})));
    EXPECT_FALSE(value("2", Value::int64(2)));
    EXPECT_FALSE(BXMatchRules::matchValuePatterns(Value::int64(1), str("1"), context_));
}

TEST_F(BXMatchRulesTest, ValueArraysMatchWhenAnyStringElementMatches) {
    EXPECT_TRUE(rule("Languages", str("fr")));
    EXPECT_TRUE(rule("Languages", arr({str("it"), str("de")})));
    EXPECT_FALSE(rule("Languages", str("7")));  // the number element is skipped
    EXPECT_FALSE(rule("Languages", str("it")));
    EXPECT_TRUE(rule("Languages", Value::boolean(true)));
}

TEST_F(BXMatchRulesTest, DeeplyNestedPatternsAreHarmless) {
    Value nested = str("en");
    for (int i = 0; i < 10000; ++i) nested = arr({nested});
    EXPECT_FALSE(rule("Language", nested));
    EXPECT_FALSE(rule("Languages", nested));
}

// ---- Conformance operators ----

TEST_F(BXMatchRulesTest, ConformsMatchesAMoreSpecificTypeAndIsAMoreGeneralOne) {
    EXPECT_TRUE(rule("Images", str("?ZQ-CONFORMS:image/x-picture")));
    EXPECT_TRUE(rule("Images", str("?ZQ-CONFORMS:image/x-png")));  // alias of the value itself
    EXPECT_FALSE(rule("Picture", str("?ZQ-CONFORMS:image/png")));
    EXPECT_TRUE(rule("Languages", str("?ZQ-CONFORMS:de")));

    EXPECT_TRUE(rule("Picture", str("?ZQ-IS:image/png")));
    EXPECT_FALSE(rule("Images", str("?ZQ-IS:image/x-picture")));
    EXPECT_TRUE(rule("Images", arr({str("?ZQ-IS:text/plain"), str("?ZQ-IS:IMAGE/PNG")})));
}

TEST_F(BXMatchRulesTest, OtherQuestionMarkOperatorsFailAndAreLoggedOnce) {
    log::CaptureSink capture;
    EXPECT_FALSE(rule("Language", str("?ZQ-LIKE:en")));
    auto lines = capture.matching("unrecognized match operator:");
    ASSERT_EQ(lines.size(), 1u);
    EXPECT_EQ(lines[0].message, "unrecognized match operator:?ZQ-LIKE:en");
    EXPECT_EQ(lines[0].category, "ops");
    EXPECT_EQ(lines[0].level, log::Level::Info);
    // The conformance prefixes are exact: a shorter or differently cased one is another operator.
    EXPECT_FALSE(rule("Images", str("?ZQ-CONFORMS")));
    EXPECT_FALSE(rule("Images", str("?zq-is:image/png")));
    EXPECT_FALSE(rule("Language", str("?")));
    EXPECT_EQ(capture.count("unrecognized match operator:"), 4u);
}

// ---- Activation-rule patterns ----

TEST_F(BXMatchRulesTest, DictionaryPatternsRunTheActivationRuleAndAreLogged) {
    log::CaptureSink capture;
    Value onePng = dict({{"attachments", arr({str("image/png")})}});
    Value twoPngs = dict({{"attachments", arr({str("image/png"), str("image/x-png")})}});
    EXPECT_TRUE(rule("ActivationRule", onePng));
    EXPECT_FALSE(rule("ActivationRule", twoPngs));
    EXPECT_FALSE(rule("Language", onePng));  // a string is no activation rule
    EXPECT_FALSE(rule("Missing", onePng));   // no value: nothing to evaluate, nothing logged
    auto lines = capture.matching("evaluating RZExtension filter: ");
    ASSERT_EQ(lines.size(), 3u);
    EXPECT_EQ(lines[0].category, "extension");
    EXPECT_EQ(lines[0].level, log::Level::Debug);
    EXPECT_EQ(lines[0].message, "evaluating RZExtension filter: " + onePng.description() +
                                    " value: " + dict({{"image/x-raster", Value::int64(1)}}).description());
}

TEST_F(BXMatchRulesTest, ASuppliedActivationEvaluatorIsUsed) {
    class Always : public ActivationRuleEvaluator {
      public:
        using ActivationRuleEvaluator::ActivationRuleEvaluator;
        bool evaluateActivationRuleWithExtensionItemsRepresentation(const Value& rule, const Value&) const override {
            return rule.isString();
        }
    };
    Always always(*types_);
    context_.activation = &always;
    EXPECT_TRUE(rule("Language", Value::emptyDictionary()));
    EXPECT_FALSE(rule("ActivationRule", Value::emptyDictionary()));
}

}  // namespace
}  // namespace bexil
