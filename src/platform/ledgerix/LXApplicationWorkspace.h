#pragma once

// LXApplicationWorkspace is the application registry as the rest of the system sees it: it registers plug-in
// bundles read from disk, answers look-ups and discovery queries with immutable records, and tells its observers
// about installs and uninstalls. Implementations are safe to call from any thread; they never hold a lock of their
// own while calling an observer or a query filter. LedgerixWorkspace is the implementation over SQLite; tests of
// the layers above may substitute their own.

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/ActingAs.h"
#include "base/Error.h"
#include "bexil/Uuid.h"
#include "bexil/Value.h"

namespace bexil {

class LXApplicationProxy;
class LXApplicationWorkspaceObserverProtocol;
class LXBexilProxy;

// The error domain of registry failures, with the codes below.
inline constexpr std::string_view LXErrorDomain = "Ledgerix";

enum LXErrorCode : int {
    // The path is not absolute, does not resolve (missing, symbolic-link loop) or is not a directory.
    kLXBadPath = 1,
    // The bundle has no readable information document, or its root is not a dictionary.
    kLXBadInfo = 2,
    // The information document describes no plug-in ("RZExtension" missing or not a dictionary).
    kLXNotAPlugIn = 3,
    // Entitlements.vrec exists but cannot be read, or its root is not a dictionary.
    kLXBadEntitlements = 4,
    // The identifier cannot name a data container (empty, ".", "..", a "/" in it, too long).
    kLXBadIdentifier = 5,
    // The data container could not be made.
    kLXContainerFailure = 6,
    // Nothing is registered at the path.
    kLXNotRegistered = 7,
    // The store failed (I/O, corruption, full disk); the registry is unchanged.
    kLXStoreFailure = 8,
};

using LXProxyList = std::vector<std::shared_ptr<const LXBexilProxy>>;
// A discovery filter: called once per candidate with its identifier (empty when it has none) and its entitlements
// (none when it has none); true keeps the candidate. An empty filter keeps every candidate, and a registry then
// reads no entitlements for it.
using LXPlugInFilter = std::function<bool(std::string_view identifier, const std::optional<Value>& entitlements)>;

// Says whether the caller already holds its own record of the plug-in with this UUID. A query given one hands back
// only the UUID of such a candidate, without reading or building its registry record. It runs with the registry's
// look-up lock held: it must not call the registry, nor take any lock that is held while calling the registry.
using LXKnownRecord = std::function<bool(const Uuid& uuid)>;

// One candidate of a discovery query that was told which records the caller holds.
struct LXCandidate {
    // The registry's record; none when the caller said it holds its own.
    std::shared_ptr<const LXBexilProxy> proxy;
    Uuid uuid;
    // Whether the plug-in lies in an application that is only a placeholder (also said when `proxy` is none).
    bool inPlaceholderApplication = false;
};
using LXCandidateList = std::vector<LXCandidate>;

// What a discovery query pins, as the rule engine that owns the query language reads it: for the extension point
// and for the identifier, the strings that a matching plug-in's value must equal (any one of them), or none when
// the query lets other values through. The registry narrows its candidates by its indexes with it and never reads
// the query's patterns itself, so a pattern it did not know could not narrow them wrongly.
struct LXPreselection {
    std::optional<std::vector<std::string>> extensionPoints = std::nullopt;
    std::optional<std::vector<std::string>> identifiers = std::nullopt;
};

// One stretch of the discovery walk, which visits plug-ins in the order of their identifiers (byte order, a missing
// identifier counting as the empty one) and, within an identifier, in registration order.
struct LXWalkSlice {
    // The candidates of the stretch that passed the filter.
    LXProxyList plugIns;
    // The identifier of the last candidate walked, whether or not it passed; none when the stretch was empty.
    std::optional<std::string> last;
    // True when no candidate sorts after `last`: the walk is over.
    bool ended = false;
};

// LXWalkSlice for a walk that was told which records the caller holds.
struct LXCandidateSlice {
    LXCandidateList candidates;
    std::optional<std::string> last;
    bool ended = false;
};

// One stretch of the candidates in registration order, for a walk that was told which records the caller holds.
struct LXRegistrationSlice {
    LXCandidateList candidates;
    // Where the next stretch starts: the registry's position of the last candidate read, whether or not it passed.
    int64_t last = 0;
    // True when no candidate comes after `last`: the walk is over.
    bool ended = false;
};

class LXApplicationWorkspace {
  public:
    virtual ~LXApplicationWorkspace() = default;

    // The process's shared registry over the default state directory, opened on first use. An error when the
    // store cannot be opened (the next call tries again).
    static Result<std::shared_ptr<LXApplicationWorkspace>> defaultWorkspace();

    // Observers are held weakly: an observer that is gone is skipped and forgotten.
    virtual void addObserver(std::weak_ptr<LXApplicationWorkspaceObserverProtocol> observer) = 0;
    virtual void removeObserver(const LXApplicationWorkspaceObserverProtocol* observer) = 0;

    // Registers the plug-in bundle at the path (a "file://" URL is accepted). Registering an unchanged bundle again
    // changes nothing and keeps its UUID; a changed bundle replaces its old record (uninstall, then install): under
    // a new UUID when its identifier or "BDBundleVersion" changed, under the old one otherwise. On failure the
    // registry is unchanged; if the store fails after the old record's uninstall was announced, observers have
    // heard of an uninstall that did not happen and find the record again on their next look-up.
    // With `readAs`, every read of the bundle (resolving its path included) uses that user's file-system rights.
    virtual Result<std::shared_ptr<const LXBexilProxy>> registerPlugin(std::string_view url,
                                                                       std::optional<UserIdentity> readAs) = 0;
    Result<std::shared_ptr<const LXBexilProxy>> registerPlugin(std::string_view url) {
        return registerPlugin(url, std::nullopt);
    }
    // Removes the record of the plug-in registered at the path; the bundle itself need not exist any more.
    virtual std::optional<Error> unregisterPlugin(std::string_view url) = 0;

    // `_LXClearSchemaCaches`: drops whatever the registry derives and caches; records already handed out stay valid.
    virtual void LXClearSchemaCaches() = 0;

    // The record of a plug-in UUID, or none.
    virtual std::shared_ptr<const LXBexilProxy> plugInProxyForUUID(const Uuid& uuid) = 0;
    // The record of the plug-in bundle at the path, or none.
    virtual std::shared_ptr<const LXBexilProxy> plugInProxyForURL(std::string_view url) = 0;
    // The record of the application bundle at the path, with its plug-ins, or none.
    virtual std::shared_ptr<const LXApplicationProxy> applicationProxyForBundleURL(std::string_view url) = 0;

    // How many plug-ins are registered, without reading their records; none when unknown.
    virtual std::optional<size_t> plugInCount() { return std::nullopt; }
    // Every registered plug-in in registration order; none when the store cannot be read.
    virtual std::optional<LXProxyList> installedPlugins() = 0;
    // The plug-ins that may match the query and that pass the filter, in registration order; none when the store
    // cannot be read. Only the pre-selection narrows the candidates (the query is for the log): the caller re-checks
    // every rule itself. The filter runs once per candidate on the calling thread.
    virtual std::optional<LXProxyList> pluginsMatchingQueryApplyFilter(const Value& query, const LXPlugInFilter& filter,
                                                                       const LXPreselection& preselection = {}) = 0;
    // The next stretch of the walk over the same candidates: at least `rows` of those whose identifier sorts after
    // `after` (from the start when none), fewer only where the walk ends, and always every candidate of the last
    // identifier it reaches, so that no identifier is split between two stretches. The default sorts the whole
    // candidate list; a registry with an index on the walk's order answers in proportion to the stretch.
    virtual std::optional<LXWalkSlice> pluginsMatchingQueryAfterIdentifier(const Value& query,
                                                                           const LXPlugInFilter& filter,
                                                                           const LXPreselection& preselection,
                                                                           const std::optional<std::string>& after,
                                                                           size_t rows);

    // The same three, handing back only the UUID of a candidate for which `known` (when given) says the caller holds
    // the record. A query with a filter reads every candidate for it and never asks `known`. The defaults build
    // every record and never ask either.
    virtual std::optional<LXCandidateList> installedCandidates(const LXKnownRecord& known);
    virtual std::optional<LXCandidateList> candidatesMatchingQuery(const Value& query, const LXPlugInFilter& filter,
                                                                   const LXPreselection& preselection,
                                                                   const LXKnownRecord& known);
    virtual std::optional<LXCandidateSlice> candidatesAfterIdentifier(const Value& query, const LXPlugInFilter& filter,
                                                                      const LXPreselection& preselection,
                                                                      const std::optional<std::string>& after,
                                                                      size_t rows, const LXKnownRecord& known);
    // candidatesMatchingQuery a stretch at a time: at most `rows` candidates whose registry position comes after
    // `after` (0: from the start), in registration order. A registry may hand out more at once where its indexes
    // cannot walk the pre-selection in that order; the default hands out every candidate in one stretch.
    virtual std::optional<LXRegistrationSlice> candidatesAfterRegistration(const Value& query,
                                                                           const LXPlugInFilter& filter,
                                                                           const LXPreselection& preselection,
                                                                           int64_t after, size_t rows,
                                                                           const LXKnownRecord& known);
    // A number that changes whenever a change to the registry's contents has been committed since it was last
    // read, so that a walk over several stretches can tell that they all saw one state; none when the registry
    // cannot say (a walk must then read everything at once).
    virtual std::optional<uint64_t> contentVersion() { return std::nullopt; }
};

}  // namespace bexil
