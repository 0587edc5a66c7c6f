// What `bexil info` shows: an example plug-in as a client builds it, with its extension point's SDK merged in.

#include <gtest/gtest.h>

#include "PlugInInfo.h"
#include "TestSupport.h"
#include "platform/sdks/SDKDirectoryRegistry.h"

namespace bexil::tool {
namespace {

const std::string kExamples = std::string(BEXIL_SOURCE_DIR) + "/examples";

class PlugInInfoTest : public ::testing::Test {
  protected:
    PlugInInfoTest() { previous_ = ExtensionSDKRegistry::setShared(std::make_shared<SDKDirectoryRegistry>()); }
    ~PlugInInfoTest() override { ExtensionSDKRegistry::setShared(previous_); }

    test::ScopedEnv sdkDir_{"BX_SDK_DIR", kExamples + "/sdks"};
    std::shared_ptr<const ExtensionSDKRegistry> previous_;
};

// Hello states its language but not its formality: the SDK's default fills the gap, its own value stays, and the
// keys the SDK gave are the ones shown as such.
TEST_F(PlugInInfoTest, ExamplePlugInGetsItsSDKDefaultsUnderItsOwnValues) {
    auto hello = resolvedPlugInAtPath(kExamples + "/bundles/Greeter.app/PlugIns/Hello.bxplugin");
    ASSERT_TRUE(hello) << hello.error().description();
    EXPECT_EQ((*hello)->attribute("Formality"), test::str("casual"));
    EXPECT_EQ((*hello)->attribute("Language"), test::str("en"));
    EXPECT_EQ((*hello)->pluginKey("CleanTimeout"), Value::int64(10));
    EXPECT_EQ((*hello)->pluginKey("Shared")->count(), 2u);

    auto sdk = findSDK("com.example.greeting");
    ASSERT_TRUE(sdk && *sdk);
    std::optional<Value> own = Document::readFile(*(*hello)->path() + "/Info.vrec").value().get("RZExtension");
    EXPECT_EQ(keysAddedBySDK(*own, *(*hello)->plugInDictionary(), (*sdk)->dictionary),
              (std::vector<std::string>{"CleanTimeout", "RZExtensionAttributes.Formality"}));
}

// A directory that is no plug-in is named in the error, never half-shown.
TEST_F(PlugInInfoTest, NonPlugInsAreRefusedByName) {
    EXPECT_FALSE(resolvedPlugInAtPath(kExamples + "/no-such-bundle"));
    auto app = resolvedPlugInAtPath(kExamples + "/bundles/Greeter.app");
    ASSERT_FALSE(app);
    EXPECT_NE(app.error().localizedDescription()->find("Greeter.app"), std::string::npos);
    EXPECT_FALSE(resolvedPlugInAtPath(kExamples + "/bundles/Misconfigured.app/PlugIns/MissingIdentifier.bxplugin"));
}

}  // namespace
}  // namespace bexil::tool
