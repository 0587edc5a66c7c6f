// Registration: reading a bundle from disk into a row, making its data container, and the three-step change
// (read, announce the uninstall unlocked, apply in one transaction) that LedgerixWorkspace.cpp describes.

#include <sqlite3.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <fstream>
#include <system_error>

#include "base/ActingAs.h"
#include "base/Document.h"
#include "platform/bundles/DirectoryBundle.h"
#include "platform/containers/DataContainer.h"
#include "platform/ledgerix/LXBexilProxy.h"
#include "platform/ledgerix/LedgerixInternal.h"
#include "platform/log/Log.h"

namespace bexil {

namespace fs = std::filesystem;
using namespace ledgerix_detail;

namespace {

// The bundle's entitlements in document form, none when it has no entitlements file, or why they cannot be used.
Result<std::optional<std::string>> readEntitlements(const std::string& bundlePath) {
    fs::path entitlementsPath = fs::path(bundlePath) / kEntitlementsFileName;
    struct stat entitlementsStatus;
    if (::lstat(entitlementsPath.c_str(), &entitlementsStatus) != 0) {
        if (errno == ENOENT) return std::optional<std::string>();
        return lxError(kLXBadEntitlements,
                       formatPrintf("cannot read the entitlements of %s: %s", bundlePath, std::strerror(errno)));
    }
    if (entitlementsStatus.st_size > static_cast<off_t>(kMaxEntitlementsBytes))
        return lxError(kLXBadEntitlements, formatPrintf("the entitlements of %s are larger than %zu bytes", bundlePath,
                                                        kMaxEntitlementsBytes));
    Result<Value> entitlements = Document::readFile(entitlementsPath);
    if (!entitlements.ok())
        return lxError(kLXBadEntitlements,
                       formatPrintf("cannot read the entitlements of %s: %@", bundlePath, entitlements.error()));
    if (!entitlements->isDictionary())
        return lxError(kLXBadEntitlements, formatPrintf("the entitlements of %s are not a dictionary", bundlePath));
    Result<std::string> text = Document::write(*entitlements);
    if (!text.ok()) return text.error();
    return std::optional<std::string>(std::move(text).value());
}

// A plug-in directly inside X.app/PlugIns/ belongs to the application X.app: the row gets its columns.
void describeApplication(LedgerixWorkspace::Row& row) {
    fs::path parent = fs::path(row.path).parent_path();
    fs::path application = parent.parent_path();
    if (parent.filename() != "PlugIns" || application.extension() != ".app" || application.stem() == "") return;
    row.appPath = application.string();
    std::shared_ptr<const DirectoryBundle> appBundle = DirectoryBundle::create(application, BundleLookup::Directory);
    std::optional<Value> appInfo = appBundle->infoDictionary();
    if (appInfo && !appInfo->isDictionary()) appInfo.reset();
    row.appPlaceholder = !appInfo.has_value();
    if (appInfo) row.appIdentifier = stringEntry(*appInfo, "BDBundleIdentifier");
    row.appName = displayName(appInfo, *row.appPath);
}

}  // namespace

Result<LedgerixWorkspace::Row> LedgerixWorkspace::readBundle(std::string_view url) {
    std::optional<std::string> lexical = lexicalPath(url);
    if (!lexical) return lxError(kLXBadPath, formatPrintf("not a usable absolute bundle path: %s", printable(url)));
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

    Result<std::optional<std::string>> entitlements = readEntitlements(*real);
    if (!entitlements.ok()) return entitlements.error();
    row.entitlements = std::move(entitlements).value();

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

    describeApplication(row);

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
    if (std::optional<Error> error = DataContainer::prepare(path))
        return lxError(kLXContainerFailure, error->localizedDescription().value_or(path));
    return std::nullopt;
}

std::optional<Error> LedgerixWorkspace::commitLocked(const Row& row, const Uuid& uuid, double registered,
                                                     std::optional<int64_t> replacedApplication) {
    if (!exec(store_.db, "BEGIN IMMEDIATE")) return failure(store_, "begin a registration");
    auto rollback = [&](std::string_view what) {
        Error error = failure(store_, what);
        exec(store_.db, "ROLLBACK");
        return error;
    };

    std::optional<int64_t> applicationId;
    if (row.appPath) {
        std::shared_ptr<Statement> stmt =
            statement(store_,
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
        std::shared_ptr<Statement> stmt = statement(store_, "DELETE FROM plugins WHERE path = ?");
        if (!stmt) return rollback("prepare the removal of the old record");
        StatementUse use(stmt->get());
        use.bind(1, std::string_view(row.path));
        if (use.step() != SQLITE_DONE) return rollback("remove the old record");
    }
    {
        std::shared_ptr<Statement> stmt =
            statement(store_,
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
            exec(store_.db, "ROLLBACK");
            return error;
        }
    }
    if (!exec(store_.db, "COMMIT")) return rollback("commit a registration");
    return std::nullopt;
}

std::optional<Error> LedgerixWorkspace::dropApplicationIfEmptyLocked(int64_t applicationId) {
    std::shared_ptr<Statement> stmt = statement(
        store_,
        "DELETE FROM applications WHERE id = ?1 AND NOT EXISTS (SELECT 1 FROM plugins WHERE application_id = ?1)");
    if (!stmt) return failure(store_, "prepare the removal of an empty application");
    StatementUse use(stmt->get());
    use.bind(1, applicationId);
    if (use.step() != SQLITE_DONE) return failure(store_, "remove an empty application");
    return std::nullopt;
}

Result<std::shared_ptr<const LXBexilProxy>> LedgerixWorkspace::registerPlugin(std::string_view url,
                                                                              std::optional<UserIdentity> readAs) {
    // Everything read of the bundle is read with the rights of the user it is registered for, so that nobody
    // learns through the registry what they could not read themselves; what the registry then writes is its own.
    Result<Row> read = [&]() -> Result<Row> {
        ActingAs reader(readAs);
        if (!reader.ok())
            return lxError(kLXBadPath, formatPrintf("cannot read %s as user %u", printable(url),
                                                    static_cast<unsigned>(readAs ? readAs->uid : 0)));
        return readBundle(url);
    }();
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
        std::unique_lock lock(store_.mutex);
        bool failed = false;
        std::optional<Row> old = rowAtPathLocked(store_, candidate.path, &failed);
        if (failed) return failure(store_, "read the current record");
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
        std::optional<Row> stored = rowAtPathLocked(store_, candidate.path, &failed);
        if (!stored) return failure(store_, "read the new record back");
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
        std::unique_lock lock(store_.mutex);
        std::optional<Row> row;
        for (const std::string& path : paths) {
            bool failed = false;
            row = rowAtPathLocked(store_, path, &failed);
            if (failed) return failure(store_, "read the current record");
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
        if (!exec(store_.db, "BEGIN IMMEDIATE")) return failure(store_, "begin an unregistration");
        std::shared_ptr<Statement> stmt = statement(store_, "DELETE FROM plugins WHERE uuid = ?");
        bool deleted = false;
        if (stmt) {
            StatementUse use(stmt->get());
            use.bind(1, row->uuid);
            deleted = use.step() == SQLITE_DONE;
        }
        if (!deleted) {
            Error error = failure(store_, "remove a plug-in record");
            exec(store_.db, "ROLLBACK");
            return error;
        }
        if (row->applicationId) {
            if (std::optional<Error> error = dropApplicationIfEmptyLocked(*row->applicationId)) {
                exec(store_.db, "ROLLBACK");
                return error;
            }
        }
        if (!exec(store_.db, "COMMIT")) {
            Error error = failure(store_, "commit an unregistration");
            exec(store_.db, "ROLLBACK");
            return error;
        }
        lock.unlock();
        log::lx().debug("unregistered %s (%@)", row->path, row->uuid);
        return std::nullopt;
    }
}

}  // namespace bexil
