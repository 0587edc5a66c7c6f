#pragma once

// The trusted source of program entitlements: a directory of .vrec documents, each naming one executable by its
// real path together with that program's entitlements. A file counts only when it, and the executable it names,
// are owned by root or by the daemon's own user and are writable by nobody else; anything else is ignored, so a
// mistake in the directory can only ever take entitlements away. Thread-safe; parsed files are cached and re-read
// only when their inode, size or modification time changes.

#include <sys/stat.h>
#include <sys/types.h>

#include <filesystem>
#include <map>
#include <mutex>
#include <optional>
#include <string>

#include "base/Error.h"
#include "bexil/Value.h"

namespace bexil {

class EntitlementsDirectory {
  public:
    // Keys of an entitlements document: {"Executable": "/real/path", "Entitlements": {...}}.
    static constexpr std::string_view kExecutableKey = "Executable";
    static constexpr std::string_view kEntitlementsKey = "Entitlements";

    // `trustedUid` is the one owner besides root that files and executables may have (the daemon's effective uid).
    explicit EntitlementsDirectory(std::filesystem::path directory, uid_t trustedUid);

    // $BX_ENTITLEMENTS_DIR, else /etc/bexil/entitlements.d.
    static std::filesystem::path defaultPath();

    // The entitlements dictionary of the executable at `realPath` (already resolved), or an empty dictionary when
    // no trusted file names it. With `running` (the status of the file a process really runs) the file at
    // `realPath` must also be that very file. An error means the directory could not be read at all.
    Result<Value> entitlementsForExecutable(const std::string& realPath, const struct stat* running = nullptr);

    // True when `path` is owned by root or `trustedUid` and neither group- nor world-writable.
    static bool isTrustedFile(const std::filesystem::path& path, uid_t trustedUid);
    // True when `path` is a directory (a link to one counts as what it points at) owned by root or `trustedUid` and
    // neither group- nor world-writable: the condition for any file in it to count.
    static bool isTrustedDirectory(const std::filesystem::path& path, uid_t trustedUid);

    const std::filesystem::path& directory() const { return directory_; }

  private:
    struct CachedFile {
        ino_t inode = 0;
        off_t size = 0;
        struct timespec mtime {};
        std::optional<std::string> executable;  // none when the file is untrusted or malformed
        Value entitlements;
    };

    std::filesystem::path directory_;
    uid_t trustedUid_;
    std::mutex mutex_;
    std::map<std::string, CachedFile> cache_;  // by file name
};

}  // namespace bexil
