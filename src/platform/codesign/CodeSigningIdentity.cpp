#include "platform/codesign/CodeSigningIdentity.h"

#include <sys/socket.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fstream>

#include "platform/codesign/EntitlementsDirectory.h"

#ifndef SO_PEERPIDFD
#define SO_PEERPIDFD 77
#endif

namespace bexil {

namespace {

int pidfdOpen(pid_t pid) { return static_cast<int>(syscall(SYS_pidfd_open, pid, 0)); }

bool pidfdAlive(int pidfd) { return syscall(SYS_pidfd_send_signal, pidfd, 0, nullptr, 0) == 0; }

// The pid a pidfd refers to, from /proc/self/fdinfo ("Pid:" is -1 once the process has been reaped).
pid_t pidOfPidfd(int pidfd) {
    std::ifstream in("/proc/self/fdinfo/" + std::to_string(pidfd));
    std::string line;
    while (std::getline(in, line))
        if (line.rfind("Pid:", 0) == 0) return static_cast<pid_t>(std::stol(line.substr(4)));
    return -1;
}

}  // namespace

std::shared_ptr<CodeSigningIdentity> CodeSigningIdentity::fromConnectedSocket(int fd,
                                                                              EntitlementsDirectory* entitlements) {
    std::shared_ptr<CodeSigningIdentity> id(new CodeSigningIdentity());
    auto fail = [&](std::string reason) {
        id->failureReason_ = std::move(reason);
        id->established_ = false;
        id->entitlements_ = Value::emptyDictionary();
        return id;
    };

    struct ucred cred {};
    socklen_t len = sizeof cred;
    if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &cred, &len) != 0 || cred.pid <= 0)
        return fail(std::string("no peer credentials: ") + strerror(errno));
    id->pid_ = cred.pid;
    id->uid_ = cred.uid;
    id->gid_ = cred.gid;

    // Prefer the pidfd the kernel took at connect time; older kernels lack it, and then the pidfd is opened now,
    // at accept, and checked below against the credentials.
    int pidfd = -1;
    len = sizeof pidfd;
    if (getsockopt(fd, SOL_SOCKET, SO_PEERPIDFD, &pidfd, &len) != 0) pidfd = pidfdOpen(cred.pid);
    if (pidfd < 0) return fail(std::string("no pidfd for the peer: ") + strerror(errno));
    id->pidfd_ = pidfd;
    if (pidOfPidfd(pidfd) != cred.pid) return fail("the peer process has exited");

    char exe[4096];
    std::string procExe = "/proc/" + std::to_string(cred.pid) + "/exe";
    ssize_t n = readlink(procExe.c_str(), exe, sizeof exe - 1);
    if (n <= 0) return fail(std::string("cannot read the peer's executable: ") + strerror(errno));
    std::string path(exe, static_cast<size_t>(n));
    static constexpr std::string_view kDeleted = " (deleted)";
    if (path.size() > kDeleted.size() && path.compare(path.size() - kDeleted.size(), kDeleted.size(), kDeleted) == 0)
        return fail("the peer's executable has been deleted");

    // Only now, after the path was read, does the pidfd prove that the pid still named the same live process while
    // it was read; a pid reused in between would have made this fail.
    if (!pidfdAlive(pidfd)) return fail("the peer process has exited");

    id->executablePath_ = std::move(path);
    id->established_ = true;
    if (entitlements) {
        Result<Value> granted = entitlements->entitlementsForExecutable(id->executablePath_);
        if (granted)
            id->entitlements_ = *granted;
        else
            id->entitlementsError_ = granted.error();
    }
    return id;
}

CodeSigningIdentity::~CodeSigningIdentity() {
    if (pidfd_ >= 0) close(pidfd_);
}

Result<Value> CodeSigningIdentity::entitlementValueForKey(std::string_view key) const {
    if (!established_) return BXError(ErrorCode::OperationFailed, "no code-signing identity: " + failureReason_);
    if (entitlementsError_) return *entitlementsError_;
    return entitlements_.get(key);
}

std::string CodeSigningIdentity::description() const {
    char buf[96];
    snprintf(buf, sizeof buf, "<identity pid=%d uid=%u gid=%u ", static_cast<int>(pid_), static_cast<unsigned>(uid_),
             static_cast<unsigned>(gid_));
    std::string out = buf;
    out += established_ ? "exe=" + executablePath_ : "unestablished: " + failureReason_;
    out += ">";
    return out;
}

}  // namespace bexil
