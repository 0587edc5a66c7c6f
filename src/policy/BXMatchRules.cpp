#include "policy/BXMatchRules.h"

#include <cmath>
#include <cstdint>
#include <limits>
#include <optional>

#include "bexil/Protocol.h"
#include "model/BXUtilities.h"
#include "platform/log/Log.h"

namespace bexil {

namespace {

const Value& trueValue() {
    static const Value value = Value::boolean(true);
    return value;
}
const Value& falseValue() {
    static const Value value = Value::boolean(false);
    return value;
}

// Value equality is numeric across bool, integer and real, so this is "a number equal to 1 / to 0"; a string is
// never equal to either.
bool isTrue(const Value& value) { return value == trueValue(); }
bool isFalse(const Value& value) { return value == falseValue(); }

// A comparison pattern: the operand and the outcome of compareVersionString that makes it hold (or, negated, fail).
// Two-character operators first, so "<>" and "<=" are not read as "<", nor ">=" as ">". Only one operator is
// stripped: "==a" compares against "=a". No operator means equality.
struct Comparison {
    std::string_view operand;
    ComparisonResult wanted = ComparisonResult::Same;
    bool negated = false;
};

Comparison comparisonOf(std::string_view pattern) {
    struct Operator {
        std::string_view prefix;
        ComparisonResult wanted;
        bool negated;
    };
    static constexpr Operator kOperators[] = {
        {"<>", ComparisonResult::Same, true},      {"<=", ComparisonResult::Descending, true},
        {">=", ComparisonResult::Ascending, true}, {"=", ComparisonResult::Same, false},
        {"<", ComparisonResult::Ascending, false}, {">", ComparisonResult::Descending, false},
    };
    for (const Operator& op : kOperators) {
        if (pattern.starts_with(op.prefix)) return {pattern.substr(op.prefix.size()), op.wanted, op.negated};
    }
    return {pattern};
}

const TypeRegistry& typesOf(const BXMatchContext& context) {
    return context.types != nullptr ? *context.types : TypeRegistry::shared();
}

int32_t clampToInt32(long double number) {
    if (std::isnan(number)) return 0;
    if (number >= static_cast<long double>(std::numeric_limits<int32_t>::max()))
        return std::numeric_limits<int32_t>::max();
    if (number <= static_cast<long double>(std::numeric_limits<int32_t>::min()))
        return std::numeric_limits<int32_t>::min();
    return static_cast<int32_t>(number);  // cuts toward zero
}

// The leading decimal integer of a string, after blanks and an optional sign; 0 when there is none.
int32_t leadingInteger(std::string_view text) {
    size_t i = 0;
    while (i < text.size() && (text[i] == ' ' || text[i] == '\t' || text[i] == '\n')) ++i;
    bool negative = false;
    if (i < text.size() && (text[i] == '-' || text[i] == '+')) negative = text[i++] == '-';
    int64_t magnitude = 0;
    constexpr int64_t kCap = int64_t{1} << 32;  // beyond every int32, so clamping below decides
    for (; i < text.size() && text[i] >= '0' && text[i] <= '9'; ++i) {
        magnitude = magnitude * 10 + (text[i] - '0');
        if (magnitude > kCap) magnitude = kCap;
    }
    return clampToInt32(static_cast<long double>(negative ? -magnitude : magnitude));
}

}  // namespace

bool BXMatchRules::match(const Value& rules, const BXPlugInCore& plugIn, const BXMatchContext& context) {
    if (rules.isNull()) return true;
    if (!rules.isDictionary()) return false;
    for (const auto& entry : rules.entries()) {
        if (!matchKeyPattern(entry.key, entry.value, plugIn, context)) return false;
    }
    return true;
}

namespace {

// The plug-in's value for a rule's key, as every rule test reads it. `settled` is set when the key alone decides:
// a containing-application rule on a plug-in inside no application never matches, whatever the pattern.
std::optional<Value> ruleValue(std::string_view key, const BXPlugInCore& plugIn, const BXMatchContext& context,
                               bool& settled) {
    std::optional<Value> value;
    if (key.starts_with(BXMatchRules::kEntitlementKeyPrefix)) {
        const BXEntitlementSource& entitlements =
            context.entitlements != nullptr ? *context.entitlements : BXEntitlementSource::recordEntitlements();
        value = entitlements.valueForEntitlement(plugIn, key.substr(BXMatchRules::kEntitlementKeyPrefix.size()));
    } else {
        if (key == BXMatchRules::kIdentifierKey) {
            if (auto identifier = plugIn.identifier()) value = Value::string(std::move(*identifier));
        } else if (key == BXMatchRules::kUuidKey) {
            if (auto uuid = plugIn.uuid()) value = Value::string(uuid->string());
        } else if (key == BXMatchRules::kUserElectionKey) {
            value = Value::string(BXMatchRules::userElectionValue(plugIn, context));
        } else if (key == BXMatchRules::kContainingAppKey) {
            auto containing = plugIn.containingPath();
            if (!containing) {
                settled = true;
                return std::nullopt;
            }
            value = Value::string(std::move(*containing));
        }
        if (!value) value = plugIn.attribute(key);
        if (!value || value->isNull()) value = plugIn.infoKey(key);
    }
    // A null Value (possible in values that came over the wire) is no value at all.
    if (value && value->isNull()) value.reset();
    return value;
}

// The pattern's test of the value the plug-in has for its key (none: it has no value).
bool patternHolds(const std::optional<Value>& value, const Value& pattern, const BXMatchContext& context) {
    if (isTrue(pattern)) return value.has_value() && !isFalse(*value);
    if (isFalse(pattern)) return !value || isFalse(*value);
    if (!value) return false;
    if (pattern.isDictionary()) return BXMatchRules::matchDictionaryPattern(*value, pattern, context);
    if (value->isString()) return BXMatchRules::matchValuePatterns(*value, pattern, context);
    if (value->isArray()) {
        for (const Value& element : value->items()) {
            if (BXMatchRules::matchValuePatterns(element, pattern, context)) return true;
        }
    }
    return false;
}

// How one pattern string tests: its operator and operand as comparisonOf and matchValuePattern read them.
void describePatternString(std::string_view text, MutableDictionary& finding) {
    namespace explain = protocol::explain;
    if (text.starts_with(BXMatchRules::kConformsOperator)) {
        finding.set(explain::kOperator, Value::string("conforms to"));
        finding.set(explain::kOperand, Value::string(text.substr(BXMatchRules::kConformsOperator.size())));
        return;
    }
    if (text.starts_with(BXMatchRules::kIsOperator)) {
        finding.set(explain::kOperator, Value::string("is conformed to by"));
        finding.set(explain::kOperand, Value::string(text.substr(BXMatchRules::kIsOperator.size())));
        return;
    }
    if (text.starts_with('?')) {
        finding.set(explain::kOperator, Value::string("unrecognized operator (never matches)"));
        return;
    }
    Comparison comparison = comparisonOf(text);
    std::string_view name = "=";
    if (comparison.negated) {
        name = comparison.wanted == ComparisonResult::Same         ? "<>"
               : comparison.wanted == ComparisonResult::Descending ? "<="
                                                                   : ">=";
    } else if (comparison.wanted != ComparisonResult::Same) {
        name = comparison.wanted == ComparisonResult::Ascending ? "<" : ">";
    }
    finding.set(explain::kOperator, Value::string(name));
    finding.set(explain::kOperand, Value::string(comparison.operand));
}

// The operator of a whole pattern, for an explanation: presence tests, activation rules, lists of alternatives and
// single comparisons.
void describePattern(const Value& pattern, MutableDictionary& finding) {
    namespace explain = protocol::explain;
    if (isTrue(pattern)) {
        finding.set(explain::kOperator, Value::string("present"));
    } else if (isFalse(pattern)) {
        finding.set(explain::kOperator, Value::string("absent"));
    } else if (pattern.isDictionary()) {
        finding.set(explain::kOperator, Value::string("activation rule"));
    } else if (pattern.isString()) {
        describePatternString(pattern.stringView(), finding);
    } else if (pattern.isArray()) {
        finding.set(explain::kOperator, Value::string("any of"));
    } else {
        finding.set(explain::kOperator, Value::string("unusable pattern (never matches)"));
    }
}

}  // namespace

bool BXMatchRules::matchKeyPattern(std::string_view key, const Value& pattern, const BXPlugInCore& plugIn,
                                   const BXMatchContext& context) {
    bool settled = false;
    std::optional<Value> value = ruleValue(key, plugIn, context, settled);
    if (settled) return false;
    return patternHolds(value, pattern, context);
}

Value BXMatchRules::explainKeyPattern(std::string_view key, const Value& pattern, const BXPlugInCore& plugIn,
                                      const BXMatchContext& context) {
    namespace explain = protocol::explain;
    bool settled = false;
    std::optional<Value> value = ruleValue(key, plugIn, context, settled);
    MutableDictionary finding;
    finding.set(explain::kKey, Value::string(key));
    if (value) finding.set(explain::kValue, *value);
    finding.set(explain::kPattern, pattern);
    describePattern(pattern, finding);
    finding.set(explain::kPassed, Value::boolean(!settled && patternHolds(value, pattern, context)));
    return finding.take();
}

Value BXMatchRules::explainMatch(const Value& rules, const BXPlugInCore& plugIn, const BXMatchContext& context) {
    MutableArray findings;
    if (!rules.isDictionary()) return findings.take();
    for (const auto& entry : rules.entries()) {
        Value finding = explainKeyPattern(entry.key, entry.value, plugIn, context);
        bool passed = finding.get(protocol::explain::kPassed) == trueValue();
        findings.append(std::move(finding));
        if (!passed) break;
    }
    return findings.take();
}

bool BXMatchRules::matchValuePatterns(const Value& value, const Value& patterns, const BXMatchContext& context) {
    const std::string* text = value.getString();
    if (text == nullptr) return false;
    if (patterns.isString()) return matchValuePattern(*text, patterns, context);
    for (const Value& pattern : patterns.items()) {  // empty for anything but an array
        if (matchValuePattern(*text, pattern, context)) return true;
    }
    return false;
}

bool BXMatchRules::matchValuePattern(std::string_view value, const Value& pattern, const BXMatchContext& context) {
    const std::string* text = pattern.getString();
    if (text == nullptr) return false;
    std::string_view p = *text;

    if (p.starts_with('?')) {
        if (p.starts_with(kConformsOperator))
            return typesOf(context).conformsTo(value, p.substr(kConformsOperator.size()));
        if (p.starts_with(kIsOperator)) return typesOf(context).conformsTo(p.substr(kIsOperator.size()), value);
        log::ops().info("unrecognized match operator:%@", pattern);
        return false;
    }

    Comparison comparison = comparisonOf(p);
    return (compareVersionString(value, comparison.operand) == comparison.wanted) != comparison.negated;
}

std::optional<std::vector<std::string>> BXMatchRules::requiredValues(const Value& rules, std::string_view key) {
    const Value* pattern = rules.isDictionary() ? rules.find(key) : nullptr;
    if (pattern == nullptr) return std::nullopt;
    // Only string patterns (alone or as a list of alternatives) are tested by comparison; every other kind is a
    // presence or activation-rule test that many values pass.
    auto equalTo = [](const Value& one) -> std::optional<std::string> {
        const std::string* text = one.getString();
        if (text == nullptr || text->starts_with('?')) return std::nullopt;
        Comparison comparison = comparisonOf(*text);
        // Same under compareVersionString holds for exactly one string: digit runs of equal value but different
        // length ("01", "1") compare unequal, every other byte compares as itself.
        if (comparison.wanted != ComparisonResult::Same || comparison.negated) return std::nullopt;
        return std::string(comparison.operand);
    };
    std::vector<std::string> values;
    if (pattern->isString()) {
        std::optional<std::string> value = equalTo(*pattern);
        if (!value) return std::nullopt;
        values.push_back(std::move(*value));
        return values;
    }
    if (!pattern->isArray() || pattern->count() == 0) return std::nullopt;
    for (const Value& alternative : pattern->items()) {
        std::optional<std::string> value = equalTo(alternative);
        if (!value) return std::nullopt;
        values.push_back(std::move(*value));
    }
    return values;
}

bool BXMatchRules::matchDictionaryPattern(const Value& value, const Value& pattern, const BXMatchContext& context) {
    log::extension().debug("evaluating RZExtension filter: %@ value: %@", pattern, value);
    if (context.activation != nullptr)
        return context.activation->evaluateActivationRuleWithExtensionItemsRepresentation(value, pattern);
    const ActivationRuleEvaluator evaluator(typesOf(context));
    return evaluator.evaluateActivationRuleWithExtensionItemsRepresentation(value, pattern);
}

int32_t BXMatchRules::electionFromAnnotation(const Value& annotation) {
    const Value* election = annotation.find(protocol::annotation::kElection);
    if (election == nullptr) return 0;
    switch (election->kind()) {
        case ValueKind::Bool:
            return *election->getBool() ? 1 : 0;
        case ValueKind::Int64:
            return static_cast<int32_t>(static_cast<uint32_t>(*election->getInt64()));
        case ValueKind::UInt64:
            return static_cast<int32_t>(static_cast<uint32_t>(*election->getUInt64()));
        case ValueKind::Real:
            return clampToInt32(*election->getReal());
        case ValueKind::String:
            return leadingInteger(election->stringView());
        default:
            return 0;
    }
}

std::string BXMatchRules::userElectionValue(const BXPlugInCore& plugIn, const BXMatchContext& context) {
    Value annotation = context.annotations != nullptr ? context.annotations->annotationForPlugIn(plugIn) : Value();
    int32_t election = electionFromAnnotation(annotation);
    // Bits 8 to 15 are cleared and the rest kept, so -1 reads as -65281 and 256 as 0.
    auto kept = static_cast<int32_t>(static_cast<uint32_t>(election) & ~uint32_t{0xFF00});
    return std::to_string(kept);
}

}  // namespace bexil
