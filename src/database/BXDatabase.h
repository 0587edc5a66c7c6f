#pragma once

// BXDatabase is the daemon's view of the installed plug-ins. The application registry is the source of truth; the
// database caches the daemon's plug-in records (BXDPlugIn) by UUID, builds them lazily from the registry's records,
// owns the annotation store, asks the registry to register and unregister bundles and observes its install and
// uninstall events. The cache and the annotation store are touched only inside `_sync`; every public operation may
// be called from any thread that is not inside `_sync` (those marked REQUIRES are the exception).

#include <atomic>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "base/ActingAs.h"
#include "base/Error.h"
#include "base/SyncQueue.h"
#include "bexil/Protocol.h"
#include "bexil/Value.h"
#include "database/BXDatabaseDelegate.h"
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
    // Empties the whole cache when it holds more than `limit` records. REQUIRES: inside `_sync`.
    void purgeCachesToLimit(unsigned limit);

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
    // Merges `annotation` into the stored one (null removes it) and saves. Posts nothing: callers that change
    // annotations for a client call notifyAnnotationChange once when they are done.
    void setAnnotationForPlugIn(const Value& annotation, const BXDPlugIn& plugIn);
    // Sets the form's "annotations" to the plug-in's stored annotation, or to an empty dictionary.
    void addAnnotationForPlugInIn(const BXDPlugIn& plugIn, MutableDictionary& form);
    void notifyAnnotationChange();
    // Stores election 1 unless an election is already made. REQUIRES: inside `_sync`.
    void autoElect(const BXDPlugIn& plugIn);

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
    std::unordered_map<Uuid, std::shared_ptr<BXDPlugIn>> cache_;
};

}  // namespace bexil
