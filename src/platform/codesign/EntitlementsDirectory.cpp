#include "platform/codesign/EntitlementsDirectory.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <set>

#include "base/Document.h"
#include "base/PosixError.h"
#include "base/StandardPaths.h"
#include "base/UniqueFd.h"
#include "platform/log/Log.h"

namespace bexil {

EntitlementsDirectory::EntitlementsDirectory(std::filesystem::path directory, uid_t trustedUid)
    : directory_(std::move(directory)), trustedUid_(trustedUid) {}

std::filesystem::path EntitlementsDirectory::defaultPath() { return entitlementsDirectory(); }

static bool ownerAndModeTrusted(const struct stat& st, uid_t trustedUid) {
    bool ownerOk = st.st_uid == 0 || st.st_uid == trustedUid;
    bool nobodyElseWrites = (st.st_mode & (S_IWGRP | S_IWOTH)) == 0;
    return ownerOk && nobodyElseWrites;
}

bool EntitlementsDirectory::isTrustedFile(const std::filesystem::path& path, uid_t trustedUid) {
    struct stat st {};
    // lstat: a symbolic link is judged as itself, so a trusted link cannot point at an untrusted file.
    if (lstat(path.c_str(), &st) != 0 || !S_ISREG(st.st_mode)) return false;
    return ownerAndModeTrusted(st, trustedUid);
}

bool EntitlementsDirectory::isTrustedDirectory(const std::filesystem::path& path, uid_t trustedUid) {
    struct stat st {};
    return stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode) && ownerAndModeTrusted(st, trustedUid);
}

Result<Value> EntitlementsDirectory::entitlementsForExecutable(const std::string& realPath,
                                                               const struct stat* running) {
    struct stat dirStat {};
    if (stat(directory_.c_str(), &dirStat) != 0) {
        // A missing directory simply grants nothing to anybody.
        if (errno == ENOENT) return Value::emptyDictionary();
        return posixError(errno, "cannot read the entitlements directory " + directory_.string());
    }
    if (!isTrustedDirectory(directory_, trustedUid_)) {
        log::ops().error("entitlements directory %s is not trusted (owner or mode); no program has entitlements",
                         directory_.c_str());
        return Value::emptyDictionary();
    }
    DIR* dir = opendir(directory_.c_str());
    if (!dir) return posixError(errno, "cannot open the entitlements directory " + directory_.string());

    // Files are taken in name order, so when two name the same executable the later name wins, on every machine.
    std::set<std::string> names;
    while (struct dirent* entry = readdir(dir)) {
        std::string name = entry->d_name;
        if (name.size() > 5 && name.compare(name.size() - 5, 5, ".vrec") == 0) names.insert(std::move(name));
    }
    closedir(dir);

    std::lock_guard lock(mutex_);
    Value found = Value::emptyDictionary();
    for (const std::string& name : names) {
        std::filesystem::path file = directory_ / name;
        // What is judged is what was opened: no link is followed, and the trust checks read the open file. A link is
        // judged as itself (lstat), and never read.
        UniqueFd fd(::open(file.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK));
        struct stat st {};
        if (fd ? fstat(fd.get(), &st) != 0 : (errno != ELOOP || lstat(file.c_str(), &st) != 0)) continue;
        CachedFile& cached = cache_[name];
        bool unchanged = cached.inode == st.st_ino && cached.size == st.st_size &&
                         cached.mtime.tv_sec == st.st_mtim.tv_sec && cached.mtime.tv_nsec == st.st_mtim.tv_nsec;
        if (!unchanged) {
            cached = CachedFile{st.st_ino, st.st_size, st.st_mtim, std::nullopt, Value()};
            if (!S_ISREG(st.st_mode) || !ownerAndModeTrusted(st, trustedUid_)) {
                log::ops().error("ignoring untrusted entitlements file %s (owner or mode)", file.c_str());
            } else if (Result<Value> doc = Document::readOpenFile(fd.get(), file); !doc) {
                log::ops().error("ignoring unreadable entitlements file %s: %@", file.c_str(), doc.error());
            } else if (const std::string* exe =
                           doc->find(kExecutableKey) ? doc->find(kExecutableKey)->getString() : nullptr;
                       !exe || !doc->get(kEntitlementsKey).isDictionary()) {
                log::ops().error("ignoring entitlements file %s: it needs a string \"%s\" and a dictionary \"%s\"",
                                 file.c_str(), kExecutableKey.data(), kEntitlementsKey.data());
            } else {
                cached.executable = *exe;
                cached.entitlements = doc->get(kEntitlementsKey);
            }
        }
        if (cached.executable && *cached.executable == realPath) found = cached.entitlements;
    }
    for (auto it = cache_.begin(); it != cache_.end();) it = names.count(it->first) ? std::next(it) : cache_.erase(it);

    if (found.count() > 0 && !isTrustedFile(realPath, trustedUid_)) {
        log::ops().error(
            "ignoring entitlements of %s: the executable is not owned by a trusted user or is writable "
            "by others",
            realPath.c_str());
        return Value::emptyDictionary();
    }
    struct stat named {};
    if (found.count() > 0 && running != nullptr &&
        (::lstat(realPath.c_str(), &named) != 0 || named.st_dev != running->st_dev ||
         named.st_ino != running->st_ino)) {
        log::ops().error("ignoring entitlements of %s: the process runs another file under that name",
                         realPath.c_str());
        return Value::emptyDictionary();
    }
    return found;
}

}  // namespace bexil
