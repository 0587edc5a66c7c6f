#include <gtest/gtest.h>

#include "TestSupport.h"
#include "model/BXSandboxExtension.h"
#include "platform/sandbox/SandboxExtensions.h"

namespace bexil {
namespace {

// A token is consumed once however often consume is called, released once by expel or destruction (a leaked grant
// would outlive the plug-in's use), and a token the sandbox refuses stays unconsumed.
TEST(BXSandboxExtension, ConsumesOnceAndReleasesOnExpelOrDestruction) {
    test::TempDir root("sandbox-extension-test");
    SandboxExtensions sandbox(root / "extension-key");
    std::optional<std::string> token =
        sandbox.issueFileExtension(SandboxExtensions::kReadOnlyClass, root.path().string());
    ASSERT_TRUE(token);
    int64_t handle = 0;
    {
        BXSandboxExtension extension(*token, &sandbox);
        extension.expel();  // nothing consumed yet: nothing happens
        extension.consume();
        handle = extension.handle();
        ASSERT_GT(handle, 0);
        extension.consume();
        EXPECT_EQ(extension.handle(), handle) << "a second consume does not consume again";
        extension.expel();
        EXPECT_EQ(extension.handle(), 0);
        EXPECT_FALSE(sandbox.consumedPath(handle));
        extension.consume();
        handle = extension.handle();
        ASSERT_TRUE(sandbox.consumedPath(handle));
    }
    EXPECT_FALSE(sandbox.consumedPath(handle)) << "destruction releases what was consumed";

    BXSandboxExtension forged(*token + "x", &sandbox);
    forged.consume();
    EXPECT_EQ(forged.handle(), 0);
}

}  // namespace
}  // namespace bexil
