// The fd owner closes exactly once, whoever ends up holding the descriptor: a double close could close a
// descriptor number that another thread has just been given.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <utility>

#include "base/UniqueFd.h"

namespace bexil {
namespace {

bool isOpen(int fd) { return ::fcntl(fd, F_GETFD) != -1; }

TEST(UniqueFd, ClosesOnceWhereverTheDescriptorEndsUp) {
    int raw = ::open("/dev/null", O_RDONLY | O_CLOEXEC);
    ASSERT_GE(raw, 0);
    {
        UniqueFd first(raw);
        UniqueFd second(std::move(first));
        EXPECT_FALSE(first);
        EXPECT_EQ(second.get(), raw);
        UniqueFd third;
        third = std::move(second);
        EXPECT_TRUE(isOpen(raw)) << "moving must not close";
    }
    EXPECT_FALSE(isOpen(raw));

    int other = ::open("/dev/null", O_RDONLY | O_CLOEXEC);
    UniqueFd owner(other);
    int released = owner.release();
    owner.reset(::open("/dev/null", O_RDONLY | O_CLOEXEC));
    EXPECT_TRUE(isOpen(released)) << "release gives the descriptor up unclosed";
    int replaced = owner.get();
    owner.reset();
    EXPECT_FALSE(isOpen(replaced));
    ::close(released);
}

}  // namespace
}  // namespace bexil
