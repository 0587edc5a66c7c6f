#pragma once

// The process descriptors (pidfds) that pin one process however its pid is reused later: opening one, signalling
// through it, and asking whether its process has exited. Thin wrappers over the system calls, since the C library
// of the oldest supported systems lacks them. Stateless; any thread.

#include <poll.h>
#include <sys/syscall.h>
#include <sys/types.h>
#include <unistd.h>

#include <cerrno>

namespace bexil {

// A new pidfd (close-on-exec) for the process `pid`, or -1 with errno set (ESRCH: there is no such process).
inline int pidfdOpen(pid_t pid) { return static_cast<int>(syscall(SYS_pidfd_open, pid, 0)); }

// Sends `signal` (0 only checks) to the process of `pidfd`; 0, or -1 with errno set (ESRCH once it has exited).
inline int pidfdSendSignal(int pidfd, int signal) {
    return static_cast<int>(syscall(SYS_pidfd_send_signal, pidfd, signal, nullptr, 0));
}

// Whether the process of `pidfd` has exited (a pidfd becomes readable then), waiting at most `timeoutMs`.
inline bool pidfdExited(int pidfd, int timeoutMs = 0) {
    pollfd p{pidfd, POLLIN, 0};
    int rc;
    do {
        rc = poll(&p, 1, timeoutMs);
    } while (rc < 0 && errno == EINTR);
    return rc > 0;
}

}  // namespace bexil
