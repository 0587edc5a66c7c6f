// The "match" request: discovery. The database's query gives the candidates (the registry pre-selects by the
// rules in its own way); every candidate then passes, in order, the visibility checks (where it lives, dedicated
// plug-ins, holds), the client's rules, the global exclusions and the host policy, before its form is exported
// and competes with the forms of the same identifier already accepted. The order matters for what a client can
// learn: a plug-in the client may not see is never matched against its rules, so rules cannot probe for it.
//
// The result is a list of forms, not records, because the duplicate resolution compares against what was
// accepted (the form's version, residence and registration time), and the replacement links are written into the
// forms after every candidate has been seen.
//
// A "match" with a page size walks the registry in the order of identifiers instead (then registration, so the
// forms of one identifier meet in the same order as without paging) and cuts pages only between identifiers: all
// candidates of an identifier compete within one page, exactly as they would in one reply. The continuation names
// the last identifier walked, so a page costs what it walks, registrations and annotation changes between pages
// neither skip nor repeat a plug-in that stayed visible, and replacement links are written among the forms of a
// page (the client library links across pages when it puts them together). A page is made in short steps with
// other requests served between them; a change between two steps is seen like one between two pages.
//
// An unpaged "match" of many candidates is made in steps as well, reading the registry a stretch at a time in
// registration order, but its reply must stay the one state that one go would answer: a change between two steps
// starts it over (see WholeMatch).

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <memory>
#include <span>
#include <string>
#include <unordered_map>
#include <variant>
#include <vector>

#include "base/SerialQueue.h"
#include "bexil/Protocol.h"
#include "daemon/BXDServer.h"
#include "daemon/BXDZemClient.h"
#include "daemon/DiscoveryContinuation.h"
#include "daemon/Transaction.h"
#include "handlers/DiscoveryFilter.h"
#include "model/BXBundle.h"
#include "model/BXUtilities.h"
#include "model/MessageForm.h"
#include "platform/log/Log.h"
#include "platform/trace/Probes.h"
#include "platform/zem/ZemCodec.h"
#include "platform/zem/ZemFrame.h"
#include "policy/BXDPlugIn.h"
#include "policy/BXHostAccessPolicy.h"
#include "policy/BXIssueReadExtension.h"

namespace bexil {

namespace {

namespace discover = protocol::discover;
namespace formKey = protocol::form;
namespace page = protocol::page;

// The most candidates one page walks: a page whose rules reject nearly everything still answers (with fewer
// forms, possibly none, and a continuation) in bounded time.
constexpr size_t kMaxPageWalk = 20000;
// Every how many steps a page in the making looks whether its client has hung up (a system call), so that a page
// nobody will read stops within a millisecond or so of work.
constexpr size_t kStepsPerHangUpProbe = 16;
// The most candidates asked of the registry at a time. Each query has a fixed cost (a read transaction of its
// own), so larger stretches make a walk cheaper; a stretch that a step leaves half offered is kept for the next.
constexpr size_t kWalkStretch = 32;
// An unpaged "match" whose candidates all come in one stretch of at most this many is made in one step: its
// offers cost less than the trips through the event loop that steps would add.
constexpr size_t kOneStepCandidates = 256;
// How many times an unpaged "match" starts again because the plug-ins changed between its steps before it is made in
// one go, which nothing can interrupt.
constexpr unsigned kMaxRestarts = 2;
// The most bytes an array's header takes: its tag and a count of up to 64 bits.
constexpr size_t kMaxArrayHeaderBytes = 11;

// Whether a step ends now: its time is up or, once it has done some of its work (`worked`), a request waits for it
// on the bulk thread. A step that may not end early (one made in one go) has no deadline.
bool stepIsOver(std::chrono::steady_clock::time_point deadline, bool worked = true) {
    if (deadline == std::chrono::steady_clock::time_point::max()) return false;
    return (worked && SerialQueue::bulkBlockIsWaitedFor()) || std::chrono::steady_clock::now() > deadline;
}

// Exports the candidates that pass the filter and lets them compete.
void offerAdmitted(const BXDatabase::PlugInSet& candidates, size_t from, size_t to, const CandidateFilter& filter,
                   AcceptedForms& accepted, BXDServer& database) {
    for (size_t i = from; i < to; ++i) {
        const std::shared_ptr<BXDPlugIn>& plugIn = candidates[i];
        if (!filter.admits(*plugIn)) continue;
        if (!accepted.offerEncoded(plugIn, database))
            log::ops().error("failed to export matching plug-in %{public}@",
                             plugIn->uuid() ? plugIn->uuid()->string() : std::string());
    }
}

// Binds a continuation to `rules`, encoded (left unbound when they cannot be encoded).
void bindRules(DiscoveryContinuation::Binding& binding, const Value& rules) {
    if (Result<std::vector<uint8_t>> encoded = ZemCodec::encode(rules); encoded)
        binding.rules.assign(encoded->begin(), encoded->end());
}

// Answers with `matches`, the reply's matches entry encoded already, or with the failure to encode it. A client of
// a version before message forms gets the reply without them.
void answerWithMatches(Transaction& transaction, const ZemCodec::Entries& matches,
                       const std::optional<Error>& failure) {
    if (failure) {
        log::ops().error("cannot encode the forms of a match for client %d: %@", transaction.client()->pid(), *failure);
        transaction.fail(ErrorCode::OperationFailed, "cannot encode the matching forms");
    } else if (!carriesMessageForms(transaction.version())) {
        transaction.done();
    } else {
        transaction.doneWithEncodedEntries(matches);
    }
}

// The page size of a paged "match": a positive integer of either integer kind; none for anything else.
std::optional<uint64_t> pageSizeOf(const Value& entry) {
    std::optional<uint64_t> size = entry.getUInt64();
    if (!size) {
        std::optional<int64_t> signedSize = entry.getInt64();
        if (signedSize && *signedSize > 0) size = static_cast<uint64_t>(*signedSize);
    }
    if (!size || *size == 0) return std::nullopt;
    return size;
}

// A page of a paged "match" on its way: the walk's place, what it accepted so far and what it checks candidates
// against, then the page's forms as they are encoded. The daemon serves one request at a time, so a page is made
// in steps of about BXDServer::pageStep() and the request queue serves the requests that came meanwhile between
// two steps: a client paging through a large registry never makes another client's point match wait for more than
// a step. A step ends after the candidate (or the form being encoded) in progress once its time is up, or sooner on
// the loop's bulk thread, which runs the steps after the first, when a request waits for it; each step costs a
// hand-over to that thread, about a microsecond. Lives on the request queue, kept alive by the step queued next.
class PageWalk {
  public:
    PageWalk(std::shared_ptr<Transaction> transaction, Value rules, uint64_t flags, size_t wanted,
             DiscoveryContinuation::Binding binding, std::optional<std::string> after)
        : transaction_(std::move(transaction)),
          database_(*transaction_->server()),
          rules_(std::move(rules)),
          flags_(flags),
          wanted_(wanted),
          binding_(std::move(binding)),
          context_{.annotations = &database_.annotationSource()},
          exclusions_(BXDUserPrefs::exclusionRuleSets(database_.currentExclusions())),
          filter_{rules_, exclusions_, flags_, *transaction_->client(), database_, context_},
          // Taken after the exclusions are read, since reading them may publish their change, which the page
          // reflects.
          generation_(database_.changeFeed().current()),
          accepted_(flags),
          walkedTo_(std::move(after)),
          group_(flags) {}

    // Makes the page until it is answered or the step's time is up; then the next step waits behind the requests
    // that came meanwhile.
    static void step(std::shared_ptr<PageWalk> page) {
        Transaction& transaction = *page->transaction_;
        const bool probe = ++page->steps_ % kStepsPerHangUpProbe == 0;
        if (transaction.client()->isDead() || (probe && transaction.client()->peerHasHungUp())) {
            // Nobody reads the reply; the page stops here.
            log::ops().info("page for client %d abandoned: the client has gone", transaction.client()->pid());
            transaction.done();
            return;
        }
        const auto deadline = std::chrono::steady_clock::now() + page->database_.pageStep();
        if (!page->forms_) {
            if (!page->walk(deadline)) return resume(std::move(page));
            // The page's forms are its own, and putting them in their final shape takes a few hundred
            // microseconds for a large page: done with the loop let go, so that a request need not wait for it.
            page->forms_ = SerialQueue::withLoopLetGo([&] {
                page->accepted_.linkReplacements();
                return page->accepted_.takeEncoded();
            });
        }
        if (!page->made_) {
            if (!page->encode(deadline)) return resume(std::move(page));
            page->made_ = true;
            // A page that took steps is answered in a step of its own, so that requests that came during its last
            // one (the request thread waiting for the loop) go first: its client then spends a millisecond or so
            // reading it, and woken first it would hold the CPU that the client of a point match answered just
            // after is woken onto, for a whole time slice.
            if (page->steps_ > 1) return resume(std::move(page));
        }
        page->answer();
        // Freeing what the page held (its forms, its copy of the reply's bytes, the stretch's records) takes as
        // long again; with the loop let go too.
        SerialQueue::withLoopLetGo([&] { page->release(); });
    }

  private:
    static void resume(std::shared_ptr<PageWalk> page) {
        Transaction& transaction = *page->transaction_;
        transaction.resumeLater([page = std::move(page)]() mutable { step(std::move(page)); });
    }

    // Walks until the page is complete (true) or `deadline` has passed (false). A step ends between two
    // candidates; the stretch it was in and the identifier it was offering carry over to the next step, unless
    // something changed in between, in which case the next step reads them again.
    bool walk(std::chrono::steady_clock::time_point deadline) {
        bool offered = false;
        if (slice_ && database_.changeFeed().current() != sliceGeneration_) {
            slice_.reset();
            group_ = AcceptedForms(flags_);
            groupIdentifier_.reset();
        }
        while (true) {
            if (!slice_ || at_ == slice_->plugIns.size()) {
                if (slice_) {
                    if (!closeGroup()) return true;
                    // Identifiers whose candidates the registry's election filter dropped were walked too.
                    if (slice_->last) walkedTo_ = slice_->last;
                    if (slice_->ended) {
                        ended_ = true;
                        return true;
                    }
                    slice_.reset();
                }
                if (accepted_.count() >= wanted_ || walked_ >= kMaxPageWalk) return true;
                // A stretch is read at the start of a step rather than at the end of one that has taken its time
                // (or that a request waits for).
                if (stepIsOver(deadline, offered)) return false;
                size_t stretch = std::clamp<size_t>(wanted_ - accepted_.count(), 1, kWalkStretch);
                sliceGeneration_ = database_.changeFeed().current();
                // The read touches only the database, so requests are served meanwhile. A change published
                // during it is one between two steps: the stretch is read again, with the loop held this time so
                // that the walk goes on however often the plug-ins change.
                slice_ = SerialQueue::withLoopLetGo(
                    [&] { return database_.findPlugInsAfterIdentifier(rules_, walkedTo_, stretch); });
                if (const uint64_t now = database_.changeFeed().current(); now != sliceGeneration_) {
                    sliceGeneration_ = now;
                    slice_ = database_.findPlugInsAfterIdentifier(rules_, walkedTo_, stretch);
                }
                walked_ += stretch;
                at_ = 0;
                if (!slice_) {
                    ended_ = true;
                    return true;
                }
                trace::discoverRaw(static_cast<unsigned>(slice_->plugIns.size()));
                continue;
            }
            const std::shared_ptr<BXDPlugIn>& plugIn = slice_->plugIns[at_];
            std::string identifier = plugIn->identifier().value_or("");
            if (groupIdentifier_ != identifier) {
                if (!closeGroup()) return true;
                groupIdentifier_ = std::move(identifier);
            }
            offerAdmitted(slice_->plugIns, at_, at_ + 1, filter_, group_, database_);
            ++at_;
            offered = true;
            if (stepIsOver(deadline)) return false;
        }
    }

    // Takes the forms of the identifier being offered into the page; false when they do not fit, which ends the
    // page before them.
    bool closeGroup() {
        if (!groupIdentifier_) return true;
        if (accepted_.count() > 0 && accepted_.count() + group_.count() > wanted_) return false;
        accepted_.absorb(std::move(group_));
        group_ = AcceptedForms(flags_);
        groupEnds_.emplace_back(*groupIdentifier_, accepted_.count());
        walkedTo_ = std::move(groupIdentifier_);
        groupIdentifier_.reset();
        return true;
    }

    // Encodes the page's forms as the reply's matches until all are (true) or `deadline` has passed (false). The
    // page ends before the identifier whose forms would take it past page::kMaxBytes (the first is always kept).
    bool encode(std::chrono::steady_clock::time_point deadline) {
        std::vector<uint8_t>& out = matches_.bytes;
        if (!encodingBegun_) {
            encodingBegun_ = true;
            if (std::optional<Error> error =
                    ZemCodec::beginEntry(matches_, protocol::key::kMatches, forms_->empty() ? 1 : 2)) {
                failure_ = std::move(error);
                return true;
            }
            headerAt_ = out.size();
            ZemCodec::appendArrayHeader(forms_->size(), out);
            groupStart_ = out.size();
        }
        while (true) {
            for (; groupsDone_ < groupEnds_.size() && groupEnds_[groupsDone_].second == encoded_; ++groupsDone_) {
                size_t groupBytes = out.size() - groupStart_;
                if (groupsDone_ > 0 && formBytes_ + groupBytes > page::kMaxBytes) {
                    cutBefore(groupsDone_);
                    return true;
                }
                formBytes_ += groupBytes;
                groupStart_ = out.size();
            }
            if (encoded_ == forms_->size()) return true;
            if (std::optional<Error> error = AcceptedForms::appendForm((*forms_)[encoded_], out)) {
                failure_ = std::move(error);
                return true;
            }
            ++encoded_;
            if (stepIsOver(deadline)) return false;
        }
    }

    // Frees what the page holds once it is answered.
    void release() {
        forms_.reset();
        matches_ = ZemCodec::Entries();
        accepted_ = AcceptedForms(flags_);
        group_ = AcceptedForms(flags_);
        slice_.reset();
        groupEnds_ = {};
    }

    // Ends the page after the identifier `group` - 1: its forms, encoded already, and the array's count go.
    void cutBefore(size_t group) {
        const size_t kept = groupEnds_[group - 1].second;
        log::ops().info("page for client %d cut at %zu forms: more would exceed %llu bytes (page::kMaxBytes)",
                        transaction_->client()->pid(), kept, static_cast<unsigned long long>(page::kMaxBytes));
        std::vector<uint8_t>& out = matches_.bytes;
        out.resize(groupStart_);
        std::vector<uint8_t> header, written;
        ZemCodec::appendArrayHeader(kept, header);
        ZemCodec::appendArrayHeader(forms_->size(), written);
        out.erase(out.begin() + static_cast<ptrdiff_t>(headerAt_),
                  out.begin() + static_cast<ptrdiff_t>(headerAt_ + written.size()));
        out.insert(out.begin() + static_cast<ptrdiff_t>(headerAt_), header.begin(), header.end());
        forms_->resize(kept);
        walkedTo_ = groupEnds_[group - 1].first;
        ended_ = false;
    }

    void answer() {
        Transaction& transaction = *transaction_;
        if (failure_) return answerWithMatches(transaction, matches_, failure_);
        log::ops().info("match returned %u plug-ins in a page", static_cast<unsigned>(forms_->size()));
        transaction.reply().set(protocol::key::kGeneration, Value::uint64(generation_));
        if (!ended_ && walkedTo_) {
            if (binding_.rules.empty()) bindRules(binding_, rules_);
            std::string continuation = database_.continuations().issue(*walkedTo_, binding_);
            transaction.reply().set(protocol::key::kContinuation,
                                    Value::data(std::span<const uint8_t>(
                                        reinterpret_cast<const uint8_t*>(continuation.data()), continuation.size())));
        }
        answerWithMatches(transaction, matches_, std::nullopt);
    }

    std::shared_ptr<Transaction> transaction_;
    BXDServer& database_;
    const Value rules_;
    const uint64_t flags_;
    const size_t wanted_;
    DiscoveryContinuation::Binding binding_;
    BXMatchContext context_;
    const std::vector<Value> exclusions_;
    const CandidateFilter filter_;
    const uint64_t generation_;

    // The walk.
    AcceptedForms accepted_;
    // Where each identifier's forms end in the page, for cutting it by size.
    std::vector<std::pair<std::string, size_t>> groupEnds_;
    // The last identifier whose forms are in the page (or that the walk passed without a form).
    std::optional<std::string> walkedTo_;
    // The stretch being offered, the generation it was read at, and the next candidate in it.
    std::optional<BXDatabase::PlugInSlice> slice_;
    uint64_t sliceGeneration_ = 0;
    size_t at_ = 0;
    // The forms offered so far of the identifier being offered; they compete among themselves before the page
    // takes them.
    AcceptedForms group_;
    std::optional<std::string> groupIdentifier_;
    size_t walked_ = 0;
    bool ended_ = false;

    // The encoding, once the walk is complete: the forms, the reply entry they are written into, how many are
    // written, how many identifiers are complete in it and where the one in progress starts.
    std::optional<std::vector<AcceptedForms::EncodedForm>> forms_;
    ZemCodec::Entries matches_;
    bool encodingBegun_ = false;
    size_t headerAt_ = 0;
    size_t encoded_ = 0;
    size_t groupsDone_ = 0;
    size_t groupStart_ = 0;
    size_t formBytes_ = 0;
    std::optional<Error> failure_;
    // The page is complete and waits for its answer to go out.
    bool made_ = false;
    size_t steps_ = 0;
};

// An unpaged "match" on its way. Its reply must be what one go would answer at one moment: every candidate in
// registration order, competing with all the others, so unlike a page it cannot end early. It is still made in steps
// of BXDServer::pageStep() (ended early on the bulk thread when a request waits, as a page's are), reading the
// registry a stretch at a time and serving the requests that came meanwhile between two steps. Whatever changed between
// two steps (a commit to the registry, or any change a client observes through "match": annotations, holds, exclusions)
// starts it again from the first stretch, so that its reply is one state; after kMaxRestarts it is made in one go. A
// match whose candidates come in one short stretch (a point match, most often) is made in one step whatever its time.
// Lives on the request queue, kept alive by the step queued next.
class WholeMatch {
  public:
    WholeMatch(std::shared_ptr<Transaction> transaction, Value rules, uint64_t flags)
        : transaction_(std::move(transaction)),
          database_(*transaction_->server()),
          rules_(std::move(rules)),
          flags_(flags),
          context_{.annotations = &database_.annotationSource()} {}

    static void step(std::shared_ptr<WholeMatch> match) {
        Transaction& transaction = *match->transaction_;
        const bool probe = ++match->steps_ % kStepsPerHangUpProbe == 0;
        if (match->steps_ > 1 && (transaction.client()->isDead() || (probe && transaction.client()->peerHasHungUp()))) {
            log::ops().info("match for client %d abandoned: the client has gone", transaction.client()->pid());
            transaction.done();
            return;
        }
        if (!match->walked_) {
            if (match->attempt_ && match->changedSinceBegun())
                match->startAgain("the plug-ins changed while it was made");
            if (!match->attempt_) match->begin();
        }
        const auto deadline = match->restarts_ >= kMaxRestarts
                                  ? std::chrono::steady_clock::time_point::max()
                                  : std::chrono::steady_clock::now() + match->database_.pageStep();
        if (!match->walked_) {
            switch (match->walk(deadline)) {
                case Walked::Paused:
                    return resume(std::move(match));
                case Walked::Changed:
                    match->startAgain("the plug-ins changed while it was made");
                    return step(std::move(match));
                case Walked::Unreadable:
                    match->startAgain("the registry could not be read");
                    return step(std::move(match));
                case Walked::Unversioned:
                    // The first stretch did not hold every candidate: the walk starts over with the registry's
                    // version read first. A match that fits one stretch never pays for reading it.
                    match->versioned_ = true;
                    match->attempt_.reset();
                    return step(std::move(match));
                case Walked::Complete:
                    match->walked_ = true;
                    break;
            }
        }
        // A match made in one step is answered in it too.
        const bool stepped = match->attempt_->stepped;
        if (!match->encode(stepped ? deadline : std::chrono::steady_clock::time_point::max()))
            return resume(std::move(match));
        match->answer();
    }

  private:
    enum class Walked { Complete, Paused, Changed, Unversioned, Unreadable };

    static void resume(std::shared_ptr<WholeMatch> match) {
        Transaction& transaction = *match->transaction_;
        transaction.resumeLater([match = std::move(match)]() mutable { step(std::move(match)); });
    }

    // What one try reads and checks against, and what it accepted so far. The filter refers to the exclusions, so
    // an attempt never moves.
    struct Attempt {
        Attempt(const WholeMatch& match, std::vector<Value> exclusionSets)
            : exclusions(std::move(exclusionSets)),
              filter{match.rules_,    exclusions,    match.flags_, *match.transaction_->client(),
                     match.database_, match.context_},
              accepted(match.flags_) {}
        Attempt(const Attempt&) = delete;
        Attempt& operator=(const Attempt&) = delete;

        const std::vector<Value> exclusions;
        const CandidateFilter filter;
        // The change feed's generation, the annotations' and the registry's version the attempt began at; the
        // registry's is read only for a walk of several stretches.
        uint64_t generation = 0;
        uint64_t annotationGeneration = 0;
        std::optional<uint64_t> version;
        AcceptedForms accepted;
        // The stretch being offered, the next candidate in it, and the candidates read so far; whether a stretch
        // was read since the registry's version was last looked at.
        std::optional<BXDatabase::PlugInStretch> stretch;
        size_t at = 0;
        size_t read = 0;
        bool unchecked = false;
        // Whether this attempt may take more than one step.
        bool stepped = false;
    };

    void begin() {
        std::vector<Value> exclusions = BXDUserPrefs::exclusionRuleSets(database_.currentExclusions());
        attempt_ = std::make_unique<Attempt>(*this, std::move(exclusions));
        // Taken after the exclusions are read, since reading them may publish their change, which the reply
        // reflects; the registry's version before its first stretch is read.
        attempt_->generation = database_.changeFeed().current();
        attempt_->annotationGeneration = database_.annotationGeneration();
        if (versioned_) {
            attempt_->version = database_.registryVersion();
            unversionable_ = !attempt_->version;
        }
    }

    // Whether something a client observes through "match" changed since the attempt began: a published change, or
    // an annotation changed in memory, which is published only once it is saved.
    bool changedSinceBegun() {
        return attempt_->generation != database_.changeFeed().current() ||
               attempt_->annotationGeneration != database_.annotationGeneration();
    }

    void startAgain(const char* why) {
        attempt_.reset();
        ++restarts_;
        log::ops().info("match for client %d started again (%u): %s%s", transaction_->client()->pid(), restarts_, why,
                        restarts_ >= kMaxRestarts ? "; it is made in one go" : "");
    }

    // Reads and offers candidates until all are offered (Complete), `deadline` has passed (Paused), the registry
    // changed since the attempt began (Changed), a second stretch is due without the version to check it by
    // (Unversioned), or a stretch after the first could not be read (Unreadable: answering the stretches before it
    // would leave out the rest without saying so; a first stretch that cannot be read answers no plug-ins, as the
    // registry giving nothing always has).
    Walked walk(std::chrono::steady_clock::time_point deadline) {
        Attempt& attempt = *attempt_;
        // Without a version to tell one state from another, everything is read in one stretch.
        const bool oneGo = deadline == std::chrono::steady_clock::time_point::max() || unversionable_;
        // The stretches read so far are one state of the registry as long as nothing was committed since the version
        // was read: looked at once before a step ends, which covers every stretch the step read.
        bool offered = false;
        auto endOfStep = [&](Walked outcome) {
            if (!attempt.unchecked) return outcome;
            attempt.unchecked = false;
            return database_.registryVersion() == attempt.version ? outcome : Walked::Changed;
        };
        while (true) {
            if (!attempt.stretch || attempt.at == attempt.stretch->plugIns.size()) {
                if (attempt.stretch && attempt.stretch->ended) {
                    const Walked outcome = endOfStep(Walked::Complete);
                    if (outcome == Walked::Complete) trace::discoverRaw(static_cast<unsigned>(attempt.read));
                    return outcome;
                }
                if (attempt.stretch && !attempt.version && !oneGo) return Walked::Unversioned;
                if (attempt.stretch && stepIsOver(deadline, offered)) return endOfStep(Walked::Paused);
                const int64_t after = attempt.stretch ? attempt.stretch->last : 0;
                // A stretch of a walk in steps is read with the loop let go, as a page's is; what the requests
                // served meanwhile changed starts the attempt again, as a change between two steps does. One go
                // holds the loop throughout.
                const bool letGo = !oneGo && SerialQueue::letsLoopGo();
                if (oneGo)
                    attempt.stretch = database_.findPlugInsAfterRegistration(rules_, after, SIZE_MAX);
                else
                    attempt.stretch = SerialQueue::withLoopLetGo(
                        [&] { return database_.findPlugInsAfterRegistration(rules_, after, kWalkStretch); });
                attempt.at = 0;
                if (letGo && changedSinceBegun()) return Walked::Changed;
                if (!attempt.stretch) {
                    if (after != 0 && !oneGo) return Walked::Unreadable;
                    trace::discoverRaw(0);
                    return Walked::Complete;
                }
                attempt.unchecked = attempt.version.has_value();
                attempt.read += attempt.stretch->plugIns.size();
                if (!attempt.stepped)
                    attempt.stepped = !attempt.stretch->ended || attempt.stretch->plugIns.size() > kOneStepCandidates;
                continue;
            }
            offerAdmitted(attempt.stretch->plugIns, attempt.at, attempt.at + 1, attempt.filter, attempt.accepted,
                          database_);
            ++attempt.at;
            offered = true;
            if (attempt.stepped && stepIsOver(deadline)) return endOfStep(Walked::Paused);
        }
    }

    // Writes the whole reply until it is complete (true) or `deadline` has passed (false): the handler's entries
    // and "matches" among them in key order, each form released once written (a large reply's forms take a while
    // to free). The reply is handed over as written: copying megabytes into another buffer would hold the queue,
    // all the longer for memory that was never used before. A client of a version before message forms gets none.
    // A reply that grows past the frame limit will be refused: from there on its forms are only measured, one at a
    // time, so that the refusal still gives its size without holding it all.
    bool encode(std::chrono::steady_clock::time_point deadline) {
        if (!carriesMessageForms(transaction_->version()) || failure_) return true;
        AcceptedForms& accepted = attempt_->accepted;
        if (!writingBegun_) {
            writingBegun_ = true;
            accepted.linkReplacements();
            transaction_->reply().set(protocol::key::kGeneration, Value::uint64(attempt_->generation));
            Result<ZemCodec::Entries> others = ZemCodec::encodeEntries(transaction_->reply().value());
            ZemCodec::Entries matchesKey;
            if (!others) failure_ = others.error();
            if (!failure_) failure_ = ZemCodec::beginEntry(matchesKey, protocol::key::kMatches, 2);
            if (failure_) return true;
            others_ = std::move(*others);
            while (othersWritten_ < others_.count() && others_.key(othersWritten_) < protocol::key::kMatches)
                ++othersWritten_;
            // Room for it all: a form's changing entries (annotations, token) take less than its kept ones
            // unless its annotations are large, so twice the kept entries is room enough but in such cases, where
            // the reply grows; room never written to costs no memory. Never more than a frame takes, though: past
            // that the reply is only measured.
            payload_.reserve(std::min(kMaxArrayHeaderBytes * 2 + others_.bytes.size() + matchesKey.bytes.size() +
                                          2 * accepted.keptEntryBytes(),
                                      ZemFrame::kMaxPayloadBytes + 1));
            ZemCodec::appendDictionaryHeader(others_.count() + 1, payload_);
            payload_.insert(payload_.end(), others_.bytes.begin(),
                            others_.bytes.begin() + static_cast<ptrdiff_t>(othersWritten_ < others_.count()
                                                                               ? others_.starts[othersWritten_]
                                                                               : others_.bytes.size()));
            payload_.insert(payload_.end(), matchesKey.bytes.begin(), matchesKey.bytes.end());
            ZemCodec::appendArrayHeader(accepted.count(), payload_);
        }
        while (nextSlot_ < accepted.slots()) {
            std::optional<AcceptedForms::EncodedForm> form = accepted.takeEncodedAt(nextSlot_++);
            if (!form) continue;
            // A form's kept entries are what it takes at least: one that cannot fit is not copied in first (past
            // the buffer's room, which is the limit's, that would copy the whole reply once more).
            if (!oversized_ && form->kept && payload_.size() + form->kept->bytes.size() > ZemFrame::kMaxPayloadBytes)
                stopKeeping();
            if ((failure_ = AcceptedForms::appendForm(*form, written()))) return true;
            countWritten();
            if (stepIsOver(deadline)) return false;
        }
        if (othersWritten_ < others_.count()) {
            written().insert(written().end(),
                             others_.bytes.begin() + static_cast<ptrdiff_t>(others_.starts[othersWritten_]),
                             others_.bytes.end());
            othersWritten_ = others_.count();
            countWritten();
        }
        return true;
    }

    // Where the next piece of the reply goes: the reply, or once it is past the frame limit the piece measured.
    std::vector<uint8_t>& written() { return oversized_ ? measured_ : payload_; }
    // Counts the piece just measured, or stops keeping the reply once it is past the limit.
    void countWritten() {
        if (oversized_) {
            *oversized_ += measured_.size();
            measured_.clear();
        } else if (payload_.size() > ZemFrame::kMaxPayloadBytes) {
            stopKeeping();
        }
    }
    // Lets go of the reply, keeping its size; what follows is only measured.
    void stopKeeping() {
        oversized_ = payload_.size();
        std::vector<uint8_t>().swap(payload_);
    }

    void answer() {
        Transaction& transaction = *transaction_;
        if (!failure_) log::ops().info("match returned %u plug-ins", static_cast<unsigned>(attempt_->accepted.count()));
        if (failure_ || !carriesMessageForms(transaction.version())) {
            transaction.reply().set(protocol::key::kGeneration, Value::uint64(attempt_->generation));
            return answerWithMatches(transaction, ZemCodec::Entries(), failure_);
        }
        if (oversized_)
            transaction.doneWithOversizedReply(*oversized_);
        else
            transaction.doneWithEncodedReply(std::move(payload_));
    }

    std::shared_ptr<Transaction> transaction_;
    BXDServer& database_;
    const Value rules_;
    const uint64_t flags_;
    BXMatchContext context_;
    std::unique_ptr<Attempt> attempt_;
    // Whether attempts read the registry's version before their first stretch (once one stretch did not hold every
    // candidate), and whether the registry turned out unable to give one.
    bool versioned_ = false;
    bool unversionable_ = false;
    unsigned restarts_ = 0;
    size_t steps_ = 0;
    // Every candidate is offered; what remains is writing the reply.
    bool walked_ = false;

    // The reply as it is written: the handler's entries, how many of them are written, and the next slot of the
    // accepted forms to write.
    std::vector<uint8_t> payload_;
    ZemCodec::Entries others_;
    size_t othersWritten_ = 0;
    bool writingBegun_ = false;
    size_t nextSlot_ = 0;
    std::optional<Error> failure_;
    // The size of a reply past the frame limit, counted so far (none while it is within), and the form being
    // measured.
    std::optional<size_t> oversized_;
    std::vector<uint8_t> measured_;
};

// Starts a page of a paged "match" (see the top of this file) once the request's page size and continuation hold.
void matchPage(Transaction& transaction, const Value& rules, uint64_t flags, const Value* pageSizeEntry,
               const Value* continuationEntry) {
    if (pageSizeEntry == nullptr) {
        transaction.fail(ErrorCode::InvalidRequest, "invalid request format (continuation without page size)");
        return;
    }
    std::optional<uint64_t> asked = pageSizeOf(*pageSizeEntry);
    if (!asked) {
        transaction.fail(ErrorCode::InvalidRequest, "invalid request format (page size must be a positive integer)");
        return;
    }
    if (continuationEntry != nullptr && !continuationEntry->isData()) {
        transaction.fail(ErrorCode::InvalidRequest, "invalid request format (continuation must be data)");
        return;
    }
    BXDZemClient& client = *transaction.client();
    BXDServer& database = *transaction.server();
    const pid_t pid = client.pid();
    if (*asked > page::kMaxForms)
        log::ops().info("client %d asked for pages of %llu forms; serving %llu (page::kMaxForms)", pid,
                        static_cast<unsigned long long>(*asked), static_cast<unsigned long long>(page::kMaxForms));
    const size_t wanted = static_cast<size_t>(std::min(*asked, page::kMaxForms));

    // The rules are bound only when a continuation is read or issued: a walk that fits one page never encodes
    // them again, which matters for large rule sets.
    DiscoveryContinuation::Binding binding{.connection = client.serial(),
                                           .uid = client.user() ? client.user()->uid : static_cast<uid_t>(-1),
                                           .pid = pid,
                                           .flags = flags,
                                           .rules = {}};
    std::optional<std::string> after;
    if (continuationEntry != nullptr) {
        std::span<const uint8_t> bytes = continuationEntry->dataBytes();
        bindRules(binding, rules);
        auto position = database.continuations().read(
            std::string_view(reinterpret_cast<const char*>(bytes.data()), bytes.size()), binding);
        if (const auto* problem = std::get_if<DiscoveryContinuation::Problem>(&position)) {
            switch (*problem) {
                case DiscoveryContinuation::Problem::Malformed:
                    transaction.fail(ErrorCode::BadContinuation, "malformed continuation");
                    break;
                case DiscoveryContinuation::Problem::Expired:
                    transaction.fail(ErrorCode::BadContinuation,
                                     "continuation expired: bxd restarted since it was issued; start again");
                    break;
                case DiscoveryContinuation::Problem::Foreign:
                    transaction.fail(ErrorCode::BadContinuation,
                                     "continuation not issued to this connection for these rules and flags");
                    break;
            }
            log::ops().info("client %d sent a continuation that is not valid here", pid);
            return;
        }
        after = std::get<std::string>(std::move(position));
    }
    PageWalk::step(std::make_shared<PageWalk>(transaction.shared_from_this(), rules, flags, wanted, std::move(binding),
                                              std::move(after)));
}

}  // namespace

void Transaction::matchPlugIns() {
    std::optional<DiscoveryQuery> query = readDiscoveryQuery(*this);
    if (!query) return;
    const Value& rules = query->rules;
    const uint64_t flags = query->flags;

    // Forms carry tokens made for earlier replies; they must stay checkable even if the key file was removed.
    if (!BXKeepReadExtensionsCheckable())
        log::ops().error("cannot restore the sandbox extension key: %{public}s", strerror(errno));

    const Value* pageSize = request().find(protocol::key::kPageSize);
    const Value* continuation = request().find(protocol::key::kContinuation);
    if (pageSize != nullptr || continuation != nullptr) {
        matchPage(*this, rules, flags, pageSize, continuation);
        return;
    }

    WholeMatch::step(std::make_shared<WholeMatch>(shared_from_this(), rules, flags));
}

}  // namespace bexil
