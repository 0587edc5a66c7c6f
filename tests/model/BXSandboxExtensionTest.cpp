#include <gtest/gtest.h>
#include <stdlib.h>

#include <filesystem>

#include "TestSupport.h"
#include "model/BXSandboxExtension.h"
#include "platform/sandbox/SandboxExtensions.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;

class BXSandboxExtensionTest : public ::testing::Test {
  protected:
    void SetUp() override {
        sandbox_ = std::make_unique<SandboxExtensions>(root_ / "extension-key");
        auto issued = sandbox_->issueFileExtension(SandboxExtensions::kReadOnlyClass, root_.string());
        ASSERT_TRUE(issued);
        token_ = *issued;
    }

    test::TempDir tmp_{"sandbox-extension-test"};
    fs::path root_ = tmp_.path();
    std::unique_ptr<SandboxExtensions> sandbox_;
    std::string token_;
};

// A token is consumed once however often consume is called, released once by expel or destruction, and a token
// the sandbox refuses stays unconsumed.
TEST_F(BXSandboxExtensionTest, ConsumesOnceAndReleasesOnExpelOrDestruction) {
    int64_t handle = 0;
    {
        BXSandboxExtension extension(token_, sandbox_.get());
        extension.expel();  // nothing consumed yet: nothing happens
        extension.consume();
        handle = extension.handle();
        ASSERT_GT(handle, 0);
        extension.consume();
        EXPECT_EQ(extension.handle(), handle) << "a second consume does not consume again";
        EXPECT_TRUE(sandbox_->consumedPath(handle));
        extension.expel();
        EXPECT_EQ(extension.handle(), 0);
        EXPECT_FALSE(sandbox_->consumedPath(handle));
        extension.consume();
        handle = extension.handle();
        ASSERT_TRUE(sandbox_->consumedPath(handle));
    }
    EXPECT_FALSE(sandbox_->consumedPath(handle)) << "destruction releases what was consumed";

    BXSandboxExtension forged(token_ + "x", sandbox_.get());
    forged.consume();
    EXPECT_EQ(forged.handle(), 0);
}

}  // namespace
}  // namespace bexil
