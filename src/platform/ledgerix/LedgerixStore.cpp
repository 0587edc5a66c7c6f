// The registry's SQLite store: the schema and its migrations, opening with the checks that find damage, moving a
// damaged file aside, and the small helpers the rest of the registry shares.

#include <sqlite3.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <ctime>
#include <system_error>

#include "base/Text.h"
#include "platform/ledgerix/LedgerixInternal.h"
#include "platform/log/Log.h"

namespace bexil::ledgerix_detail {

namespace fs = std::filesystem;

namespace {

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
    // The paged discovery walk visits plug-ins by identifier, then registration; without this index every page
    // would sort the whole table.
    R"sql(
    CREATE INDEX plugins_walk ON plugIns(coalesce(identifier, ''), id);
    )sql",
    // A walk narrowed to an extension point or an identifier reads each alternative of the pre-selection in walk
    // order from one of these; without them every stretch would collect and sort all the point's remaining plug-ins.
    R"sql(
    CREATE INDEX plugins_point_walk ON plugIns(point_key, coalesce(identifier, ''), id);
    CREATE INDEX plugins_wild_walk ON plugIns(coalesce(identifier, ''), id) WHERE point_wild = 1;
    CREATE INDEX plugins_identifier_walk ON plugIns(identifier_key, coalesce(identifier, ''), id);
    )sql",
};
static_assert(std::size(kMigrations) == LedgerixWorkspace::kSchemaVersion);

}  // namespace

bool exec(sqlite3* db, const char* sql) { return sqlite3_exec(db, sql, nullptr, nullptr, nullptr) == SQLITE_OK; }

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
std::string printable(std::string_view url) { return quotedForMessage(url); }

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

std::optional<std::string> realPath(const std::string& path, int* error) {
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

bool isDamage(int code) {
    int primary = code & 0xff;
    return primary == SQLITE_CORRUPT || primary == SQLITE_NOTADB;
}

namespace {

// A step of opening that failed: the store's own error for `what` (read before the connection closes), and whether
// the code says the file is damaged.
Opened failedTo(sqlite3* db, std::string_view what, int code) {
    return {nullptr, storeError(db, what), isDamage(code)};
}
Opened refused(Error error, bool damaged = false) { return {nullptr, std::move(error), damaged}; }

// The value of a one-row pragma, or none.
std::optional<sqlite3_int64> pragmaNumber(sqlite3* db, const char* sql) {
    sqlite3_stmt* stmt = nullptr;
    int rc = sqlite3_prepare_v2(db, sql, -1, &stmt, nullptr);
    if (rc == SQLITE_OK) rc = sqlite3_step(stmt);
    std::optional<sqlite3_int64> value;
    if (rc == SQLITE_ROW) value = sqlite3_column_int64(stmt, 0);
    sqlite3_finalize(stmt);
    return value;
}

// WAL keeps readers and the writer apart and makes a commit one append; FULL syncs the log at every commit, so a
// registration that returned is on disk. NORMAL leaves the sync to checkpoints: still atomic, and still safe when
// only the process dies, because the log is in the kernel's hands once written.
std::optional<Opened> configure(sqlite3* db, LedgerixWorkspace::Durability durability) {
    sqlite3_stmt* stmt = nullptr;
    int rc = sqlite3_prepare_v2(db, "PRAGMA journal_mode=WAL", -1, &stmt, nullptr);
    if (rc == SQLITE_OK) rc = sqlite3_step(stmt);
    std::string mode = rc == SQLITE_ROW ? reinterpret_cast<const char*>(sqlite3_column_text(stmt, 0)) : "";
    sqlite3_finalize(stmt);
    if (rc != SQLITE_ROW) return failedTo(db, "switch to write-ahead logging", sqlite3_errcode(db));
    if (mode != "wal")
        return refused(lxError(kLXStoreFailure, "registry store refused write-ahead logging (mode " + mode + ")"));
    const char* synchronous =
        durability == LedgerixWorkspace::Durability::Full ? "PRAGMA synchronous=FULL" : "PRAGMA synchronous=NORMAL";
    if (!exec(db, synchronous) || !exec(db, "PRAGMA foreign_keys=ON"))
        return failedTo(db, "configure the database", sqlite3_errcode(db));
    return std::nullopt;
}

// The full check reads every page; it runs when the last run saw damage (the marker file).
std::optional<Opened> checkEveryPage(sqlite3* db) {
    sqlite3_stmt* stmt = nullptr;
    int rc = sqlite3_prepare_v2(db, "PRAGMA quick_check", -1, &stmt, nullptr);
    std::string verdict;
    if (rc == SQLITE_OK) {
        while ((rc = sqlite3_step(stmt)) == SQLITE_ROW) {
            if (verdict.empty()) verdict = reinterpret_cast<const char*>(sqlite3_column_text(stmt, 0));
        }
    }
    sqlite3_finalize(stmt);
    if (rc != SQLITE_DONE) return failedTo(db, "check the database", sqlite3_errcode(db));
    if (verdict == "ok") return std::nullopt;
    // The check lists every bad page; the first few say enough.
    if (verdict.size() > 300) verdict = verdict.substr(0, 300) + "...";
    return refused(lxError(kLXStoreFailure, "registry database check failed: " + verdict), true);
}

// What a registry of 100,000 plug-ins can pay at every start: read the header and the schema and check that the file
// is as long as its header says, which finds truncation and files that are not databases.
std::optional<Opened> checkHeaderAndLength(sqlite3* db, const std::string& path) {
    if (!exec(db, "SELECT count(*) FROM sqlite_schema")) return failedTo(db, "read the schema", sqlite3_errcode(db));
    std::optional<sqlite3_int64> pages = pragmaNumber(db, "PRAGMA page_count");
    std::optional<sqlite3_int64> pageSize = pages ? pragmaNumber(db, "PRAGMA page_size") : std::nullopt;
    if (!pages || !pageSize) return failedTo(db, "read the database size", sqlite3_errcode(db));
    // Pages still in the log may lie beyond the end of the file; without a log the file holds every page.
    std::error_code ec;
    bool logPending = fs::exists(path + "-wal", ec) && fs::file_size(path + "-wal", ec) > 0;
    uintmax_t size = fs::file_size(path, ec);
    auto expected = static_cast<uintmax_t>(*pages * *pageSize);
    if (logPending || ec || size >= expected) return std::nullopt;
    return refused(lxError(kLXStoreFailure, formatPrintf("registry database is truncated: %ju of %lld bytes", size,
                                                         static_cast<long long>(expected))),
                   true);
}

// Brings the schema to kSchemaVersion one released step at a time; a newer schema is left alone.
std::optional<Opened> migrate(sqlite3* db, const std::string& path) {
    std::optional<sqlite3_int64> found = pragmaNumber(db, "PRAGMA user_version");
    if (!found) return failedTo(db, "read the schema version", sqlite3_errcode(db));
    int64_t version = *found;
    if (version > LedgerixWorkspace::kSchemaVersion || version < 0) {
        return refused(lxError(kLXStoreFailure,
                               formatPrintf("registry database %s has schema version %lld; this program knows up "
                                            "to %d",
                                            path, static_cast<long long>(version), LedgerixWorkspace::kSchemaVersion)));
    }
    for (int64_t step = version; step < LedgerixWorkspace::kSchemaVersion; ++step) {
        std::string sql = std::string("BEGIN IMMEDIATE;") + kMigrations[step] +
                          formatPrintf("PRAGMA user_version = %lld; COMMIT;", static_cast<long long>(step + 1));
        if (!exec(db, sql.c_str())) {
            int code = sqlite3_errcode(db);
            Opened failure = failedTo(db, "migrate the schema", code);
            exec(db, "ROLLBACK");
            return failure;
        }
        log::lx().info("registry database %s migrated to schema version %lld", path, static_cast<long long>(step + 1));
    }
    return std::nullopt;
}

}  // namespace

Opened openStore(const std::string& path, const LedgerixWorkspace::Options& options, OpenCheck check) {
    sqlite3* db = nullptr;
    int rc = sqlite3_open_v2(path.c_str(), &db, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_NOMUTEX,
                             options.storeVfs.empty() ? nullptr : options.storeVfs.c_str());
    std::optional<Opened> failure;
    if (rc != SQLITE_OK) {
        failure = failedTo(db, "open the database", rc);
    } else {
        sqlite3_extended_result_codes(db, 1);
        sqlite3_busy_timeout(db, 5000);
        failure = configure(db, options.durability);
        if (!failure) failure = check == OpenCheck::Full ? checkEveryPage(db) : checkHeaderAndLength(db, path);
        if (!failure) failure = migrate(db, path);
    }
    if (failure) {
        sqlite3_close(db);
        return *failure;
    }
    return Opened{db, std::nullopt, false};
}

Opened openLookupConnection(const std::string& path, const LedgerixWorkspace::Options& options) {
    sqlite3* db = nullptr;
    int rc = sqlite3_open_v2(path.c_str(), &db, SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOMUTEX,
                             options.storeVfs.empty() ? nullptr : options.storeVfs.c_str());
    if (rc == SQLITE_OK) {
        sqlite3_extended_result_codes(db, 1);
        sqlite3_busy_timeout(db, 5000);
        // The log mode is recorded in the file, so this connection is in it already; query_only keeps it a reader.
        if (!exec(db, "PRAGMA query_only=ON")) rc = sqlite3_errcode(db);
    }
    if (rc != SQLITE_OK) {
        Opened failure = failedTo(db, "open the database for look-ups", rc);
        sqlite3_close(db);
        return failure;
    }
    return Opened{db, std::nullopt, false};
}

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

}  // namespace bexil::ledgerix_detail
