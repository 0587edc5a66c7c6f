#pragma once

// What bxd and its clients agree on, defined once: the protocol version, the request names, the keys of requests
// and replies, the error codes, the flag bits, and the names of the service, the notification, the entitlement and
// the preference domain. Plain constants with no state, usable from any thread. It depends on the standard library
// only, so the daemon, the client library, the tool and applications (it is installed) all read the same table;
// docs/protocol.md describes each entry and a test holds the two together.
//
// Adding a request means: its entry in kRequests, its handler in the daemon's handler table (which does not build
// until it has one), its test, and at most a subcommand of the tool.

#include <array>
#include <cstdint>
#include <optional>
#include <string_view>

namespace bexil::protocol {

// The version every request carries under key::kVersion. Requests of the accepted older version are served alike;
// only the discovery result is encoded for the current version alone.
inline constexpr uint64_t kCurrentVersion = 3;
inline constexpr uint64_t kAcceptedOldVersion = 2;

// The name under which bxd offers its service (the socket's name, see docs/protocol.md).
inline constexpr std::string_view kServiceName = "com.quorvel.bexil.bxd";
// Posted each time the stored annotations or the set of holds change.
inline constexpr std::string_view kAnnotationChangeNotification = "com.quorvel.bexil.annotation-change";
// Lets a client remove plug-ins and discover every plug-in (discover::kAll).
inline constexpr std::string_view kManagerEntitlement = "com.quorvel.private.bexil.manager";
// The preference domain that bxd reads (the global exclusions, docs/preferences.md).
inline constexpr std::string_view kUserPrefsDomain = "com.quorvel.bexil.userprefs";

// The requests, in the order the daemon compares their names (byte for byte; the first match wins).
// "launch", "holds", "status", "changes", "explain", "watch" and "unwatch" are extensions of ours: on Linux nobody
// but bxd starts plug-ins, administrators want to see what holds plug-ins out of use and what the daemon is doing, a
// client that keeps a copy of a discovery learns what changed since it was made instead of discovering again, a
// discovery that returns nothing should be able to say why, and an application that shows plug-ins wants to hear of
// changes rather than poll (docs/protocol.md).
enum class Request {
    Add,
    Remove,
    Bulk,
    Match,
    Ready,
    Access,
    Annotate,
    BulkAnnotate,
    Lock,
    Launch,
    Holds,
    Status,
    Changes,
    Explain,
    Watch,
    Unwatch
};

struct RequestInfo {
    Request request;
    // The value of key::kRequest.
    std::string_view name;
    // One line on what it does.
    std::string_view summary;
};

inline constexpr std::array<RequestInfo, 16> kRequests{{
    {Request::Add, "add", "register the plug-in bundles at paths"},
    {Request::Remove, "remove", "unregister the plug-ins at paths (manager only)"},
    {Request::Bulk, "bulk", "bulk registration options (none supported)"},
    {Request::Match, "match", "discover the plug-ins that match rules"},
    {Request::Ready, "ready", "make plug-ins ready for the calling host"},
    {Request::Access, "access", "read-only access tokens for plug-ins"},
    {Request::Annotate, "annotate", "set the annotations of plug-ins"},
    {Request::BulkAnnotate, "bulk-annotate", "set the annotations of many plug-ins by UUID text"},
    {Request::Lock, "lock", "place or release a hold on plug-ins"},
    {Request::Launch, "launch", "start a plug-in made ready for the calling host, with a socket to it"},
    {Request::Holds, "holds", "list the holds in force (manager only)"},
    {Request::Status, "status", "what bxd is doing now: uptime, connections, requests served, cache, holds"},
    {Request::Changes, "changes", "the plug-ins added, removed and changed since a generation"},
    {Request::Explain, "explain", "say, step by step, why discovery with rules finds a plug-in or not"},
    {Request::Watch, "watch", "discover like match, then hear of every change of the result on this connection"},
    {Request::Unwatch, "unwatch", "cancel a watch of this connection"},
}};

constexpr std::string_view nameOf(Request request) {
    for (const RequestInfo& info : kRequests)
        if (info.request == request) return info.name;
    return {};
}

// The request whose name is exactly `name`, if any.
constexpr std::optional<Request> requestNamed(std::string_view name) {
    for (const RequestInfo& info : kRequests)
        if (info.name == name) return info.request;
    return std::nullopt;
}

// Keys of request and reply dictionaries.
namespace key {
inline constexpr std::string_view kRequest = "request";          // string, a name of kRequests
inline constexpr std::string_view kVersion = "version";          // uint64
inline constexpr std::string_view kPaths = "paths";              // array of absolute path strings
inline constexpr std::string_view kUuids = "uuids";              // array of UUIDs
inline constexpr std::string_view kFlags = "flags";              // uint64
inline constexpr std::string_view kRules = "rules";              // dictionary of match rules
inline constexpr std::string_view kAnnotations = "annotations";  // dictionary
inline constexpr std::string_view kErrorCode = "errorcode";      // uint64, in a failed reply
inline constexpr std::string_view kError = "error";              // string, in a failed reply
inline constexpr std::string_view kMatches = "matches";          // array of plug-in forms, in a "match" reply
inline constexpr std::string_view kConflicts = "conflicts";      // array, in a "lock" reply refused as busy
inline constexpr std::string_view kExtensions = "extensions";    // array of tokens, in an "access" reply
inline constexpr std::string_view kPid = "pid";                  // uint64, the instance a "launch" started
inline constexpr std::string_view kBundleInfo = "bundleInfo";    // dictionary, what a "launch" started
inline constexpr std::string_view kHolds = "holds";              // array of hold descriptions, in a "holds" reply
// In a "status" reply:
inline constexpr std::string_view kUptime = "uptime";                // uint64, seconds since bxd started
inline constexpr std::string_view kConnections = "connections";      // uint64, client connections open now
inline constexpr std::string_view kServed = "served";                // dictionary, request name -> uint64 count
inline constexpr std::string_view kCachedRecords = "cachedRecords";  // uint64, plug-in records in the cache
inline constexpr std::string_view kCacheLimit = "cacheLimit";        // uint64, records past which it is purged
inline constexpr std::string_view kHoldCount = "holdCount";          // uint64, holds in force
inline constexpr std::string_view kRegistered = "registered";        // uint64, plug-ins in the registry
inline constexpr std::string_view kWatchCount = "watchCount";        // uint64, watches in force
// Paged discovery, an extension of ours: in a "match" request, the most forms a page may carry (uint64, see
// page::), and the continuation of the previous page (data); in a reply, the continuation of this page (data,
// absent on the last page).
inline constexpr std::string_view kPageSize = "pagesize";
inline constexpr std::string_view kContinuation = "continuation";
// Change generations, an extension of ours (docs/generations.md): in a "match" reply, the generation it was computed
// at (uint64); in a "changes" request, the generation to answer from, and in its reply, the current one.
inline constexpr std::string_view kGeneration = "generation";
// In a "changes" reply: one entry per plug-in that changed (array of dictionaries, see change::), and whether an
// exclusions change lies in the answered span, so that every plug-in may have changed (bool, absent when not).
inline constexpr std::string_view kChanges = "changes";
inline constexpr std::string_view kResync = "resync";
// "explain", an extension of ours: in the request, the plug-in asked about (an identifier, a UUID, UUID text or an
// absolute path); in the reply, one explanation per candidate (see explain::), and when there is none, why.
inline constexpr std::string_view kPlugIn = "plugin";
inline constexpr std::string_view kExplanation = "explanation";
inline constexpr std::string_view kNotFound = "notFound";
// Standing queries, an extension of ours: the watch's id (uint64) in a "watch" reply, an "unwatch" request and every
// message of the watch; "generation" (above) the generation a result or a change belongs to; in a watch's messages,
// what kind of message it is (string, watch::kUpdate or watch::kResync) and the forms added (array of forms), the UUIDs
// removed (array of UUID texts) and the forms changed (array of forms).
inline constexpr std::string_view kWatch = "watch";
inline constexpr std::string_view kEvent = "event";
inline constexpr std::string_view kAdded = "added";
inline constexpr std::string_view kRemoved = "removed";
inline constexpr std::string_view kChanged = "changed";
inline constexpr std::array kList{kRequest,       kVersion,    kPaths,     kUuids,      kFlags,       kRules,
                                  kAnnotations,   kErrorCode,  kError,     kMatches,    kConflicts,   kExtensions,
                                  kPid,           kBundleInfo, kHolds,     kUptime,     kConnections, kServed,
                                  kCachedRecords, kCacheLimit, kHoldCount, kRegistered, kPageSize,    kContinuation,
                                  kGeneration,    kChanges,    kResync,    kPlugIn,     kExplanation, kNotFound,
                                  kWatch,         kEvent,      kAdded,     kRemoved,    kChanged,     kWatchCount};
}  // namespace key

// Entries of one element of a "changes" reply's key::kChanges (an extension of ours).
namespace change {
inline constexpr std::string_view kUuid = "uuid";              // UUID of the plug-in
inline constexpr std::string_view kEffect = "effect";          // string, one of the effects below
inline constexpr std::string_view kKinds = "kinds";            // array of kind strings, for kChanged only
inline constexpr std::string_view kGeneration = "generation";  // uint64, the plug-in's latest change
inline constexpr std::string_view kIdentifier = "identifier";  // string, absent for a removed plug-in
inline constexpr std::array kList{kUuid, kEffect, kKinds, kGeneration, kIdentifier};
// Effects: present now and not at the generation asked from; there then and gone now; there both times.
inline constexpr std::string_view kAdded = "added";
inline constexpr std::string_view kRemoved = "removed";
inline constexpr std::string_view kChanged = "changed";
// Kinds of change a "changed" entry went through.
inline constexpr std::string_view kRegistration = "registration";
inline constexpr std::string_view kUnregistration = "unregistration";
inline constexpr std::string_view kAnnotation = "annotation";
inline constexpr std::string_view kHold = "hold";
inline constexpr std::string_view kRelease = "release";
inline constexpr std::array kKindList{kRegistration, kUnregistration, kAnnotation, kHold, kRelease};
}  // namespace change

// Keys of an annotation (the value of key::kAnnotations in "annotate", per plug-in in "bulk-annotate").
namespace annotation {
inline constexpr std::string_view kElection = "election";    // number: the user's election (docs/annotations.md)
inline constexpr std::string_view kExtension = "extension";  // dictionary, stored for the plug-in as it is
inline constexpr std::array kList{kElection, kExtension};
}  // namespace annotation

// Entries of a plug-in's form, the dictionary a "match" reply carries per plug-in under key::kMatches.
namespace form {
inline constexpr std::string_view kHubProtocolVersion = "hubProtocolVersion";
inline constexpr std::string_view kPath = "path";
inline constexpr std::string_view kSystemResident = "systemResident";
inline constexpr std::string_view kIdentifier = "identifier";
inline constexpr std::string_view kOriginalIdentifier = "original-identifier";
inline constexpr std::string_view kVersion = "version";
inline constexpr std::string_view kBundleInfo = "bundleInfo";
inline constexpr std::string_view kInfo = "info";
inline constexpr std::string_view kUuid = "uuid";
inline constexpr std::string_view kLastModified = "lastmodified";
inline constexpr std::string_view kAnnotations = "annotations";
inline constexpr std::string_view kEntitlements = "entitlements";
inline constexpr std::string_view kContainingPath = "containingPath";
inline constexpr std::string_view kLocalizedContainingDisplayName = "localizedContainingDisplayName";
inline constexpr std::string_view kLocalizedDisplayName = "localizedDisplayName";
inline constexpr std::string_view kLocalizedShortName = "localizedShortName";
inline constexpr std::string_view kHash = "hash";
inline constexpr std::string_view kRequirement = "requirement";
inline constexpr std::string_view kExtensions = "extensions";  // resource name -> read-only access token
inline constexpr std::string_view kOverrider = "overrider";    // UUID text of the plug-in that replaces this one
inline constexpr std::string_view kOverriding = "overriding";  // identifier of the plug-in this one replaces
inline constexpr std::array kList{kHubProtocolVersion,
                                  kPath,
                                  kSystemResident,
                                  kIdentifier,
                                  kOriginalIdentifier,
                                  kVersion,
                                  kBundleInfo,
                                  kInfo,
                                  kUuid,
                                  kLastModified,
                                  kAnnotations,
                                  kEntitlements,
                                  kContainingPath,
                                  kLocalizedContainingDisplayName,
                                  kLocalizedDisplayName,
                                  kLocalizedShortName,
                                  kHash,
                                  kRequirement,
                                  kExtensions,
                                  kOverrider,
                                  kOverriding};
}  // namespace form

// The codes of failed replies and of the errors the system makes (domain "Bexil"); 0 is success.
enum class ErrorCode : int {
    // The registry refused a registration change, or a plug-in named by UUID text is unknown.
    RegistryRefused = 2,
    // A malformed request...
    InvalidRequest = 4,
    // ... or, with the same code, an operation that failed inside the daemon.
    OperationFailed = 4,
    // An interface specification text is malformed.
    BadInterfaceSpec = 6,
    // The protocol version, or a stored document's version, is not the expected one.
    VersionMismatch = 7,
    // A bad path, or nothing at the path.
    BadPath = 9,
    // The caller is not allowed.
    NotAllowed = 11,
    // The plug-in's configuration is invalid or unsupported.
    InvalidConfiguration = 12,
    // Plug-ins are busy.
    PlugInsBusy = 14,
    // A bulk annotation entry is malformed.
    BadBulkAnnotation = 18,
    // A discovery continuation that this run of bxd did not issue to this connection for this request: malformed,
    // altered, another client's, or from before bxd restarted (an extension of ours).
    BadContinuation = 19,
    // A "changes" request for a generation older than the changes bxd keeps, or from before it started: discover
    // again with "match" (an extension of ours).
    GenerationTooOld = 20,
    // A "watch" refused because the connection, or bxd as a whole, keeps as many watches as it may (watch::; an
    // extension of ours).
    WatchLimit = 21,
};

// Every code once (OperationFailed shares InvalidRequest's).
inline constexpr std::array<ErrorCode, 12> kErrorCodes{
    ErrorCode::RegistryRefused,      ErrorCode::InvalidRequest,   ErrorCode::BadInterfaceSpec,
    ErrorCode::VersionMismatch,      ErrorCode::BadPath,          ErrorCode::NotAllowed,
    ErrorCode::InvalidConfiguration, ErrorCode::PlugInsBusy,      ErrorCode::BadBulkAnnotation,
    ErrorCode::BadContinuation,      ErrorCode::GenerationTooOld, ErrorCode::WatchLimit};

constexpr int codeOf(ErrorCode code) { return static_cast<int>(code); }

// Flag bits of "match" (key::kFlags).
namespace discover {
inline constexpr uint64_t kAllVersions = 0x1;   // every version of an identifier, not only the best one
inline constexpr uint64_t kAllInstances = 0x4;  // with kAllVersions: also copies of the same identifier and version
inline constexpr uint64_t kSystemOnly = 0x8;    // only plug-ins on the system volume
inline constexpr uint64_t kAll = 0x200;         // skip visibility, holds and host policy (manager, not sandboxed, only)
inline constexpr std::array kBits{kAllVersions, kAllInstances, kSystemOnly, kAll};
}  // namespace discover

// Bounds of paged discovery (key::kPageSize).
namespace page {
// A larger page size is served as this one: a page is one reply frame, and the daemon serves other clients only
// between pages.
inline constexpr uint64_t kMaxForms = 10000;
// A page also ends before its forms would take more than this many bytes (half a frame), whatever the page size.
inline constexpr uint64_t kMaxBytes = 8u << 20;
// The page size the client library and the tool ask for.
inline constexpr uint64_t kDefaultForms = 256;
}  // namespace page

// The explanation of one candidate in an "explain" reply (key::kExplanation): the plug-in, its outcome and the
// steps of discovery it went through, in order, up to the first it failed. docs/protocol.md says what each holds.
namespace explain {
// Entries of one candidate's explanation, beside form::kUuid, form::kIdentifier, form::kVersion and form::kPath.
inline constexpr std::string_view kOutcome = "outcome";
inline constexpr std::string_view kSteps = "steps";
// Outcomes.
inline constexpr std::string_view kMatched = "matched";    // "match" with these rules and flags returns it
inline constexpr std::string_view kRejected = "rejected";  // a step before the duplicates left it out
inline constexpr std::string_view kLost = "lost";          // another plug-in of its identifier was preferred
// Entries of one step.
inline constexpr std::string_view kStep = "step";
inline constexpr std::string_view kPassed = "passed";
inline constexpr std::string_view kSkipped = "skipped";  // bool: the flags skip this step (discover all)
inline constexpr std::string_view kReason = "reason";    // string: why it failed, in words
// The steps, in the order discovery takes them.
inline constexpr std::string_view kRegistry = "registry";
inline constexpr std::string_view kResidence = "residence";
inline constexpr std::string_view kDedication = "dedication";
inline constexpr std::string_view kHold = "hold";
inline constexpr std::string_view kRulesStep = "rules";
inline constexpr std::string_view kExclusions = "exclusions";
inline constexpr std::string_view kHostPolicy = "host-policy";
inline constexpr std::string_view kExport = "export";
inline constexpr std::string_view kDuplicates = "duplicates";
inline constexpr std::array kStepNames{kRegistry,   kResidence,  kDedication, kHold,      kRulesStep,
                                       kExclusions, kHostPolicy, kExport,     kDuplicates};
// Details of the steps.
inline constexpr std::string_view kBundleOnDisk = "bundleOnDisk";                    // registry: bool
inline constexpr std::string_view kSystemVolume = "systemVolume";                    // residence: bool
inline constexpr std::string_view kContainingApplication = "containingApplication";  // residence: path
inline constexpr std::string_view kDedicated = "dedicated";                          // dedication: bool
inline constexpr std::string_view kHost = "host";          // dedication: the caller's bundle path
inline constexpr std::string_view kHoldUuid = "holdUuid";  // hold: the hold's UUID
inline constexpr std::string_view kPlacedBy = "placedBy";  // hold: {"pid", "executable"} of who placed it
inline constexpr std::string_view kExecutable = "executable";
inline constexpr std::string_view kFindings = "findings";  // rules, exclusions: per rule evaluated, in order
inline constexpr std::string_view kKey = "key";
inline constexpr std::string_view kValue = "value";      // the plug-in's value for the key; absent when it has none
inline constexpr std::string_view kPattern = "pattern";  // the pattern as the rule set holds it
inline constexpr std::string_view kOperator = "operator";
inline constexpr std::string_view kOperand = "operand";
inline constexpr std::string_view kExclusion = "exclusion";  // exclusions: the index of the entry that matched
inline constexpr std::string_view kExclusionRules = "exclusionRules";  // exclusions: that entry's rule set
inline constexpr std::string_view kCount = "count";                    // exclusions: how many were tried
inline constexpr std::string_view kWinner = "winner";                  // duplicates: UUID text of who won
inline constexpr std::string_view kTieBreak = "tieBreak";              // duplicates: by what it won
inline constexpr std::string_view kReplacedBy = "replacedBy";  // duplicates: UUID text of the plug-in replacing it
// Tie-breaks.
inline constexpr std::string_view kHigherVersion = "higher version";
inline constexpr std::string_view kSystemVolumeWins = "system volume";
inline constexpr std::string_view kLaterRegistration = "later registration";
inline constexpr std::string_view kFoundFirst = "found first";
// What a caller is told about an identity with no candidate to explain.
inline constexpr std::string_view kNotRegistered = "not registered";
inline constexpr std::string_view kNotRegisteredOrHidden = "not registered, or not visible to you";
inline constexpr std::string_view kNoBundle = "no bundle at this path";
inline constexpr std::array kList{kOutcome,
                                  kSteps,
                                  kStep,
                                  kPassed,
                                  kSkipped,
                                  kReason,
                                  kBundleOnDisk,
                                  kSystemVolume,
                                  kContainingApplication,
                                  kDedicated,
                                  kHost,
                                  kHoldUuid,
                                  kPlacedBy,
                                  kExecutable,
                                  kFindings,
                                  kKey,
                                  kValue,
                                  kPattern,
                                  kOperator,
                                  kOperand,
                                  kExclusion,
                                  kExclusionRules,
                                  kCount,
                                  kWinner,
                                  kTieBreak,
                                  kReplacedBy};
}  // namespace explain
// Standing queries ("watch", "unwatch"): the values of key::kEvent in a watch's messages, and the limits.
namespace watch {
// A change of the result: key::kAdded, key::kRemoved, key::kChanged, at key::kGeneration.
inline constexpr std::string_view kUpdate = "update";
// The watcher fell behind: the messages it missed are not sent, the watch has ended, and its result must be
// fetched afresh (the client library does that on its own).
inline constexpr std::string_view kResync = "resync";
// The most watches one connection may keep, and all connections together.
inline constexpr uint64_t kMaxPerClient = 64;
inline constexpr uint64_t kMaxTotal = 4096;
// The bytes that may wait unwritten towards a watcher: a watch message that finds more ends the watch with a resync.
inline constexpr uint64_t kMaxQueuedBytes = 1u << 20;
}  // namespace watch

// Flag bits of "lock" (key::kFlags).
namespace hold {
inline constexpr uint64_t kPlugInPaths = 0x1;  // the paths name plug-ins, not applications
inline constexpr uint64_t kRefuseBusy = 0x2;   // refuse with ErrorCode::PlugInsBusy when a plug-in is in use
inline constexpr uint64_t kTerminate = 0x4;    // end the held plug-ins' running instances before answering
inline constexpr std::array kBits{kPlugInPaths, kRefuseBusy, kTerminate};
}  // namespace hold

}  // namespace bexil::protocol
