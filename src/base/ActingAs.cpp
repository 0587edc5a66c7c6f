#include "base/ActingAs.h"

#include <sys/fsuid.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace bexil {

namespace {

// glibc's setgroups changes every thread of the process; the system call itself changes only the caller.
bool setThreadGroups(const std::vector<gid_t>& groups) {
    return ::syscall(SYS_setgroups, groups.size(), groups.empty() ? nullptr : groups.data()) == 0;
}

// setfsuid and setfsgid answer the previous value and report no error; asking with an invalid id reads the current.
uid_t currentFsuid() { return static_cast<uid_t>(::setfsuid(static_cast<uid_t>(-1))); }
gid_t currentFsgid() { return static_cast<gid_t>(::setfsgid(static_cast<gid_t>(-1))); }

}  // namespace

ActingAs::ActingAs(std::optional<UserIdentity> user) {
    if (!user || user->uid == 0 || geteuid() != 0) return;
    int count = ::getgroups(0, nullptr);
    groups_.resize(count > 0 ? static_cast<size_t>(count) : 0);
    if (count < 0 || ::getgroups(count, groups_.data()) != count) {
        ok_ = false;
        return;
    }
    switched_ = true;
    ::setfsgid(user->gid);
    ok_ = setThreadGroups({}) && currentFsgid() == user->gid;
    ::setfsuid(user->uid);
    ok_ = ok_ && currentFsuid() == user->uid;
}

ActingAs::~ActingAs() {
    if (!switched_) return;
    ::setfsuid(geteuid());
    ::setfsgid(getegid());
    setThreadGroups(groups_);
}

}  // namespace bexil
