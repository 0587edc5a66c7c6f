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
// page (the client library links across pages when it puts them together).

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
#include "policy/BXDPlugIn.h"
#include "policy/BXHostAccessPolicy.h"
#include "policy/BXIssueReadExtension.h"

namespace bexil {

namespace {

namespace discover = protocol::discover;
namespace formKey = protocol::form;
namespace page = protocol::page;

// The most candidates one page walks: a page whose rules reject nearly everything still answers (with fewer
// forms, possibly none, and a continuation) before it has held the request queue for long.
constexpr size_t kMaxPageWalk = 20000;
// The longest a page keeps the request queue once it holds a form: the daemon serves one request at a time, so
// another client's request waits for the page in progress, and a point match must not wait for a whole page of
// hundreds of forms. A page that runs out of time ends after the stretch in progress, with a continuation.
constexpr std::chrono::microseconds kPageTimeBudget{500};
// The most candidates asked of the registry at a time. The time budget is checked between stretches, so a stretch
// is never read and then thrown away; small stretches keep a page close to its budget.
constexpr size_t kWalkStretch = 16;

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

// Answers with `forms` as the reply's matches, written from the encoded entries the records keep and the few that
// change, so that no form is built as a dictionary and encoded again on its way out.
void answerWithForms(Transaction& transaction, std::span<const AcceptedForms::EncodedForm> forms) {
    if (!carriesMessageForms(transaction.version())) {
        transaction.done();
        return;
    }
    ZemCodec::Entries entries;
    // The forms were checked at their own level within the reply; the entry's value is the array that holds them.
    std::optional<Error> error = ZemCodec::beginEntry(entries, protocol::key::kMatches, forms.empty() ? 1 : 2);
    if (!error) error = AcceptedForms::appendMatches(forms, entries.bytes);
    if (error) {
        log::ops().error("cannot encode the forms of a match for client %d: %@", transaction.client()->pid(), *error);
        transaction.fail(ErrorCode::OperationFailed, "cannot encode the matching forms");
        return;
    }
    transaction.doneWithEncodedEntries(entries);
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

// One page of a paged "match" (see the top of this file). Answers the transaction.
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

    DiscoveryContinuation::Binding binding{.connection = client.serial(),
                                           .uid = client.user() ? client.user()->uid : static_cast<uid_t>(-1),
                                           .pid = pid,
                                           .flags = flags,
                                           .rules = {}};
    // The rules are bound only when a continuation is read or issued: a walk that fits one page never encodes
    // them again, which matters for large rule sets.
    auto bindRules = [&binding, &rules] {
        if (Result<std::vector<uint8_t>> encoded = ZemCodec::encode(rules); encoded)
            binding.rules.assign(encoded->begin(), encoded->end());
    };
    std::optional<std::string> after;
    if (continuationEntry != nullptr) {
        std::span<const uint8_t> bytes = continuationEntry->dataBytes();
        bindRules();
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

    BXMatchContext context{.annotations = &database.annotationSource()};
    AcceptedForms accepted(flags);
    // Taken after the exclusions are read, since reading them may publish their change, which the page reflects.
    uint64_t generation = 0;
    // Where each identifier's forms end in the page, for cutting it by size later.
    std::vector<std::pair<std::string, size_t>> groupEnds;
    std::optional<std::string> walkedTo = after;
    bool ended = false;
    {
        std::vector<Value> exclusions = BXDUserPrefs::exclusionRuleSets(database.currentExclusions());
        CandidateFilter filter{rules, exclusions, flags, client, database, context};
        generation = database.changeFeed().current();
        size_t walked = 0;
        bool full = false;
        const auto deadline = std::chrono::steady_clock::now() + kPageTimeBudget;
        while (!full && walked < kMaxPageWalk) {
            size_t stretch = std::clamp<size_t>(wanted - accepted.count(), 1, kWalkStretch);
            std::optional<BXDatabase::PlugInSlice> slice =
                database.findPlugInsAfterIdentifier(rules, walkedTo, stretch);
            walked += stretch;
            if (!slice) {
                ended = true;
                break;
            }
            trace::discoverRaw(static_cast<unsigned>(slice->plugIns.size()));
            const BXDatabase::PlugInSet& candidates = slice->plugIns;
            for (size_t first = 0; first < candidates.size();) {
                std::string identifier = candidates[first]->identifier().value_or("");
                size_t end = first + 1;
                while (end < candidates.size() && candidates[end]->identifier().value_or("") == identifier) ++end;
                AcceptedForms group(flags);
                offerAdmitted(candidates, first, end, filter, group, database);
                if (accepted.count() > 0 && accepted.count() + group.count() > wanted) {
                    full = true;
                    break;
                }
                accepted.absorb(std::move(group));
                groupEnds.emplace_back(identifier, accepted.count());
                walkedTo = std::move(identifier);
                first = end;
            }
            if (full) break;
            // Identifiers whose candidates the registry's election filter dropped were walked too.
            if (slice->last) walkedTo = slice->last;
            if (slice->ended) {
                ended = true;
                break;
            }
            full = accepted.count() >= wanted || (accepted.count() > 0 && std::chrono::steady_clock::now() > deadline);
        }
        accepted.linkReplacements();
    }

    std::vector<AcceptedForms::EncodedForm> forms = accepted.takeEncoded();
    // The page ends before the identifier whose forms would take it past page::kMaxBytes (the first is always kept).
    size_t bytes = 0;
    for (size_t group = 0, at = 0; group < groupEnds.size(); ++group) {
        size_t groupBytes = 0;
        for (; at < groupEnds[group].second; ++at) {
            Result<size_t> size = AcceptedForms::encodedSize(forms[at]);
            groupBytes += size ? *size : 0;
        }
        if (group > 0 && bytes + groupBytes > page::kMaxBytes) {
            log::ops().info("page for client %d cut at %zu forms: more would exceed %llu bytes (page::kMaxBytes)", pid,
                            groupEnds[group - 1].second, static_cast<unsigned long long>(page::kMaxBytes));
            forms.erase(forms.begin() + static_cast<ptrdiff_t>(groupEnds[group - 1].second), forms.end());
            walkedTo = groupEnds[group - 1].first;
            ended = false;
            break;
        }
        bytes += groupBytes;
    }

    log::ops().info("match returned %u plug-ins in a page", static_cast<unsigned>(forms.size()));
    transaction.reply().set(protocol::key::kGeneration, Value::uint64(generation));
    if (!ended && walkedTo) {
        if (continuationEntry == nullptr) bindRules();
        std::string continuation = database.continuations().issue(*walkedTo, binding);
        transaction.reply().set(protocol::key::kContinuation,
                                Value::data(std::span<const uint8_t>(
                                    reinterpret_cast<const uint8_t*>(continuation.data()), continuation.size())));
    }
    answerWithForms(transaction, forms);
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

    BXDServer* database = server();
    BXMatchContext context{.annotations = &database->annotationSource()};
    AcceptedForms accepted(flags);
    {
        // The candidates and the rejected forms live in this scope, so they are gone before the reply is encoded.
        std::vector<Value> exclusions = BXDUserPrefs::exclusionRuleSets(database->currentExclusions());
        CandidateFilter filter{rules, exclusions, flags, *client(), *database, context};
        reply().set(protocol::key::kGeneration, Value::uint64(database->changeFeed().current()));
        std::optional<BXDatabase::PlugInSet> candidates = database->findPlugIns(rules);
        trace::discoverRaw(candidates ? static_cast<unsigned>(candidates->size()) : 0);
        if (candidates) offerAdmitted(*candidates, 0, candidates->size(), filter, accepted, *database);
        accepted.linkReplacements();
    }

    log::ops().info("match returned %u plug-ins", static_cast<unsigned>(accepted.count()));
    answerWithForms(*this, accepted.takeEncoded());
    log::ops().debug("reply marshalled");
}

}  // namespace bexil
