#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/stat.h>

#include <cerrno>
#include <filesystem>
#include <fstream>

#include "TestSupport.h"
#include "platform/sandbox/SandboxExtensions.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;

class SandboxExtensionsTest : public ::testing::Test {
  protected:
    void SetUp() override { test::writeText(root_ / "bundle" / "Resources" / "a.txt", "a"); }

    fs::path keyPath() const { return root_ / "runtime" / "sandbox" / "extension-key"; }

    test::TempDir tmp_{"sandbox-test"};
    fs::path root_ = tmp_.path();
};

TEST_F(SandboxExtensionsTest, IssuedTokenNamesTheCanonicalPathAndIsConsumable) {
    SandboxExtensions issuer(keyPath());
    auto token = issuer.issueFileExtension(SandboxExtensions::kReadOnlyClass,
                                           (root_ / "bundle" / "Resources" / ".." / "Resources" / "a.txt").string());
    ASSERT_TRUE(token);
    EXPECT_EQ(fs::status(keyPath()).permissions() & fs::perms::all, fs::perms::owner_read | fs::perms::owner_write);

    // Another process (here: another object over the same key file) checks and records it.
    SandboxExtensions consumer(keyPath());
    int64_t handle = consumer.consume(*token);
    ASSERT_GT(handle, 0);
    EXPECT_EQ(consumer.consumedPath(handle), (root_ / "bundle" / "Resources" / "a.txt").string());
    consumer.release(handle);
    EXPECT_FALSE(consumer.consumedPath(handle));
    consumer.release(handle);  // releasing twice is harmless

    // Through a symbolic link to the bundle: the token names (and signs) the file the link leads to.
    fs::create_directory_symlink(root_ / "bundle", root_ / "link");
    EXPECT_EQ(issuer.issueFileExtension(SandboxExtensions::kReadOnlyClass,
                                        (root_ / "link" / "Resources" / "a.txt").string()),
              token);
}

TEST_F(SandboxExtensionsTest, AlteredOrForeignTokensAreRefused) {
    SandboxExtensions issuer(keyPath());
    auto token = issuer.issueFileExtension(SandboxExtensions::kReadOnlyClass, (root_ / "bundle").string());
    ASSERT_TRUE(token);

    std::string otherPath = *token;
    otherPath.replace(otherPath.rfind("bundle"), 6, "bundlf");
    std::string otherClass = *token;
    otherClass.replace(0, 1, "x");
    for (const std::string& bad : {otherPath, otherClass, std::string(""), std::string(";;"), std::string("a;b;c"),
                                   token->substr(0, token->size() / 2)}) {
        errno = 0;
        EXPECT_EQ(issuer.consume(bad), -1) << bad;
        EXPECT_EQ(errno, EPERM) << bad;
    }

    // A new run makes a new key: tokens of the earlier run stop working.
    SandboxExtensions nextRun(keyPath());
    ASSERT_TRUE(nextRun.issueFileExtension(SandboxExtensions::kReadOnlyClass, (root_ / "bundle").string()));
    EXPECT_EQ(nextRun.consume(*token), -1);
}

TEST_F(SandboxExtensionsTest, ARemovedKeyFileIsWrittenBackWithTheSameKey) {
    SandboxExtensions issuer(keyPath());
    auto first = issuer.issueFileExtension(SandboxExtensions::kReadOnlyClass, (root_ / "bundle").string());
    ASSERT_TRUE(first);
    fs::remove_all(root_ / "runtime");
    auto second = issuer.issueFileExtension(SandboxExtensions::kReadOnlyClass, (root_ / "bundle").string());
    ASSERT_TRUE(second);
    EXPECT_EQ(*first, *second) << "still the same run, so still the same key";
    EXPECT_GT(SandboxExtensions(keyPath()).consume(*first), 0);
}

TEST_F(SandboxExtensionsTest, MissingPathsAndBadClassesGetNoToken) {
    SandboxExtensions issuer(keyPath());
    errno = 0;
    EXPECT_FALSE(issuer.issueFileExtension(SandboxExtensions::kReadOnlyClass, (root_ / "missing").string()));
    EXPECT_EQ(errno, ENOENT);
    fs::create_symlink(root_ / "missing", root_ / "dangling");
    errno = 0;
    EXPECT_FALSE(issuer.issueFileExtension(SandboxExtensions::kReadOnlyClass, (root_ / "dangling").string()));
    EXPECT_EQ(errno, ENOENT);
    errno = 0;
    EXPECT_FALSE(issuer.issueFileExtension(SandboxExtensions::kReadOnlyClass,
                                           (root_ / "bundle" / "Resources" / "a.txt" / "x").string()));
    EXPECT_EQ(errno, ENOTDIR);
    errno = 0;
    EXPECT_FALSE(issuer.issueFileExtension("a;b", (root_ / "bundle").string()));
    EXPECT_EQ(errno, EINVAL);
    EXPECT_FALSE(issuer.issueFileExtension(SandboxExtensions::kReadOnlyClass, std::string("/tmp\0x", 6)));
    EXPECT_FALSE(fs::exists(keyPath())) << "no key is made before a token is issued";
}

TEST_F(SandboxExtensionsTest, ConsumingWithoutAKeyFailsWithTheFileError) {
    SandboxExtensions consumer(keyPath());
    errno = 0;
    EXPECT_EQ(consumer.consume("com.quorvel.sandbox.read-only;00;/tmp"), -1);
    EXPECT_EQ(errno, ENOENT);
}

}  // namespace
}  // namespace bexil
