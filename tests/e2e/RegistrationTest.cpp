// "add", "remove" and "bulk" through the real daemon, checked against the registry in its state directory, and the
// running instances (real child processes) of a removed plug-in ended. Path forms, re-registration (a changed build
// is an uninstall, as for "remove"), bad bundles and bundles gone from disk are LedgerixTest's.

#include <grp.h>
#include <gtest/gtest.h>

#include "ChildProcess.h"
#include "E2eSupport.h"
#include "platform/runtime/InstanceRecords.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;
using namespace test;

const fs::path kHostClient = fs::path(BEXIL_BINARY_DIR) / "tests/bx_host_client";
const std::string kHello = "com.example.greeter.hello";
const std::string kBonjour = "com.example.greeter.bonjour";

class RegistrationTest : public DaemonTest {
  protected:
    void SetUp() override {
        copyExamples({"Greeter.app", "OutsideApplication.bxplugin"});
        ASSERT_TRUE(start()) << bxd_.log();
    }
    void TearDown() override {
        for (pid_t pid : instances_) {
            kill(pid, SIGKILL);
            waitpid(pid, nullptr, 0);
        }
    }
    std::string hello() const { return plugIn("Greeter.app/PlugIns/Hello.bxplugin"); }
    std::string bonjour() const { return plugIn("Greeter.app/PlugIns/Bonjour.bxplugin"); }

    // Starts an instance of the plug-in with `bundleIdentifier` and records it as its runtime would.
    pid_t run(const std::string& bundleIdentifier) {
        pid_t pid = startSleeper();
        instances_.push_back(pid);
        EXPECT_TRUE(running_.record(bundleIdentifier, pid));
        return pid;
    }
    bool recorded(const std::string& bundleIdentifier, pid_t pid) const {
        return fs::exists(running_.directory() / bundleIdentifier / std::to_string(pid));
    }
    // The signal that ended `pid` (reaped), 0 when it exited otherwise, or -1 while it still runs after `timeout`.
    int endingSignal(pid_t pid, std::chrono::milliseconds timeout) {
        auto deadline = std::chrono::steady_clock::now() + timeout;
        do {
            int status = 0;
            if (waitpid(pid, &status, WNOHANG) == pid) {
                std::erase(instances_, pid);
                return WIFSIGNALED(status) ? WTERMSIG(status) : 0;
            }
            std::this_thread::sleep_for(std::chrono::milliseconds(10));
        } while (std::chrono::steady_clock::now() < deadline);
        return -1;
    }

    InstanceRecords running_{InstanceRecords::Kind::Running, bxd_.root() / "runtime"};
    std::vector<pid_t> instances_;
};

// Guards "add": an empty list succeeds with nothing registered; the plug-ins of an application and one outside any
// application (refused only when looked up: SystemPlugInTest) are registered and announced, and adding a bundle
// again keeps its UUID. And "bulk", which always succeeds and logs the flags it does not support.
TEST_F(RegistrationTest, AddRegistersPlugInsAndReAddKeepsTheirUuids) {
    add({});
    EXPECT_EQ(bxd_.countInLog("plug-in INSTALLED:"), 0u);
    std::string outside = plugIn("OutsideApplication.bxplugin");
    add({hello(), bonjour(), outside});
    std::optional<Uuid> helloUuid = registeredUuid(hello());
    ASSERT_TRUE(helloUuid && registeredUuid(bonjour()) && registeredUuid(outside));
    expectLog("plug-in INSTALLED:com.example.greeter.hello");
    add({hello()});
    EXPECT_EQ(registeredUuid(hello()), helloUuid);

    succeed(request("bulk", {{"flags", Value::uint64(0x2a)}}));
    expectLog("bulk options 0x2a not supported");
}

// Guards the path checks of "add" with their codes and texts: a malformed list is code 4, a path that is not
// absolute or does not resolve (also one over the path limit) is code 9, a bundle the registry refuses is code 2
// without the database's own text. The walk handles the paths before the bad one and stops there.
TEST_F(RegistrationTest, BadPathsAreRefusedAndTheWalkStopsAtTheFirst) {
    expectFailure(request("add"), 4, "invalid request format");
    expectFailure(request("add", {{"paths", Value::string(hello())}}), 4, "invalid request format");
    expectFailure(request("add", {{"paths", Value::array({Value::string(hello()), Value::uint64(7)})}}), 4,
                  "invalid request format");
    EXPECT_TRUE(registeredUuid(hello())) << "the element before the bad one was handled";

    expectFailure(pathsRequest("add", {"bundles/Hello.bxplugin"}), 9, "absolute path required: bundles/Hello.bxplugin");
    std::string missing = plugIn("Greeter.app/PlugIns/Missing.bxplugin");
    expectFailure(pathsRequest("add", {hello(), missing, bonjour()}), 9, "invalid plugin path: " + missing);
    EXPECT_FALSE(registeredUuid(bonjour())) << "the walk stopped at the missing path";
    std::string tooLong = "/" + std::string(5000, 'x');
    expectFailure(pathsRequest("add", {tooLong}), 9, "invalid plugin path: " + tooLong);

    std::string application = plugIn("Greeter.app");
    expectFailure(pathsRequest("add", {application}), 2, "unable to register plug-in at " + application);
    expectLog("failed to register plug-in at " + application);
    EXPECT_EQ(bxd_.countInLog("Ledgerix failed to register the plug-in"), 0u) << "the database's text stays inside";
}

// Guards "remove": refused and logged without the manager entitlement (the path's form is checked first); with it,
// a restarted daemon still knows the bundles, unregisters and announces the plug-in, has the service manager end
// its instances by the plug-in's version (SIGTERM suffices, records go) while another plug-in's instance runs on,
// and reports a path it does not know.
TEST_F(RegistrationTest, RemoveNeedsTheEntitlementAndEndsThePlugInsInstancesAfterARestart) {
    add({hello(), bonjour()});
    expectFailure(pathsRequest("remove", {"Hello.bxplugin"}), 9, "absolute path required: Hello.bxplugin");
    expectFailure(pathsRequest("remove", {hello()}), 11, "caller lacks entitlement for this operation");
    expectLog("refused request from pid=" + std::to_string(getpid()) + " to remove plug-in at " + hello() +
              " - client lacks required entitlement");
    grantSelfManager();
    bxd_.stop();
    ASSERT_TRUE(start()) << bxd_.log();
    std::string helloUuid = registeredUuid(hello()).value_or(Uuid()).string();
    pid_t first = run(kHello), second = run(kHello), other = run(kBonjour);

    succeed(pathsRequest("remove", {hello()}));
    EXPECT_FALSE(registeredUuid(hello()));
    EXPECT_TRUE(registeredUuid(bonjour()));
    EXPECT_EQ(endingSignal(first, std::chrono::seconds(10)), SIGTERM) << bxd_.log();
    EXPECT_EQ(endingSignal(second, std::chrono::seconds(10)), SIGTERM) << bxd_.log();
    const std::string lines[] = {
        "plug-in UNINSTALLED:" + kHello, "requesting termination for " + kHello + "(1) jobard:1 " + helloUuid,
        "one or more plug-ins have been terminated for uuid=" + helloUuid, "removal complete for"};
    for (const std::string& line : lines) expectLog(line);
    // The records go once the service manager has seen both exits, which is before it reports the termination,
    // but may be after this test reaped them.
    EXPECT_FALSE(recorded(kHello, first) || recorded(kHello, second));
    EXPECT_EQ(endingSignal(other, std::chrono::milliseconds(0)), -1);
    EXPECT_TRUE(recorded(kBonjour, other));
    EXPECT_EQ(bxd_.countInLog("requesting termination for " + kBonjour), 0u) << bxd_.log();

    expectFailure(pathsRequest("remove", {hello()}), 9, "no plugin at " + hello());
}

// Guards registering as a client that is not root: bxd reads the bundle with the client's rights, so a bundle in a
// directory the client cannot enter, or one whose information document is a link to a file the client cannot read,
// is refused and left unregistered (while root registers it), and a bundle the client can read registers as usual.
TEST_F(RegistrationTest, AClientRegistersOnlyWhatItCouldReadItself) {
    if (geteuid() != 0) GTEST_SKIP() << "needs root to run a client as another user";
    fs::permissions(bxd_.root(), fs::perms(0755));
    const fs::path privateApp = bundles_ / "Private.app", linkedApp = bundles_ / "Linked.app";
    fs::create_directories(privateApp / "PlugIns");
    fs::copy(hello(), privateApp / "PlugIns/Hello.bxplugin", fs::copy_options::recursive);
    fs::permissions(privateApp, fs::perms(0700));
    fs::create_directories(linkedApp / "PlugIns/Hello.bxplugin");
    fs::create_symlink(privateApp / "PlugIns/Hello.bxplugin/Info.vrec", linkedApp / "PlugIns/Hello.bxplugin/Info.vrec");
    const std::string hidden = (privateApp / "PlugIns/Hello.bxplugin").string();
    const std::string linked = (linkedApp / "PlugIns/Hello.bxplugin").string();

    fs::path output = bxd_.root() / "client-nobody.txt";
    pid_t client = fork();
    if (client == 0) {
        int out = open(output.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
        if (out < 0 || dup2(out, 1) < 0 || dup2(out, 2) < 0 || setgroups(0, nullptr) != 0 ||
            setresgid(65534, 65534, 65534) != 0 || setresuid(65534, 65534, 65534) != 0)
            _exit(125);
        execl(kHostClient.c_str(), kHostClient.c_str(), ("add:" + hidden).c_str(), ("add:" + linked).c_str(),
              ("add:" + hello()).c_str(), nullptr);
        _exit(127);
    }
    int status = 0;
    ASSERT_EQ(waitpid(client, &status, 0), client);
    std::string text = slurp(output);
    ASSERT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << text;
    std::string answers = text.substr(text.find('\n') + 1);  // after the client's pid
    EXPECT_EQ(answers, "9 invalid plugin path: " + hidden + "\n2 unable to register plug-in at " + linked + "\n0 \n")
        << bxd_.log();
    EXPECT_FALSE(registeredUuid(hidden));
    EXPECT_FALSE(registeredUuid(linked));
    EXPECT_TRUE(registeredUuid(hello()));

    add({hidden});  // bxd's own client, root, reads it
    EXPECT_TRUE(registeredUuid(hidden));
}

}  // namespace
}  // namespace bexil
