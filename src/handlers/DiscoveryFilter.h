#pragma once

// The two halves of discovery that every request judging plug-ins against a client's rules shares: the filter each
// candidate passes (CandidateFilter) and the competition among the forms that passed (AcceptedForms). They live on
// the request queue, for the length of one request; neither owns the records or the client it is given.

#include <memory>
#include <string>
#include <unordered_map>
#include <vector>

#include "bexil/Value.h"
#include "policy/BXMatchRules.h"

namespace bexil {

class BXDPlugIn;
class BXDServer;
class BXDZemClient;

// The filter that every candidate passes, in this order, before it competes with the others: where it lives,
// dedication and holds (all three skipped for the discover-all flag), the client's rules, the global exclusions and
// the host policy (skipped for discover-all). A plug-in the client may not see is never matched against its rules,
// so rules cannot probe for it.
struct CandidateFilter {
    const Value& rules;
    const std::vector<Value>& exclusions;
    uint64_t flags;
    BXDZemClient& client;
    BXDServer& database;
    const BXMatchContext& context;

    bool all() const;
    bool admits(BXDPlugIn& plugIn) const;
};

// The forms accepted so far, in the order of acceptance, with the duplicate resolution among forms of the same
// identifier: a form that a later duplicate beat is left as an empty slot, so that the positions recorded per
// identifier stay valid.
class AcceptedForms {
  public:
    explicit AcceptedForms(uint64_t flags) : flags_(flags) {}

    // Offers the exported form of a candidate that passed the filter; it is kept unless an accepted form of its
    // identifier beats it, and it replaces one that it beats.
    void offer(const BXDPlugIn& plugIn, MutableDictionary exported, BXDServer& database);
    // Writes the replacement links into the forms, once every candidate has been seen.
    void linkReplacements();
    size_t count() const { return kept_; }
    // Appends the kept forms and replacement claims of `group`, whose identifier none of this one's forms have.
    void absorb(AcceptedForms&& group);
    // The kept forms as values. The builders are not used again: their entries move rather than being copied.
    std::vector<Value> take();

  private:
    using Form = std::shared_ptr<MutableDictionary>;

    uint64_t flags_;
    std::vector<Form> forms_;
    // The positions in forms_ of the live forms of each identifier, in the order of forms_.
    std::unordered_map<std::string, std::vector<size_t>> positions_;
    std::unordered_map<std::string, Form> replacements_;
    size_t kept_ = 0;
};

}  // namespace bexil
