#include "platform/sandbox/ProcessSandbox.h"

#include <sys/stat.h>

#include <fstream>
#include <optional>
#include <string>

#include "platform/log/Log.h"

namespace bexil {

namespace {

// The seccomp mode from a status file: 0 none, 1 strict, 2 filter; none when the line is missing or unreadable.
std::optional<long> seccompMode(const std::filesystem::path& status) {
    std::ifstream in(status);
    if (!in) return std::nullopt;
    std::string line;
    constexpr std::string_view kField = "Seccomp:";
    while (std::getline(in, line)) {
        if (line.compare(0, kField.size(), kField) != 0) continue;
        try {
            return std::stol(line.substr(kField.size()));
        } catch (const std::exception&) {
            return std::nullopt;
        }
    }
    return std::nullopt;
}

// The identity (device and inode) of a namespace link, or none when it cannot be looked at.
std::optional<std::pair<dev_t, ino_t>> namespaceIdentity(const std::filesystem::path& link) {
    struct stat info {};
    if (stat(link.c_str(), &info) != 0) return std::nullopt;
    return std::make_pair(info.st_dev, info.st_ino);
}

}  // namespace

bool processIsSandboxed(pid_t pid, const std::filesystem::path& procRoot) {
    std::filesystem::path process = procRoot / std::to_string(pid);
    std::optional<long> mode = seccompMode(process / "status");
    if (!mode) {
        log::ops().debug("cannot read the seccomp state of pid %d; treating it as sandboxed", pid);
        return true;
    }
    if (*mode != 0) return true;
    std::optional<std::pair<dev_t, ino_t>> theirs = namespaceIdentity(process / "ns" / "user");
    std::optional<std::pair<dev_t, ino_t>> ours = namespaceIdentity(procRoot / "self" / "ns" / "user");
    if (!theirs || !ours) {
        log::ops().debug("cannot compare the user namespace of pid %d; treating it as sandboxed", pid);
        return true;
    }
    return *theirs != *ours;
}

}  // namespace bexil
