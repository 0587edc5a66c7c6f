#include "platform/containers/DataContainer.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "base/Format.h"
#include "base/PosixError.h"
#include "base/UniqueFd.h"

namespace bexil {

namespace {

constexpr mode_t kContainerMode = 0700;

// The directory `name` inside `parent`, made when missing, opened without following a link; ENOTDIR when what is
// there is not a real directory.
int openOrMakeDirectory(int parent, const char* name, int* error) {
    if (::mkdirat(parent, name, kContainerMode) != 0 && errno != EEXIST) {
        *error = errno;
        return -1;
    }
    int fd = ::openat(parent, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    if (fd < 0) {
        // A link answers ELOOP to O_NOFOLLOW, any other file ENOTDIR to O_DIRECTORY: both mean "not a directory".
        *error = errno == ELOOP ? ENOTDIR : errno;
        return -1;
    }
    struct stat status;
    if (::fstat(fd, &status) != 0 || !S_ISDIR(status.st_mode)) {
        ::close(fd);
        *error = ENOTDIR;
        return -1;
    }
    return fd;
}

}  // namespace

std::optional<Error> DataContainer::prepare(const std::filesystem::path& path, std::optional<Owner> owner) {
    auto failed = [&](int error) {
        if (error == ENOTDIR)
            return Error(std::string(BXPosixErrorDomain), ENOTDIR,
                         formatPrintf("the data container %s is not a directory", path.string()));
        return posixError(error, formatPrintf("cannot make the data container %s", path.string()));
    };
    std::error_code ec;
    std::filesystem::create_directories(path.parent_path(), ec);
    UniqueFd parent(::open(path.parent_path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!parent) return failed(errno);
    int error = 0;
    UniqueFd container(openOrMakeDirectory(parent.get(), path.filename().c_str(), &error));
    if (!container) return failed(error);
    UniqueFd tmp(openOrMakeDirectory(container.get(), "tmp", &error));
    if (!tmp) return failed(error);
    for (int fd : {container.get(), tmp.get()}) {
        if (::fchmod(fd, kContainerMode) != 0) return failed(errno);
        if (owner && ::fchown(fd, owner->uid, owner->gid) != 0) return failed(errno);
    }
    return std::nullopt;
}

}  // namespace bexil
