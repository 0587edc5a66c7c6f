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
        EXPECT_EQ(bundle->plugInsPath(), app + "/PlugIns");
        EXPECT_EQ(bundle->executablePath(), app + "/greeter");
        EXPECT_EQ(bundle->bundleIdentifier(), "com.example.greeter");
        ASSERT_TRUE(bundle->infoDictionary());
    }
}

TEST(BXBundleConstruction, URLsAreDecodedOnlyWhenTheyAreFileURLs) {
    test::TempDir root("bexil-url");
    fs::path dir = root / "With Space%41.app";
    fs::create_directories(dir);
    std::string encoded = root.path().string() + "/With%20Space%2541.app";
    EXPECT_EQ(BXBundle::initWithURL("file://" + encoded)->path(), dir.string());
    EXPECT_EQ(BXBundle::initWithURL("file://localhost" + encoded)->path(), dir.string());
    // A plain path is never decoded: its "%41" stays.
    EXPECT_EQ(BXBundle::initWithURL(dir.string())->path(), dir.string());
    // A URL naming another host is no local path.
    EXPECT_FALSE(BXBundle::initWithURL("file://elsewhere" + dir.string())->path());
}

// Only a missing platform bundle gives no object; a path that names no bundle gives one that answers nothing, and
// logs (only when asked for its information) why it has none.
TEST(BXBundleQueries, MissingBundlesAnswerNothingAndLogWhyTheyHaveNoInformation) {
    EXPECT_EQ(BXBundle::initWithZEMBundle(nullptr), nullptr);
    // The test program lies in no bundle: its main bundle exists and answers nothing.
    auto main = BXBundle::initForMainBundle();
    ASSERT_TRUE(main);
    EXPECT_FALSE(main->path());

    log::CaptureSink capture;
    auto bundle = BXBundle::initWithPath("/nonexistent/Nowhere.app");
    ASSERT_TRUE(bundle);
    EXPECT_FALSE(bundle->path());
    EXPECT_FALSE(bundle->executablePath());
    EXPECT_FALSE(bundle->bundleIdentifier());
    EXPECT_FALSE(capture.contains("Info.vrec")) << "bundleIdentifier must not log";
    EXPECT_FALSE(bundle->infoDictionary());
    auto entries = capture.matching("failed to retrieve Info.vrec for ");
    ASSERT_EQ(entries.size(), 1u);
    EXPECT_EQ(entries[0].level, log::Level::Info);
    EXPECT_EQ(entries[0].category, "ops");
    EXPECT_EQ(entries[0].message,
              "failed to retrieve Info.vrec for (null) through <no bundle at /nonexistent/Nowhere.app: "
              "No such file or directory>");
    EXPECT_EQ(BXBundle::initWithExecutablePath("/nonexistent/tool")->executablePath(), std::nullopt);
}

// Information that cannot be read is logged as not retrieved, information that is not a dictionary as not converted,
// and an identifier that is not a string is no identifier.
TEST(BXBundleQueries, UnreadableOrMisshapenInformationAnswersNothingAndSaysWhy) {
    test::TempDir root_("bexil-bxbundle");
    fs::path bundle = root_ / "Broken.app";
    test::writeText(bundle / "Info.vrec", "<vrec><dict><key>BDBundleIdentifier</key>");
    log::CaptureSink capture;
    auto broken = BXBundle::initWithPath(bundle.string());
    EXPECT_FALSE(broken->bundleIdentifier());
    EXPECT_FALSE(broken->infoDictionary());
    auto entry = capture.find("failed to retrieve Info.vrec for " + bundle.string() + " through <bundle ");
    ASSERT_TRUE(entry);
    EXPECT_NE(entry->message.find("BexilDocument"), std::string::npos) << entry->message;

    fs::path listedPath = root_ / "Listed.app";
    fs::create_directories(listedPath);
    ASSERT_FALSE(Document::writeFileAtomically(listedPath / "Info.vrec", Value::array({Value::string("x")})));
    capture.clear();
    auto listed = BXBundle::initWithPath(listedPath.string());
    EXPECT_FALSE(listed->bundleIdentifier());
    EXPECT_FALSE(listed->infoDictionary());
    auto entries = capture.matching("failed to");
    ASSERT_EQ(entries.size(), 1u);
    EXPECT_EQ(entries[0].level, log::Level::Info);
    EXPECT_EQ(entries[0].message, "failed to convert Info.vrec to dictionary: " + listedPath.string() +
                                      " source=<bundle " + listedPath.string() + ">");

    fs::path numberedPath = root_ / "Numbered.app";
    fs::create_directories(numberedPath);
    ASSERT_FALSE(
        Document::writeFileAtomically(numberedPath / "Info.vrec", dict({{"BDBundleIdentifier", Value::int64(5)}})));
    auto numbered = BXBundle::initWithPath(numberedPath.string());
    EXPECT_FALSE(numbered->bundleIdentifier());
    EXPECT_TRUE(numbered->infoDictionary());
}

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

TEST(BXBundleQueries, PathsFollowTheSupportDirectoryNotTheBundlePath) {
    auto fake = std::make_shared<FakeBundle>();
    fake->bundlePath = "/apps/Tool.app";
    fake->support = "/var/support/Tool/";
    auto bundle = BXBundle::initWithZEMBundle(fake);
    EXPECT_EQ(bundle->plugInsPath(), "/var/support/Tool/PlugIns");
    EXPECT_EQ(bundle->bundleDirectory("Themes"), "/var/support/Tool/Themes");
    EXPECT_EQ(bundle->executablePath(), "/apps/Tool.app");

    fake->executable = "/apps/Tool.app/tool";
    EXPECT_EQ(bundle->executablePath(), "/apps/Tool.app/tool");
}

// The support path is asked of the service once and kept, even when it has none; first uses on several threads at
// once must all see the one answer.
TEST(BXBundleQueries, SupportPathIsAskedOnceAndKeptEvenWhenAbsentAndConcurrentFirstUsesAgree) {
    auto fake = std::make_shared<FakeBundle>();
    fake->support = "/s";
    auto bundle = BXBundle::initWithZEMBundle(fake);
    EXPECT_EQ(bundle->supportPath(), "/s");
    fake->support = "/changed";
    EXPECT_EQ(bundle->plugInsPath(), "/s/PlugIns");
    EXPECT_EQ(fake->supportQueries.load(), 1);

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
