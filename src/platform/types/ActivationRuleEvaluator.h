#pragma once

// ActivationRuleEvaluator decides whether a plug-in's activation rule accepts a set of extension items. The rule
// maps type identifiers to the most attachments of that type the plug-in takes; the items representation lists
// the attachments' types. The items are accepted when each attachment can be given to a rule type it conforms to
// without any rule type receiving more than its count. docs/activation-rules.md fixes the exact semantics. It keeps
// a reference to its type registry, which must outlive it; any thread may use it.

#include <cstddef>

#include "bexil/Value.h"
#include "platform/types/TypeRegistry.h"

namespace bexil {

class ActivationRuleEvaluator {
  public:
    // More attachments than this are refused (logged): the assignment search is quadratic in their number.
    static constexpr size_t kMaxAttachments = 256;
    // More rule types than this are refused (logged).
    static constexpr size_t kMaxRuleTypes = 64;
    // The key of the attachment list in an items representation.
    static constexpr const char* kAttachmentsKey = "attachments";

    explicit ActivationRuleEvaluator(const TypeRegistry& types) : types_(types) {}
    virtual ~ActivationRuleEvaluator() = default;

    // The process-wide evaluator over TypeRegistry::shared().
    static ActivationRuleEvaluator& shared();

    // True when `rule` (a dictionary from type identifier to maximum count) accepts `items` (a dictionary whose
    // "attachments" is an array of type identifiers). Every value of the wrong kind gives false.
    virtual bool evaluateActivationRuleWithExtensionItemsRepresentation(const Value& rule, const Value& items) const;

  private:
    const TypeRegistry& types_;
};

}  // namespace bexil
