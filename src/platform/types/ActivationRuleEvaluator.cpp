// The acceptance test is a bipartite assignment with capacities: attachments on one side, rule types on the other,
// an edge where the attachment conforms to the type, and each type taking at most its count. A greedy assignment
// would refuse items that fit (a PNG file given to the rule's "application/octet-stream" first can leave a plain-text
// file with nowhere to go, although the PNG also fitted "image/png"), so the evaluator searches augmenting paths;
// with the limits
// below that is at most a few hundred thousand steps, and usually a handful.

#include "platform/types/ActivationRuleEvaluator.h"

#include <cstdint>
#include <string>
#include <vector>

#include "platform/log/Log.h"

namespace bexil {

namespace {

struct Assignment {
    // edges[a]: the rule types attachment a conforms to.
    std::vector<std::vector<size_t>> edges;
    std::vector<uint64_t> capacity;
    // holders[t]: the attachments currently given to type t.
    std::vector<std::vector<size_t>> holders;

    // Gives attachment `a` a type, moving earlier attachments along if needed (Kuhn's augmenting path, with a
    // type's capacity standing in for that many copies of it). Each type is entered once per search, so the
    // recursion is at most kMaxRuleTypes deep.
    bool place(size_t a, std::vector<bool>& seen) {
        for (size_t t : edges[a]) {
            if (seen[t]) continue;
            seen[t] = true;
            if (holders[t].size() < capacity[t]) {
                holders[t].push_back(a);
                return true;
            }
            for (size_t& holder : holders[t]) {
                if (place(holder, seen)) {
                    holder = a;
                    return true;
                }
            }
        }
        return false;
    }
};

}  // namespace

ActivationRuleEvaluator& ActivationRuleEvaluator::shared() {
    static ActivationRuleEvaluator* evaluator = new ActivationRuleEvaluator(TypeRegistry::shared());
    return *evaluator;
}

bool ActivationRuleEvaluator::evaluateActivationRuleWithExtensionItemsRepresentation(const Value& rule,
                                                                                     const Value& items) const {
    if (!rule.isDictionary() || !items.isDictionary()) return false;
    const Value* attachments = items.find(kAttachmentsKey);
    if (attachments == nullptr || !attachments->isArray()) return false;
    if (attachments->count() > kMaxAttachments) {
        log::extension().error("activation rule: %zu attachments exceed the limit of %zu", attachments->count(),
                               kMaxAttachments);
        return false;
    }
    if (rule.count() > kMaxRuleTypes) {
        log::extension().error("activation rule: %zu types exceed the limit of %zu", rule.count(), kMaxRuleTypes);
        return false;
    }

    Assignment assignment;
    std::vector<std::string_view> ruleTypes;
    for (const auto& entry : rule.entries()) {
        // A count that is not a whole non-negative number admits nothing of its type.
        auto count = entry.value.numberAsUInt64();
        if (!count || *count == 0) continue;
        ruleTypes.push_back(entry.key);
        assignment.capacity.push_back(*count);
    }
    assignment.holders.resize(ruleTypes.size());

    for (const Value& attachment : attachments->items()) {
        const std::string* type = attachment.getString();
        if (type == nullptr) return false;
        std::vector<size_t> fits;
        for (size_t t = 0; t < ruleTypes.size(); ++t) {
            if (types_.conformsTo(*type, ruleTypes[t])) fits.push_back(t);
        }
        if (fits.empty()) return false;
        assignment.edges.push_back(std::move(fits));
    }
    for (size_t a = 0; a < assignment.edges.size(); ++a) {
        std::vector<bool> seen(ruleTypes.size(), false);
        if (!assignment.place(a, seen)) return false;
    }
    return true;
}

}  // namespace bexil
