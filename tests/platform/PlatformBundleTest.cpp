#include <gtest/gtest.h>

#include <filesystem>
#include <string>

#include "TestSupport.h"
#include "base/Document.h"
#include "platform/bundles/DirectoryBundle.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;

const fs::path kExamples = fs::path(BEXIL_SOURCE_DIR) / "examples" / "bundles";

using test::dict;
using test::writeText;

std::shared_ptr<const DirectoryBundle> atDirectory(const fs::path& path) {
    return DirectoryBundle::create(path, BundleLookup::Directory);
}
std::shared_ptr<const DirectoryBundle> ofExecutable(const fs::path& path) {
    return DirectoryBundle::create(path, BundleLookup::ContainingExecutable);
}
std::optional<std::string> rootOf(const std::shared_ptr<const DirectoryBundle>& bundle) {
    return bundle->stringProperty(BundleStringProperty::BundlePath);
}
std::optional<std::string> executableOf(const std::shared_ptr<const DirectoryBundle>& bundle) {
    return bundle->stringProperty(BundleStringProperty::ExecutablePath);
}

// A bundle that names nothing must answer nothing at all.
void expectNothing(const std::shared_ptr<const DirectoryBundle>& bundle) {
    EXPECT_FALSE(rootOf(bundle));
    EXPECT_FALSE(executableOf(bundle));
    EXPECT_FALSE(bundle->stringProperty(BundleStringProperty::SupportPath));
    EXPECT_FALSE(bundle->infoDictionary());
}

// A fresh directory under the system's temporary directory, removed with everything in it afterwards.
class BundleDirectoryTest : public ::testing::Test {
  protected:
    void writeInfo(const fs::path& bundle, const Value& info) {
        fs::create_directories(bundle);
        ASSERT_FALSE(Document::writeFileAtomically(bundle / "Info.vrec", info).has_value());
    }
    void writeExecutable(const fs::path& file) {
        writeText(file, "#!/bin/sh\nexit 0\n");
        fs::permissions(file, fs::perms::owner_all | fs::perms::group_read | fs::perms::group_exec);
    }
    // A bundle at `relative` whose executable is `executable` (relative to the bundle).
    fs::path makeBundle(const fs::path& relative, const std::string& executable,
                        const std::string& identifier = "com.example.test") {
        fs::path bundle = root_ / relative;
        writeInfo(bundle, dict({{"BDBundleIdentifier", Value::string(identifier)},
                                {"BDBundleExecutable", Value::string(executable)}}));
        writeExecutable(bundle / executable);
        return bundle;
    }

    test::TempDir tmp_{"bexil-bundle"};
    fs::path root_ = tmp_.path();
};

// A bundle reports its real root whatever form of the path it was opened by, and the executable its document names.
TEST_F(BundleDirectoryTest, BundleAnswersItsRealRootExecutableAndInformation) {
    std::string app = fs::canonical(kExamples / "Greeter.app").string();
    auto bundle = atDirectory(kExamples / "Greeter.app");
    EXPECT_EQ(rootOf(bundle), app);
    EXPECT_EQ(executableOf(bundle), app + "/greeter");
    ASSERT_TRUE(bundle->infoDictionary());

    makeBundle("Real.app", "tool");
    fs::create_directory_symlink(root_ / "Real.app", root_ / "Link.app");
    EXPECT_EQ(rootOf(atDirectory(root_ / "Link.app")), (root_ / "Real.app").string());
    EXPECT_EQ(rootOf(atDirectory(root_ / "Real.app" / "." / ".." / "Real.app")), (root_ / "Real.app").string());

    // Without an executable key, or without information at all, a bundle has no executable.
    auto data = atDirectory(kExamples / "Notes.app/PlugIns/Stationery.bxplugin");
    EXPECT_TRUE(data->infoDictionary());
    EXPECT_FALSE(executableOf(data));
    fs::create_directories(root_ / "Plain");
    auto plain = atDirectory(root_ / "Plain");
    EXPECT_EQ(rootOf(plain), (root_ / "Plain").string());
    EXPECT_FALSE(executableOf(plain));
}

// Guards paths that name no bundle (missing, empty, a file, one cut short by a NUL, a link loop) against answering
// anything, or hanging.
TEST_F(BundleDirectoryTest, PathsThatNameNoBundleAnswerNothing) {
    for (const fs::path& path : {root_ / "missing", fs::path("")}) {
        expectNothing(atDirectory(path));
        expectNothing(ofExecutable(path));
    }
    // A NUL byte would cut the path short at the system call; the bundle at the shorter path must not answer.
    makeBundle("Cut.app", "tool");
    expectNothing(atDirectory((root_ / "Cut.app").string() + std::string(1, '\0') + "/elsewhere"));
    expectNothing(ofExecutable((root_ / "Cut.app/tool").string() + std::string(1, '\0')));

    writeText(root_ / "file", "not a directory");
    expectNothing(atDirectory(root_ / "file"));
    fs::create_symlink(root_ / "b", root_ / "a");
    fs::create_symlink(root_ / "a", root_ / "b");
    expectNothing(atDirectory(root_ / "a"));
    expectNothing(ofExecutable(root_ / "a" / "tool"));
}

// Information that cannot be read leaves the bundle without it and says why; a root other than a dictionary is
// handed over as read, but names no executable.
TEST_F(BundleDirectoryTest, UnreadableInformationLeavesTheBundleWithoutItAndSaysWhy) {
    writeText(root_ / "Malformed.app/Info.vrec", "<vrec><dict><key>BDBundleIdentifier</key></dict>");
    writeText(root_ / "Huge.app/Info.vrec", std::string(DirectoryBundle::kMaxInfoBytes + 1, ' '));
    fs::create_directories(root_ / "Folder.app/Info.vrec");
    for (const char* name : {"Malformed.app", "Huge.app", "Folder.app"}) {
        auto bundle = atDirectory(root_ / name);
        EXPECT_EQ(rootOf(bundle), (root_ / name).string());
        EXPECT_FALSE(bundle->infoDictionary()) << name;
        EXPECT_NE(bundle->problem(), "") << name;
    }

    writeInfo(root_ / "List.app", Value::array({Value::string("BDBundleExecutable"), Value::string("tool")}));
    writeExecutable(root_ / "List.app/tool");
    auto list = atDirectory(root_ / "List.app");
    ASSERT_TRUE(list->infoDictionary());
    EXPECT_TRUE(list->infoDictionary()->isArray());
    EXPECT_FALSE(executableOf(list));
}

// The executable name is never followed out of the bundle.
TEST_F(BundleDirectoryTest, ExecutableMustBeAnExistingFileInsideTheBundle) {
    writeExecutable(root_ / "outside");
    const std::pair<const char*, Value> cases[] = {
        {"Climbs", Value::string("../outside")},
        {"ClimbsAfterDescending", Value::string("bin/../../outside")},
        {"Absolute", Value::string((root_ / "outside").string())},
        {"Dot", Value::string(".")},
        {"Missing", Value::string("tool")},
    };
    for (const auto& [name, executable] : cases) {
        writeInfo(root_ / name, dict({{"BDBundleExecutable", executable}}));
        auto bundle = atDirectory(root_ / name);
        EXPECT_EQ(rootOf(bundle), (root_ / name).string());
        EXPECT_FALSE(executableOf(bundle)) << name;
        EXPECT_NE(bundle->problem(), "") << name;
    }
    // A name that wanders but stays inside is normalised.
    fs::path wandering = makeBundle("Wandering.app", "bin/tool");
    writeInfo(wandering, dict({{"BDBundleExecutable", Value::string("bin/./../bin/tool")}}));
    EXPECT_EQ(executableOf(atDirectory(wandering)), (wandering / "bin/tool").string());
}

// Guards against hanging on, or reading through, a link loop in place of Info.vrec.
TEST_F(BundleDirectoryTest, InformationThatIsALinkLoopGivesNothingInsteadOfHanging) {
    fs::create_directories(root_ / "Looping.app");
    fs::create_symlink(root_ / "Looping.app/Info.vrec", root_ / "Looping.app/Info.vrec");
    auto bundle = atDirectory(root_ / "Looping.app");
    EXPECT_EQ(rootOf(bundle), (root_ / "Looping.app").string());
    EXPECT_FALSE(bundle->infoDictionary());
    EXPECT_NE(bundle->problem(), "");
}

// Guards the upward walk from an executable: the nearest bundle that names the file, past decoys and broken ones.
TEST_F(BundleDirectoryTest, ExecutableLeadsUpToTheBundleThatNamesIt) {
    fs::path app = makeBundle("Deep.app", "libexec/tools/deep/tool", "com.example.deep");
    // A directory on the way up whose document names something else is passed over, as is one that is malformed.
    writeInfo(app / "libexec/tools", dict({{"BDBundleIdentifier", Value::string("com.example.decoy")},
                                           {"BDBundleExecutable", Value::string("deep/other")}}));
    writeExecutable(app / "libexec/tools/deep/other");
    writeText(app / "libexec/tools/deep/Info.vrec", "<vrec><string>broken");

    auto found = ofExecutable(app / "libexec/tools/deep/tool");
    EXPECT_EQ(rootOf(found), app.string());
    EXPECT_EQ(executableOf(found), (app / "libexec/tools/deep/tool").string());
    // The nearest bundle that names the file wins: the decoy's own executable finds the decoy.
    EXPECT_EQ(rootOf(ofExecutable(app / "libexec/tools/deep/other")), (app / "libexec/tools").string());

    // A file that no document names finds nothing, even inside a bundle; so does a directory.
    writeExecutable(app / "libexec/stray");
    expectNothing(ofExecutable(app / "libexec/stray"));
    expectNothing(ofExecutable(app));
}

// Guards links in the walk: a document naming a link, and a link from outside to the executable.
TEST_F(BundleDirectoryTest, ExecutableLookupSeesThroughSymbolicLinks) {
    fs::path app = makeBundle("Versions.app", "bin/tool-1.2");
    // The document names a link inside the bundle; the real file is what the walk starts from.
    writeInfo(app, dict({{"BDBundleExecutable", Value::string("current")}}));
    fs::create_symlink("bin/tool-1.2", app / "current");
    auto viaTarget = ofExecutable(app / "bin/tool-1.2");
    EXPECT_EQ(rootOf(viaTarget), app.string());
    EXPECT_EQ(executableOf(viaTarget), (app / "current").string());
    // A link from elsewhere to the executable finds the bundle too.
    fs::create_symlink(app / "bin/tool-1.2", root_ / "launcher");
    EXPECT_EQ(rootOf(ofExecutable(root_ / "launcher")), app.string());
}

}  // namespace
}  // namespace bexil
