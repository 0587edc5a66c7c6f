// System plug-ins through the real daemon. The daemon runs inside a private root made by bubblewrap, where a
// temporary directory of the test is mounted at /System (and its bundles directory below /SystemX), so nothing is
// ever created at the real machine's /System. The private root sees the test's temporary root and the build tree at
// their own paths, and shares the process ids with the test, so clients outside talk to it as to any daemon.

#include <gtest/gtest.h>

#include <map>
#include <set>

#include "E2eSupport.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;
using namespace test;

const std::string kClock = "com.example.system.clock";
const std::string kHello = "com.example.greeter.hello";
const std::string kSystemClock = "/System/Library/PlugIns/Clock.bxplugin";

class SystemPlugInTest : public DaemonTest {
  protected:
    void SetUp() override {
        copyExamples({"Greeter.app", "OutsideApplication.bxplugin"});
        // What the daemon sees at /System; /SystemX/Library/PlugIns shows the bundles directory.
        system_ = bundles_.parent_path() / "system";
        fs::create_directories(system_ / "Library/PlugIns");
        fs::copy(kExamples / "System/Library/PlugIns/Clock.bxplugin", system_ / "Library/PlugIns/Clock.bxplugin",
                 fs::copy_options::recursive);

        // This test's temporary root and the build tree, plus the directories that stand for /System and /SystemX.
        std::vector<std::string> launcher = privateRootLauncher(
            bxd_.root(),
            {"--ro-bind", system_.string(), "/System", "--ro-bind", bundles_.string(), "/SystemX/Library/PlugIns"});
        // Machines without user namespaces or mount rights cannot make the private root; say so instead of failing.
        std::string probe;
        for (const std::string& word : launcher) probe += "'" + word + "' ";
        Outcome made = shell(probe + "/usr/bin/test -d /System/Library/PlugIns/Clock.bxplugin");
        if (made.status != 0) GTEST_SKIP() << "bubblewrap cannot make a private root with /System here: " << made.err;
        bxd_.setLauncher(std::move(launcher));
        ASSERT_TRUE(start()) << bxd_.log();
    }

    // The forms of every registered instance of the clock, keyed by path.
    std::map<std::string, Value> clockInstances() {
        Value reply = TestClient().replyTo(matchRequest(identifierRule(kClock), kAllVersions | kAllInstances));
        std::map<std::string, Value> forms;
        for (const Value& form : reply.get("matches").items()) forms[std::string(form.get("path").stringView())] = form;
        return forms;
    }
    // The path of the one clock a client gets without flags.
    std::string servedClock() {
        std::vector<Value> forms = formsOf(TestClient().replyTo(matchRequest(identifierRule(kClock))), kClock);
        EXPECT_EQ(forms.size(), 1u);
        return forms.empty() ? std::string() : std::string(forms[0].get("path").stringView());
    }

    // Changes the bundle's information document, so that adding it again registers it anew (a new registration
    // time, and a place after every plug-in registered before).
    void rebuild(const fs::path& bundle) {
        Result<Value> info = Document::readFile(bundle / "Info.vrec");
        ASSERT_TRUE(info.ok()) << info.error().description();
        MutableDictionary changed(*info);
        changed.set("TestBuild", Value::int64(++builds_));
        ASSERT_FALSE(Document::writeFileAtomically(bundle / "Info.vrec", changed.take()));
    }

    // Adds `paths` in one request that starts just after a second begins, so that all get the same registration
    // time (whole seconds); tries again on the rare run where the second ended in between.
    void addWithinOneSecond(const std::vector<fs::path>& bundles, const std::vector<std::string>& paths) {
        for (int attempt = 0; attempt < 3; ++attempt) {
            for (const fs::path& bundle : bundles) rebuild(bundle);
            sleepToNextSecond();
            add(paths);
            std::set<int64_t> times;
            for (const auto& [path, form] : clockInstances()) times.insert(*form.get("lastmodified").numberAsInt64());
            if (times.size() == 1) return;
        }
        FAIL() << "could not register the clocks within one second";
    }

    fs::path system_;
    int builds_ = 0;
};

// Guards residence: outside applications only plug-ins whose real path is below /System are served (not one below
// /SystemX, nor a link planted in /System that leads out of it), auto-elected; the system-only flag keeps just
// them, and privileged discovery ignores that flag without bringing pretenders back.
TEST_F(SystemPlugInTest, OnlyPlugInsReallyBelowSystemAreServedOutsideApplications) {
    fs::create_directory_symlink(bundles_ / "OutsideApplication.bxplugin",
                                 system_ / "Library/PlugIns/Planted.bxplugin");
    add({kSystemClock, plugIn("Greeter.app/PlugIns/Hello.bxplugin"),
         "/SystemX/Library/PlugIns/OutsideApplication.bxplugin", "/System/Library/PlugIns/Planted.bxplugin"});

    Value all = TestClient().replyTo(matchRequest());
    EXPECT_EQ(identifiers(all), (Ids{kHello, kClock})) << all.description();
    // The system plug-in asks for automatic election, which its first look-up made.
    EXPECT_EQ(formsOf(all, kClock).at(0).get("annotations"), Value::dictionary({{"election", Value::int64(1)}}));
    EXPECT_EQ(identifiers(TestClient().replyTo(matchRequest(std::nullopt, kSystemOnly))), (Ids{kClock}));
    grantSelfManager();
    TestClient manager;  // entitlements are read when a client connects
    EXPECT_EQ(identifiers(manager.replyTo(matchRequest(std::nullopt, kSystemOnly | kDiscoverAll))),
              (Ids{kHello, kClock}));

    // Both pretenders were registered and are refused as mis-configured whenever they are looked up.
    for (const std::string& path : {std::string("/SystemX/Library/PlugIns/OutsideApplication.bxplugin"),
                                    (bundles_ / "OutsideApplication.bxplugin").string()})
        expectLog("ignoring mis-configured plug-in at " + path +
                  ": plug-ins outside containing apps must be in /System");
}

// Guards the tie between equal versions of a system plug-in and an application's copy: within one registration
// second the system's wins whichever was met first; a later registration of the application's wins.
TEST_F(SystemPlugInTest, SameVersionGoesToTheSystemPlugInUnlessTheApplicationsIsRegisteredLater) {
    // The application's copy of the clock: same identifier, same version.
    fs::path appClock = bundles_ / "Greeter.app/PlugIns/Clock.bxplugin";
    fs::copy(system_ / "Library/PlugIns/Clock.bxplugin", appClock, fs::copy_options::recursive);
    fs::path systemClock = system_ / "Library/PlugIns/Clock.bxplugin";

    // The application's plug-in met first, the system's second, registered in the same second: the system's wins.
    addWithinOneSecond({appClock, systemClock}, {appClock.string(), kSystemClock});
    std::map<std::string, Value> both = clockInstances();
    ASSERT_EQ(both.size(), 2u);
    EXPECT_EQ(both[kSystemClock].get("systemResident"), Value::boolean(true));
    EXPECT_EQ(servedClock(), kSystemClock);

    // The system's met first, both in the same second: the one met first stays.
    addWithinOneSecond({appClock, systemClock}, {kSystemClock, appClock.string()});
    EXPECT_EQ(servedClock(), kSystemClock);

    // The system's met first, the application's registered a second later: the later registration wins.
    sleepToNextSecond();
    rebuild(appClock);
    add({appClock.string()});
    both = clockInstances();
    ASSERT_EQ(both.size(), 2u);
    EXPECT_GT(*both[appClock.string()].get("lastmodified").numberAsInt64(),
              *both[kSystemClock].get("lastmodified").numberAsInt64());
    EXPECT_EQ(servedClock(), appClock.string());
}

}  // namespace
}  // namespace bexil
