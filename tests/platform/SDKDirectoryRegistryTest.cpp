#include <gtest/gtest.h>

#include <filesystem>
#include <string>

#include "CapturedLog.h"
#include "TestSupport.h"
#include "platform/sdks/SDKDirectoryRegistry.h"

namespace bexil {
namespace {

using namespace test;
namespace fs = std::filesystem;

class SDKDirectoryRegistryTest : public ::testing::Test {
  protected:
    // Writes the SDK document of `name` holding {"From": from} into `directory`.
    static void writeSDK(const fs::path& directory, const std::string& name, const std::string& from) {
        writeText(directory / (name + ".vrec"), *Document::write(dict({{"From", str(from)}})));
    }
    static std::string from(const Result<std::optional<Value>>& entry) {
        if (!entry) return "error: " + entry.error().localizedDescription().value_or("");
        if (!*entry) return "none";
        return std::string((*entry)->get("From").stringView());
    }

    TempDir root_{"bx-sdks"};
    fs::path etc_ = root_ / "etc";
    fs::path usr_ = root_ / "usr";
    SDKDirectoryRegistry registry_{{etc_, usr_}};
};

// The administrator's directory replaces the vendor's file of the same name; other names still come from the
// vendor's, missing ones and missing directories are simply not registered.
TEST_F(SDKDirectoryRegistryTest, EarlierDirectoryReplacesTheSameNameInLaterOnes) {
    writeSDK(usr_, "com.example.a", "usr");
    writeSDK(usr_, "com.example.b", "usr");
    writeSDK(etc_, "com.example.a", "etc");
    EXPECT_EQ(from(registry_.readSDKEntry("com.example.a")), "etc");
    EXPECT_EQ(from(registry_.readSDKEntry("com.example.b")), "usr");
    EXPECT_EQ(from(registry_.readSDKEntry("com.example.c")), "none");
    EXPECT_EQ(from(SDKDirectoryRegistry({root_ / "absent"}).readSDKEntry("com.example.a")), "none");

    ScopedEnv env("BX_SDK_DIR", usr_.string());
    EXPECT_EQ(SDKDirectoryRegistry::defaultDirectories(), std::vector<fs::path>{usr_});
}

// Names come from plug-ins: none may leave the directory, however it is spelled.
TEST_F(SDKDirectoryRegistryTest, NamesThatCouldLeaveTheDirectoryAreRefused) {
    writeSDK(root_, "secret", "outside");
    writeSDK(usr_ / "sub", "x", "sub");
    for (const char* name : {"../secret", "sub/x", "..", ".", "", "/etc/passwd"})
        EXPECT_TRUE(from(registry_.readSDKEntry(name)).starts_with("error: invalid SDK name")) << name;
    log::CaptureSink capture;
    EXPECT_FALSE(registry_.copySDKEntry("../secret"));
    EXPECT_EQ(capturedLine(capture, "cannot be used"),
              "error ops: sdk \"../secret\" cannot be used: invalid SDK name \"../secret\"");
}

// An unusable document hides the lower ones (it was put there to replace them) and says why; a huge one is logged
// with the limit.
TEST_F(SDKDirectoryRegistryTest, UnusableDocumentsAreRefusedWithTheirReason) {
    writeSDK(usr_, "com.example.a", "usr");
    writeText(etc_ / "com.example.a.vrec", "<vrec><dict><key>x</key>");
    EXPECT_TRUE(from(registry_.readSDKEntry("com.example.a")).find("is malformed") != std::string::npos);
    writeText(etc_ / "com.example.a.vrec", *Document::write(Value::array({str("x")})));
    EXPECT_TRUE(from(registry_.readSDKEntry("com.example.a")).ends_with("does not hold a dictionary"));
    fs::create_directories(etc_ / "com.example.dir.vrec");
    EXPECT_TRUE(from(registry_.readSDKEntry("com.example.dir")).ends_with("is not a regular file"));

    log::CaptureSink capture;
    writeText(etc_ / "com.example.a.vrec", std::string(SDKDirectoryRegistry::kMaxSDKDocumentBytes + 1, ' '));
    EXPECT_TRUE(from(registry_.readSDKEntry("com.example.a")).ends_with("size limit"));
    EXPECT_TRUE(capture.contains("is larger than 1048576 bytes"));
}

// A link to another SDK in the same directory is an alias; a link that leads out of it (or nowhere) is refused.
TEST_F(SDKDirectoryRegistryTest, SymbolicLinksMustStayInsideTheirDirectory) {
    writeSDK(usr_, "com.example.real", "real");
    writeSDK(root_, "secret", "outside");
    fs::create_symlink("com.example.real.vrec", usr_ / "com.example.alias.vrec");
    fs::create_symlink(root_ / "secret.vrec", usr_ / "com.example.escape.vrec");
    fs::create_symlink("../usr/com.example.real.vrec", usr_ / "com.example.roundabout.vrec");
    fs::create_symlink("missing.vrec", usr_ / "com.example.dangling.vrec");
    EXPECT_EQ(from(registry_.readSDKEntry("com.example.alias")), "real");
    EXPECT_EQ(from(registry_.readSDKEntry("com.example.roundabout")), "real");
    EXPECT_TRUE(from(registry_.readSDKEntry("com.example.escape")).find("leads outside") != std::string::npos);
    EXPECT_TRUE(from(registry_.readSDKEntry("com.example.dangling")).find("leads nowhere") != std::string::npos);
}

// Guards the kept documents: a file edited in place (same size, so only its times tell), replaced by another file,
// broken or removed is seen at the next look-up, never answered from what was read before.
TEST_F(SDKDirectoryRegistryTest, EveryChangeToADocumentIsSeenAtTheNextLookUp) {
    writeSDK(usr_, "com.example.a", "one");
    EXPECT_EQ(from(registry_.readSDKEntry("com.example.a")), "one");
    EXPECT_EQ(from(registry_.readSDKEntry("com.example.a")), "one");
    writeSDK(usr_, "com.example.a", "two");
    EXPECT_EQ(from(registry_.readSDKEntry("com.example.a")), "two");
    writeSDK(root_, "replacement", "new");
    fs::rename(root_ / "replacement.vrec", usr_ / "com.example.a.vrec");
    EXPECT_EQ(from(registry_.readSDKEntry("com.example.a")), "new");
    writeText(usr_ / "com.example.a.vrec", "<vrec><dict><key>x</key>");
    EXPECT_NE(from(registry_.readSDKEntry("com.example.a")).find("is malformed"), std::string::npos);
    fs::remove(usr_ / "com.example.a.vrec");
    EXPECT_EQ(from(registry_.readSDKEntry("com.example.a")), "none");
}

}  // namespace
}  // namespace bexil
