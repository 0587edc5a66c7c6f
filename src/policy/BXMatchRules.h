#pragma once

// BXMatchRules evaluates rule sets, the query language in which clients, global exclusions and hosts' allowed-plug-in
// entitlements say which plug-ins they mean. A rule set is a dictionary from key to pattern; a plug-in matches when
// every rule does. The key picks a value from the plug-in (an attribute or information key, its identifier or UUID,
// the user's election, its containing application, one of its own entitlements) and the pattern tests it: presence,
// a string with an optional comparison operator, a type-conformance test, a list of alternatives, or an activation
// rule. Evaluation has no side effects besides log lines and never fails: a lookup that finds nothing, or a value or
// pattern of an unexpected kind, is simply no match.
//
// The operations are stateless; they run on the caller's thread. Reading the election may enter the database's
// queue through the annotation source, so REQUIRES: never called on that queue.

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "bexil/Value.h"
#include "model/BXPlugInCore.h"
#include "platform/types/ActivationRuleEvaluator.h"
#include "platform/types/TypeRegistry.h"
#include "policy/BXAnnotationSource.h"
#include "policy/BXEntitlementSource.h"

namespace bexil {

// What an evaluation reads besides the plug-in record. Every member may be left empty: no annotation source means
// no election (0), no entitlement source reads the record's own entitlements, no type registry uses the shared
// one, and no activation evaluator uses one over the chosen type registry. The objects must outlive the call.
struct BXMatchContext {
    const BXAnnotationSource* annotations = nullptr;
    const BXEntitlementSource* entitlements = nullptr;
    const TypeRegistry* types = nullptr;
    const ActivationRuleEvaluator* activation = nullptr;
};

class BXMatchRules {
  public:
    static constexpr std::string_view kEntitlementKeyPrefix = "ENTITLEMENT:";
    static constexpr std::string_view kIdentifierKey = "RZExtensionIdentifier";
    static constexpr std::string_view kExtensionPointKey = "RZExtensionPointIdentifier";
    static constexpr std::string_view kUuidKey = "com.quorvel.uuid";
    static constexpr std::string_view kUserElectionKey = "RZUserElection";
    static constexpr std::string_view kContainingAppKey = "RZExtensionContainingApp";
    static constexpr std::string_view kConformsOperator = "?ZQ-CONFORMS:";
    static constexpr std::string_view kIsOperator = "?ZQ-IS:";

    // True when every rule of `rules` matches the plug-in, keys taken in the dictionary's order and the first
    // failure ending the evaluation. A null rule set, or an empty one, matches every plug-in; any other value that
    // is not a dictionary matches none.
    static bool match(const Value& rules, const BXPlugInCore& plugIn, const BXMatchContext& context = {});

    // One rule: the plug-in's value for `key`, tested against `pattern`.
    static bool matchKeyPattern(std::string_view key, const Value& pattern, const BXPlugInCore& plugIn,
                                const BXMatchContext& context = {});

    // explain variants: what match and matchKeyPattern decide, with what they compared, for a person to read. One
    // rule gives {"key", "value" (the plug-in's; absent when it has none), "pattern", "operator", "operand" (for a
    // comparison or type test), "passed"}; a rule set gives one such entry per rule, in order, up to the first that
    // failed (empty for a null rule set). The decision is made by the same code as match's.
    static Value explainKeyPattern(std::string_view key, const Value& pattern, const BXPlugInCore& plugIn,
                                   const BXMatchContext& context = {});
    static Value explainMatch(const Value& rules, const BXPlugInCore& plugIn, const BXMatchContext& context = {});

    // The pattern-list test: `patterns` is one pattern string or an array of alternatives. False when `value` is
    // not a string, or `patterns` is neither a string nor an array.
    static bool matchValuePatterns(const Value& value, const Value& patterns, const BXMatchContext& context = {});

    // One pattern string against a string value; a pattern that is not a string never matches.
    static bool matchValuePattern(std::string_view value, const Value& pattern, const BXMatchContext& context = {});

    // The activation-rule test: `value` (the plug-in's activation rule) against `pattern` (an extension-items
    // representation). Logs the pair at debug level on the "extension" channel.
    static bool matchDictionaryPattern(const Value& value, const Value& pattern, const BXMatchContext& context = {});

    // The election as rules see it: the annotation's "election" read as a signed 32-bit integer (0 when absent),
    // bits 8 to 15 cleared, in decimal.
    static std::string userElectionValue(const BXPlugInCore& plugIn, const BXMatchContext& context = {});

    // The strings that a plug-in's value for `key` must equal, one of them, for `rules` to hold as this engine
    // compares; none when the rules let other values through (no rule on the key, an operator other than equality,
    // a type test, a boolean or activation-rule pattern, a list with any such alternative, an empty list). The
    // registry narrows its candidates with it, so it must never leave out a value the rule could accept.
    static std::optional<std::vector<std::string>> requiredValues(const Value& rules, std::string_view key);

    // An annotation's "election" read as a signed 32-bit integer: numbers keep their low 32 bits (reals are cut
    // toward zero, then clamped), a string its leading decimal integer (clamped), anything else or absence is 0.
    static int32_t electionFromAnnotation(const Value& annotation);
};

}  // namespace bexil
