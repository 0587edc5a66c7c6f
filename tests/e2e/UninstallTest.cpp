// Uninstalling plug-ins through the real daemon ends their running instances: real child processes of this test,
// recorded under the runtime directory the way plug-in runtimes record them, are terminated when a manager
// "remove"s their plug-in or "add"s a changed build of it.

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
#include "base/Document.h"
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

TEST_F(UninstallTest, RemovingAPlugInTerminatesItsRunningInstancesOnly) {
    std::string helloUuid = uuidOf(kHello);
    pid_t first = run(kHello), second = run(kHello), other = run(kBonjour);

    request("remove", {hello()});
    EXPECT_TRUE(ended(first, std::chrono::seconds(10))) << bxd_.log();
    EXPECT_TRUE(ended(second, std::chrono::seconds(10))) << bxd_.log();
    EXPECT_TRUE(bxd_.waitForLog("one or more plug-ins have been terminated for uuid=" + helloUuid)) << bxd_.log();
    EXPECT_TRUE(bxd_.waitForLog("removal complete for")) << bxd_.log();
    EXPECT_FALSE(fs::exists(record(kHello, first)));
    EXPECT_FALSE(fs::exists(record(kHello, second)));

    // The other plug-in of the same application keeps running, and its record stays.
    EXPECT_FALSE(ended(other, std::chrono::milliseconds(0)));
    EXPECT_TRUE(fs::exists(record(kBonjour, other)));
    EXPECT_EQ(bxd_.countInLog("requesting termination for " + kBonjour), 0u) << bxd_.log();
}

TEST_F(UninstallTest, AddingAChangedBuildTerminatesTheInstancesOfTheOldOne) {
    std::string oldUuid = uuidOf(kHello);
    pid_t instance = run(kHello);

    // The same bundle again changes nothing, so nothing is ended.
    request("add", {hello()});
    EXPECT_EQ(uuidOf(kHello), oldUuid);
    EXPECT_EQ(bxd_.countInLog("requesting termination for"), 0u) << bxd_.log();
    EXPECT_FALSE(ended(instance, std::chrono::milliseconds(0)));

    // A new build: the registry uninstalls the old one before it installs the new one.
    fs::path info = fs::path(hello()) / "Info.vrec";
    Result<Value> document = Document::readFile(info);
    ASSERT_TRUE(document.ok()) << document.error().description();
    MutableDictionary changed(*document);
    changed.set("BDBundleVersion", Value::string("2"));
    ASSERT_FALSE(Document::writeFileAtomically(info, changed.take()));
    request("add", {hello()});

    EXPECT_TRUE(ended(instance, std::chrono::seconds(10))) << bxd_.log();
    EXPECT_TRUE(bxd_.waitForLog("plug-in UNINSTALLED:" + kHello + " " + kHello + "(1) " + oldUuid)) << bxd_.log();
    // The old build is the one whose instances are ended, by its version.
    EXPECT_TRUE(bxd_.waitForLog("requesting termination for " + kHello + "(1) jobard:1 " + oldUuid)) << bxd_.log();
    EXPECT_TRUE(bxd_.waitForLog("removal complete for")) << bxd_.log();
    std::string newUuid = uuidOf(kHello);
    EXPECT_NE(newUuid, oldUuid) << "a new build is a new plug-in";
    EXPECT_FALSE(newUuid.empty());
}

}  // namespace
}  // namespace bexil
