#pragma once

// LedgerixWorkspace is the application registry over one SQLite database in the state directory (see
// docs/ledgerix.md for the file, its schema and what survives a crash). It owns two handles on the database, one for
// changes and one for look-ups, each serialised by a mutex of its own that is never held while an observer or a
// query filter runs. Records are read
// one row at a time when asked for; opening a large registry reads nothing but the schema.

#include <filesystem>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "platform/ledgerix/LXApplicationWorkspace.h"

struct sqlite3;
struct sqlite3_stmt;

namespace bexil {

class LedgerixWorkspace final : public LXApplicationWorkspace, public std::enable_shared_from_this<LedgerixWorkspace> {
  public:
    static constexpr int kSchemaVersion = 3;
    static constexpr std::string_view kDatabaseFileName = "registry.sqlite3";
    static constexpr std::string_view kContainersDirectoryName = "containers";

    // How far a committed change is guaranteed to survive.
    enum class Durability {
        // A change that returned survives a crash of the process and of the machine (the log is synced at commit).
        Full,
        // A change that returned survives a crash of the process; a crash of the machine may lose the last ones,
        // never consistency. For bulk loading and measurements.
        Process,
    };

    struct Options {
        // Where the database and the data containers live.
        std::filesystem::path stateDirectory;
        // The directory that stands for "/" when deciding whether a bundle lies on the system volume (under
        // "<root>/System/"). Only tests change it, so that they never need a real /System.
        std::filesystem::path rootDirectory = "/";
        Durability durability = Durability::Full;
        // The SQLite VFS the store's files are opened through; empty for the default. Tests name one that fails
        // reads, writes or syncs on demand, to show what the registry does when its storage fails.
        std::string storeVfs;
    };

    // Opens (creating or migrating) the registry. A damaged database is moved aside and an empty one started (logged);
    // a database of a newer schema, or a state directory that cannot be made, is an error.
    static Result<std::shared_ptr<LedgerixWorkspace>> open(Options options);
    // $BX_STATE_DIR, else /var/lib/bexil for root, else $XDG_STATE_HOME/bexil ($HOME/.local/state/bexil).
    static std::filesystem::path defaultStateDirectory();

    ~LedgerixWorkspace() override;
    LedgerixWorkspace(const LedgerixWorkspace&) = delete;
    LedgerixWorkspace& operator=(const LedgerixWorkspace&) = delete;

    void addObserver(std::weak_ptr<LXApplicationWorkspaceObserverProtocol> observer) override;
    void removeObserver(const LXApplicationWorkspaceObserverProtocol* observer) override;
    using LXApplicationWorkspace::registerPlugin;
    // Registers the bundle at `url`, reading it from disk as `readAs` when given (see ActingAs).
    Result<std::shared_ptr<const LXBexilProxy>> registerPlugin(std::string_view url,
                                                               std::optional<UserIdentity> readAs) override;
    std::optional<Error> unregisterPlugin(std::string_view url) override;
    void LXClearSchemaCaches() override;
    std::shared_ptr<const LXBexilProxy> plugInProxyForUUID(const Uuid& uuid) override;
    std::shared_ptr<const LXBexilProxy> plugInProxyForURL(std::string_view url) override;
    std::shared_ptr<const LXApplicationProxy> applicationProxyForBundleURL(std::string_view url) override;
    std::optional<LXProxyList> installedPlugins() override;
    std::optional<LXProxyList> pluginsMatchingQueryApplyFilter(const Value& query, const LXPlugInFilter& filter,
                                                               const LXPreselection& preselection = {}) override;
    std::optional<LXWalkSlice> pluginsMatchingQueryAfterIdentifier(const Value& query, const LXPlugInFilter& filter,
                                                                   const LXPreselection& preselection,
                                                                   const std::optional<std::string>& after,
                                                                   size_t rows) override;
    std::optional<LXCandidateList> installedCandidates(const LXKnownRecord& known) override;
    std::optional<LXCandidateList> candidatesMatchingQuery(const Value& query, const LXPlugInFilter& filter,
                                                           const LXPreselection& preselection,
                                                           const LXKnownRecord& known) override;
    std::optional<LXCandidateSlice> candidatesAfterIdentifier(const Value& query, const LXPlugInFilter& filter,
                                                              const LXPreselection& preselection,
                                                              const std::optional<std::string>& after, size_t rows,
                                                              const LXKnownRecord& known) override;
    std::optional<LXRegistrationSlice> candidatesAfterRegistration(const Value& query, const LXPlugInFilter& filter,
                                                                   const LXPreselection& preselection, int64_t after,
                                                                   size_t rows, const LXKnownRecord& known) override;
    // SQLite's data version of the look-up connection, which moves with every commit of the change connection.
    std::optional<uint64_t> contentVersion() override;

    const std::filesystem::path& databasePath() const { return databasePath_; }
    // Runs the store's full integrity check and decodes every stored dictionary; the first problem found, or none.
    std::optional<Error> checkIntegrity();
    // The number of registered plug-ins; none when the store cannot be read.
    std::optional<size_t> plugInCount() override;

    // Use open(); public only for make_shared.
    struct Private;
    LedgerixWorkspace(Options options, sqlite3* db, sqlite3* lookupDb, const Private&);
    // The columns of one stored record; defined and used only by the implementation.
    struct Row;

  private:
    class Statement;

    // One SQLite connection with the mutex that serialises its use and its cache of prepared statements.
    struct Connection {
        std::mutex mutex;
        sqlite3* db = nullptr;
        std::vector<std::shared_ptr<Statement>> statements;
    };

    // The error of a failed store operation (logged); damage it reveals marks the file for a full check at next open.
    Error failure(Connection& connection, std::string_view what);
    // REQUIRES: the connection's mutex held, for every member whose name ends in Locked, for statement() and
    // failure().
    std::shared_ptr<Statement> statement(Connection& connection, const std::string& sql);
    // The order the rows are read in unless a caller says otherwise; put by the reader, not by SQLite.
    static constexpr std::string_view kRegistrationOrder = " ORDER BY p.id";
    // The rows that `where` selects, in registration order unless `order` says otherwise (an ORDER BY clause and
    // anything after it, such as a LIMIT that `integerArgument` binds). Rows that `known` says the caller holds are
    // read only in part (Row::held). `through`, when given, names the index SQLite must read the plug-ins through.
    // `extent`, when given, counts the rows read, kept or not, and keeps the position of the last.
    struct Extent {
        size_t rows = 0;
        int64_t last = 0;
    };
    std::optional<std::vector<Row>> selectRowsLocked(Connection& connection, std::string_view where,
                                                     const std::vector<std::string>& arguments,
                                                     std::optional<int64_t> integerArgument,
                                                     std::string_view order = kRegistrationOrder,
                                                     const LXKnownRecord* known = nullptr,
                                                     std::string_view through = {}, Extent* extent = nullptr);
    // On the look-up connection.
    std::optional<std::vector<Row>> selectRows(std::string_view where, const std::vector<std::string>& arguments,
                                               std::optional<int64_t> integerArgument,
                                               std::string_view order = kRegistrationOrder,
                                               const LXKnownRecord* known = nullptr);
    // The record at exactly this path; none when there is none or the store failed (then *failed is set).
    std::optional<Row> rowAtPathLocked(Connection& connection, const std::string& path, bool* failed);
    std::optional<Error> commitLocked(const Row& row, const Uuid& uuid, double registered,
                                      std::optional<int64_t> replacedApplication);
    std::optional<Error> dropApplicationIfEmptyLocked(int64_t applicationId);

    // The bundle at the URL as it would be stored, or why it cannot be registered.
    Result<Row> readBundle(std::string_view url);
    static std::optional<Error> makeContainer(const std::string& path);
    // The paths under which a URL may be registered: its lexical form, then its real path when that differs.
    static std::vector<std::string> candidatePaths(std::string_view url);

    std::shared_ptr<const LXBexilProxy> proxyFromRow(const Row& row);
    LXProxyList proxiesFromRows(const std::vector<Row>& rows);
    // The candidates of a query's rows that pass the filter (a held row is a UUID only; the filter never sees one).
    LXCandidateList candidatesFromRows(const std::vector<Row>& rows, const LXPlugInFilter& filter);
    std::shared_ptr<const LXApplicationProxy> applicationFromRow(const Row& row);
    LXProxyList plugInsOfApplication(int64_t applicationId);
    enum class Change { Installed, Uninstalled };
    void notifyObservers(Change change, const LXProxyList& plugIns);

    const Options options_;
    const std::filesystem::path databasePath_;
    // Changes go through one connection and look-ups through another, so that a look-up never waits while a
    // commit syncs the log: in write-ahead-log mode a reader sees the last commit without taking the writer's lock.
    Connection store_;
    Connection lookups_;
    // Bundles whose real path begins with this lie on the system volume ("/System/" unless tests move the root).
    std::string systemPrefix_;
    std::mutex observersMutex_;
    std::vector<std::weak_ptr<LXApplicationWorkspaceObserverProtocol>> observers_;
    // The application records that plug-in records carry, by application row, so that the plug-ins of one
    // application share one (see applicationFromRow). Entries of records gone are swept when the map has doubled.
    std::mutex applicationsMutex_;
    std::unordered_map<int64_t, std::weak_ptr<const LXApplicationProxy>> applications_;
    size_t applicationsSweepAt_ = 64;
};

}  // namespace bexil
