#pragma once

// UniqueFd owns one file descriptor and closes it when it goes (or when reset); it moves and never copies. One
// owner is used by one thread at a time, like any value.

#include <unistd.h>

#include <utility>

namespace bexil {

class UniqueFd {
  public:
    UniqueFd() = default;
    // Takes `fd`, which may be -1 (nothing owned, as after a failed open).
    explicit UniqueFd(int fd) : fd_(fd) {}
    ~UniqueFd() { reset(); }
    UniqueFd(UniqueFd&& other) noexcept : fd_(other.release()) {}
    UniqueFd& operator=(UniqueFd&& other) noexcept {
        if (this != &other) reset(other.release());
        return *this;
    }
    UniqueFd(const UniqueFd&) = delete;
    UniqueFd& operator=(const UniqueFd&) = delete;

    int get() const { return fd_; }
    explicit operator bool() const { return fd_ >= 0; }
    // Gives the descriptor up without closing it.
    int release() { return std::exchange(fd_, -1); }
    // Closes what is owned and takes `fd` instead.
    void reset(int fd = -1) {
        if (fd_ >= 0) ::close(fd_);
        fd_ = fd;
    }

  private:
    int fd_ = -1;
};

}  // namespace bexil
