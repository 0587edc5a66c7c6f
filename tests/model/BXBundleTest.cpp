#include <gtest/gtest.h>

#include <atomic>
#include <filesystem>
#include <string>
#include <thread>
#include <vector>

#include "TestSupport.h"
#include "base/Document.h"
#include "model/BXBundle.h"
#include "platform/log/CaptureSink.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;

const fs::path kExamples = fs::path(BEXIL_SOURCE_DIR) / "examples" / "bundles";

std::string real(const fs::path& path) { return fs::canonical(path).string(); }

using test::dict;

// A platform bundle whose answers the test sets, counting how often each property is asked for.
class FakeBundle : public PlatformBundle {
  public:
    std::optional<std::string> bundlePath;
    std::optional<std::string> executable;
    std::optional<std::string> support;
    mutable std::atomic<int> supportQueries{0};

    std::optional<std::string> stringProperty(BundleStringProperty property) const override {
        switch (property) {
            case BundleStringProperty::BundlePath:
                return bundlePath;
            case BundleStringProperty::ExecutablePath:
                return executable;
            case BundleStringProperty::SupportPath:
                ++supportQueries;
                return support;
        }
        return std::nullopt;
    }
    std::optional<Value> infoDictionary() const override { return std::nullopt; }
    std::string description() const override { return "<fake bundle>"; }
};

// Every way in (path, URL, executable, the bundle directory, a platform bundle) leads to the same resolved bundle.
TEST(BXBundleConstruction, EveryConstructorFindsTheExampleApplication) {
    fs::path greeter = kExamples / "Greeter.app";
    std::string app = real(greeter);
    const std::shared_ptr<BXBundle> bundles[] = {
        BXBundle::initWithPath(greeter.string()),
        BXBundle::initWithURL("file://" + greeter.string()),
        BXBundle::initWithURL(greeter.string()),
        BXBundle::initWithExecutablePath((greeter / "greeter").string()),
        BXBundle::initWithExecutableURL("file://" + (greeter / "greeter").string()),
        BXBundle::initWithExecutablePath(greeter.string()),  // the bundle directory itself
        BXBundle::initWithZEMBundle(BXBundle::initWithPath(app)->bundle()),
    };
    for (const auto& bundle : bundles) {
        ASSERT_TRUE(bundle);
        SCOPED_TRACE(bundle->description());
        EXPECT_EQ(bundle->path(), app);
        EXPECT_EQ(bundle->executablePath(), app + "/greeter");
        EXPECT_EQ(bundle->bundleIdentifier(), "com.example.greeter");
    }
    // An executable deep inside its bundle leads back to the bundle, not to the directory above it.
    fs::path bonjour = greeter / "PlugIns" / "Bonjour.bxplugin";
    EXPECT_EQ(BXBundle::initWithExecutablePath((bonjour / "bin" / "bonjour").string())->path(), real(bonjour));
}

// Percent-escapes are undone only in file URLs, and a URL naming another host is no local path.
TEST(BXBundleConstruction, URLsAreDecodedOnlyWhenTheyAreFileURLs) {
    test::TempDir root("bexil-url");
    fs::path dir = root / "With Space%41.app";
    fs::create_directories(dir);
    std::string encoded = root.path().string() + "/With%20Space%2541.app";
    EXPECT_EQ(BXBundle::initWithURL("file://" + encoded)->path(), dir.string());
    EXPECT_EQ(BXBundle::initWithURL("file://localhost" + encoded)->path(), dir.string());
    EXPECT_EQ(BXBundle::initWithURL(dir.string())->path(), dir.string());
    EXPECT_FALSE(BXBundle::initWithURL("file://elsewhere" + dir.string())->path());
}

// Only a missing platform bundle gives no object; a path that names no bundle gives one that answers nothing.
// Information that cannot be read, or is not a dictionary, counts as absent, and the daemon logs which one it was
// (the texts operators look for); an identifier that is not a string is no identifier.
TEST(BXBundleQueries, MissingOrUnusableInformationAnswersNothingAndSaysWhy) {
    EXPECT_EQ(BXBundle::initWithZEMBundle(nullptr), nullptr);
    log::CaptureSink capture;
    auto missing = BXBundle::initWithPath("/nonexistent/Nowhere.app");
    ASSERT_TRUE(missing);
    EXPECT_FALSE(missing->path());
    EXPECT_FALSE(missing->executablePath());
    EXPECT_FALSE(missing->infoDictionary());
    EXPECT_TRUE(
        capture.contains("failed to retrieve Info.vrec for (null) through <no bundle at "
                         "/nonexistent/Nowhere.app: No such file or directory>"));

    test::TempDir root_("bexil-bxbundle");
    fs::path listedPath = root_ / "Listed.app";
    fs::create_directories(listedPath);
    ASSERT_FALSE(Document::writeFileAtomically(listedPath / "Info.vrec", Value::array({Value::string("x")})));
    auto listed = BXBundle::initWithPath(listedPath.string());
    EXPECT_FALSE(listed->bundleIdentifier());
    EXPECT_FALSE(listed->infoDictionary());
    EXPECT_TRUE(capture.contains("failed to convert Info.vrec to dictionary: " + listedPath.string() +
                                 " source=<bundle " + listedPath.string() + ">"));

    fs::path numberedPath = root_ / "Numbered.app";
    fs::create_directories(numberedPath);
    ASSERT_FALSE(
        Document::writeFileAtomically(numberedPath / "Info.vrec", dict({{"BDBundleIdentifier", Value::int64(5)}})));
    EXPECT_FALSE(BXBundle::initWithPath(numberedPath.string())->bundleIdentifier());
}

// A link loop must not hang or crash the daemon reading a bundle.
TEST(BXBundleQueries, SymbolicLinkLoopAnswersNothing) {
    test::TempDir root_("bexil-bxbundle");
    fs::create_symlink(root_ / "b.app", root_ / "a.app");
    fs::create_symlink(root_ / "a.app", root_ / "b.app");
    for (const auto& bundle : {BXBundle::initWithPath((root_ / "a.app").string()),
                               BXBundle::initWithExecutablePath((root_ / "a.app").string())}) {
        ASSERT_TRUE(bundle);
        EXPECT_FALSE(bundle->path());
        EXPECT_FALSE(bundle->executablePath());
        EXPECT_FALSE(bundle->infoDictionary());
    }
}

// Plug-ins are looked for under the support directory, which is asked of the service once and kept, even when it
// has none; first uses on several threads at once must all see the one answer. A bundle without an executable
// reports its own path.
TEST(BXBundleQueries, SupportPathIsAskedOnceAndKeptEvenWhenAbsentAndConcurrentFirstUsesAgree) {
    auto fake = std::make_shared<FakeBundle>();
    fake->bundlePath = "/apps/Tool.app";
    fake->support = "/var/support/Tool/";
    EXPECT_EQ(BXBundle::initWithZEMBundle(fake)->plugInsPath(), "/var/support/Tool/PlugIns");
    EXPECT_EQ(BXBundle::initWithZEMBundle(fake)->executablePath(), "/apps/Tool.app");

    auto none = std::make_shared<FakeBundle>();
    auto empty = BXBundle::initWithZEMBundle(none);
    EXPECT_FALSE(empty->supportPath());
    none->support = "/late";
    EXPECT_FALSE(empty->plugInsPath());
    EXPECT_EQ(none->supportQueries.load(), 1);

    for (int round = 0; round < 20; ++round) {
        auto fake = std::make_shared<FakeBundle>();
        fake->support = "/support/" + std::to_string(round);
        auto bundle = BXBundle::initWithZEMBundle(fake);
        std::vector<std::optional<std::string>> seen(8);
        std::vector<std::thread> threads;
        for (size_t i = 0; i < seen.size(); ++i) threads.emplace_back([&, i] { seen[i] = bundle->plugInsPath(); });
        for (auto& t : threads) t.join();
        for (const auto& s : seen) EXPECT_EQ(s, fake->support.value() + "/PlugIns");
    }
}

}  // namespace
}  // namespace bexil
