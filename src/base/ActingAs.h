#pragma once

// ActingAs makes the calling thread's file-system access be checked as another user's while it lives: the thread's
// file-system uid and gid become the user's and it has no supplementary groups. bxd runs as root but reads files
// that clients name (bundles); reading them as the client means a client learns nothing through bxd that it could
// not read itself, whatever links or swaps it arranges. Linux keeps these credentials per thread, so only the
// calling thread is affected; the destructor restores them. One guard belongs to one thread, on its stack.

#include <sys/types.h>

#include <optional>
#include <vector>

namespace bexil {

// A user as the kernel checks file access: a uid and its primary gid.
struct UserIdentity {
    uid_t uid;
    gid_t gid;
};

class ActingAs {
  public:
    // Acts as `user` when the process has root's file-system rights and `user` is not root; otherwise (no user,
    // root, or an unprivileged process, whose reads are its own anyway) changes nothing.
    explicit ActingAs(std::optional<UserIdentity> user);
    ~ActingAs();
    ActingAs(const ActingAs&) = delete;
    ActingAs& operator=(const ActingAs&) = delete;

    // False when the switch was needed but failed: the thread then still reads as root, so the caller must not
    // read on the user's behalf.
    bool ok() const { return ok_; }

  private:
    bool switched_ = false;
    bool ok_ = true;
    std::vector<gid_t> groups_;
};

}  // namespace bexil
