// bexil info and bexil sdk show: what a plug-in author runs to see what an extension point gives a plug-in, here
// the example plug-ins with the example SDKs. They read the disk only, so they answer with no bxd running. (The
// merge itself: BXPlugInSDK; the look-up rules: SDKDirectoryRegistryTest.)

#include <gtest/gtest.h>

#include "E2eSupport.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;
using namespace test;

class SDKToolTest : public DaemonTest {
  protected:
    SDKToolTest() {
        fs::copy(kExamples.parent_path() / "sdks", sdks_);
        std::ofstream(sdks_ / "com.example.broken.vrec") << "<vrec><dict>";
        setenv("BX_SDK_DIR", sdks_.c_str(), 1);
    }
    ~SDKToolTest() override { unsetenv("BX_SDK_DIR"); }

    fs::path sdks_ = bxd_.root() / "sdks";
};

// Guards the exit statuses and single lines of sdk show, with no daemon running: the document and where it came
// from; 66 for an extension point without an SDK, 65 for one whose document cannot be used or a refused name.
TEST_F(SDKToolTest, SdkShowPrintsTheDocumentOrSaysWhyNot) {
    Outcome shown = bexil("sdk show com.example.greeting");
    EXPECT_EQ(shown.status, 0) << shown.err;
    EXPECT_NE(shown.out.find("SDK of com.example.greeting from " + (sdks_ / "com.example.greeting.vrec").string()),
              std::string::npos)
        << shown.out;

    const std::tuple<std::string, int, std::string> cases[] = {
        {"com.example.none", 66,
         "bexil: no SDK is registered for extension point com.example.none (searched " + sdks_.string() + ")\n"},
        {"com.example.broken", 65, "is malformed"},
        {"../sdks/com.example.greeting", 65, "invalid SDK name"},
    };
    for (const auto& [point, status, text] : cases) {
        Outcome run = bexil("sdk show " + point);
        EXPECT_EQ(run.status, status) << point << ": " << run.err;
        EXPECT_EQ(std::count(run.err.begin(), run.err.end(), '\n'), 1) << run.err;
        EXPECT_NE(run.err.find(text), std::string::npos) << point << ": " << run.err;
    }
}

// Guards info: the plug-in's own values stay, the SDK's defaults fill in and are named as the SDK's; a directory
// that is no plug-in is one line and status 65.
TEST_F(SDKToolTest, InfoShowsThePlugInAfterResolution) {
    const std::string bonjour = (kExamples / "Greeter.app/PlugIns/Bonjour.bxplugin").string();
    Outcome shown = bexil("info " + bonjour);
    EXPECT_EQ(shown.status, 0) << shown.err;
    for (const char* text : {"from the SDK:    CleanTimeout, RZExtensionAttributes.Formality\n", "\"Language\": \"fr\"",
                             "\"Formality\": \"casual\"", "\"CleanTimeout\": 10"})
        EXPECT_NE(shown.out.find(text), std::string::npos) << text << "\n" << shown.out;

    Outcome app = bexil("info " + (kExamples / "Greeter.app").string());
    EXPECT_EQ(app.status, 65);
    EXPECT_NE(app.err.find("is not a plug-in: its Info.vrec has no RZExtension dictionary\n"), std::string::npos)
        << app.err;
}

}  // namespace
}  // namespace bexil
