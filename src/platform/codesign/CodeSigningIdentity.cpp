#include "platform/codesign/CodeSigningIdentity.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>

#include "base/Pidfd.h"
#include "base/UniqueFd.h"
#include "platform/codesign/EntitlementsDirectory.h"

namespace bexil {

namespace {

bool pidfdAlive(int pidfd) { return pidfdSendSignal(pidfd, 0) == 0; }

}  // namespace

std::shared_ptr<CodeSigningIdentity> CodeSigningIdentity::ofPeer(const ZemPeerCredentials& peer,
                                                                 EntitlementsDirectory* entitlements) {
    std::shared_ptr<CodeSigningIdentity> id(new CodeSigningIdentity());
    auto fail = [&](std::string reason) {
        id->failureReason_ = std::move(reason);
        id->established_ = false;
        id->entitlements_ = Value::emptyDictionary();
        return id;
    };
    id->pid_ = peer.pid;
    id->uid_ = peer.uid;
    id->gid_ = peer.gid;
    id->pidfd_ = peer.pidfd;
    if (!peer.complete()) return fail(peer.failure);

    char exe[4096];
    std::string procExe = "/proc/" + std::to_string(peer.pid) + "/exe";
    // The link's text is the path as the peer's own mount namespace shows it, where another file may be mounted
    // over a trusted program; opening the link gives the file the peer really runs, whose identity is what counts.
    UniqueFd running(::open(procExe.c_str(), O_RDONLY | O_CLOEXEC));
    struct stat runningStatus {};
    if (!running || ::fstat(running.get(), &runningStatus) != 0)
        return fail(std::string("cannot open the peer's executable: ") + strerror(errno));
    ssize_t n = readlink(procExe.c_str(), exe, sizeof exe - 1);
    if (n <= 0) return fail(std::string("cannot read the peer's executable: ") + strerror(errno));
    std::string path(exe, static_cast<size_t>(n));
    static constexpr std::string_view kDeleted = " (deleted)";
    if (path.size() > kDeleted.size() && path.compare(path.size() - kDeleted.size(), kDeleted.size(), kDeleted) == 0)
        return fail("the peer's executable has been deleted");

    // Only now, after the path was read, does the pidfd prove that the pid still named the same live process while
    // it was read; a pid reused in between would have made this fail.
    if (!pidfdAlive(peer.pidfd->get())) return fail("the peer process has exited");

    id->executablePath_ = std::move(path);
    id->established_ = true;
    if (entitlements) {
        Result<Value> granted = entitlements->entitlementsForExecutable(id->executablePath_, &runningStatus);
        if (granted)
            id->entitlements_ = *granted;
        else
            id->entitlementsError_ = granted.error();
    }
    return id;
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
