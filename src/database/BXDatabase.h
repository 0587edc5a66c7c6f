#pragma once

// BXDatabase is the daemon's view of the installed plug-ins. The application registry is the source of truth; the
// database caches the daemon's plug-in records (BXDPlugIn) by UUID, builds them lazily from the registry's records,
// owns the annotation store, asks the registry to register and unregister bundles and observes its install and
// uninstall events. The cache and the annotation store are touched only inside `_sync`; every public operation may
// be called from any thread that is not inside `_sync` (those marked REQUIRES are the exception).
//
// Writes that wait for the disk run on the database's writer queue, a serial queue with a thread of its own, so that
// nobody else waits for them: the annotation document is written there, outside `_sync`, and the daemon runs its
// registrations there. Changes reach memory first (what the next look-up sees) and the disk after, in order; a
// caller that must not answer before its change is durable continues from the writer.

#include <atomic>
#include <functional>
#include <memory>
#include <optional>
#include <shared_mutex>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "base/ActingAs.h"
#include "base/Error.h"
#include "base/EventLoop.h"
#include "base/SerialQueue.h"
#include "base/SyncQueue.h"
#include "bexil/Protocol.h"
#include "bexil/Value.h"
#include "database/BXDatabaseDelegate.h"
#include "platform/ledgerix/LXApplicationWorkspace.h"
#include "policy/BXAnnotationSource.h"

namespace bexil {

class BXDAnnotationStore;
class BXDPlugIn;
class LXApplicationWorkspace;
class LXBexilProxy;
class MutableDictionary;

class BXDatabase {
  public:
    // Default for the largest number of cached records before the cache is emptied.
    static constexpr unsigned kDefaultCacheLimit = 1000000;
    // Posted (without payload) after a client's annotation changes and after hold changes.
    static constexpr std::string_view kAnnotationChangeNotification = protocol::kAnnotationChangeNotification;
    // The annotation "election" key and the value automatic election stores.
    static constexpr std::string_view kElectionKey = protocol::annotation::kElection;
    static constexpr int64_t kAutoElection = 1;

    // Posts a named system notification; the default posts through the platform's notification folder.
    using NotificationPoster = std::function<void(std::string_view name)>;

    // A database over `workspace` (none: the registry's shared workspace in the default state directory) with the
    // annotation document at `databasePath` (none: the store's default). None when the registry or the annotation
    // store cannot be opened (logged). For tests and tools; the daemon builds its server instead.
    static std::unique_ptr<BXDatabase> create(std::optional<std::string> databasePath,
                                              std::shared_ptr<LXApplicationWorkspace> workspace = nullptr,
                                              NotificationPoster poster = nullptr);

    virtual ~BXDatabase();
    BXDatabase(const BXDatabase&) = delete;
    BXDatabase& operator=(const BXDatabase&) = delete;

    // The annotation document path given at construction (none: the store's default location).
    const std::optional<std::string>& databasePath() const { return databasePath_; }

    unsigned cacheLimit() const { return cacheLimit_.load(std::memory_order_relaxed); }
    void setCacheLimit(unsigned limit) { cacheLimit_.store(limit, std::memory_order_relaxed); }

    // Held weakly: the delegate (the server) owns the database, never the other way round.
    BXDatabaseDelegate* delegate() const { return delegate_.load(); }
    void setDelegate(BXDatabaseDelegate* delegate) { delegate_.store(delegate); }

    const std::shared_ptr<LXApplicationWorkspace>& workspace() const { return workspace_; }
    // REQUIRES: inside `_sync` (the store has no lock of its own).
    BXDAnnotationStore& annotations();
    SyncQueue& sync() { return _sync; }

    // ---- Records ----

    // The record of a registry record: the cached one, else a new one. None when no record can be built.
    std::shared_ptr<BXDPlugIn> plugInForProxy(const std::shared_ptr<const LXBexilProxy>& proxy);
    // Builds, auto-elects and caches a record (purging first when the cache is over its limit). REQUIRES: inside
    // `_sync`.
    std::shared_ptr<BXDPlugIn> createPlugInForProxy(const std::shared_ptr<const LXBexilProxy>& proxy);
    // Empties the whole cache when it holds more than `limit` records. REQUIRES: inside `_sync`. The cache is empty
    // on return; the records it held are released on the writer queue, kPurgeReleaseBatch per block and each block
    // queued behind the writes that came meanwhile, so that emptying a large cache stalls nobody (records still in
    // use elsewhere live on as before).
    void purgeCachesToLimit(unsigned limit);
    // Freeing a record takes a few microseconds; a batch stays near a millisecond.
    static constexpr size_t kPurgeReleaseBatch = 250;
    // Whether records of a purge are still waiting to be released (for benchmarks and diagnostics).
    bool releasingPurgedRecords() const { return purgesReleasing_.load() > 0; }

    std::shared_ptr<BXDPlugIn> findPlugIn(const Uuid& uuid);
    // The record of the plug-in bundle at `url` (a path); the registry is asked every time.
    std::shared_ptr<BXDPlugIn> findPlugInAtPath(std::string_view url);
    // The records of an application's plug-ins in the registry's order; none (not empty) when it has none.
    std::optional<std::vector<std::shared_ptr<BXDPlugIn>>> plugInsWithinApplication(std::string_view url);

    // ---- Discovery ----

    // The query key that lists the user elections a discovery wants.
    static constexpr std::string_view kUserElectionQueryKey = "RZUserElection";
    using PlugInSet = std::vector<std::shared_ptr<BXDPlugIn>>;

    // findPlugIns: the records of the plug-ins that the registry finds for `query` and whose user election is among
    // the query's "RZUserElection" values (all of them when there is none, or it is malformed). An empty query lists
    // every installed plug-in without election filtering. Records without bundle URL and plug-ins of placeholder
    // applications are skipped. No duplicates, in the registry's order; none when the registry gave nothing.
    // REQUIRES: not inside `_sync` (the election filter and the record look-ups enter it).
    std::optional<PlugInSet> findPlugIns(const Value& query);

    // One stretch of the paged discovery walk (see LXWalkSlice): the records findPlugIns would give for the
    // candidates, in the walk's order (identifier, then registration).
    struct PlugInSlice {
        PlugInSet plugIns;
        // The identifier of the last candidate walked; none when the stretch was empty.
        std::optional<std::string> last;
        bool ended = false;
    };
    // findPlugIns over at least `rows` candidates whose identifier sorts after `after` (from the start when none),
    // every candidate of the last identifier reached included. None when the registry gave nothing.
    // REQUIRES: not inside `_sync`.
    std::optional<PlugInSlice> findPlugInsAfterIdentifier(const Value& query, const std::optional<std::string>& after,
                                                          size_t rows);

    // One stretch of findPlugIns in the registry's order (see LXRegistrationSlice): the records, where the next
    // stretch starts, and whether this was the last.
    struct PlugInStretch {
        PlugInSet plugIns;
        int64_t last = 0;
        bool ended = false;
    };
    // findPlugIns over the candidates after registry position `after` (0: from the start), at most `rows` of them
    // where the registry can walk them in its order (it may give more). None when the registry gave nothing.
    // REQUIRES: not inside `_sync`.
    std::optional<PlugInStretch> findPlugInsAfterRegistration(const Value& query, int64_t after, size_t rows);
    // A number that moves with every change of an annotation, as soon as it is made (before it is saved).
    // REQUIRES: not inside `_sync`.
    uint64_t annotationGeneration();
    // A number that moves whenever a change to the registry has been committed (see
    // LXApplicationWorkspace::contentVersion); none when the registry cannot say.
    std::optional<uint64_t> registryVersion();

    // findPlugIns narrowed to the candidates whose identifier is `identifier`, in the registry's order (a standing
    // query recomputes one identifier at a time). None when the registry gave nothing.
    // REQUIRES: not inside `_sync`.
    std::optional<PlugInSet> findPlugInsWithIdentifier(const Value& query, const std::string& identifier);

    // One wanted election value of a query: "=x" is "x" (possibly empty), an alphanumeric start is the whole
    // string; none for anything else (not a string, empty, another first character).
    static std::optional<std::string> normalizeElection(const Value& value);
    // The wanted list of `query`'s "RZUserElection" (a string or an array of them), or none when it is absent, of
    // another type, or any element fails normalisation: election filtering is then off.
    static std::optional<std::vector<std::string>> wantedElections(const Value& query);

    // Registers / unregisters the plug-in bundle at `url`; an error of code 2 when the registry refuses. The bundle
    // is read with the rights of `readAs` when given.
    std::optional<Error> addPlugIn(std::string_view url, std::optional<UserIdentity> readAs = std::nullopt);
    std::optional<Error> removePlugIn(std::string_view url);

    // The number of cached records (for tests and diagnostics).
    size_t cachedCount();

    // ---- Annotations ----

    // The annotations as the match rules read them (the election), through `_sync`. Lives as long as the database.
    const BXAnnotationSource& annotationSource() const { return *annotationSource_; }

    // The stored annotation of the plug-in (a dictionary), or null.
    Value annotationForPlugIn(const BXDPlugIn& plugIn);
    // Merges `annotation` into the stored one (null removes it) and saves, returning once the save is done (a failed
    // save is logged and the change stays in memory). Posts nothing: callers that change annotations for a client
    // call notifyAnnotationChange once when they are done.
    void setAnnotationForPlugIn(const Value& annotation, const BXDPlugIn& plugIn);
    // The merge of setAnnotationForPlugIn, in memory only: every reader sees it at once; saveAnnotations writes it.
    void changeAnnotationForPlugIn(const Value& annotation, const BXDPlugIn& plugIn);
    // Writes the annotation document unless it already holds every change made so far; several changes made
    // while an earlier write ran thus share the next one. A failure is logged and leaves the changes in memory.
    // REQUIRES: on the writer queue (each write follows the one before).
    void saveAnnotations();
    // Sets the form's "annotations" to the plug-in's stored annotation, or to an empty dictionary.
    void addAnnotationForPlugInIn(const BXDPlugIn& plugIn, MutableDictionary& form);
    void notifyAnnotationChange();
    // Stores election 1 unless an election is already made. REQUIRES: inside `_sync`.
    void autoElect(const BXDPlugIn& plugIn);

    // ---- Writer ----

    // The queue of the writes that wait for the disk (see the top of this file). Blocks on it may enter `_sync`.
    const SerialQueue& writer() const { return writer_; }
    // Returns once every block queued on the writer before the call has run and every purged record is released.
    // REQUIRES: not on the writer.
    void waitForWriter();

    // ---- Registry events ----

    void pluginsDidInstall(const std::vector<std::shared_ptr<const LXBexilProxy>>& plugIns);
    // Drops the records from the cache inside `_sync`, then tells the delegate outside it.
    void pluginsWillUninstall(const std::vector<std::shared_ptr<const LXBexilProxy>>& plugIns);

  protected:
    // initWithDatabase: remembers the path; initWithDatabase() then opens the registry and the store.
    explicit BXDatabase(std::optional<std::string> databasePath,
                        std::shared_ptr<LXApplicationWorkspace> workspace = nullptr,
                        NotificationPoster poster = nullptr);
    // False when the registry or the annotation store cannot be opened (logged); the object is then unusable.
    bool initWithDatabase();

  private:
    class Observer;
    class AnnotationReader;
    using RecordMap = std::unordered_map<Uuid, std::shared_ptr<BXDPlugIn>>;

    // Releases a batch of `records` on the writer and queues the next batch behind whatever came meanwhile.
    void releaseOnWriter(std::shared_ptr<RecordMap> records);

    // The records of the registry's candidates, without duplicates, skipping those without bundle URL and those of
    // placeholder applications. REQUIRES: not inside `_sync`.
    PlugInSet recordsForProxies(const LXProxyList& proxies);
    // The same for candidates some of which are UUIDs only, taken from the cache; none when one of those is no
    // longer cached (its plug-in changed, or the cache was purged, since the query).
    std::optional<PlugInSet> recordsForCandidates(const LXCandidateList& candidates);
    // The records of what `ask` hands back when told which records the cache holds, so that the registry reads only
    // the others. When one of those left the cache before it was looked up, `ask` is asked again told nothing, and
    // every record comes from what it reads then; none when the registry cannot be read.
    std::optional<PlugInSet> recordsAsking(
        const std::function<std::optional<LXCandidateList>(const LXKnownRecord& known)>& ask);
    // Whether the cache holds a record for the UUID, callable outside `_sync` (while the registry holds its lock).
    bool cacheHolds(const Uuid& uuid) const;
    // The registry's pre-selection and election filter for a query.
    LXPreselection preselectionFor(const Value& query) const;
    LXPlugInFilter filterFor(const Value& query);

    // The registry's filter for a wanted election list: reads each candidate's election inside `_sync`.
    bool electionFilter(const std::vector<std::string>& wanted, std::string_view identifier,
                        const std::optional<Value>& entitlements);

    std::optional<std::string> databasePath_;
    std::atomic<unsigned> cacheLimit_{kDefaultCacheLimit};
    std::atomic<BXDatabaseDelegate*> delegate_{nullptr};
    std::shared_ptr<LXApplicationWorkspace> workspace_;
    std::unique_ptr<BXDAnnotationStore> annotations_;
    NotificationPoster poster_;
    // The registry holds its observers weakly; this forwarder lives exactly as long as the database.
    std::shared_ptr<Observer> observer_;
    std::unique_ptr<BXAnnotationSource> annotationSource_;
    SyncQueue _sync{"BXDatabase"};
    RecordMap cache_;
    // Changes to cache_'s entries take this as well as `_sync`, so that cacheHolds() can read it without `_sync`:
    // the registry asks while holding its lock, which a thread inside `_sync` may be waiting for. Held only around
    // the change itself.
    mutable std::shared_mutex cacheEntries_;
    std::atomic<unsigned> purgesReleasing_{0};
    // Last, so that the writer's thread has stopped before anything its blocks use goes away.
    EventLoop writerLoop_{1};
    SerialQueue writer_{"writer", writerLoop_};
};

}  // namespace bexil
