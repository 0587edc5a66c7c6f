// The registry keeps one SQLite connection and serialises every use of it with mutex_. Registrations are rare and
// look-ups cheap, so a single connection is enough; the point of the store is durability, not parallel reads.
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
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <fstream>
#include <system_error>
#include <utility>

#include "base/Document.h"
#include "base/StandardPaths.h"
#include "base/Text.h"
#include "platform/bundles/DirectoryBundle.h"
#include "platform/ledgerix/LXApplicationProxy.h"
#include "platform/ledgerix/LXApplicationWorkspaceObserverProtocol.h"
#include "platform/ledgerix/LXBexilProxy.h"
#include "platform/log/Log.h"

namespace bexil {

namespace fs = std::filesystem;

namespace {

// Next to the database: present when damage was seen at run time, so that the next open runs the full check.
constexpr std::string_view kNeedsCheckSuffix = ".needs-check";
constexpr std::string_view kEntitlementsFileName = "Entitlements.vrec";
// Entitlements are a handful of keys; like information documents, anything larger is refused rather than read.
constexpr size_t kMaxEntitlementsBytes = DirectoryBundle::kMaxInfoBytes;
constexpr std::string_view kExtensionPointKey = "RZExtensionPointIdentifier";
constexpr std::string_view kIdentifierKey = "RZExtensionIdentifier";
// Dynamic discovery queries get statements of their own shape; past this many the cache is dropped and rebuilt.
constexpr size_t kMaxCachedStatements = 64;

// Each entry brings the schema from version i to i + 1. Entries never change once released; a schema change adds one.
constexpr const char* kMigrations[] = {
    R"sql(
    CREATE TABLE applications(
        id INTEGER PRIMARY KEY,
        path TEXT NOT NULL UNIQUE,
        identifier TEXT,
        name TEXT,
        placeholder INTEGER NOT NULL);
    CREATE TABLE plugIns(
        id INTEGER PRIMARY KEY,
        uuid BLOB NOT NULL UNIQUE,
        path TEXT NOT NULL UNIQUE,
        identifier TEXT,
        identifier_key TEXT,
        bundle_identifier TEXT,
        bundle_version TEXT,
        point_key TEXT,
        point_wild INTEGER NOT NULL,
        application_id INTEGER REFERENCES applications(id),
        system INTEGER NOT NULL,
        registered REAL NOT NULL,
        container TEXT,
        name TEXT,
        short_name TEXT,
        info BLOB NOT NULL,
        entitlements BLOB);
    CREATE INDEX plugins_identifier_key ON plugIns(identifier_key);
    CREATE INDEX plugins_point_key ON plugIns(point_key);
    CREATE INDEX plugins_point_wild ON plugIns(point_wild) WHERE point_wild = 1;
    CREATE INDEX plugins_application ON plugIns(application_id);
    )sql",
};
static_assert(std::size(kMigrations) == LedgerixWorkspace::kSchemaVersion);

constexpr std::string_view kSelectRow =
    "SELECT p.id, p.uuid, p.path, p.identifier, p.bundle_identifier, p.bundle_version, p.application_id, p.system, "
    "p.registered, p.container, p.name, p.short_name, p.info, p.entitlements, "
    "a.path, a.identifier, a.name, a.placeholder "
    "FROM plugins p LEFT JOIN applications a ON a.id = p.application_id";

Error storeError(sqlite3* db, std::string_view what) {
    std::string detail = db ? sqlite3_errmsg(db) : "out of memory";
    log::ops().error("registry store failed to %s: %s", what, detail);
    return Error(std::string(LXErrorDomain), kLXStoreFailure,
                 formatPrintf("registry store failed to %s: %s", what, detail));
}

Error lxError(LXErrorCode code, std::string message) {
    return Error(std::string(LXErrorDomain), code, std::move(message));
}

bool isDigit(char c) { return c >= '0' && c <= '9'; }

// The form in which indexed keys are stored and looked up: every run of digits without its leading zeros (a run of
// zeros keeps one). Discovery tells "v01" from "v1", so one key may stand for a few values that a rule tells apart;
// that only widens the candidates, which the caller checks rule by rule anyway.
std::string matchForm(std::string_view text) {
    std::string form;
    form.reserve(text.size());
    for (size_t i = 0; i < text.size();) {
        if (!isDigit(text[i])) {
            form += text[i++];
            continue;
        }
        size_t end = i;
        while (end < text.size() && isDigit(text[end])) ++end;
        while (end - i > 1 && text[i] == '0') ++i;
        form.append(text.substr(i, end - i));
        i = end;
    }
    return form;
}

// The URL as a caller sent it, safe to put in a message: control bytes (a NUL among them) are escaped.
std::string printable(std::string_view url) {
    std::string text;
    for (char c : url) {
        if (static_cast<unsigned char>(c) < 0x20 || c == 0x7f)
            text += formatPrintf("\\x%02x", static_cast<unsigned>(static_cast<unsigned char>(c)));
        else
            text += c;
    }
    return text;
}

std::optional<std::string> stringEntry(const Value& dictionary, std::string_view key) {
    const Value* value = dictionary.find(key);
    if (value == nullptr || !value->isString()) return std::nullopt;
    return *value->getString();
}

// A URL or path as the registry keys it: absolute, "file://" removed, "." and ".." folded, no trailing slash. None
// for anything that cannot be a bundle path.
std::optional<std::string> lexicalPath(std::string_view url) {
    std::optional<std::string> fromURL;
    if (url.starts_with("file://")) {
        fromURL = pathOfFileURL(url);
        if (!fromURL) return std::nullopt;
        url = *fromURL;
    }
    if (url.empty() || url[0] != '/' || url.find('\0') != std::string_view::npos) return std::nullopt;
    std::string path = fs::path(url).lexically_normal().string();
    while (path.size() > 1 && path.back() == '/') path.pop_back();
    return path;
}

std::optional<std::string> realPath(const std::string& path, int* error = nullptr) {
    char buffer[PATH_MAX];
    if (::realpath(path.c_str(), buffer) == nullptr) {
        if (error) *error = errno;
        return std::nullopt;
    }
    return std::string(buffer);
}

// The name shown for a bundle: its display name, else its name, else its directory name without extension.
std::string displayName(const std::optional<Value>& info, const std::string& path) {
    if (info && info->isDictionary()) {
        for (std::string_view key : {"BDBundleDisplayName", "BDBundleName"}) {
            if (std::optional<std::string> name = stringEntry(*info, key); name && !name->empty()) return *name;
        }
    }
    return fs::path(path).stem().string();
}

bool validContainerName(const std::string& identifier) {
    return !identifier.empty() && identifier != "." && identifier != ".." && identifier.size() <= NAME_MAX &&
           identifier.find('/') == std::string::npos && identifier.find('\0') == std::string::npos;
}

}  // namespace

// ---- Statements ----

class LedgerixWorkspace::Statement {
  public:
    Statement(std::string sql, sqlite3_stmt* stmt) : sql_(std::move(sql)), stmt_(stmt) {}
    ~Statement() { sqlite3_finalize(stmt_); }
    Statement(const Statement&) = delete;
    Statement& operator=(const Statement&) = delete;

    const std::string& sql() const { return sql_; }
    sqlite3_stmt* get() const { return stmt_; }

  private:
    std::string sql_;
    sqlite3_stmt* stmt_;
};

namespace {

// One use of a prepared statement: binds, steps, reads, and leaves it reset for the next use.
class StatementUse {
  public:
    explicit StatementUse(sqlite3_stmt* stmt) : stmt_(stmt) {}
    ~StatementUse() {
        sqlite3_reset(stmt_);
        sqlite3_clear_bindings(stmt_);
    }
    StatementUse(const StatementUse&) = delete;
    StatementUse& operator=(const StatementUse&) = delete;

    void bind(int index, const std::optional<std::string>& text) {
        if (text)
            sqlite3_bind_text(stmt_, index, text->data(), static_cast<int>(text->size()), SQLITE_TRANSIENT);
        else
            sqlite3_bind_null(stmt_, index);
    }
    void bind(int index, std::string_view text) {
        sqlite3_bind_text(stmt_, index, text.data(), static_cast<int>(text.size()), SQLITE_TRANSIENT);
    }
    void bindBlob(int index, const std::optional<std::string>& bytes) {
        if (bytes)
            sqlite3_bind_blob(stmt_, index, bytes->data(), static_cast<int>(bytes->size()), SQLITE_TRANSIENT);
        else
            sqlite3_bind_null(stmt_, index);
    }
    void bind(int index, const Uuid& uuid) {
        sqlite3_bind_blob(stmt_, index, uuid.bytes().data(), 16, SQLITE_TRANSIENT);
    }
    void bind(int index, int64_t number) { sqlite3_bind_int64(stmt_, index, number); }
    void bind(int index, const std::optional<int64_t>& number) {
        if (number)
            sqlite3_bind_int64(stmt_, index, *number);
        else
            sqlite3_bind_null(stmt_, index);
    }
    void bindReal(int index, double number) { sqlite3_bind_double(stmt_, index, number); }

    int step() { return sqlite3_step(stmt_); }

    bool isNull(int column) const { return sqlite3_column_type(stmt_, column) == SQLITE_NULL; }
    int64_t integer(int column) const { return sqlite3_column_int64(stmt_, column); }
    double real(int column) const { return sqlite3_column_double(stmt_, column); }
    std::optional<std::string> text(int column) const {
        if (isNull(column)) return std::nullopt;
        const unsigned char* bytes = sqlite3_column_text(stmt_, column);
        return std::string(reinterpret_cast<const char*>(bytes), sqlite3_column_bytes(stmt_, column));
    }
    std::optional<std::string> blob(int column) const {
        if (isNull(column)) return std::nullopt;
        const void* bytes = sqlite3_column_blob(stmt_, column);
        int size = sqlite3_column_bytes(stmt_, column);
        return bytes ? std::string(static_cast<const char*>(bytes), size) : std::string();
    }

  private:
    sqlite3_stmt* stmt_;
};

}  // namespace

// One plug-in row with its application's columns; also the shape of a bundle read from disk before it is stored.
struct LedgerixWorkspace::Row {
    int64_t id = 0;
    Uuid uuid;
    bool uuidValid = true;
    std::string path;
    std::optional<std::string> identifier;
    std::optional<std::string> bundleIdentifier;
    std::optional<std::string> bundleVersion;
    std::optional<int64_t> applicationId;
    bool system = false;
    double registered = 0;
    std::optional<std::string> container;
    std::optional<std::string> name;
    std::optional<std::string> shortName;
    std::string info;
    std::optional<std::string> entitlements;
    std::optional<std::string> appPath;
    std::optional<std::string> appIdentifier;
    std::optional<std::string> appName;
    bool appPlaceholder = false;
    // Only for rows about to be written.
    std::optional<std::string> identifierKey;
    std::optional<std::string> pointKey;
    bool pointWild = false;

    // Everything a registration derives from the bundle; equal means that registering again changes nothing.
    bool sameBundleAs(const Row& other) const {
        return path == other.path && identifier == other.identifier && bundleIdentifier == other.bundleIdentifier &&
               bundleVersion == other.bundleVersion && system == other.system && container == other.container &&
               name == other.name && shortName == other.shortName && info == other.info &&
               entitlements == other.entitlements && appPath == other.appPath && appIdentifier == other.appIdentifier &&
               appName == other.appName && appPlaceholder == other.appPlaceholder;
    }
};

struct LedgerixWorkspace::Private {};

// ---- Opening ----

namespace {

struct Opened {
    sqlite3* db = nullptr;
    std::optional<Error> error;
    // The file is not a database or fails its check: it may be moved aside and replaced.
    bool damaged = false;
};

bool isDamage(int code) {
    int primary = code & 0xff;
    return primary == SQLITE_CORRUPT || primary == SQLITE_NOTADB;
}

bool exec(sqlite3* db, const char* sql) { return sqlite3_exec(db, sql, nullptr, nullptr, nullptr) == SQLITE_OK; }

enum class OpenCheck { Light, Full };

Opened openStore(const std::string& path, LedgerixWorkspace::Durability durability, OpenCheck check) {
    Opened result;
    sqlite3* db = nullptr;
    int rc =
        sqlite3_open_v2(path.c_str(), &db, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_NOMUTEX, nullptr);
    auto fail = [&](std::string_view what, int code) {
        result.damaged = isDamage(code);
        result.error = storeError(db, what);
        sqlite3_close(db);
        result.db = nullptr;
        return result;
    };
    if (rc != SQLITE_OK) return fail("open the database", rc);
    sqlite3_extended_result_codes(db, 1);
    sqlite3_busy_timeout(db, 5000);

    // WAL keeps readers and the writer apart and makes a commit one append; FULL syncs the log at every commit, so
    // a registration that returned is on disk. NORMAL leaves the sync to checkpoints: still atomic, and still safe
    // when only the process dies, because the log is in the kernel's hands once written.
    sqlite3_stmt* stmt = nullptr;
    rc = sqlite3_prepare_v2(db, "PRAGMA journal_mode=WAL", -1, &stmt, nullptr);
    if (rc == SQLITE_OK) rc = sqlite3_step(stmt);
    std::string mode = rc == SQLITE_ROW ? reinterpret_cast<const char*>(sqlite3_column_text(stmt, 0)) : "";
    sqlite3_finalize(stmt);
    if (rc != SQLITE_ROW) return fail("switch to write-ahead logging", sqlite3_errcode(db));
    if (mode != "wal") {
        result.error = lxError(kLXStoreFailure, "registry store refused write-ahead logging (mode " + mode + ")");
        sqlite3_close(db);
        return result;
    }
    const char* synchronous =
        durability == LedgerixWorkspace::Durability::Full ? "PRAGMA synchronous=FULL" : "PRAGMA synchronous=NORMAL";
    if (!exec(db, synchronous) || !exec(db, "PRAGMA foreign_keys=ON"))
        return fail("configure the database", sqlite3_errcode(db));

    // The full check reads every page, which a registry of 100,000 plug-ins should not pay at every start. It runs
    // when the last run saw damage (the marker file); otherwise the open reads the header and the schema and checks
    // that the file is as long as its header says, which finds truncation and files that are not databases.
    if (check == OpenCheck::Full) {
        rc = sqlite3_prepare_v2(db, "PRAGMA quick_check", -1, &stmt, nullptr);
        std::string verdict;
        if (rc == SQLITE_OK) {
            while ((rc = sqlite3_step(stmt)) == SQLITE_ROW) {
                if (verdict.empty()) verdict = reinterpret_cast<const char*>(sqlite3_column_text(stmt, 0));
            }
        }
        sqlite3_finalize(stmt);
        if (rc != SQLITE_DONE) return fail("check the database", sqlite3_errcode(db));
        if (verdict != "ok") {
            result.damaged = true;
            // The check lists every bad page; the first few say enough.
            if (verdict.size() > 300) verdict = verdict.substr(0, 300) + "...";
            result.error = lxError(kLXStoreFailure, "registry database check failed: " + verdict);
            sqlite3_close(db);
            return result;
        }
    } else {
        if (!exec(db, "SELECT count(*) FROM sqlite_schema")) return fail("read the schema", sqlite3_errcode(db));
        int64_t pages = 0, pageSize = 0;
        for (auto [sql, out] : {std::pair{"PRAGMA page_count", &pages}, std::pair{"PRAGMA page_size", &pageSize}}) {
            rc = sqlite3_prepare_v2(db, sql, -1, &stmt, nullptr);
            if (rc == SQLITE_OK) rc = sqlite3_step(stmt);
            if (rc == SQLITE_ROW) *out = sqlite3_column_int64(stmt, 0);
            sqlite3_finalize(stmt);
            if (rc != SQLITE_ROW) return fail("read the database size", sqlite3_errcode(db));
        }
        // Pages still in the log may lie beyond the end of the file; without a log the file holds every page.
        std::error_code ec;
        bool logPending = fs::exists(path + "-wal", ec) && fs::file_size(path + "-wal", ec) > 0;
        uintmax_t size = fs::file_size(path, ec);
        if (!logPending && !ec && size < static_cast<uintmax_t>(pages * pageSize)) {
            result.damaged = true;
            result.error = lxError(kLXStoreFailure, formatPrintf("registry database is truncated: %ju of %lld bytes",
                                                                 size, static_cast<long long>(pages * pageSize)));
            sqlite3_close(db);
            return result;
        }
    }

    rc = sqlite3_prepare_v2(db, "PRAGMA user_version", -1, &stmt, nullptr);
    if (rc == SQLITE_OK) rc = sqlite3_step(stmt);
    int64_t version = rc == SQLITE_ROW ? sqlite3_column_int64(stmt, 0) : -1;
    sqlite3_finalize(stmt);
    if (rc != SQLITE_ROW) return fail("read the schema version", sqlite3_errcode(db));
    if (version > LedgerixWorkspace::kSchemaVersion || version < 0) {
        result.error = lxError(kLXStoreFailure,
                               formatPrintf("registry database %s has schema version %lld; this program knows up "
                                            "to %d",
                                            path, static_cast<long long>(version), LedgerixWorkspace::kSchemaVersion));
        sqlite3_close(db);
        return result;
    }
    for (int64_t step = version; step < LedgerixWorkspace::kSchemaVersion; ++step) {
        std::string sql = std::string("BEGIN IMMEDIATE;") + kMigrations[step] +
                          formatPrintf("PRAGMA user_version = %lld; COMMIT;", static_cast<long long>(step + 1));
        if (!exec(db, sql.c_str())) {
            int code = sqlite3_errcode(db);
            exec(db, "ROLLBACK");
            return fail("migrate the schema", code);
        }
        log::lx().info("registry database %s migrated to schema version %lld", path, static_cast<long long>(step + 1));
    }
    result.db = db;
    return result;
}

// Moves a damaged database and its companions aside; the error when that is impossible.
std::optional<Error> quarantine(const std::string& path, std::string* movedTo) {
    *movedTo = formatPrintf("%s.corrupt-%lld", path, static_cast<long long>(::time(nullptr)));
    for (std::string_view suffix : {"", "-wal", "-shm"}) {
        std::string from = path + std::string(suffix);
        std::error_code ec;
        if (!fs::exists(from, ec)) continue;
        fs::rename(from, *movedTo + std::string(suffix), ec);
        if (ec)
            return lxError(kLXStoreFailure,
                           formatPrintf("cannot move the damaged registry database %s aside: %s", from, ec.message()));
    }
    return std::nullopt;
}

}  // namespace

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
    Opened opened = openStore(path, options.durability, suspect ? OpenCheck::Full : OpenCheck::Light);
    if (!opened.db && opened.damaged) {
        std::string movedTo;
        if (std::optional<Error> error = quarantine(path, &movedTo)) return *error;
        log::ops().error("registry database %s is damaged (%@); moved it aside to %s and started an empty registry",
                         path, opened.error, movedTo);
        opened = openStore(path, options.durability, OpenCheck::Light);
    }
    if (!opened.db) return *opened.error;
    if (suspect) fs::remove(marker, ec);
    return std::make_shared<LedgerixWorkspace>(std::move(options), opened.db, Private{});
}

LedgerixWorkspace::LedgerixWorkspace(Options options, sqlite3* db, const Private&)
    : options_(std::move(options)), databasePath_(options_.stateDirectory / kDatabaseFileName), db_(db) {
    fs::path root = options_.rootDirectory.empty() ? fs::path("/") : options_.rootDirectory;
    std::string rootText = realPath(root.string()).value_or(root.lexically_normal().string());
    while (!rootText.empty() && rootText.back() == '/') rootText.pop_back();
    systemPrefix_ = rootText + "/System/";
}

LedgerixWorkspace::~LedgerixWorkspace() {
    statements_.clear();
    sqlite3_close(db_);
}

std::shared_ptr<LedgerixWorkspace::Statement> LedgerixWorkspace::statement(const std::string& sql) {
    for (const std::shared_ptr<Statement>& cached : statements_) {
        if (cached->sql() == sql) return cached;
    }
    if (statements_.size() >= kMaxCachedStatements) statements_.clear();
    sqlite3_stmt* stmt = nullptr;
    if (sqlite3_prepare_v3(db_, sql.c_str(), static_cast<int>(sql.size()), SQLITE_PREPARE_PERSISTENT, &stmt, nullptr) !=
        SQLITE_OK) {
        failure("prepare a statement");
        return nullptr;
    }
    statements_.push_back(std::make_shared<Statement>(sql, stmt));
    return statements_.back();
}

Error LedgerixWorkspace::failure(std::string_view what) {
    int code = sqlite3_extended_errcode(db_);
    Error error = storeError(db_, what);
    if (isDamage(code)) {
        // The file is damaged somewhere a light open check does not look; make the next open check every page.
        std::ofstream(databasePath_.string() + std::string(kNeedsCheckSuffix)) << "damage seen: " << what << "\n";
        log::ops().fault("registry database %s is damaged; it will be checked when next opened",
                         databasePath_.string());
    }
    return error;
}

void LedgerixWorkspace::LXClearSchemaCaches() {
    std::lock_guard lock(mutex_);
    statements_.clear();
    sqlite3_db_release_memory(db_);
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

}  // namespace

std::optional<std::vector<LedgerixWorkspace::Row>> LedgerixWorkspace::selectRowsLocked(
    std::string_view where, const std::vector<std::string>& arguments, std::optional<int64_t> integerArgument) {
    std::string sql(kSelectRow);
    if (!where.empty()) {
        sql += " WHERE ";
        sql += where;
    }
    sql += " ORDER BY p.id";
    std::shared_ptr<Statement> stmt = statement(sql);
    if (!stmt) return std::nullopt;
    StatementUse use(stmt->get());
    int index = 1;
    for (const std::string& argument : arguments) use.bind(index++, std::string_view(argument));
    if (integerArgument) use.bind(index++, *integerArgument);
    std::vector<Row> rows;
    int rc;
    while ((rc = use.step()) == SQLITE_ROW) {
        Row& row = rows.emplace_back();
        readRowColumns(use, row);
        if (!row.uuidValid) {
            log::ops().fault("registry row %lld at %s has no valid UUID; ignoring it", static_cast<long long>(row.id),
                             row.path);
            rows.pop_back();
        }
    }
    if (rc != SQLITE_DONE) {
        failure("read plug-in records");
        return std::nullopt;
    }
    return rows;
}

std::optional<std::vector<LedgerixWorkspace::Row>> LedgerixWorkspace::selectRows(
    std::string_view where, const std::vector<std::string>& arguments, std::optional<int64_t> integerArgument) {
    std::lock_guard lock(mutex_);
    return selectRowsLocked(where, arguments, integerArgument);
}

std::shared_ptr<const LXApplicationProxy> LedgerixWorkspace::applicationFromRow(const Row& row) {
    if (!row.appPath || !row.applicationId) return nullptr;
    LXApplicationProxy::Fields fields{*row.appPath, row.appIdentifier, row.appName, row.appPlaceholder};
    std::weak_ptr<LedgerixWorkspace> weak = weak_from_this();
    int64_t applicationId = *row.applicationId;
    return std::make_shared<const LXApplicationProxy>(
        std::move(fields), [weak, applicationId]() -> LXApplicationProxy::PlugInList {
            std::shared_ptr<LedgerixWorkspace> workspace = weak.lock();
            return workspace ? workspace->plugInsOfApplication(applicationId) : LXApplicationProxy::PlugInList{};
        });
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

LXProxyList LedgerixWorkspace::plugInsOfApplication(int64_t applicationId) {
    std::optional<std::vector<Row>> rows = selectRows("p.application_id = ?", {}, applicationId);
    if (!rows) return {};
    std::sort(rows->begin(), rows->end(), [](const Row& a, const Row& b) { return a.path < b.path; });
    return proxiesFromRows(*rows);
}

std::optional<LedgerixWorkspace::Row> LedgerixWorkspace::rowAtPathLocked(const std::string& path, bool* failed) {
    std::optional<std::vector<Row>> rows = selectRowsLocked("p.path = ?", {path}, std::nullopt);
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
        std::lock_guard lock(mutex_);
        std::shared_ptr<Statement> stmt = statement(std::string(kSelectRow) + " WHERE p.uuid = ?");
        if (!stmt) return nullptr;
        StatementUse use(stmt->get());
        use.bind(1, uuid);
        int rc = use.step();
        if (rc == SQLITE_ROW) {
            found.emplace();
            readRowColumns(use, *found);
        } else if (rc != SQLITE_DONE) {
            failure("look a plug-in up by UUID");
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
            std::lock_guard lock(mutex_);
            row = rowAtPathLocked(path, nullptr);
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
            std::lock_guard lock(mutex_);
            std::shared_ptr<Statement> stmt =
                statement("SELECT id, path, identifier, name, placeholder FROM applications WHERE path = ?");
            if (!stmt) return nullptr;
            StatementUse use(stmt->get());
            use.bind(1, std::string_view(path));
            int rc = use.step();
            if (rc == SQLITE_ROW) {
                applicationId = use.integer(0);
                fields = LXApplicationProxy::Fields{use.text(1).value_or(path), use.text(2), use.text(3),
                                                    use.integer(4) != 0};
            } else if (rc != SQLITE_DONE) {
                failure("look an application up");
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

std::optional<LXProxyList> LedgerixWorkspace::installedPlugins() {
    std::optional<std::vector<Row>> rows = selectRows("", {}, std::nullopt);
    if (!rows) return std::nullopt;
    log::lx().debug("%zu installed plug-in(s)", rows->size());
    return proxiesFromRows(*rows);
}

std::optional<LXProxyList> LedgerixWorkspace::pluginsMatchingQueryApplyFilter(const Value& query,
                                                                              const LXPlugInFilter& filter,
                                                                              const LXPreselection& preselection) {
    // The indexes narrow by what the rule engine says the query pins. A plug-in whose point is not one plain string
    // (point_wild), or that has no identifier, may still answer such a rule from its dictionaries, so it always
    // stays a candidate.
    std::string where;
    std::vector<std::string> arguments;
    auto constrain = [&](const std::optional<std::vector<std::string>>& values, std::string_view column,
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
    };
    constrain(preselection.extensionPoints, "p.point_key", "p.point_wild = 1");
    constrain(preselection.identifiers, "p.identifier_key", "p.identifier_key IS NULL");

    std::optional<std::vector<Row>> rows = selectRows(where, arguments, std::nullopt);
    if (!rows) return std::nullopt;
    log::lx().debug("%zu candidate(s) for %@ (pre-selection: %s)", rows->size(), query,
                    where.empty() ? std::string("none") : where);

    // The filter runs without the lock: it may call back into the registry.
    LXProxyList matches;
    for (const Row& row : *rows) {
        std::shared_ptr<const LXBexilProxy> proxy = proxyFromRow(row);
        if (filter && !filter(row.identifier.value_or(""), proxy->entitlements())) continue;
        matches.push_back(std::move(proxy));
    }
    log::lx().debug("%zu plug-in(s) pass the filter", matches.size());
    return matches;
}

std::optional<size_t> LedgerixWorkspace::plugInCount() {
    std::lock_guard lock(mutex_);
    std::shared_ptr<Statement> stmt = statement("SELECT count(*) FROM plugins");
    if (!stmt) return std::nullopt;
    StatementUse use(stmt->get());
    if (use.step() != SQLITE_ROW) {
        failure("count plug-ins");
        return std::nullopt;
    }
    return static_cast<size_t>(use.integer(0));
}

std::optional<Error> LedgerixWorkspace::checkIntegrity() {
    {
        std::lock_guard lock(mutex_);
        sqlite3_stmt* stmt = nullptr;
        if (sqlite3_prepare_v2(db_, "PRAGMA integrity_check", -1, &stmt, nullptr) != SQLITE_OK)
            return failure("run the integrity check");
        std::string verdict;
        int rc;
        while ((rc = sqlite3_step(stmt)) == SQLITE_ROW) {
            if (verdict.empty()) verdict = reinterpret_cast<const char*>(sqlite3_column_text(stmt, 0));
        }
        sqlite3_finalize(stmt);
        if (rc != SQLITE_DONE) return failure("run the integrity check");
        if (verdict != "ok") return lxError(kLXStoreFailure, "registry integrity check failed: " + verdict);
    }
    std::optional<std::vector<Row>> rows;
    {
        std::lock_guard lock(mutex_);
        rows = selectRowsLocked("", {}, std::nullopt);
        std::shared_ptr<Statement> stmt = statement("SELECT count(*) FROM plugins");
        if (!rows || !stmt) return failure("read every plug-in record");
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

// ---- Registration ----

Result<LedgerixWorkspace::Row> LedgerixWorkspace::readBundle(std::string_view url) {
    std::optional<std::string> lexical = lexicalPath(url);
    if (!lexical) return lxError(kLXBadPath, formatPrintf("not a usable absolute bundle path: \"%s\"", printable(url)));
    int error = 0;
    std::optional<std::string> real = realPath(*lexical, &error);
    if (!real) return lxError(kLXBadPath, formatPrintf("cannot resolve %s: %s", *lexical, std::strerror(error)));
    struct stat status;
    if (::stat(real->c_str(), &status) != 0 || !S_ISDIR(status.st_mode))
        return lxError(kLXBadPath, formatPrintf("%s is not a bundle directory", *real));

    Row row;
    row.path = *real;
    std::shared_ptr<const DirectoryBundle> bundle = DirectoryBundle::create(*real, BundleLookup::Directory);
    std::optional<Value> info = bundle->infoDictionary();
    if (!info) return lxError(kLXBadInfo, formatPrintf("no usable Info.vrec in %s: %s", *real, bundle->problem()));
    if (!info->isDictionary())
        return lxError(kLXBadInfo, formatPrintf("the Info.vrec of %s is not a dictionary", *real));
    const Value* plugIn = info->find("RZExtension");
    if (plugIn == nullptr) plugIn = info->find("Bexil");
    if (plugIn == nullptr || !plugIn->isDictionary())
        return lxError(kLXNotAPlugIn,
                       formatPrintf("%s is not a plug-in: its Info.vrec has no RZExtension dictionary", *real));

    fs::path entitlementsPath = fs::path(*real) / kEntitlementsFileName;
    struct stat entitlementsStatus;
    if (::lstat(entitlementsPath.c_str(), &entitlementsStatus) == 0) {
        if (entitlementsStatus.st_size > static_cast<off_t>(kMaxEntitlementsBytes))
            return lxError(kLXBadEntitlements, formatPrintf("the entitlements of %s are larger than %zu bytes", *real,
                                                            kMaxEntitlementsBytes));
        Result<Value> entitlements = Document::readFile(entitlementsPath);
        if (!entitlements.ok())
            return lxError(kLXBadEntitlements,
                           formatPrintf("cannot read the entitlements of %s: %@", *real, entitlements.error()));
        if (!entitlements->isDictionary())
            return lxError(kLXBadEntitlements, formatPrintf("the entitlements of %s are not a dictionary", *real));
        Result<std::string> text = Document::write(*entitlements);
        if (!text.ok()) return text.error();
        row.entitlements = std::move(text).value();
    } else if (errno != ENOENT) {
        return lxError(kLXBadEntitlements,
                       formatPrintf("cannot read the entitlements of %s: %s", *real, std::strerror(errno)));
    }

    row.identifier = stringEntry(*plugIn, kIdentifierKey);
    if (!row.identifier) row.identifier = stringEntry(*info, "BDBundleIdentifier");
    if (row.identifier && !validContainerName(*row.identifier))
        return lxError(kLXBadIdentifier, formatPrintf("the identifier \"%s\" of %s cannot name a data container",
                                                      *row.identifier, *real));
    if (row.identifier) row.identifierKey = matchForm(*row.identifier);
    row.bundleIdentifier = stringEntry(*info, "BDBundleIdentifier");
    row.bundleVersion = stringEntry(*info, "BDBundleVersion");

    // Discovery reads an extension point rule from the attributes, then from the top of the information
    // dictionary; a plug-in that holds the key there, or a non-string one in its plug-in dictionary, must stay a
    // candidate for any extension point.
    const Value* point = plugIn->find(kExtensionPointKey);
    if (point && point->isString()) row.pointKey = matchForm(*point->getString());
    const Value* attributes = plugIn->find("RZExtensionAttributes");
    row.pointWild = (point && !point->isString()) || info->contains(kExtensionPointKey) ||
                    (attributes && attributes->isDictionary() && attributes->contains(kExtensionPointKey));

    row.system = row.path.starts_with(systemPrefix_);
    row.name = displayName(info, row.path);
    row.shortName = stringEntry(*info, "BDBundleName");
    if (!row.shortName || row.shortName->empty()) row.shortName = row.name;

    // A plug-in directly inside X.app/PlugIns/ belongs to the application X.app.
    fs::path parent = fs::path(row.path).parent_path();
    fs::path application = parent.parent_path();
    if (parent.filename() == "PlugIns" && application.extension() == ".app" && application.stem() != "") {
        row.appPath = application.string();
        std::shared_ptr<const DirectoryBundle> appBundle =
            DirectoryBundle::create(application, BundleLookup::Directory);
        std::optional<Value> appInfo = appBundle->infoDictionary();
        if (appInfo && !appInfo->isDictionary()) appInfo.reset();
        row.appPlaceholder = !appInfo.has_value();
        if (appInfo) row.appIdentifier = stringEntry(*appInfo, "BDBundleIdentifier");
        row.appName = displayName(appInfo, *row.appPath);
    }

    const Value* protocol = plugIn->find("RZExtensionProtocol");
    bool carriesCode = !(protocol && protocol->isString() && *protocol->getString() == "#Data");
    if (carriesCode && row.identifier)
        row.container = (options_.stateDirectory / kContainersDirectoryName / *row.identifier).string();

    Result<std::string> infoText = Document::write(*info);
    if (!infoText.ok()) return infoText.error();
    row.info = std::move(infoText).value();
    return row;
}

std::optional<Error> LedgerixWorkspace::makeContainer(const std::string& path) {
    std::error_code ec;
    fs::create_directories(fs::path(path) / "tmp", ec);
    if (ec)
        return lxError(kLXContainerFailure, formatPrintf("cannot make the data container %s: %s", path, ec.message()));
    for (const fs::path& directory : {fs::path(path), fs::path(path) / "tmp"}) {
        struct stat status;
        if (::lstat(directory.c_str(), &status) != 0 || !S_ISDIR(status.st_mode))
            return lxError(kLXContainerFailure, formatPrintf("the data container %s is not a directory", path));
        ::chmod(directory.c_str(), 0700);
    }
    return std::nullopt;
}

std::optional<Error> LedgerixWorkspace::commitLocked(const Row& row, const Uuid& uuid, double registered,
                                                     std::optional<int64_t> replacedApplication) {
    if (!exec(db_, "BEGIN IMMEDIATE")) return failure("begin a registration");
    auto rollback = [&](std::string_view what) {
        Error error = failure(what);
        exec(db_, "ROLLBACK");
        return error;
    };

    std::optional<int64_t> applicationId;
    if (row.appPath) {
        std::shared_ptr<Statement> stmt = statement(
            "INSERT INTO applications(path, identifier, name, placeholder) VALUES(?, ?, ?, ?) "
            "ON CONFLICT(path) DO UPDATE SET identifier = excluded.identifier, name = excluded.name, "
            "placeholder = excluded.placeholder RETURNING id");
        if (!stmt) return rollback("prepare the application record");
        StatementUse use(stmt->get());
        use.bind(1, row.appPath);
        use.bind(2, row.appIdentifier);
        use.bind(3, row.appName);
        use.bind(4, int64_t{row.appPlaceholder});
        if (use.step() != SQLITE_ROW) return rollback("record the application");
        applicationId = use.integer(0);
        // RETURNING delivers the row before the statement is done; finish it so the insert is complete.
        while (use.step() == SQLITE_ROW) {
        }
    }
    {
        std::shared_ptr<Statement> stmt = statement("DELETE FROM plugins WHERE path = ?");
        if (!stmt) return rollback("prepare the removal of the old record");
        StatementUse use(stmt->get());
        use.bind(1, std::string_view(row.path));
        if (use.step() != SQLITE_DONE) return rollback("remove the old record");
    }
    {
        std::shared_ptr<Statement> stmt = statement(
            "INSERT INTO plugins(uuid, path, identifier, identifier_key, bundle_identifier, bundle_version, "
            "point_key, point_wild, application_id, system, registered, container, name, short_name, info, "
            "entitlements) VALUES(?, ?, ?, ?, ?, ?, ?, ?, ?, ?, ?, ?, ?, ?, ?, ?)");
        if (!stmt) return rollback("prepare the plug-in record");
        StatementUse use(stmt->get());
        use.bind(1, uuid);
        use.bind(2, std::string_view(row.path));
        use.bind(3, row.identifier);
        use.bind(4, row.identifierKey);
        use.bind(5, row.bundleIdentifier);
        use.bind(6, row.bundleVersion);
        use.bind(7, row.pointKey);
        use.bind(8, int64_t{row.pointWild});
        use.bind(9, applicationId);
        use.bind(10, int64_t{row.system});
        use.bindReal(11, registered);
        use.bind(12, row.container);
        use.bind(13, row.name);
        use.bind(14, row.shortName);
        use.bindBlob(15, row.info);
        use.bindBlob(16, row.entitlements);
        if (use.step() != SQLITE_DONE) return rollback("store the plug-in record");
    }
    if (replacedApplication && replacedApplication != applicationId) {
        if (std::optional<Error> error = dropApplicationIfEmptyLocked(*replacedApplication)) {
            exec(db_, "ROLLBACK");
            return error;
        }
    }
    if (!exec(db_, "COMMIT")) return rollback("commit a registration");
    return std::nullopt;
}

std::optional<Error> LedgerixWorkspace::dropApplicationIfEmptyLocked(int64_t applicationId) {
    std::shared_ptr<Statement> stmt = statement(
        "DELETE FROM applications WHERE id = ?1 AND NOT EXISTS (SELECT 1 FROM plugins WHERE application_id = ?1)");
    if (!stmt) return failure("prepare the removal of an empty application");
    StatementUse use(stmt->get());
    use.bind(1, applicationId);
    if (use.step() != SQLITE_DONE) return failure("remove an empty application");
    return std::nullopt;
}

Result<std::shared_ptr<const LXBexilProxy>> LedgerixWorkspace::registerPlugin(std::string_view url) {
    Result<Row> read = readBundle(url);
    if (!read.ok()) {
        log::lx().info("registration of %s refused: %@", printable(url), read.error());
        return read.error();
    }
    Row candidate = std::move(read).value();
    // The container is made before the record that names it is committed, and outside the lock; after a failure or
    // a crash in between an empty container is left behind, which the next registration of that identifier reuses.
    if (candidate.container) {
        if (std::optional<Error> error = makeContainer(*candidate.container)) {
            log::lx().info("registration of %s refused: %@", candidate.path, *error);
            return *error;
        }
    }

    std::vector<Uuid> announced;
    for (;;) {
        std::unique_lock lock(mutex_);
        bool failed = false;
        std::optional<Row> old = rowAtPathLocked(candidate.path, &failed);
        if (failed) return failure("read the current record");
        if (old && old->sameBundleAs(candidate)) {
            lock.unlock();
            log::lx().debug("%s is registered unchanged as %@", candidate.path, old->uuid);
            return proxyFromRow(*old);
        }
        if (old && std::find(announced.begin(), announced.end(), old->uuid) == announced.end()) {
            lock.unlock();
            announced.push_back(old->uuid);
            notifyObservers(Change::Uninstalled, {proxyFromRow(*old)});
            continue;
        }
        // The UUID names the plug-in as long as the bundle keeps its identity and version; a new build is a new
        // plug-in for everyone who caches by UUID.
        bool sameBuild =
            old && old->identifier == candidate.identifier && old->bundleVersion == candidate.bundleVersion;
        Uuid uuid = sameBuild ? old->uuid : Uuid::random();
        if (std::optional<Error> error =
                commitLocked(candidate, uuid, Date::now().secondsSince1970, old ? old->applicationId : std::nullopt))
            return *error;
        std::optional<Row> stored = rowAtPathLocked(candidate.path, &failed);
        if (!stored) return failure("read the new record back");
        lock.unlock();
        std::shared_ptr<const LXBexilProxy> proxy = proxyFromRow(*stored);
        log::lx().debug("registered %@", proxy);
        notifyObservers(Change::Installed, {proxy});
        return proxy;
    }
}

std::optional<Error> LedgerixWorkspace::unregisterPlugin(std::string_view url) {
    std::vector<std::string> paths = candidatePaths(url);
    std::vector<Uuid> announced;
    for (;;) {
        std::unique_lock lock(mutex_);
        std::optional<Row> row;
        for (const std::string& path : paths) {
            bool failed = false;
            row = rowAtPathLocked(path, &failed);
            if (failed) return failure("read the current record");
            if (row) break;
        }
        if (!row) {
            lock.unlock();
            log::lx().info("unregistration of %s refused: nothing is registered there", printable(url));
            return lxError(kLXNotRegistered, formatPrintf("no plug-in is registered at %s", printable(url)));
        }
        if (std::find(announced.begin(), announced.end(), row->uuid) == announced.end()) {
            lock.unlock();
            announced.push_back(row->uuid);
            notifyObservers(Change::Uninstalled, {proxyFromRow(*row)});
            continue;
        }
        if (!exec(db_, "BEGIN IMMEDIATE")) return failure("begin an unregistration");
        std::shared_ptr<Statement> stmt = statement("DELETE FROM plugins WHERE uuid = ?");
        bool deleted = false;
        if (stmt) {
            StatementUse use(stmt->get());
            use.bind(1, row->uuid);
            deleted = use.step() == SQLITE_DONE;
        }
        if (!deleted) {
            Error error = failure("remove a plug-in record");
            exec(db_, "ROLLBACK");
            return error;
        }
        if (row->applicationId) {
            if (std::optional<Error> error = dropApplicationIfEmptyLocked(*row->applicationId)) {
                exec(db_, "ROLLBACK");
                return error;
            }
        }
        if (!exec(db_, "COMMIT")) {
            Error error = failure("commit an unregistration");
            exec(db_, "ROLLBACK");
            return error;
        }
        lock.unlock();
        log::lx().debug("unregistered %s (%@)", row->path, row->uuid);
        return std::nullopt;
    }
}

}  // namespace bexil
