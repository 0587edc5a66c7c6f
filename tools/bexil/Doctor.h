#pragma once

// The checks of `bexil doctor`: is this installation of bxd usable, and if not, what to change. Each check looks at
// one thing the daemon depends on, in the directories the BX_* variables (or the defaults for this user) name, and
// answers with what it found and, when that is wrong, what to do about it. Nothing is changed. Stateless; any thread
// (the daemon check waits for a reply on a connection of its own).

#include <sys/types.h>

#include <chrono>
#include <filesystem>
#include <string>
#include <vector>

#include "bexil/Value.h"

namespace bexil::tool {

// Exit status of `bexil doctor` when a check failed (sysexits.h EX_CONFIG: something is configured wrong).
inline constexpr int kExitConfig = 78;

struct DoctorCheck {
    std::string name;  // short and stable, for scripts: "daemon", "entitlements directory", ...
    bool ok = false;
    std::string detail;  // what was found
    std::string fix;     // what to do; empty when ok
};

// The user whose files bxd trusts besides root: the owner of the service socket `socket` when there is one (the
// daemon made it), else this process's effective user (the one who would start a daemon with these settings).
uid_t daemonUser(const std::filesystem::path& socket);

// bxd answers the status request on `service` within `timeout`.
DoctorCheck checkDaemon(const std::string& service, std::chrono::milliseconds timeout);
// `path` (one of bxd's own directories, called `name`) exists, is a directory owned by root or `owner`, and nobody
// but its owner (and group) may write to it.
DoctorCheck checkOwnDirectory(const std::string& name, const std::filesystem::path& path, uid_t owner);
// The entitlements directory is trusted by the rule bxd applies, and so is every entitlements file in it.
DoctorCheck checkEntitlements(const std::filesystem::path& path, uid_t owner);
// The bubblewrap program `bwrap` exists and sets up a sandbox that runs a trivial command.
DoctorCheck checkBubblewrap(const std::string& bwrap);
// Some data directory holds the shared-mime-info files the type registry reads.
DoctorCheck checkMimeDatabase(const std::vector<std::filesystem::path>& dataDirectories);
// Where bxd's log goes: the journal when its socket is writable (or forced), else standard error.
DoctorCheck checkJournal();

// Every check, for the daemon on `service`, with the directories of this process's environment.
std::vector<DoctorCheck> runDoctor(const std::string& service, std::chrono::milliseconds timeout);

// One line per check: "NAME: ok (DETAIL)" or "NAME: PROBLEM: DETAIL; fix: FIX".
std::string doctorLine(const DoctorCheck& check);
// The checks as an array of {"check", "ok", "detail", "fix"} dictionaries.
Value doctorValue(const std::vector<DoctorCheck>& checks);

}  // namespace bexil::tool
