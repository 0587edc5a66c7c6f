#pragma once

// The two halves of discovery that every request judging plug-ins against a client's rules shares: the filter each
// candidate passes (CandidateFilter) and the competition among the forms that passed (AcceptedForms). They live on
// the request queue, for the length of one request; neither owns the records or the client it is given.

#include <memory>
#include <optional>
#include <span>
#include <string>
#include <unordered_map>
#include <vector>

#include "base/Error.h"
#include "bexil/Value.h"
#include "platform/zem/ZemCodec.h"
#include "policy/BXMatchRules.h"

namespace bexil {

class BXDPlugIn;
class BXDServer;
class BXDZemClient;
class Transaction;

// The "rules" and "flags" of a discovery request ("match", "explain"), read and checked alike for both.
struct DiscoveryQuery {
    Value rules;
    uint64_t flags = 0;
};
// The query of `transaction`'s request, or none once it has answered the failure: rules that are not a dictionary
// (code 4) or the discover-all flag without the manager entitlement or from a sandboxed caller (code 11).
std::optional<DiscoveryQuery> readDiscoveryQuery(Transaction& transaction);

// What the filter found for one candidate, step by step (see CandidateFilter::explain).
struct FilterTrace {
    // One dictionary per step ({"step", "passed", details...}), in the filter's order, every step evaluated even
    // after one failed.
    std::vector<Value> steps;
    // The index in steps of the first that failed; none when the candidate passed.
    std::optional<size_t> firstFailure;
    // Whether a step that decides who may see the plug-in at all failed: it lives where the caller cannot see it,
    // is dedicated to another application, is held, or the host policy refuses it to this caller.
    bool hidden = false;
};

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
    // The same decisions as admits, made by the same code, with what each step compared; slower, for "explain".
    FilterTrace explain(BXDPlugIn& plugIn) const;

  private:
    // The filter itself; `observer` sees each step's outcome and may ask for its details (only explain does).
    template <class Observer>
    bool run(BXDPlugIn& plugIn, Observer& observer) const;
};

// By what one of two forms of the same identifier is preferred to the other, in the order the rules are tried.
enum class DuplicateRule { HigherVersion, SystemVolume, LaterRegistration, FoundFirst };
std::string_view nameOf(DuplicateRule rule);

// The identifiers a plug-in says it replaces: a string names one, an array every string in it.
std::vector<std::string> replacedIdentifiers(const BXDPlugIn& plugIn);

// The forms accepted so far, in the order of acceptance, with the duplicate resolution among forms of the same
// identifier: a form that a later duplicate beat is left as an empty slot, so that the positions recorded per
// identifier stay valid.
class AcceptedForms {
  public:
    explicit AcceptedForms(uint64_t flags) : flags_(flags) {}

    // Who beat a plug-in (UUID text) among forms of its identifier, and by what.
    struct Defeat {
        std::string winner;
        DuplicateRule rule;
    };
    using Defeats = std::unordered_map<std::string, Defeat>;
    // From now on, every form beaten (the one offered or one accepted before) is recorded in `defeats`, which must
    // outlive the offers. For "explain"; discovery itself records nothing.
    void recordDefeats(Defeats* defeats) { defeats_ = defeats; }

    // Offers the exported form of a candidate that passed the filter; it is kept unless an accepted form of its
    // identifier beats it, and it replaces one that it beats.
    void offer(const BXDPlugIn& plugIn, MutableDictionary exported, BXDServer& database);
    // The same for a reply that is sent encoded: the form is the record's kept entries (encoded once per record)
    // and the entries that change, which alone are built here. False when the form cannot be made (logged). Forms
    // offered this way are handed over by takeEncoded, the others by take; an instance takes one kind only.
    bool offerEncoded(const std::shared_ptr<BXDPlugIn>& plugIn, BXDServer& database);
    // Writes the replacement links into the forms, once every candidate has been seen.
    void linkReplacements();
    size_t count() const { return kept_; }
    // The bytes of the kept entries of the forms offered encoded and kept: what their encoding takes at least.
    size_t keptEntryBytes() const { return keptEntryBytes_; }
    // Appends the kept forms and replacement claims of `group`, whose identifier none of this one's forms have.
    void absorb(AcceptedForms&& group);
    // The kept forms as values. The builders are not used again: their entries move rather than being copied.
    std::vector<Value> take();

    // A form offered encoded: the record's kept entries merged with the changing ones.
    struct EncodedForm {
        std::shared_ptr<const ZemCodec::Entries> kept;
        Value changing;
    };
    std::vector<EncodedForm> takeEncoded();
    // The same one form at a time, for a reply written in steps: the slots of forms_ (kept forms and the empty
    // slots of beaten ones), and the form of a slot, taken out and released here (none for an empty slot). Once a
    // form is taken, the competition is over: nothing more may be offered.
    size_t slots() const { return forms_.size(); }
    std::optional<EncodedForm> takeEncodedAt(size_t slot);
    // Appends one form as an element of a reply's matches array (after its header); the entry nests the forms two
    // levels below the reply.
    static std::optional<Error> appendForm(const EncodedForm& form, std::vector<uint8_t>& out);

  private:
    struct Form {
        // The whole form when offered with offer, else the entries that change.
        MutableDictionary entries;
        // Set for a form offered encoded: its record answers what the competition asks.
        std::shared_ptr<const BXDPlugIn> record;
        std::shared_ptr<const ZemCodec::Entries> kept;
    };
    using FormPointer = std::shared_ptr<Form>;

    // Lets `plugIn` compete with the accepted forms of its identifier: false when one of them beats it; otherwise
    // the one it beats, if any, is dropped, and the positions of its identifier are where its form goes.
    std::vector<size_t>* compete(const BXDPlugIn& plugIn);
    void keep(const BXDPlugIn& plugIn, std::vector<size_t>& sameIdentifier, FormPointer form);

    uint64_t flags_;
    Defeats* defeats_ = nullptr;
    std::vector<FormPointer> forms_;
    // The positions in forms_ of the live forms of each identifier, in the order of forms_.
    std::unordered_map<std::string, std::vector<size_t>> positions_;
    std::unordered_map<std::string, FormPointer> replacements_;
    size_t kept_ = 0;
    size_t keptEntryBytes_ = 0;
};

}  // namespace bexil
