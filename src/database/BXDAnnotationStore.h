#pragma once

// BXDAnnotationStore keeps the per-plug-in annotations (the user's election, client data) in memory as one map and
// rewrites the whole annotation document (docs/annotations.md) after changes. The database owns the one store and
// calls it only while holding its lock `_sync`; the store has no lock of its own, so no other queue may call it. The
// one exception is writeSnapshot(), which touches nothing of the store's and so runs outside the lock: the database
// takes a snapshot inside `_sync`, writes it without holding anything, and notes the outcome inside `_sync` again.

#include <concepts>
#include <cstdint>
#include <filesystem>
#include <optional>
#include <string>
#include <string_view>

#include "base/Document.h"
#include "base/Error.h"
#include "bexil/Value.h"

namespace bexil {

// Anything that names the annotation key it reads and writes (the daemon's plug-in record does).
template <class P>
concept AnnotationKeyed = requires(const P& plugIn) {
    { plugIn.annotationKey() } -> std::convertible_to<std::string_view>;
};

class BXDAnnotationStore {
  public:
    // The only document version accepted and the one written.
    static constexpr int kDatabaseVersion = 16;
    // The daemon's identifier; its data container holds the legacy document.
    static constexpr const char* kDaemonIdentifier = "com.quorvel.bxd";
    // The name of the legacy document inside that container.
    static constexpr const char* kLegacyDocumentName = "Bexil-Annotations";

    // initWithDatabase: loads the document at `path` (a file), or at defaultDatabaseURL() when none; when that
    // fails, migrates the legacy document; else starts empty. Never fails: a bad document is logged and reset.
    // Throws InternalInconsistency only when the legacy document is needed and the container cannot be located.
    // `fileSystem` (used for every write) must outlive the store.
    explicit BXDAnnotationStore(std::optional<std::string> path,
                                Document::FileSystem& fileSystem = Document::posixFileSystem());
    BXDAnnotationStore(const BXDAnnotationStore&) = delete;
    BXDAnnotationStore& operator=(const BXDAnnotationStore&) = delete;

    // The annotation stored under `key` when it is a dictionary, else null.
    Value annotationForIdentifier(std::string_view key) const;

    template <AnnotationKeyed P>
    Value annotationForPlugIn(const P& plugIn) const {
        return annotationForIdentifier(plugIn.annotationKey());
    }

    // Merges `annotation` (a dictionary) into the entry under the plug-in's annotation key: given keys replace
    // stored ones, others stay. A null annotation removes the whole entry. Then writes the document; a failed
    // write is logged and the change stays in memory. Throws InternalInconsistency for any other kind of value.
    template <AnnotationKeyed P>
    void setAnnotationForPlugIn(const Value& annotation, const P& plugIn) {
        setAnnotationForIdentifier(annotation, plugIn.annotationKey());
    }
    // The same, for an annotation key.
    void setAnnotationForIdentifier(const Value& annotation, std::string_view key);

    // The merge of setAnnotationForPlugIn without the write: the change is in memory only until a later save.
    template <AnnotationKeyed P>
    void changeAnnotationForPlugIn(const Value& annotation, const P& plugIn) {
        changeAnnotationForIdentifier(annotation, plugIn.annotationKey());
    }
    void changeAnnotationForIdentifier(const Value& annotation, std::string_view key);

    // The map as it is now, numbered by the changes made so far, for writing outside the owner's lock.
    struct Snapshot {
        std::filesystem::path url;
        Value annotations;
        uint64_t generation = 0;
    };
    Snapshot snapshot() const { return {annotationsURL_, annotations_, generation_}; }
    // Writes `snapshot` atomically and durably. Reads nothing of the store but its file system, so any thread may
    // call it while another holds the owner's lock.
    std::optional<Error> writeSnapshot(const Snapshot& snapshot) const;
    // Takes note of how writing `snapshot` went (its error, or none).
    void noteSaved(const Snapshot& snapshot, const std::optional<Error>& error);
    // The number of changes made so far, and how many of them the document on disk holds.
    uint64_t generation() const { return generation_; }
    uint64_t savedGeneration() const { return savedGeneration_; }

    // Reads the document at `url`; on success its map replaces the store's, on failure the map is unchanged.
    // Fires the trace probe "db-load" on every failure, a missing file (POSIX ENOENT) included.
    std::optional<Error> loadDb(const std::filesystem::path& url);
    // Writes the whole map to annotationsURL() atomically and durably.
    std::optional<Error> saveDb();

    // "/var/db/Bexil-Annotations".
    static std::filesystem::path defaultDatabaseURL() { return globalURL(); }
    static std::filesystem::path globalURL() { return "/var/db/Bexil-Annotations"; }
    // The daemon's data container, <state dir>/containers/com.quorvel.bxd/. Logs and throws InternalInconsistency
    // when no state dir can be found.
    static std::filesystem::path containerURL();

    const std::filesystem::path& annotationsURL() const { return annotationsURL_; }
    void setAnnotationsURL(std::filesystem::path url) { annotationsURL_ = std::move(url); }
    // The annotation map: a dictionary from annotation key to annotation.
    const Value& annotations() const { return annotations_; }
    void setAnnotations(Value annotations);

    // Whether the map holds changes that did not reach the disk durably (a save failed since the last success).
    bool diskBehind() const { return diskBehind_; }

  private:
    // Removes temporary files that writes interrupted by a crash left beside the document.
    void removeStaleTemporaries() const;

    std::filesystem::path annotationsURL_;
    Value annotations_ = Value::emptyDictionary();
    Document::FileSystem& fileSystem_;
    bool diskBehind_ = false;
    uint64_t generation_ = 0;
    uint64_t savedGeneration_ = 0;
};

}  // namespace bexil
