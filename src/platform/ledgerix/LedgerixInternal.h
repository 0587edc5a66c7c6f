#pragma once

// The registry's internals shared by its source files (not for use outside src/platform/ledgerix): the SQLite store
// (schema, statements, opening and recovery), the row shape, and the small path and text helpers. Everything here
// runs under the workspace's mutex unless it says otherwise.

#include <sqlite3.h>

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "bexil/Value.h"
#include "platform/bundles/DirectoryBundle.h"
#include "platform/ledgerix/LedgerixWorkspace.h"

namespace bexil {

namespace ledgerix_detail {

// Next to the database: present when damage was seen at run time, so that the next open runs the full check.
inline constexpr std::string_view kNeedsCheckSuffix = ".needs-check";
inline constexpr std::string_view kEntitlementsFileName = "Entitlements.vrec";
// Entitlements are a handful of keys; like information documents, anything larger is refused rather than read.
inline constexpr size_t kMaxEntitlementsBytes = DirectoryBundle::kMaxInfoBytes;
inline constexpr std::string_view kExtensionPointKey = "RZExtensionPointIdentifier";
inline constexpr std::string_view kIdentifierKey = "RZExtensionIdentifier";
// Dynamic discovery queries get statements of their own shape; past this many the cache is dropped and rebuilt.
inline constexpr size_t kMaxCachedStatements = 64;

inline constexpr std::string_view kSelectRow =
    "SELECT p.id, p.uuid, p.path, p.identifier, p.bundle_identifier, p.bundle_version, p.application_id, p.system, "
    "p.registered, p.container, p.name, p.short_name, p.info, p.entitlements, "
    "a.path, a.identifier, a.name, a.placeholder "
    "FROM plugins p LEFT JOIN applications a ON a.id = p.application_id";

Error storeError(sqlite3* db, std::string_view what);
Error lxError(LXErrorCode code, std::string message);
// The form in which indexed keys are stored and looked up: every run of digits without its leading zeros (a run of
// zeros keeps one). Discovery tells "v01" from "v1", so one key may stand for a few values that a rule tells apart;
// that only widens the candidates, which the caller checks rule by rule anyway.
std::string matchForm(std::string_view text);
// The URL as a caller sent it, quoted and safe to put in a message (a NUL among its bytes is escaped).
std::string printable(std::string_view url);
std::optional<std::string> stringEntry(const Value& dictionary, std::string_view key);
// A URL or path as the registry keys it: absolute, a file URL read as its path, "." and ".." folded, no trailing
// slash. None for anything that cannot be a bundle path.
std::optional<std::string> lexicalPath(std::string_view url);
std::optional<std::string> realPath(const std::string& path, int* error = nullptr);
// The name shown for a bundle: its display name, else its name, else its directory name without extension.
std::string displayName(const std::optional<Value>& info, const std::string& path);
bool validContainerName(const std::string& identifier);

// Whether a result code means the file is damaged (not a database, or corrupt).
bool isDamage(int code);
// Runs SQL that returns no rows; false on any failure (sqlite3_errcode tells which).
bool exec(sqlite3* db, const char* sql);

// An opened store, or why it could not be opened.
struct Opened {
    sqlite3* db = nullptr;
    std::optional<Error> error;
    // The file is not a database or fails its check: it may be moved aside and replaced.
    bool damaged = false;
};
enum class OpenCheck { Light, Full };
// Opens (creating when needed) and configures the store at `path`, checks it as `check` says and migrates its
// schema to kSchemaVersion, through the VFS that `options` names.
Opened openStore(const std::string& path, const LedgerixWorkspace::Options& options, OpenCheck check);
// A second connection to the store that openStore opened (and so checked and migrated) at `path`, for look-ups
// only: it refuses to write.
Opened openLookupConnection(const std::string& path, const LedgerixWorkspace::Options& options);
// Moves a damaged database and its companions aside; the error when that is impossible.
std::optional<Error> quarantine(const std::string& path, std::string* movedTo);

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

}  // namespace ledgerix_detail

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
    // Read for a query told that the caller holds this record: only the id, UUID, identifier and placeholder flag
    // were read.
    bool held = false;
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

}  // namespace bexil
