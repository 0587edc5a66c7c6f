#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <future>

#include "TestSupport.h"
#include "base/ActingAs.h"
#include "base/UniqueFd.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;

constexpr UserIdentity kNobody{65534, 65534};

bool readable(const fs::path& path) { return static_cast<bool>(UniqueFd(::open(path.c_str(), O_RDONLY | O_CLOEXEC))); }

// Guards reading on a client's behalf: while the guard lives, this thread reads neither a file private to root nor
// one readable only by root's group (bxd's own groups must not count), another thread still reads as root, and
// afterwards this thread does too.
TEST(ActingAs, ThisThreadReadsAsTheUserAndOnlyWhileTheGuardLives) {
    if (geteuid() != 0) GTEST_SKIP() << "acting as another user needs root";
    test::TempDir dir("bexil-acting-as");
    fs::permissions(dir.path(), fs::perms(0755));
    const fs::path owner = dir.path() / "owner-only", group = dir.path() / "group-only", all = dir.path() / "all";
    for (const auto& [path, mode] : {std::pair{owner, 0600}, std::pair{group, 0640}, std::pair{all, 0644}}) {
        std::ofstream(path) << "x";
        ASSERT_EQ(::chown(path.c_str(), 0, 0), 0);
        ASSERT_EQ(::chmod(path.c_str(), static_cast<mode_t>(mode)), 0);
    }
    // A thread that exists already (a new one would inherit the guard's identity, as threads do).
    std::promise<void> go;
    std::future<bool> other = std::async(std::launch::async, [&, started = go.get_future()]() mutable {
        started.wait();
        return readable(owner);
    });
    {
        ActingAs nobody(kNobody);
        go.set_value();
        ASSERT_TRUE(nobody.ok());
        EXPECT_FALSE(readable(owner));
        EXPECT_FALSE(readable(group)) << "root's supplementary groups must not count";
        EXPECT_TRUE(readable(all));
        EXPECT_TRUE(other.get()) << "another thread is not affected";
    }
    EXPECT_TRUE(readable(owner)) << "the guard restored root's rights";
    EXPECT_TRUE(readable(group));

    ActingAs root(UserIdentity{0, 0}), none(std::nullopt);
    EXPECT_TRUE(root.ok() && none.ok());
    EXPECT_TRUE(readable(owner)) << "acting as root or as nobody in particular changes nothing";
}

// Guards failing closed: an identity the kernel cannot take (the transport's "unknown" value) is reported, so that
// the caller does not read as root instead.
TEST(ActingAs, AnIdentityThatCannotBeTakenIsReported) {
    if (geteuid() != 0) GTEST_SKIP() << "acting as another user needs root";
    ActingAs unknown(UserIdentity{static_cast<uid_t>(-1), static_cast<gid_t>(-1)});
    EXPECT_FALSE(unknown.ok());
}

}  // namespace
}  // namespace bexil
