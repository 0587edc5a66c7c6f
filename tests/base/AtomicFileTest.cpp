// The atomic replacement as its other users meet it (every injected failure is DocumentFileTest's, through the
// document): the mode asked for is the mode made, so a secret key is never readable by others even for a moment,
// and a replacement for readers only skips the syncs but is still whole and leaves no temporary file.

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <fstream>
#include <iterator>
#include <string>

#include "TestSupport.h"
#include "base/AtomicFile.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;
using test::FailingFileSystem;
using test::TempDir;

std::string contents(const fs::path& path) {
    std::ifstream in(path, std::ios::binary);
    return std::string(std::istreambuf_iterator<char>(in), {});
}

size_t entries(const fs::path& directory) {
    return static_cast<size_t>(std::distance(fs::directory_iterator(directory), fs::directory_iterator()));
}

TEST(AtomicFile, TheModeAskedForIsTheModeMade) {
    TempDir dir;
    mode_t previous = ::umask(0);
    std::optional<Error> error = replaceFileAtomically(dir / "key", std::string_view("\0\1secret", 8), 0600);
    ::umask(previous);
    ASSERT_FALSE(error) << error->description();
    struct stat status {};
    ASSERT_EQ(::stat((dir / "key").c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 0777, 0600u);
    EXPECT_EQ(contents(dir / "key"), std::string("\0\1secret", 8));
}

TEST(AtomicFile, ForReadersOnlyNoSyncIsMadeAndTheFileIsStillWhole) {
    TempDir dir;
    ASSERT_FALSE(replaceFileAtomically(dir / "counter", "1\n"));
    // Every fsync fails here: a replacement that still made one would report it.
    FailingFileSystem noSync("fsync", EIO);
    EXPECT_FALSE(replaceFileAtomically(dir / "counter", "2\n", 0644, Durability::ReadersOnly, noSync));
    EXPECT_EQ(contents(dir / "counter"), "2\n");
    EXPECT_EQ(entries(dir), 1u) << "no temporary file is left";

    std::optional<Error> durable = replaceFileAtomically(dir / "counter", "3\n", 0644, Durability::Synced, noSync);
    ASSERT_TRUE(durable);
    EXPECT_EQ(durable->code(), EIO);
    EXPECT_EQ(contents(dir / "counter"), "2\n");
    EXPECT_EQ(entries(dir), 1u);
}

}  // namespace
}  // namespace bexil
