#include "base/AtomicFile.h"

#include <fcntl.h>
#include <sys/random.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdio>
#include <string>

#include "base/PosixError.h"

namespace bexil {

namespace {

// "<operation> "<path>": <strerror>", in the POSIX domain.
Error fileError(int error, std::string_view operation, const std::filesystem::path& path) {
    return posixError(error, std::string(operation) + " \"" + path.string() + "\"");
}

// A name of our own beside the target, so the rename stays within one file system and two writers never share a
// temporary file.
std::filesystem::path temporaryBeside(const std::filesystem::path& path) {
    std::array<uint8_t, 8> random{};
    if (getrandom(random.data(), random.size(), GRND_NONBLOCK) != static_cast<ssize_t>(random.size())) random.fill(0);
    std::string suffix = ".tmp-" + std::to_string(getpid()) + "-";
    for (uint8_t b : random) {
        char hex[3];
        snprintf(hex, sizeof hex, "%02x", b);
        suffix += hex;
    }
    std::filesystem::path temporary = path;
    temporary += suffix;
    return temporary;
}

}  // namespace

int FileSystem::open(const char* path, int flags, mode_t mode) { return ::open(path, flags, mode); }
ssize_t FileSystem::write(int fd, const void* bytes, size_t count) { return ::write(fd, bytes, count); }
int FileSystem::fsync(int fd) { return ::fsync(fd); }
int FileSystem::close(int fd) { return ::close(fd); }
int FileSystem::rename(const char* from, const char* to) { return ::rename(from, to); }
int FileSystem::unlink(const char* path) { return ::unlink(path); }

FileSystem& posixFileSystem() {
    static FileSystem fileSystem;
    return fileSystem;
}

std::optional<Error> replaceFileAtomically(const std::filesystem::path& path, std::string_view bytes, mode_t mode,
                                           Durability durability, FileSystem& fs) {
    const std::filesystem::path temporary = temporaryBeside(path);
    int fd = fs.open(temporary.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC | O_NOFOLLOW, mode);
    if (fd < 0) return fileError(errno, "create", temporary);

    enum class Open { Yes, No };
    auto abandon = [&](int err, const char* operation, Open stillOpen) {
        if (stillOpen == Open::Yes) fs.close(fd);
        fs.unlink(temporary.c_str());
        return fileError(err, operation, temporary);
    };

    std::string_view rest = bytes;
    while (!rest.empty()) {
        ssize_t n = fs.write(fd, rest.data(), rest.size());
        if (n < 0 && errno == EINTR) continue;
        if (n < 0) return abandon(errno, "write", Open::Yes);
        if (n == 0) return abandon(EIO, "write", Open::Yes);
        rest.remove_prefix(static_cast<size_t>(n));
    }
    if (durability == Durability::Synced && fs.fsync(fd) != 0) return abandon(errno, "fsync", Open::Yes);
    if (fs.close(fd) != 0) return abandon(errno, "close", Open::No);
    if (fs.rename(temporary.c_str(), path.c_str()) != 0) {
        int err = errno;
        fs.unlink(temporary.c_str());
        return fileError(err, "rename over", path);
    }
    if (durability == Durability::ReadersOnly) return std::nullopt;

    std::filesystem::path directory = path.parent_path();
    if (directory.empty()) directory = ".";
    int dirFd = fs.open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC, 0);
    if (dirFd < 0) return fileError(errno, "open directory", directory);
    if (fs.fsync(dirFd) != 0) {
        int err = errno;
        fs.close(dirFd);
        return fileError(err, "fsync directory", directory);
    }
    fs.close(dirFd);
    return std::nullopt;
}

}  // namespace bexil
