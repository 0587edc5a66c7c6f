// `bexil doctor` against a private installation: silent about nothing, it passes a healthy one and names each
// problem of a broken one (untrusted entitlements, no bubblewrap, no daemon) with status 78.

#include <gtest/gtest.h>

#include <sstream>

#include "E2eSupport.h"
#include "client/JsonText.h"

namespace bexil {
namespace {

using namespace test;

class DoctorTest : public DaemonTest {
  protected:
    void SetUp() override {
        // A healthy installation needs a bubblewrap that works; some containers do not grant its namespaces.
        if (std::system("bwrap --unshare-all --ro-bind / / true >/dev/null 2>&1") != 0)
            GTEST_SKIP() << "bubblewrap cannot run here";
    }
    // The doctor's line for the check `name` (empty when it printed none).
    static std::string lineOf(const std::string& out, const std::string& name) {
        std::istringstream lines(out);
        for (std::string line; std::getline(lines, line);)
            if (line.rfind(name + ": ", 0) == 0) return line;
        return {};
    }
};

// Guards the healthy case: every check is ok and the status is 0, so the check can gate an installation script;
// --json gives the same verdicts as data.
TEST_F(DoctorTest, HealthyInstallationPasses) {
    ASSERT_TRUE(start()) << bxd_.log();
    Outcome run = bexil("doctor");
    EXPECT_EQ(run.status, 0) << run.out << run.err;
    for (const char* name : {"daemon", "service directory", "state directory", "runtime directory",
                             "entitlements directory", "bubblewrap", "MIME database", "journal"})
        EXPECT_NE(lineOf(run.out, name).find(": ok ("), std::string::npos) << name << "\n" << run.out;

    Outcome json = bexil("--json doctor");
    EXPECT_EQ(json.status, 0);
    auto checks = parseJson(json.out);
    ASSERT_TRUE(checks) << json.out;
    EXPECT_EQ(checks->count(), 8u);
    for (const Value& check : checks->items()) EXPECT_TRUE(check.get("ok").getBool().value_or(false)) << json.out;
}

// Guards the broken case: an entitlements directory others may write to (which makes bxd ignore every file in it),
// a file in it that bxd ignores, a bubblewrap that is not there and a daemon that is not running are each named
// with a fix, and the status says so.
TEST_F(DoctorTest, BrokenInstallationNamesEachProblem) {
    ASSERT_EQ(chmod(bxd_.entitlementsDir().c_str(), 0775), 0);
    const std::string doctor = "env BX_BWRAP=/nonexistent/bwrap timeout 60 '" BEXIL_BINARY_DIR "/tools/bexil/bexil' ";
    Outcome run = shell(doctor + "doctor");
    EXPECT_EQ(run.status, 78) << run.out << run.err;
    EXPECT_NE(lineOf(run.out, "daemon").find("PROBLEM: nothing answers on " + bxd_.socketPath()), std::string::npos)
        << run.out;
    std::string entitlements = lineOf(run.out, "entitlements directory");
    EXPECT_NE(entitlements.find("PROBLEM: " + bxd_.entitlementsDir().string() + " is not trusted"), std::string::npos)
        << run.out;
    EXPECT_NE(entitlements.find("mode 0775"), std::string::npos) << entitlements;
    EXPECT_NE(lineOf(run.out, "bubblewrap").find("PROBLEM: /nonexistent/bwrap: No such file"), std::string::npos)
        << run.out;
    EXPECT_NE(lineOf(run.out, "bubblewrap").find("fix: "), std::string::npos) << run.out;
    EXPECT_NE(lineOf(run.out, "state directory").find(": ok ("), std::string::npos) << run.out;

    // A trusted directory with one file in it that bxd would skip.
    ASSERT_EQ(chmod(bxd_.entitlementsDir().c_str(), 0755), 0);
    grant("/usr/bin/true", Value::emptyDictionary(), "loose");
    ASSERT_EQ(chmod((bxd_.entitlementsDir() / "loose.vrec").c_str(), 0666), 0);
    ASSERT_TRUE(start()) << bxd_.log();
    Outcome json = shell(doctor + "--json doctor");
    EXPECT_EQ(json.status, 78);
    auto checks = parseJson(json.out);
    ASSERT_TRUE(checks) << json.out;
    std::vector<std::string> failed;
    for (const Value& check : checks->items()) {
        if (check.get("ok").getBool().value_or(true)) continue;
        failed.emplace_back(check.get("check").stringView());
        EXPECT_FALSE(check.get("fix").stringView().empty()) << json.out;
        if (failed.back() == "entitlements directory") {
            EXPECT_NE(check.get("detail").stringView().find("loose.vrec"), std::string::npos) << json.out;
        }
    }
    EXPECT_EQ(failed, (std::vector<std::string>{"entitlements directory", "bubblewrap"})) << json.out;
}

}  // namespace
}  // namespace bexil
