#pragma once

// TypeRegistry answers whether one type identifier conforms to another, from the shared MIME database's `aliases`
// and `subclasses` files under each data directory's "mime" folder. A type conforms to itself, to the canonical
// type its alias names, and, transitively, to every type it is declared a subclass of; like the MIME database, it
// also treats every text/* type as a subclass of text/plain and every type outside inode/* as a subclass of
// application/octet-stream. Names compare without regard to ASCII case.
//
// The files are read on first use and kept; a later query re-reads them when their modification time, size or
// identity changed (checked at most once per recheck interval). One registry may be shared by any number of
// threads; the data it answers from is an immutable snapshot swapped in one step. Subclass it in tests to
// substitute the answers.

#include <chrono>
#include <filesystem>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

namespace bexil {

class TypeRegistry {
  public:
    // A file larger than this is not read (a MIME database's files are a few tens of kilobytes); logged when hit.
    static constexpr uintmax_t kMaxFileBytes = 16u << 20;
    // Most types one conformance query walks through before it gives up (logged when hit); real databases need
    // fewer than ten.
    static constexpr size_t kMaxTypesVisited = 4096;
    // How often, at most, a query checks whether the files changed.
    static constexpr std::chrono::milliseconds kDefaultRecheckInterval{1000};

    // Reads `<dir>/mime/aliases` and `<dir>/mime/subclasses` of each directory; an alias in an earlier directory
    // wins over one in a later directory, subclass declarations of all directories add up.
    explicit TypeRegistry(std::vector<std::filesystem::path> dataDirs,
                          std::chrono::milliseconds recheckInterval = kDefaultRecheckInterval);
    virtual ~TypeRegistry();
    TypeRegistry(const TypeRegistry&) = delete;
    TypeRegistry& operator=(const TypeRegistry&) = delete;

    // The directories of $XDG_DATA_DIRS, or /usr/local/share and /usr/share when it is unset or empty.
    static std::vector<std::filesystem::path> defaultDataDirs();
    // The process-wide registry over defaultDataDirs(), made on first use.
    static TypeRegistry& shared();

    // True when `type` conforms to `other`. An empty identifier conforms to nothing.
    virtual bool conformsTo(std::string_view type, std::string_view other) const;

    // The lower-cased canonical name of `type`: the target of its alias, if it has one, else itself.
    std::string canonicalType(std::string_view type) const;

    const std::vector<std::filesystem::path>& dataDirs() const { return dataDirs_; }

  private:
    struct Snapshot;
    struct FileStamp;

    std::shared_ptr<const Snapshot> current() const;
    std::vector<FileStamp> stampFiles() const;
    std::shared_ptr<const Snapshot> load(std::vector<FileStamp> stamps) const;

    const std::vector<std::filesystem::path> dataDirs_;
    const std::chrono::milliseconds recheckInterval_;
    // Guards snapshot_ and lastCheck_; never held while reading files.
    mutable std::mutex mutex_;
    mutable std::shared_ptr<const Snapshot> snapshot_;
    mutable std::chrono::steady_clock::time_point lastCheck_{};
};

}  // namespace bexil
