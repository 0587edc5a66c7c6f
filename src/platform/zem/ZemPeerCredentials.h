#pragma once

// What the kernel says about the process at the other end of an accepted connection, read once at accept: its
// credentials and a pidfd that pins the very process, so that later checks (its executable, whether it still runs)
// cannot be fooled by a reused pid. Who the process is, and what it may do, is for the daemon to decide from these.
// Immutable once read; any thread may read it.

#include <sys/types.h>

#include <memory>
#include <string>

#include "base/UniqueFd.h"

namespace bexil {

struct ZemPeerCredentials {
    pid_t pid = -1;
    uid_t uid = static_cast<uid_t>(-1);
    gid_t gid = static_cast<gid_t>(-1);
    // The pidfd of the peer, shared by whoever pins the process with it; null when none could be had.
    std::shared_ptr<const UniqueFd> pidfd = nullptr;
    // Why the credentials or the pidfd are missing, or why the pidfd does not name the peer; empty when all is well.
    std::string failure = {};

    bool complete() const { return failure.empty(); }

    // Reads them for the connected Unix-domain socket `fd`: the pidfd the kernel took at connect time, or on older
    // kernels one opened now and checked to name the process of the credentials.
    static ZemPeerCredentials ofConnectedSocket(int fd);
};

}  // namespace bexil
