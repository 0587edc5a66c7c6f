#pragma once

// Whether a process runs sandboxed at all: confined by a seccomp filter, or in another user namespace than the
// daemon. Privileged requests ask it about their caller. Stateless: reads /proc on every call, from any thread.

#include <sys/types.h>

#include <filesystem>

namespace bexil {

// True when process `pid` runs under a seccomp filter ("Seccomp:" of its status is not 0) or in another user
// namespace than the calling process. A process whose state cannot be read counts as sandboxed: the answer
// guards privileges, so not knowing must not grant them. `procRoot` lets tests supply their own process table.
bool processIsSandboxed(pid_t pid, const std::filesystem::path& procRoot = "/proc");

}  // namespace bexil
