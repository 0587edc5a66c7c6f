// Uninstalling plug-ins through the real daemon ends their running instances: real child processes of this test,
// recorded under the runtime directory the way plug-in runtimes record them, are terminated when a manager
// "remove"s their plug-in. (A changed build added again is announced as an uninstall by the registry, which takes
// the same path: LedgerixReRegistrationTest.NewVersionIsUninstallThenInstallUnderANewUuid.)

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>
#include <filesystem>
#include <thread>

#include "BxdProcess.h"
#include "E2eSupport.h"
#include "TestClient.h"
#include "platform/jobard/RunningInstances.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;
using namespace test;

const std::string kHello = "com.example.greeter.hello";
const std::string kBonjour = "com.example.greeter.bonjour";

// A stand-in for a running plug-in: a child that sleeps until it is signalled, lets go of the test's output and
// dies with the test however the test ends.
pid_t startInstance() {
    pid_t parent = getpid();
    pid_t child = fork();
    if (child == 0) {
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        if (getppid() != parent) _exit(0);
        int devnull = open("/dev/null", O_RDWR);
        dup2(devnull, STDOUT_FILENO);
        dup2(devnull, STDERR_FILENO);
        for (;;) pause();
    }
    return child;
}

// The signal that ended `pid` (reaped), 0 when it exited otherwise, or -1 when it still runs after `timeout`.
int endingSignal(pid_t pid, std::chrono::milliseconds timeout) {
    auto deadline = std::chrono::steady_clock::now() + timeout;
    do {
        int status = 0;
        if (waitpid(pid, &status, WNOHANG) == pid) return WIFSIGNALED(status) ? WTERMSIG(status) : 0;
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    } while (std::chrono::steady_clock::now() < deadline);
    return -1;
}

class UninstallTest : public DaemonTest {
  protected:
    void SetUp() override {
        copyExamples({"Greeter.app"});
        grantSelfManager();
        ASSERT_TRUE(start()) << bxd_.log();
        client_ = std::make_unique<TestClient>();
        request("add", {hello(), bonjour()});
    }
    void TearDown() override {
        for (pid_t pid : instances_) {
            kill(pid, SIGKILL);
            waitpid(pid, nullptr, 0);
        }
    }

    void request(const char* name, const std::vector<std::string>& paths) {
        Value reply = client_->replyTo(pathsRequest(name, paths));
        EXPECT_EQ(errorCode(reply), 0) << name << ": " << errorText(reply) << bxd_.log();
    }

    // Starts an instance of the plug-in with `bundleIdentifier` and records it as its runtime would.
    pid_t run(const std::string& bundleIdentifier) {
        pid_t pid = startInstance();
        instances_.push_back(pid);
        EXPECT_TRUE(running_.record(bundleIdentifier, pid));
        return pid;
    }
    fs::path record(const std::string& bundleIdentifier, pid_t pid) const {
        return running_.directory() / bundleIdentifier / std::to_string(pid);
    }
    // Reaps `pid` once it has ended; false while it still runs.
    bool ended(pid_t pid, std::chrono::milliseconds timeout) {
        int signal = endingSignal(pid, timeout);
        if (signal < 0) return false;
        std::erase(instances_, pid);
        EXPECT_EQ(signal, SIGTERM) << "a plug-in that takes its termination signal needs no SIGKILL";
        return true;
    }

    // The UUID of the served plug-in with `identifier`.
    std::string uuidOf(const std::string& identifier) {
        Value reply = client_->replyTo(matchRequest(identifierRule(identifier)));
        for (const Value& form : reply.get("matches").items()) return std::string(form.get("uuid").stringView());
        ADD_FAILURE() << "no plug-in " << identifier << " served: " << reply.description();
        return {};
    }

    std::string hello() const { return plugIn("Greeter.app/PlugIns/Hello.bxplugin"); }
    std::string bonjour() const { return plugIn("Greeter.app/PlugIns/Bonjour.bxplugin"); }

    std::unique_ptr<TestClient> client_;
    RunningInstances running_{"instances", bxd_.root() / "runtime"};
    std::vector<pid_t> instances_;
};

// Guards the wiring from the registry's uninstall to the service manager: every recorded instance of the removed
// plug-in gets SIGTERM (by the plug-in's version) and loses its record; another plug-in's instance runs on.
TEST_F(UninstallTest, RemovingAPlugInTerminatesItsRunningInstancesOnly) {
    std::string helloUuid = uuidOf(kHello);
    pid_t first = run(kHello), second = run(kHello), other = run(kBonjour);

    request("remove", {hello()});
    EXPECT_TRUE(ended(first, std::chrono::seconds(10))) << bxd_.log();
    EXPECT_TRUE(ended(second, std::chrono::seconds(10))) << bxd_.log();
    EXPECT_TRUE(bxd_.waitForLog("requesting termination for " + kHello + "(1) jobard:1 " + helloUuid)) << bxd_.log();
    EXPECT_TRUE(bxd_.waitForLog("one or more plug-ins have been terminated for uuid=" + helloUuid)) << bxd_.log();
    EXPECT_TRUE(bxd_.waitForLog("removal complete for")) << bxd_.log();
    EXPECT_FALSE(fs::exists(record(kHello, first)));
    EXPECT_FALSE(fs::exists(record(kHello, second)));

    EXPECT_FALSE(ended(other, std::chrono::milliseconds(0)));
    EXPECT_TRUE(fs::exists(record(kBonjour, other)));
    EXPECT_EQ(bxd_.countInLog("requesting termination for " + kBonjour), 0u) << bxd_.log();
}

}  // namespace
}  // namespace bexil
