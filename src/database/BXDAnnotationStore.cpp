#include "database/BXDAnnotationStore.h"

#include "base/StandardPaths.h"

// The store trusts nothing it reads: a document that cannot be used is logged, left on disk for inspection and
// replaced by the first write, never half-applied. Every write builds the whole document from the map in memory
// into a fresh temporary file and syncs it on its own descriptor before renaming it into place. Nothing of a failed
// write is reused, so a sync that failed (and whose dirty pages the kernel may have dropped without trace) can never
// be covered up by a later sync that reports success on the same pages: the next success is a success of its own.

#include <signal.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <cstdlib>
#include <system_error>
#include <utility>

#include "platform/log/Log.h"
#include "platform/trace/Probes.h"

namespace bexil {

namespace {

constexpr std::string_view kVersionKey = "version";
constexpr std::string_view kDataKey = "data";
constexpr std::string_view kTemporaryMarker = ".tmp-";

// <state dir> as the platform services share it, or the errno why there is none.
Result<std::filesystem::path> stateDirectoryOrError() {
    if (std::optional<std::filesystem::path> dir = stateDirectory()) return *dir;
    return Error(std::string(BXPosixErrorDomain), ENOENT, "no state directory: neither BX_STATE_DIR nor HOME is set");
}

}  // namespace

BXDAnnotationStore::BXDAnnotationStore(std::optional<std::string> path, Document::FileSystem& fileSystem)
    : annotationsURL_(path ? std::filesystem::path(*path) : defaultDatabaseURL()), fileSystem_(fileSystem) {
    removeStaleTemporaries();

    std::optional<Error> error = loadDb(annotationsURL_);
    if (!error) return;

    bool missing = error->domain() == BXPosixErrorDomain && error->code() == ENOENT;
    if (!missing)
        log::ops().error("unable to load annotation database:%{public}@ error:%{public}@ (resetting)",
                         annotationsURL_.string(), *error);

    if (!loadDb(containerURL() / kLegacyDocumentName)) {
        log::ops().info("migrating shared annotations");
        if (std::optional<Error> saveError = saveDb())
            log::ops().error("unable to save migrated annotations to %{public}@ error:%{public}@",
                             annotationsURL_.string(), *saveError);
    }
    // Otherwise the map is still the empty one it started as; nothing is written until the first change.
}

std::optional<Error> BXDAnnotationStore::loadDb(const std::filesystem::path& url) {
    auto fail = [](Error error) -> std::optional<Error> {
        trace::dbLoad(error.domain().c_str(), static_cast<uint64_t>(error.code()));
        return error;
    };

    Result<Value> root = Document::readFile(url);
    if (!root.ok()) return fail(root.error());
    if (!root->isDictionary())
        return fail(
            Error(std::string(BXDocumentErrorDomain), kDocumentMalformed,
                  url.string() + ": the root is of type " + valueKindName(root->kind()) + ", not a dictionary"));

    // A version that is not a number counts as absent, and absent counts as 0.
    int64_t version = root->get(kVersionKey).numberAsInt64().value_or(0);
    if (version != kDatabaseVersion)
        return fail(BXErrorWithFormat(ErrorCode::VersionMismatch, "found database version %d needed version %d",
                                      version, kDatabaseVersion));

    const Value* data = root->find(kDataKey);
    if (data == nullptr) {
        annotations_ = Value::emptyDictionary();
        return std::nullopt;
    }
    if (!data->isDictionary())
        return fail(
            Error(std::string(BXDocumentErrorDomain), kDocumentMalformed,
                  url.string() + ": root[\"data\"] is of type " + valueKindName(data->kind()) + ", not a dictionary"));
    annotations_ = *data;
    return std::nullopt;
}

std::optional<Error> BXDAnnotationStore::saveDb() {
    Snapshot now = snapshot();
    std::optional<Error> error = writeSnapshot(now);
    noteSaved(now, error);
    return error;
}

std::optional<Error> BXDAnnotationStore::writeSnapshot(const Snapshot& snapshot) const {
    MutableDictionary root;
    root.set(kVersionKey, Value::int64(kDatabaseVersion));
    root.set(kDataKey, snapshot.annotations);
    return Document::writeFileAtomically(snapshot.url, root.take(), fileSystem_);
}

void BXDAnnotationStore::noteSaved(const Snapshot& snapshot, const std::optional<Error>& error) {
    diskBehind_ = error.has_value();
    if (!error && snapshot.generation > savedGeneration_) savedGeneration_ = snapshot.generation;
}

std::filesystem::path BXDAnnotationStore::containerURL() {
    Result<std::filesystem::path> state = stateDirectoryOrError();
    if (!state.ok()) {
        auto code = static_cast<unsigned long long>(state.error().code());
        log::ops().error("failed to get storage container: error=%llu", code);
        throw InternalInconsistency(formatPrintf("unable to locate user container: error %llu", code));
    }
    return *state / "containers" / kDaemonIdentifier / "";
}

Value BXDAnnotationStore::annotationForIdentifier(std::string_view key) const {
    const Value* entry = annotations_.find(key);
    if (entry == nullptr || !entry->isDictionary()) return Value();
    return *entry;
}

void BXDAnnotationStore::setAnnotationForIdentifier(const Value& annotation, std::string_view key) {
    changeAnnotationForIdentifier(annotation, key);
    if (std::optional<Error> error = saveDb())
        log::ops().error("unable to save annotations:%{public}@ error:%{public}@", annotationsURL_.string(), *error);
}

void BXDAnnotationStore::changeAnnotationForIdentifier(const Value& annotation, std::string_view key) {
    if (!annotation.isNull() && !annotation.isDictionary())
        throw InternalInconsistency("annotation for \"" + std::string(key) + "\" is of type " +
                                    valueKindName(annotation.kind()) + ", not a dictionary");

    MutableDictionary map(annotations_);
    if (annotation.isNull()) {
        map.remove(key);
    } else {
        // A merge: what is given replaces, what is not given stays. Only removal drops keys.
        MutableDictionary merged(annotationForIdentifier(key));
        for (const DictionaryEntry& entry : annotation.entries()) merged.set(entry.key, entry.value);
        map.set(key, merged.take());
    }
    annotations_ = map.take();
    ++generation_;
}

void BXDAnnotationStore::setAnnotations(Value annotations) {
    annotations_ = annotations.isDictionary() ? std::move(annotations) : Value::emptyDictionary();
    ++generation_;
}

void BXDAnnotationStore::removeStaleTemporaries() const {
    std::filesystem::path directory = annotationsURL_.parent_path();
    if (directory.empty()) directory = ".";
    std::string prefix = annotationsURL_.filename().string() + std::string(kTemporaryMarker);

    std::error_code ec;
    std::filesystem::directory_iterator it(directory, ec), end;
    for (; !ec && it != end; it.increment(ec)) {
        std::string name = it->path().filename().string();
        if (name.compare(0, prefix.size(), prefix) != 0) continue;
        // "<name>.tmp-<pid>-<hex>": a file whose writer still runs is in use and stays.
        std::string_view rest = std::string_view(name).substr(prefix.size());
        pid_t pid = 0;
        auto [end_, parseError] = std::from_chars(rest.data(), rest.data() + rest.size(), pid);
        if (parseError != std::errc() || end_ == rest.data() + rest.size() || *end_ != '-' || pid <= 0) continue;
        if (pid == getpid() || kill(pid, 0) == 0 || errno != ESRCH) continue;
        std::error_code removeError;
        if (std::filesystem::remove(it->path(), removeError))
            log::ops().info("removed the leftover of an interrupted annotation write: %{public}s", it->path().string());
    }
}

}  // namespace bexil
