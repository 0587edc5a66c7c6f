#include <gtest/gtest.h>
#include <spawn.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "TestSupport.h"
#include "base/Document.h"
#include "platform/bundles/DirectoryBundle.h"

extern char** environ;

namespace bexil {
namespace {

namespace fs = std::filesystem;

const fs::path kExamples = fs::path(BEXIL_SOURCE_DIR) / "examples" / "bundles";
constexpr const char* kMainBundleVariable = "BX_TEST_EXPECTED_MAIN_BUNDLE";
constexpr int kProbePassed = 42;

using test::dict;
using test::writeText;

std::string real(const fs::path& path) { return fs::canonical(path).string(); }

// A fresh directory under the system's temporary directory, removed with everything in it afterwards.
class BundleDirectoryTest : public ::testing::Test {
protected:
    fs::path makeDirectory(const fs::path& relative) {
        fs::create_directories(root_ / relative);
        return root_ / relative;
    }
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

    static void expectNothing(const PlatformBundle& bundle) {
        EXPECT_FALSE(bundle.stringProperty(BundleStringProperty::BundlePath));
        EXPECT_FALSE(bundle.stringProperty(BundleStringProperty::ExecutablePath));
        EXPECT_FALSE(bundle.stringProperty(BundleStringProperty::SupportPath));
        EXPECT_FALSE(bundle.infoDictionary());
    }

    test::TempDir tmp_{"bexil-bundle"};
    fs::path root_ = tmp_.path();
};

TEST_F(BundleDirectoryTest, ExampleApplicationAnswersItsRootExecutableAndInformation) {
    auto bundle = DirectoryBundle::create(kExamples / "Greeter.app", BundleLookup::Directory);
    std::string app = real(kExamples / "Greeter.app");
    EXPECT_EQ(bundle->stringProperty(BundleStringProperty::BundlePath), app);
    EXPECT_EQ(bundle->stringProperty(BundleStringProperty::SupportPath), app);
    EXPECT_EQ(bundle->stringProperty(BundleStringProperty::ExecutablePath), app + "/greeter");
    ASSERT_TRUE(bundle->infoDictionary());
    EXPECT_EQ(bundle->infoDictionary()->get("BDBundleIdentifier"), Value::string("com.example.greeter"));
    EXPECT_EQ(bundle->problem(), "");
    EXPECT_NE(bundle->description().find(app), std::string::npos);
}

TEST_F(BundleDirectoryTest, RelativeAndUnnormalisedPathsReportTheRealRoot) {
    makeBundle("Real.app", "tool");
    fs::create_directory_symlink(root_ / "Real.app", root_ / "Link.app");
    auto viaLink = DirectoryBundle::create(root_ / "Link.app", BundleLookup::Directory);
    EXPECT_EQ(viaLink->stringProperty(BundleStringProperty::BundlePath), (root_ / "Real.app").string());

    auto dotted = DirectoryBundle::create(root_ / "Real.app" / "." / ".." / "Real.app", BundleLookup::Directory);
    EXPECT_EQ(dotted->stringProperty(BundleStringProperty::BundlePath), (root_ / "Real.app").string());
}

TEST_F(BundleDirectoryTest, BundleWithoutExecutableKeyOrInformationHasNoExecutable) {
    auto data = DirectoryBundle::create(kExamples / "Notes.app/PlugIns/Stationery.bxplugin", BundleLookup::Directory);
    EXPECT_TRUE(data->stringProperty(BundleStringProperty::BundlePath));
    EXPECT_FALSE(data->stringProperty(BundleStringProperty::ExecutablePath));
    EXPECT_TRUE(data->infoDictionary());
    // A directory without Info.vrec is a bundle without information.
    fs::path plain = makeDirectory("Plain");
    auto bundle = DirectoryBundle::create(plain, BundleLookup::Directory);
    EXPECT_EQ(bundle->stringProperty(BundleStringProperty::BundlePath), plain.string());
    EXPECT_FALSE(bundle->stringProperty(BundleStringProperty::ExecutablePath));
    EXPECT_FALSE(bundle->infoDictionary());
    EXPECT_EQ(bundle->problem(), "");
    EXPECT_NE(bundle->description().find("without Info.vrec"), std::string::npos);
}

TEST_F(BundleDirectoryTest, PathsThatNameNoBundleAnswerNothing) {
    for (const fs::path& path : {root_ / "missing", root_ / "missing" / "deeper", fs::path("")}) {
        SCOPED_TRACE(path.string());
        auto bundle = DirectoryBundle::create(path, BundleLookup::Directory);
        expectNothing(*bundle);
        EXPECT_NE(bundle->description().find("no bundle at"), std::string::npos);
        expectNothing(*DirectoryBundle::create(path, BundleLookup::ContainingExecutable));
    }
    // A NUL byte would cut the path short at the system call; the bundle at the shorter path must not answer.
    makeBundle("Cut.app", "tool");
    fs::path cut = (root_ / "Cut.app").string() + std::string(1, '\0') + "/elsewhere";
    expectNothing(*DirectoryBundle::create(cut, BundleLookup::Directory));
    expectNothing(*DirectoryBundle::create((root_ / "Cut.app/tool").string() + std::string(1, '\0'),
                                           BundleLookup::ContainingExecutable));

    writeText(root_ / "file", "not a directory");
    auto file = DirectoryBundle::create(root_ / "file", BundleLookup::Directory);
    expectNothing(*file);
    EXPECT_NE(file->description().find("not a directory"), std::string::npos);
}

TEST_F(BundleDirectoryTest, UnreadableInformationLeavesTheBundleWithoutItAndSaysWhyAndOtherRootsAreHandedOverAsRead) {
    fs::path malformed = makeDirectory("Malformed.app");
    writeText(malformed / "Info.vrec", "<vrec><dict><key>BDBundleIdentifier</key></dict>");
    auto bundle = DirectoryBundle::create(malformed, BundleLookup::Directory);
    EXPECT_EQ(bundle->stringProperty(BundleStringProperty::BundlePath), malformed.string());
    EXPECT_FALSE(bundle->infoDictionary());
    EXPECT_NE(bundle->problem().find("BexilDocument"), std::string::npos) << bundle->problem();

    fs::path huge = makeDirectory("Huge.app");
    writeText(huge / "Info.vrec", std::string(DirectoryBundle::kMaxInfoBytes + 1, ' '));
    auto big = DirectoryBundle::create(huge, BundleLookup::Directory);
    EXPECT_FALSE(big->infoDictionary());
    EXPECT_NE(big->problem().find("larger than"), std::string::npos) << big->problem();

    fs::path folder = makeDirectory("Folder.app/Info.vrec");
    auto notFile = DirectoryBundle::create(folder.parent_path(), BundleLookup::Directory);
    EXPECT_FALSE(notFile->infoDictionary());
    EXPECT_NE(notFile->problem().find("not a regular file"), std::string::npos);

    fs::path listed = root_ / "List.app";
    writeInfo(listed, Value::array({Value::string("BDBundleExecutable"), Value::string("tool")}));
    writeExecutable(listed / "tool");
    auto list = DirectoryBundle::create(listed, BundleLookup::Directory);
    ASSERT_TRUE(list->infoDictionary());
    EXPECT_TRUE(list->infoDictionary()->isArray());
    EXPECT_FALSE(list->stringProperty(BundleStringProperty::ExecutablePath));
}

TEST_F(BundleDirectoryTest, ExecutableMustBeAnExistingFileInsideTheBundle) {
    writeExecutable(root_ / "outside");
    struct Case {
        const char* name;
        Value executable;
    };
    const Case cases[] = {
        {"Climbs", Value::string("../outside")},
        {"ClimbsAfterDescending", Value::string("bin/../../outside")},
        {"Absolute", Value::string((root_ / "outside").string())},
        {"Empty", Value::string("")},
        {"Dot", Value::string(".")},
        {"NotAString", Value::int64(7)},
        {"Missing", Value::string("tool")},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        fs::path bundle = root_ / c.name;
        writeInfo(bundle, dict({{"BDBundleExecutable", c.executable}}));
        auto opened = DirectoryBundle::create(bundle, BundleLookup::Directory);
        EXPECT_EQ(opened->stringProperty(BundleStringProperty::BundlePath), bundle.string());
        EXPECT_FALSE(opened->stringProperty(BundleStringProperty::ExecutablePath));
        EXPECT_NE(opened->problem(), "");
    }
    // A name that wanders but stays inside is normalised.
    fs::path wandering = makeBundle("Wandering.app", "bin/tool");
    writeInfo(wandering, dict({{"BDBundleExecutable", Value::string("bin/./../bin/tool")}}));
    EXPECT_EQ(DirectoryBundle::create(wandering, BundleLookup::Directory)
                  ->stringProperty(BundleStringProperty::ExecutablePath),
              (wandering / "bin/tool").string());
}

TEST_F(BundleDirectoryTest, SymbolicLinkLoopsGiveNothingInsteadOfHanging) {
    fs::create_symlink(root_ / "b", root_ / "a");
    fs::create_symlink(root_ / "a", root_ / "b");
    expectNothing(*DirectoryBundle::create(root_ / "a", BundleLookup::Directory));
    expectNothing(*DirectoryBundle::create(root_ / "a", BundleLookup::ContainingExecutable));
    expectNothing(*DirectoryBundle::create(root_ / "a" / "tool", BundleLookup::ContainingExecutable));

    fs::path looping = makeDirectory("Looping.app");
    fs::create_symlink(looping / "Info.vrec", looping / "Info.vrec");
    auto bundle = DirectoryBundle::create(looping, BundleLookup::Directory);
    EXPECT_EQ(bundle->stringProperty(BundleStringProperty::BundlePath), looping.string());
    EXPECT_FALSE(bundle->infoDictionary());
    EXPECT_NE(bundle->problem(), "");

    // The executable itself a loop: it names nothing that exists.
    fs::path selfish = root_ / "Selfish.app";
    writeInfo(selfish, dict({{"BDBundleExecutable", Value::string("tool")}}));
    fs::create_symlink(selfish / "tool", selfish / "tool");
    EXPECT_FALSE(DirectoryBundle::create(selfish, BundleLookup::Directory)
                     ->stringProperty(BundleStringProperty::ExecutablePath));
    expectNothing(*DirectoryBundle::create(selfish / "tool", BundleLookup::ContainingExecutable));
}

TEST_F(BundleDirectoryTest, ExecutableLeadsUpToTheBundleThatNamesIt) {
    fs::path app = makeBundle("Deep.app", "libexec/tools/deep/tool", "com.example.deep");
    // A directory on the way up whose document names something else is passed over, as is one that is malformed.
    writeInfo(app / "libexec/tools", dict({{"BDBundleIdentifier", Value::string("com.example.decoy")},
                                           {"BDBundleExecutable", Value::string("deep/other")}}));
    writeExecutable(app / "libexec/tools/deep/other");
    writeText(app / "libexec/tools/deep/Info.vrec", "<vrec><string>broken");

    auto found = DirectoryBundle::create(app / "libexec/tools/deep/tool", BundleLookup::ContainingExecutable);
    EXPECT_EQ(found->stringProperty(BundleStringProperty::BundlePath), app.string());
    EXPECT_EQ(found->stringProperty(BundleStringProperty::ExecutablePath), (app / "libexec/tools/deep/tool").string());
    ASSERT_TRUE(found->infoDictionary());
    EXPECT_EQ(found->infoDictionary()->get("BDBundleIdentifier"), Value::string("com.example.deep"));

    // The decoy's own executable finds the decoy.
    auto decoy = DirectoryBundle::create(app / "libexec/tools/deep/other", BundleLookup::ContainingExecutable);
    EXPECT_EQ(decoy->stringProperty(BundleStringProperty::BundlePath), (app / "libexec/tools").string());

    // A file that no document names finds nothing, even inside a bundle; so does a directory.
    writeExecutable(app / "libexec/stray");
    auto stray = DirectoryBundle::create(app / "libexec/stray", BundleLookup::ContainingExecutable);
    expectNothing(*stray);
    EXPECT_NE(stray->description().find("names it"), std::string::npos);
    expectNothing(*DirectoryBundle::create(app, BundleLookup::ContainingExecutable));
}

TEST_F(BundleDirectoryTest, ExecutableLookupSeesThroughSymbolicLinks) {
    fs::path app = makeBundle("Versions.app", "bin/tool-1.2");
    // The document names a link inside the bundle; the real file is what the walk starts from.
    writeInfo(app, dict({{"BDBundleExecutable", Value::string("current")}}));
    fs::create_symlink("bin/tool-1.2", app / "current");
    auto viaTarget = DirectoryBundle::create(app / "bin/tool-1.2", BundleLookup::ContainingExecutable);
    EXPECT_EQ(viaTarget->stringProperty(BundleStringProperty::BundlePath), app.string());
    EXPECT_EQ(viaTarget->stringProperty(BundleStringProperty::ExecutablePath), (app / "current").string());

    // A link from elsewhere to the executable finds the bundle too.
    fs::create_symlink(app / "bin/tool-1.2", root_ / "launcher");
    auto viaLauncher = DirectoryBundle::create(root_ / "launcher", BundleLookup::ContainingExecutable);
    EXPECT_EQ(viaLauncher->stringProperty(BundleStringProperty::BundlePath), app.string());
}

TEST_F(BundleDirectoryTest, ExamplePlugInsAreTheirOwnBundlesNotTheirApplications) {
    fs::path greeter = kExamples / "Greeter.app";
    auto app = DirectoryBundle::create(greeter / "greeter", BundleLookup::ContainingExecutable);
    EXPECT_EQ(app->stringProperty(BundleStringProperty::BundlePath), real(greeter));

    fs::path bonjour = greeter / "PlugIns/Bonjour.bxplugin";
    auto plugIn = DirectoryBundle::create(bonjour / "bin/bonjour", BundleLookup::ContainingExecutable);
    EXPECT_EQ(plugIn->stringProperty(BundleStringProperty::BundlePath), real(bonjour));
    EXPECT_EQ(plugIn->infoDictionary()->get("BDBundleIdentifier"), Value::string("com.example.greeter.bonjour"));
}

// The main bundle is found from the running program's own executable. This test copies its own program into a
// bundle and runs the copy, which checks (in the branch below) that it finds that bundle.
TEST(MainBundle, IsTheBundleThatNamesTheRunningProgram) {
    if (const char* expected = std::getenv(kMainBundleVariable)) {
        auto main = DirectoryBundle::createMain();
        EXPECT_EQ(main->stringProperty(BundleStringProperty::BundlePath), std::string(expected));
        EXPECT_EQ(main->stringProperty(BundleStringProperty::ExecutablePath), std::string(expected) + "/bin/probe");
        // A distinctive status, so that the parent knows this check ran and did not just match no test.
        std::fflush(nullptr);
        std::_Exit(::testing::Test::HasFailure() ? 1 : kProbePassed);
    }
    // This program itself lies in no bundle.
    EXPECT_FALSE(DirectoryBundle::createMain()->stringProperty(BundleStringProperty::BundlePath));

    test::TempDir root("bexil-main");
    fs::path bundle = root / "Probe.app";
    fs::create_directories(bundle / "bin");
    ASSERT_FALSE(Document::writeFileAtomically(bundle / "Info.vrec",
                                               dict({{"BDBundleExecutable", Value::string("bin/probe")}})));
    fs::copy_file("/proc/self/exe", bundle / "bin/probe");
    fs::permissions(bundle / "bin/probe", fs::perms::owner_all);

    std::string program = (bundle / "bin/probe").string();
    std::string filter = "--gtest_filter=MainBundle.IsTheBundleThatNamesTheRunningProgram";
    std::vector<char*> argv = {program.data(), filter.data(), nullptr};
    std::string expectation = std::string(kMainBundleVariable) + "=" + bundle.string();
    std::vector<char*> envp;
    for (char** e = environ; *e != nullptr; ++e) envp.push_back(*e);
    envp.push_back(expectation.data());
    envp.push_back(nullptr);

    pid_t pid = 0;
    ASSERT_EQ(posix_spawn(&pid, program.c_str(), nullptr, nullptr, argv.data(), envp.data()), 0);
    int status = 0;
    ASSERT_EQ(waitpid(pid, &status, 0), pid);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == kProbePassed) << "status " << status;
}

}  // namespace
}  // namespace bexil
