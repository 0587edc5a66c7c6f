// The registry keeps two SQLite connections, each serialised by its own mutex: store_ for changes and lookups_ for
// everything that only reads. A commit syncs the log while holding store_'s mutex; with one connection every look-up
// of the daemon waited for that sync. In write-ahead-log mode a reader on the other connection sees every commit
// that finished before its statement began and never waits for the writer, so look-ups stay as cheap as they were.
//
// A change (register, re-register, unregister) runs in three steps so that observers are told about an uninstall
// before it happens without the registry holding its lock while they run: read what is at the path (locked),
// announce its uninstall (unlocked), then apply the change in one transaction (locked), re-reading the path first.
// If someone else changed the path in between, the loop announces that record too and tries again, so every record
// that goes away has been announced once. Installs are announced after the commit.
//
// Rows become LXBexilProxy snapshots that keep their dictionaries as document text until asked; the containing
// application comes from the same row (a join), and its plug-in list is read only when someone asks for it.

#include "platform/ledgerix/LedgerixWorkspace.h"

#include <pwd.h>
#include <sqlite3.h>
#include <unistd.h>

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <fstream>
#include <set>
#include <string>
#include <utility>

#include "base/Document.h"
#include "base/StandardPaths.h"
#include "platform/ledgerix/LXApplicationProxy.h"
#include "platform/ledgerix/LXApplicationWorkspaceObserverProtocol.h"
#include "platform/ledgerix/LXBexilProxy.h"
#include "platform/ledgerix/LedgerixInternal.h"
#include "platform/log/Log.h"

namespace bexil {

namespace fs = std::filesystem;
using namespace ledgerix_detail;

struct LedgerixWorkspace::Private {};

fs::path LedgerixWorkspace::defaultStateDirectory() {
    if (std::optional<fs::path> dir = stateDirectory()) return *dir;
    if (const passwd* entry = ::getpwuid(::geteuid()); entry && entry->pw_dir)
        return fs::path(entry->pw_dir) / ".local/state/bexil";
    return "/var/lib/bexil";
}

Result<std::shared_ptr<LedgerixWorkspace>> LedgerixWorkspace::open(Options options) {
    std::error_code ec;
    fs::create_directories(options.stateDirectory, ec);
    if (ec)
        return lxError(kLXStoreFailure, formatPrintf("cannot make the registry state directory %s: %s",
                                                     options.stateDirectory.string(), ec.message()));
    std::string path = (options.stateDirectory / kDatabaseFileName).string();
    fs::path marker = path + std::string(kNeedsCheckSuffix);
    bool suspect = fs::exists(marker, ec);
    Opened opened = openStore(path, options, suspect ? OpenCheck::Full : OpenCheck::Light);
    if (!opened.db && opened.damaged) {
        std::string movedTo;
        if (std::optional<Error> error = quarantine(path, &movedTo)) return *error;
        log::ops().error("registry database %s is damaged (%@); moved it aside to %s and started an empty registry",
                         path, opened.error, movedTo);
        opened = openStore(path, options, OpenCheck::Light);
    }
    if (!opened.db) return *opened.error;
    if (suspect) fs::remove(marker, ec);
    Opened lookups = openLookupConnection(path, options);
    if (!lookups.db) {
        sqlite3_close(opened.db);
        return *lookups.error;
    }
    return std::make_shared<LedgerixWorkspace>(std::move(options), opened.db, lookups.db, Private{});
}

LedgerixWorkspace::LedgerixWorkspace(Options options, sqlite3* db, sqlite3* lookupDb, const Private&)
    : options_(std::move(options)), databasePath_(options_.stateDirectory / kDatabaseFileName) {
    store_.db = db;
    lookups_.db = lookupDb;
    fs::path root = options_.rootDirectory.empty() ? fs::path("/") : options_.rootDirectory;
    std::string rootText = realPath(root.string()).value_or(root.lexically_normal().string());
    while (!rootText.empty() && rootText.back() == '/') rootText.pop_back();
    systemPrefix_ = rootText + "/System/";
}

LedgerixWorkspace::~LedgerixWorkspace() {
    lookups_.statements.clear();
    sqlite3_close(lookups_.db);
    store_.statements.clear();
    // The last connection to close checkpoints the log into the database.
    sqlite3_close(store_.db);
}

std::shared_ptr<LedgerixWorkspace::Statement> LedgerixWorkspace::statement(Connection& connection,
                                                                           const std::string& sql) {
    for (const std::shared_ptr<Statement>& cached : connection.statements) {
        if (cached->sql() == sql) return cached;
    }
    if (connection.statements.size() >= kMaxCachedStatements) connection.statements.clear();
    sqlite3_stmt* stmt = nullptr;
    if (sqlite3_prepare_v3(connection.db, sql.c_str(), static_cast<int>(sql.size()), SQLITE_PREPARE_PERSISTENT, &stmt,
                           nullptr) != SQLITE_OK) {
        failure(connection, "prepare a statement");
        return nullptr;
    }
    connection.statements.push_back(std::make_shared<Statement>(sql, stmt));
    return connection.statements.back();
}

Error LedgerixWorkspace::failure(Connection& connection, std::string_view what) {
    int code = sqlite3_extended_errcode(connection.db);
    Error error = storeError(connection.db, what);
    if (isDamage(code)) {
        // The file is damaged somewhere a light open check does not look; make the next open check every page.
        std::ofstream(databasePath_.string() + std::string(kNeedsCheckSuffix)) << "damage seen: " << what << "\n";
        log::ops().fault("registry database %s is damaged; it will be checked when next opened",
                         databasePath_.string());
    }
    return error;
}

void LedgerixWorkspace::LXClearSchemaCaches() {
    for (Connection* connection : {&store_, &lookups_}) {
        std::lock_guard lock(connection->mutex);
        connection->statements.clear();
        sqlite3_db_release_memory(connection->db);
    }
}

// ---- Reading rows ----

namespace {

void readRowColumns(const StatementUse& use, LedgerixWorkspace::Row& row) {
    row.id = use.integer(0);
    std::optional<std::string> uuid = use.blob(1);
    if (uuid && uuid->size() == 16) {
        std::array<uint8_t, 16> bytes;
        std::memcpy(bytes.data(), uuid->data(), 16);
        row.uuid = Uuid(bytes);
    } else {
        row.uuidValid = false;
    }
    row.path = use.text(2).value_or("");
    row.identifier = use.text(3);
    row.bundleIdentifier = use.text(4);
    row.bundleVersion = use.text(5);
    if (!use.isNull(6)) row.applicationId = use.integer(6);
    row.system = use.integer(7) != 0;
    row.registered = use.real(8);
    row.container = use.text(9);
    row.name = use.text(10);
    row.shortName = use.text(11);
    row.info = use.blob(12).value_or("");
    row.entitlements = use.blob(13);
    row.appPath = use.text(14);
    row.appIdentifier = use.text(15);
    row.appName = use.text(16);
    row.appPlaceholder = use.integer(17) != 0;
}

// Reads of the row only what a candidate the caller holds needs, when `known` says the caller holds it. The other
// columns, the information and entitlements documents among them, are never copied out of the statement.
bool readHeldRow(const StatementUse& use, const LXKnownRecord& known, LedgerixWorkspace::Row& row) {
    std::optional<std::string> uuid = use.blob(1);
    if (!uuid || uuid->size() != 16) return false;
    std::array<uint8_t, 16> bytes;
    std::memcpy(bytes.data(), uuid->data(), 16);
    row.uuid = Uuid(bytes);
    if (!known(row.uuid)) return false;
    row.id = use.integer(0);
    row.identifier = use.text(3);
    row.appPlaceholder = use.integer(17) != 0;
    row.held = true;
    return true;
}

}  // namespace

std::optional<std::vector<LedgerixWorkspace::Row>> LedgerixWorkspace::selectRowsLocked(
    Connection& connection, std::string_view where, const std::vector<std::string>& arguments,
    std::optional<int64_t> integerArgument, std::string_view order, const LXKnownRecord* known,
    std::string_view through, Extent* extent) {
    std::string sql(kSelectRow);
    if (!through.empty()) {
        constexpr std::string_view kTable = "FROM plugins p";
        if (size_t at = sql.find(kTable); at != std::string::npos)
            sql.insert(at + kTable.size(), " INDEXED BY " + std::string(through));
    }
    if (!where.empty()) {
        sql += " WHERE ";
        sql += where;
    }
    // Registration order is put right here, not by SQLite: a pre-selection reads its rows through an index in another
    // order, and SQLite would sort them by copying every column of every row (the documents among them) into a
    // sorter first, which costs a point match more than its whole filter.
    const bool inRegistrationOrder = order == kRegistrationOrder;
    if (!inRegistrationOrder) sql += order;
    std::shared_ptr<Statement> stmt = statement(connection, sql);
    if (!stmt) return std::nullopt;
    StatementUse use(stmt->get());
    int index = 1;
    for (const std::string& argument : arguments) use.bind(index++, std::string_view(argument));
    if (integerArgument) use.bind(index++, *integerArgument);
    std::vector<Row> rows;
    int rc;
    while ((rc = use.step()) == SQLITE_ROW) {
        if (extent) {
            ++extent->rows;
            extent->last = use.integer(0);
        }
        Row& row = rows.emplace_back();
        if (known && readHeldRow(use, *known, row)) continue;
        readRowColumns(use, row);
        if (!row.uuidValid) {
            log::ops().fault("registry row %lld at %s has no valid UUID; ignoring it", static_cast<long long>(row.id),
                             row.path);
            rows.pop_back();
        }
    }
    if (rc != SQLITE_DONE) {
        failure(connection, "read plug-in records");
        return std::nullopt;
    }
    auto byId = [](const Row& a, const Row& b) { return a.id < b.id; };
    if (inRegistrationOrder && !std::is_sorted(rows.begin(), rows.end(), byId))
        std::sort(rows.begin(), rows.end(), byId);
    return rows;
}

std::optional<std::vector<LedgerixWorkspace::Row>> LedgerixWorkspace::selectRows(
    std::string_view where, const std::vector<std::string>& arguments, std::optional<int64_t> integerArgument,
    std::string_view order, const LXKnownRecord* known) {
    std::lock_guard lock(lookups_.mutex);
    return selectRowsLocked(lookups_, where, arguments, integerArgument, order, known);
}

// Every plug-in record carries its application's record, and most applications have several plug-ins: while one
// application record is alive, the records of its other plug-ins share it as long as it still says what the row
// says and has not read its plug-in list yet (a list read before a record was made could miss that record's
// plug-in; one read later is what a record of its own would read too).
std::shared_ptr<const LXApplicationProxy> LedgerixWorkspace::applicationFromRow(const Row& row) {
    if (!row.appPath || !row.applicationId) return nullptr;
    int64_t applicationId = *row.applicationId;
    auto sameAsRow = [&row](const LXApplicationProxy& application) {
        return !application.plugInsRead() && application.bundleURL() == *row.appPath &&
               application.bundleIdentifier() == row.appIdentifier && application.localizedName() == row.appName &&
               application.isPlaceholder() == row.appPlaceholder;
    };
    {
        std::lock_guard lock(applicationsMutex_);
        if (auto it = applications_.find(applicationId); it != applications_.end())
            if (std::shared_ptr<const LXApplicationProxy> shared = it->second.lock(); shared && sameAsRow(*shared))
                return shared;
    }
    LXApplicationProxy::Fields fields{*row.appPath, row.appIdentifier, row.appName, row.appPlaceholder};
    std::weak_ptr<LedgerixWorkspace> weak = weak_from_this();
    auto made = std::make_shared<const LXApplicationProxy>(
        std::move(fields), [weak, applicationId]() -> LXApplicationProxy::PlugInList {
            std::shared_ptr<LedgerixWorkspace> workspace = weak.lock();
            return workspace ? workspace->plugInsOfApplication(applicationId) : LXApplicationProxy::PlugInList{};
        });
    std::lock_guard lock(applicationsMutex_);
    applications_[applicationId] = made;
    if (applications_.size() >= applicationsSweepAt_) {
        std::erase_if(applications_, [](const auto& entry) { return entry.second.expired(); });
        applicationsSweepAt_ = std::max<size_t>(64, 2 * applications_.size());
    }
    return made;
}

std::shared_ptr<const LXBexilProxy> LedgerixWorkspace::proxyFromRow(const Row& row) {
    LXBexilProxy::Fields fields;
    fields.bundleURL = row.path;
    fields.pluginIdentifier = row.identifier;
    fields.originalIdentifier = row.bundleIdentifier;
    fields.bundleIdentifier = row.bundleIdentifier;
    fields.bundleVersion = row.bundleVersion;
    fields.pluginUUID = row.uuid;
    fields.registrationDate = Date{row.registered};
    fields.isOnSystemPartition = row.system;
    fields.containingBundle = applicationFromRow(row);
    fields.dataContainerURL = row.container;
    fields.localizedName = row.name;
    fields.localizedShortName = row.shortName;
    fields.infoVrecDocument = row.info;
    fields.entitlementsDocument = row.entitlements.value_or("");
    return std::make_shared<const LXBexilProxy>(std::move(fields));
}

LXProxyList LedgerixWorkspace::proxiesFromRows(const std::vector<Row>& rows) {
    LXProxyList proxies;
    proxies.reserve(rows.size());
    for (const Row& row : rows) proxies.push_back(proxyFromRow(row));
    return proxies;
}

LXCandidateList LedgerixWorkspace::candidatesFromRows(const std::vector<Row>& rows, const LXPlugInFilter& filter) {
    LXCandidateList candidates;
    candidates.reserve(rows.size());
    for (const Row& row : rows) {
        if (row.held) {
            candidates.push_back(LXCandidate{nullptr, row.uuid, row.appPlaceholder});
            continue;
        }
        std::shared_ptr<const LXBexilProxy> proxy = proxyFromRow(row);
        if (filter && !filter(row.identifier.value_or(""), proxy->entitlements())) continue;
        candidates.push_back(LXCandidate{std::move(proxy), row.uuid, row.appPlaceholder});
    }
    return candidates;
}

LXProxyList LedgerixWorkspace::plugInsOfApplication(int64_t applicationId) {
    std::optional<std::vector<Row>> rows = selectRows("p.application_id = ?", {}, applicationId);
    if (!rows) return {};
    std::sort(rows->begin(), rows->end(), [](const Row& a, const Row& b) { return a.path < b.path; });
    return proxiesFromRows(*rows);
}

std::optional<LedgerixWorkspace::Row> LedgerixWorkspace::rowAtPathLocked(Connection& connection,
                                                                         const std::string& path, bool* failed) {
    std::optional<std::vector<Row>> rows = selectRowsLocked(connection, "p.path = ?", {path}, std::nullopt);
    if (!rows) {
        if (failed) *failed = true;
        return std::nullopt;
    }
    if (rows->empty()) return std::nullopt;
    return std::move(rows->front());
}

std::vector<std::string> LedgerixWorkspace::candidatePaths(std::string_view url) {
    std::vector<std::string> paths;
    std::optional<std::string> lexical = lexicalPath(url);
    if (!lexical) return paths;
    paths.push_back(*lexical);
    if (std::optional<std::string> real = realPath(*lexical); real && *real != *lexical) paths.push_back(*real);
    return paths;
}

// ---- Look-ups ----

std::shared_ptr<const LXBexilProxy> LedgerixWorkspace::plugInProxyForUUID(const Uuid& uuid) {
    std::optional<Row> found;
    {
        std::lock_guard lock(lookups_.mutex);
        std::shared_ptr<Statement> stmt = statement(lookups_, std::string(kSelectRow) + " WHERE p.uuid = ?");
        if (!stmt) return nullptr;
        StatementUse use(stmt->get());
        use.bind(1, uuid);
        int rc = use.step();
        if (rc == SQLITE_ROW) {
            found.emplace();
            readRowColumns(use, *found);
        } else if (rc != SQLITE_DONE) {
            failure(lookups_, "look a plug-in up by UUID");
        }
    }
    if (!found) {
        log::lx().debug("no plug-in with UUID %@", uuid);
        return nullptr;
    }
    return proxyFromRow(*found);
}

std::shared_ptr<const LXBexilProxy> LedgerixWorkspace::plugInProxyForURL(std::string_view url) {
    for (const std::string& path : candidatePaths(url)) {
        std::optional<Row> row;
        {
            std::lock_guard lock(lookups_.mutex);
            row = rowAtPathLocked(lookups_, path, nullptr);
        }
        if (row) return proxyFromRow(*row);
    }
    log::lx().debug("no plug-in at %s", printable(url));
    return nullptr;
}

std::shared_ptr<const LXApplicationProxy> LedgerixWorkspace::applicationProxyForBundleURL(std::string_view url) {
    for (const std::string& path : candidatePaths(url)) {
        std::optional<LXApplicationProxy::Fields> fields;
        int64_t applicationId = 0;
        {
            std::lock_guard lock(lookups_.mutex);
            std::shared_ptr<Statement> stmt =
                statement(lookups_, "SELECT id, path, identifier, name, placeholder FROM applications WHERE path = ?");
            if (!stmt) return nullptr;
            StatementUse use(stmt->get());
            use.bind(1, std::string_view(path));
            int rc = use.step();
            if (rc == SQLITE_ROW) {
                applicationId = use.integer(0);
                fields = LXApplicationProxy::Fields{use.text(1).value_or(path), use.text(2), use.text(3),
                                                    use.integer(4) != 0};
            } else if (rc != SQLITE_DONE) {
                failure(lookups_, "look an application up");
                return nullptr;
            }
        }
        if (fields) {
            return std::make_shared<const LXApplicationProxy>(std::move(*fields), plugInsOfApplication(applicationId));
        }
    }
    log::lx().debug("no application at %s", printable(url));
    return nullptr;
}

std::optional<LXCandidateList> LedgerixWorkspace::installedCandidates(const LXKnownRecord& known) {
    std::optional<std::vector<Row>> rows =
        selectRows("", {}, std::nullopt, kRegistrationOrder, known ? &known : nullptr);
    if (!rows) return std::nullopt;
    return candidatesFromRows(*rows, {});
}

std::optional<LXProxyList> LedgerixWorkspace::installedPlugins() {
    std::optional<std::vector<Row>> rows = selectRows("", {}, std::nullopt);
    if (!rows) return std::nullopt;
    log::lx().debug("%zu installed plug-in(s)", rows->size());
    return proxiesFromRows(*rows);
}

namespace {

// The condition that narrows the candidates by what the rule engine says the query pins, with its arguments. A
// plug-in whose point is not one plain string (point_wild), or that has no identifier, may still answer such a rule
// from its dictionaries, so it always stays a candidate.
struct Preselected {
    std::string where;
    std::vector<std::string> arguments;

    explicit Preselected(const LXPreselection& preselection) {
        constrain(preselection.extensionPoints, "p.point_key", "p.point_wild = 1");
        constrain(preselection.identifiers, "p.identifier_key", "p.identifier_key IS NULL");
    }

    void constrain(const std::optional<std::vector<std::string>>& values, std::string_view column,
                   std::string_view orElse) {
        if (!values || values->empty()) return;
        if (!where.empty()) where += " AND ";
        where += "(";
        where += column;
        where += " IN (";
        for (size_t i = 0; i < values->size(); ++i) where += i ? ",?" : "?";
        where += ") OR ";
        where += orElse;
        where += ")";
        for (const std::string& value : *values) arguments.push_back(matchForm(value));
    }

    // The condition with `more` joined to it.
    std::string whereAnd(std::string_view more) const {
        return where.empty() ? std::string(more) : "(" + where + ") AND " + std::string(more);
    }
};

// One alternative of a pre-selection (a point, the plug-ins whose point is not plain, an identifier, the plug-ins
// without one) with the index that holds its plug-ins in walk order.
struct WalkBranch {
    std::string where;
    std::vector<std::string> arguments;
    std::string_view index;
};

// The alternatives of the first constraint of `preselection` (the points, else the identifiers), each narrowed by
// the other constraint; one alternative without a condition when nothing is pre-selected. The walk reads each in
// order from its index and merges them: one query with the whole pre-selection, ordered and limited, would collect
// and sort all the remaining candidates for every stretch.
std::vector<WalkBranch> walkBranches(const LXPreselection& preselection) {
    auto present = [](const std::optional<std::vector<std::string>>& values) { return values && !values->empty(); };
    std::vector<WalkBranch> branches;
    auto split = [&](const std::vector<std::string>& values, std::string_view column, std::string_view orElse,
                     std::string_view index, std::string_view orElseIndex, const Preselected& other) {
        std::set<std::string> keys;
        for (const std::string& value : values) keys.insert(matchForm(value));
        auto add = [&](std::string condition, std::vector<std::string> arguments, std::string_view through) {
            arguments.insert(arguments.end(), other.arguments.begin(), other.arguments.end());
            branches.push_back({other.where.empty() ? condition : "(" + condition + ") AND (" + other.where + ")",
                                std::move(arguments), through});
        };
        for (const std::string& key : keys) add(std::string(column) + " = ?", {key}, index);
        add(std::string(orElse), {}, orElseIndex);
    };
    if (present(preselection.extensionPoints)) {
        split(*preselection.extensionPoints, "p.point_key", "p.point_wild = 1", "plugins_point_walk",
              "plugins_wild_walk",
              Preselected(LXPreselection{.extensionPoints = std::nullopt, .identifiers = preselection.identifiers}));
    } else if (present(preselection.identifiers)) {
        split(*preselection.identifiers, "p.identifier_key", "p.identifier_key IS NULL", "plugins_identifier_walk",
              "plugins_identifier_walk", Preselected(LXPreselection{}));
    } else {
        branches.push_back({"", {}, "plugins_walk"});
    }
    return branches;
}

// The walk's order; the index plugins_walk holds exactly this expression.
constexpr std::string_view kWalkKey = "coalesce(p.identifier, '')";
// What the walk's order puts in place of a missing identifier.
const std::string kNoIdentifier;

LXProxyList proxiesOf(LXCandidateList candidates) {
    LXProxyList proxies;
    proxies.reserve(candidates.size());
    for (LXCandidate& candidate : candidates) proxies.push_back(std::move(candidate.proxy));
    return proxies;
}

// What a query asks `known`: nothing when it has a filter, which needs every candidate's entitlements.
const LXKnownRecord* consulted(const LXPlugInFilter& filter, const LXKnownRecord& known) {
    return !filter && known ? &known : nullptr;
}

}  // namespace

std::optional<LXProxyList> LedgerixWorkspace::pluginsMatchingQueryApplyFilter(const Value& query,
                                                                              const LXPlugInFilter& filter,
                                                                              const LXPreselection& preselection) {
    std::optional<LXCandidateList> candidates = candidatesMatchingQuery(query, filter, preselection, {});
    if (!candidates) return std::nullopt;
    return proxiesOf(std::move(*candidates));
}

std::optional<LXCandidateList> LedgerixWorkspace::candidatesMatchingQuery(const Value& query,
                                                                          const LXPlugInFilter& filter,
                                                                          const LXPreselection& preselection,
                                                                          const LXKnownRecord& known) {
    Preselected preselected(preselection);
    std::optional<std::vector<Row>> rows = selectRows(preselected.where, preselected.arguments, std::nullopt,
                                                      kRegistrationOrder, consulted(filter, known));
    if (!rows) return std::nullopt;
    log::lx().debug("%zu candidate(s) for %@ (pre-selection: %s)", rows->size(), query,
                    preselected.where.empty() ? std::string("none") : preselected.where);
    // The filter runs without the lock: it may call back into the registry.
    LXCandidateList matches = candidatesFromRows(*rows, filter);
    log::lx().debug("%zu plug-in(s) pass the filter", matches.size());
    return matches;
}

std::optional<LXWalkSlice> LedgerixWorkspace::pluginsMatchingQueryAfterIdentifier(
    const Value& query, const LXPlugInFilter& filter, const LXPreselection& preselection,
    const std::optional<std::string>& after, size_t rows) {
    std::optional<LXCandidateSlice> slice = candidatesAfterIdentifier(query, filter, preselection, after, rows, {});
    if (!slice) return std::nullopt;
    return LXWalkSlice{proxiesOf(std::move(slice->candidates)), std::move(slice->last), slice->ended};
}

std::optional<LXCandidateSlice> LedgerixWorkspace::candidatesAfterIdentifier(const Value& query,
                                                                             const LXPlugInFilter& filter,
                                                                             const LXPreselection& preselection,
                                                                             const std::optional<std::string>& after,
                                                                             size_t rows, const LXKnownRecord& known) {
    const LXKnownRecord* heldBy = consulted(filter, known);
    Preselected preselected(preselection);
    const std::string key(kWalkKey);
    const int64_t limit = static_cast<int64_t>(std::clamp<size_t>(rows, 1, INT32_MAX));
    std::optional<std::vector<Row>> stretch;
    bool full = false;
    {
        std::lock_guard lock(lookups_.mutex);
        // Each alternative's next `limit` rows; the first `limit` of them all, in walk order, are the stretch.
        stretch.emplace();
        std::set<int64_t> seen;
        for (WalkBranch& branch : walkBranches(preselection)) {
            std::string where = branch.where;
            if (after) {
                where = where.empty() ? key + " > ?" : "(" + where + ") AND " + key + " > ?";
                branch.arguments.push_back(*after);
            }
            std::optional<std::vector<Row>> next = selectRowsLocked(
                lookups_, where, branch.arguments, limit, " ORDER BY " + key + ", p.id LIMIT ?", heldBy, branch.index);
            if (!next) return std::nullopt;
            for (Row& row : *next)
                if (seen.insert(row.id).second) stretch->push_back(std::move(row));
        }
        auto walkOrder = [](const Row& a, const Row& b) {
            const std::string& left = a.identifier ? *a.identifier : kNoIdentifier;
            const std::string& right = b.identifier ? *b.identifier : kNoIdentifier;
            return left != right ? left < right : a.id < b.id;
        };
        std::sort(stretch->begin(), stretch->end(), walkOrder);
        full = static_cast<int64_t>(stretch->size()) >= limit;
        if (full) stretch->resize(static_cast<size_t>(limit));
        // A full stretch may have cut its last identifier short: the rest of that identifier comes with it.
        if (full) {
            const Row& last = stretch->back();
            std::vector<std::string> sameArguments = preselected.arguments;
            sameArguments.push_back(last.identifier.value_or(""));
            std::optional<std::vector<Row>> rest =
                selectRowsLocked(lookups_, preselected.whereAnd(key + " = ? AND p.id > ?"), sameArguments, last.id,
                                 kRegistrationOrder, heldBy);
            if (!rest) return std::nullopt;
            for (Row& row : *rest) stretch->push_back(std::move(row));
        }
    }
    LXCandidateSlice slice;
    slice.ended = !full;
    if (!stretch->empty()) slice.last = stretch->back().identifier.value_or("");
    log::lx().debug("%zu candidate(s) for %@ after %s", stretch->size(), query, after ? *after : std::string("-"));
    // The filter runs without the lock: it may call back into the registry.
    slice.candidates = candidatesFromRows(*stretch, filter);
    return slice;
}

std::optional<LXRegistrationSlice> LedgerixWorkspace::candidatesAfterRegistration(const Value& query,
                                                                                  const LXPlugInFilter& filter,
                                                                                  const LXPreselection& preselection,
                                                                                  int64_t after, size_t rows,
                                                                                  const LXKnownRecord& known) {
    Preselected preselected(preselection);
    // The pre-selection's indexes give their rows in another order, so that a stretch after a position would sort
    // all the rest of them each time: what they select is read at once, in one query, instead.
    if (!preselected.where.empty()) {
        if (after != 0) return LXRegistrationSlice{{}, after, true};
        std::optional<LXCandidateList> candidates = candidatesMatchingQuery(query, filter, preselection, known);
        if (!candidates) return std::nullopt;
        return LXRegistrationSlice{std::move(*candidates), INT64_MAX, true};
    }
    const int64_t limit = static_cast<int64_t>(std::clamp<size_t>(rows, 1, INT32_MAX));
    Extent extent{0, after};
    std::optional<std::vector<Row>> stretch;
    {
        std::lock_guard lock(lookups_.mutex);
        // One integer argument is the limit; the position is bound as text and read back as the integer it is,
        // which still lets SQLite seek to it by the primary key.
        stretch = selectRowsLocked(lookups_, "p.id > CAST(? AS INTEGER)", {std::to_string(after)}, limit,
                                   " ORDER BY p.id LIMIT ?", consulted(filter, known), {}, &extent);
    }
    if (!stretch) return std::nullopt;
    LXRegistrationSlice slice;
    slice.last = extent.last;
    // Rows are counted as read, kept or not: only a short stretch is the last one.
    slice.ended = extent.rows < static_cast<size_t>(limit);
    log::lx().debug("%zu candidate(s) for %@ after position %lld", stretch->size(), query,
                    static_cast<long long>(after));
    // The filter runs without the lock: it may call back into the registry.
    slice.candidates = candidatesFromRows(*stretch, filter);
    return slice;
}

std::optional<uint64_t> LedgerixWorkspace::contentVersion() {
    std::lock_guard lock(lookups_.mutex);
    std::shared_ptr<Statement> stmt = statement(lookups_, "PRAGMA data_version");
    if (!stmt) return std::nullopt;
    StatementUse use(stmt->get());
    if (use.step() != SQLITE_ROW) {
        failure(lookups_, "read the data version");
        return std::nullopt;
    }
    return static_cast<uint64_t>(use.integer(0));
}

std::optional<size_t> LedgerixWorkspace::plugInCount() {
    std::lock_guard lock(lookups_.mutex);
    std::shared_ptr<Statement> stmt = statement(lookups_, "SELECT count(*) FROM plugins");
    if (!stmt) return std::nullopt;
    StatementUse use(stmt->get());
    if (use.step() != SQLITE_ROW) {
        failure(lookups_, "count plug-ins");
        return std::nullopt;
    }
    return static_cast<size_t>(use.integer(0));
}

std::optional<Error> LedgerixWorkspace::checkIntegrity() {
    {
        std::lock_guard lock(lookups_.mutex);
        sqlite3_stmt* stmt = nullptr;
        if (sqlite3_prepare_v2(lookups_.db, "PRAGMA integrity_check", -1, &stmt, nullptr) != SQLITE_OK)
            return failure(lookups_, "run the integrity check");
        std::string verdict;
        int rc;
        while ((rc = sqlite3_step(stmt)) == SQLITE_ROW) {
            if (verdict.empty()) verdict = reinterpret_cast<const char*>(sqlite3_column_text(stmt, 0));
        }
        sqlite3_finalize(stmt);
        if (rc != SQLITE_DONE) return failure(lookups_, "run the integrity check");
        if (verdict != "ok") return lxError(kLXStoreFailure, "registry integrity check failed: " + verdict);
    }
    std::optional<std::vector<Row>> rows;
    {
        std::lock_guard lock(lookups_.mutex);
        rows = selectRowsLocked(lookups_, "", {}, std::nullopt);
        std::shared_ptr<Statement> stmt = statement(lookups_, "SELECT count(*) FROM plugins");
        if (!rows || !stmt) return failure(lookups_, "read every plug-in record");
        StatementUse use(stmt->get());
        if (use.step() != SQLITE_ROW || static_cast<size_t>(use.integer(0)) != rows->size())
            return lxError(kLXStoreFailure, "registry holds plug-in rows that cannot be read");
    }
    for (const Row& row : *rows) {
        Result<Value> info = Document::read(row.info);
        if (!info.ok() || !info->isDictionary())
            return lxError(kLXStoreFailure,
                           "registry record at " + row.path + " has an unreadable information dictionary");
        if (row.entitlements) {
            Result<Value> entitlements = Document::read(*row.entitlements);
            if (!entitlements.ok() || !entitlements->isDictionary())
                return lxError(kLXStoreFailure, "registry record at " + row.path + " has unreadable entitlements");
        }
    }
    return std::nullopt;
}

// ---- Observers ----

void LedgerixWorkspace::addObserver(std::weak_ptr<LXApplicationWorkspaceObserverProtocol> observer) {
    std::lock_guard lock(observersMutex_);
    observers_.push_back(std::move(observer));
}

void LedgerixWorkspace::removeObserver(const LXApplicationWorkspaceObserverProtocol* observer) {
    std::lock_guard lock(observersMutex_);
    std::erase_if(observers_, [observer](const auto& weak) {
        std::shared_ptr<LXApplicationWorkspaceObserverProtocol> strong = weak.lock();
        return !strong || strong.get() == observer;
    });
}

void LedgerixWorkspace::notifyObservers(Change change, const LXProxyList& plugIns) {
    std::vector<std::shared_ptr<LXApplicationWorkspaceObserverProtocol>> targets;
    {
        std::lock_guard lock(observersMutex_);
        std::erase_if(observers_, [](const auto& weak) { return weak.expired(); });
        for (const auto& weak : observers_) {
            if (auto strong = weak.lock()) targets.push_back(std::move(strong));
        }
    }
    for (const auto& observer : targets) {
        if (change == Change::Installed)
            observer->pluginsDidInstall(plugIns);
        else
            observer->pluginsWillUninstall(plugIns);
    }
}

}  // namespace bexil
