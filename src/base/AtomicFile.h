#pragma once

// Replacing a file so that a reader, or the file system after a crash, sees the old content or the new one and
// never a part: a temporary file of a fresh name beside the target is written, synced, renamed over the target,
// and the directory synced. The system calls go through a FileSystem that tests derive from to make one call fail.
// Stateless apart from the calls; any thread (two writers of one target each win in turn).

#include <sys/types.h>

#include <filesystem>
#include <optional>
#include <string_view>

#include "base/Error.h"

namespace bexil {

// The system calls of an atomic replacement. The base class makes the plain POSIX calls; each returns what the
// system call returns and leaves errno set on failure.
class FileSystem {
  public:
    virtual ~FileSystem() = default;
    virtual int open(const char* path, int flags, mode_t mode);
    virtual ssize_t write(int fd, const void* bytes, size_t count);
    virtual int fsync(int fd);
    virtual int close(int fd);
    virtual int rename(const char* from, const char* to);
    virtual int unlink(const char* path);
};

// The plain POSIX calls.
FileSystem& posixFileSystem();

// Whether the replacement must survive a crash of the machine, or only be whole for readers (a counter that
// observers re-read anyway is not worth the syncs).
enum class Durability { Synced, ReadersOnly };

// Replaces the file at `path` with `bytes`, created with `mode` (less the umask). On failure before the rename the
// old file is untouched and the temporary file removed; when only the directory sync fails, the new content is in
// place but the error is still returned, because it may not be durable. Errors are POSIX errors naming the call
// and the file ("fsync \"/x/.y.tmp-1-ab\": Input/output error").
std::optional<Error> replaceFileAtomically(const std::filesystem::path& path, std::string_view bytes,
                                           mode_t mode = 0666, Durability durability = Durability::Synced,
                                           FileSystem& fileSystem = posixFileSystem());

}  // namespace bexil
