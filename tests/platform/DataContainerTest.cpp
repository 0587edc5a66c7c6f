#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "TestSupport.h"
#include "base/PosixError.h"
#include "platform/containers/DataContainer.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;

constexpr uid_t kNobody = 65534;

struct stat statOf(const fs::path& path) {
    struct stat status {};
    EXPECT_EQ(::lstat(path.c_str(), &status), 0) << path;
    return status;
}

class DataContainerTest : public ::testing::Test {
  protected:
    test::TempDir tmp_{"bexil-container"};
    const fs::path containers_ = tmp_.path() / "containers";
    const fs::path container_ = containers_ / "com.example.plug";
    const fs::path outside_ = tmp_.path() / "outside";
};

// Guards the shape and ownership of a container: both directories are made private, what was in them stays, and an
// owner, when named, gets both.
TEST_F(DataContainerTest, MakesBothDirectoriesPrivateAndKeepsWhatIsInThem) {
    ASSERT_FALSE(DataContainer::prepare(container_));
    EXPECT_EQ(statOf(container_).st_mode & 07777, 0700u);
    EXPECT_EQ(statOf(container_ / "tmp").st_mode & 07777, 0700u);
    std::ofstream(container_ / "notes.txt") << "kept";
    fs::permissions(container_ / "tmp", fs::perms(0755));
    ASSERT_FALSE(DataContainer::prepare(container_));
    EXPECT_TRUE(fs::exists(container_ / "notes.txt"));
    EXPECT_EQ(statOf(container_ / "tmp").st_mode & 07777, 0700u);

    if (geteuid() != 0) GTEST_SKIP() << "giving a container to another user needs root";
    ASSERT_FALSE(DataContainer::prepare(container_, DataContainer::Owner{kNobody, kNobody}));
    EXPECT_EQ(statOf(container_).st_uid, kNobody);
    EXPECT_EQ(statOf(container_ / "tmp").st_uid, kNobody);
}

// Guards against a user who owns a container turning it against bxd: a link at the container or at its tmp/, or a
// file at tmp/, is refused, and what a link leads to keeps its owner and mode even when an owner was asked for.
TEST_F(DataContainerTest, LinksAndFilesInPlaceOfTheDirectoriesAreRefusedAndNotFollowed) {
    fs::create_directories(outside_);
    fs::permissions(outside_, fs::perms(0751));
    const struct stat before = statOf(outside_);
    const std::optional<DataContainer::Owner> owner =
        geteuid() == 0 ? std::optional(DataContainer::Owner{kNobody, kNobody}) : std::nullopt;

    fs::create_directories(containers_);
    fs::create_directory_symlink(outside_, container_);
    std::optional<Error> error = DataContainer::prepare(container_, owner);
    ASSERT_TRUE(error);
    EXPECT_EQ(error->code(), ENOTDIR);
    EXPECT_EQ(error->localizedDescription(), "the data container " + container_.string() + " is not a directory");

    fs::remove(container_);
    fs::create_directories(container_);
    fs::create_directory_symlink(outside_, container_ / "tmp");
    EXPECT_TRUE(DataContainer::prepare(container_, owner));
    const struct stat after = statOf(outside_);
    EXPECT_EQ(after.st_uid, before.st_uid);
    EXPECT_EQ(after.st_mode, before.st_mode);
    EXPECT_FALSE(fs::exists(outside_ / "tmp")) << "nothing was made through the link";

    fs::remove(container_ / "tmp");
    std::ofstream(container_ / "tmp") << "a file";
    error = DataContainer::prepare(container_, owner);
    ASSERT_TRUE(error);
    EXPECT_EQ(error->code(), ENOTDIR);
}

}  // namespace
}  // namespace bexil
