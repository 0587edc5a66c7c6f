#include "platform/zem/ZemPeerCredentials.h"

#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <fstream>

#include "base/Pidfd.h"

#ifndef SO_PEERPIDFD
#define SO_PEERPIDFD 77
#endif

namespace bexil {

namespace {

// The pid a pidfd refers to, from /proc/self/fdinfo ("Pid:" is -1 once the process has been reaped).
pid_t pidOfPidfd(int pidfd) {
    std::ifstream in("/proc/self/fdinfo/" + std::to_string(pidfd));
    std::string line;
    while (std::getline(in, line))
        if (line.rfind("Pid:", 0) == 0) return static_cast<pid_t>(std::stol(line.substr(4)));
    return -1;
}

}  // namespace

ZemPeerCredentials ZemPeerCredentials::ofConnectedSocket(int fd) {
    ZemPeerCredentials peer;
    struct ucred cred {};
    socklen_t len = sizeof cred;
    if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &cred, &len) != 0 || cred.pid <= 0) {
        peer.failure = std::string("no peer credentials: ") + strerror(errno);
        return peer;
    }
    peer.pid = cred.pid;
    peer.uid = cred.uid;
    peer.gid = cred.gid;

    // Prefer the pidfd the kernel took at connect time; older kernels lack it, and then the pidfd is opened now,
    // at accept, and checked against the credentials.
    int pidfd = -1;
    len = sizeof pidfd;
    if (getsockopt(fd, SOL_SOCKET, SO_PEERPIDFD, &pidfd, &len) != 0) pidfd = pidfdOpen(cred.pid);
    if (pidfd < 0) {
        peer.failure = std::string("no pidfd for the peer: ") + strerror(errno);
        return peer;
    }
    peer.pidfd = std::make_shared<const UniqueFd>(pidfd);
    if (pidOfPidfd(pidfd) != cred.pid) peer.failure = "the peer process has exited";
    return peer;
}

}  // namespace bexil
