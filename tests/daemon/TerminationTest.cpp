// Termination of running plug-in instances and the busy check, with real processes recorded the way plug-in
// runtimes record them.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <future>
#include <sstream>
#include <thread>

#include "ChildProcess.h"
#include "PlugInRecord.h"
#include "TestSupport.h"
#include "base/EventLoop.h"
#include "daemon/BXDServer.h"
#include "platform/jobard/ServiceManager.h"
#include "platform/ledgerix/LXBexilProxy.h"
#include "platform/log/CaptureSink.h"
#include "platform/wardend/ProcessAssertions.h"
#include "policy/BXDPlugIn.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;

using test::SleeperGuard;
using test::startSleeper;

bool reapWithin(pid_t pid, std::chrono::seconds timeout) {
    auto deadline = std::chrono::steady_clock::now() + timeout;
    while (std::chrono::steady_clock::now() < deadline) {
        if (waitpid(pid, nullptr, WNOHANG) == pid) return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return false;
}

std::shared_ptr<const LXBexilProxy> proxy(const std::string& bundleIdentifier, std::optional<std::string> version) {
    LXBexilProxy::Fields fields;
    fields.bundleIdentifier = bundleIdentifier;
    fields.pluginIdentifier = bundleIdentifier;
    fields.bundleVersion = version.value_or("1.0");
    fields.pluginUUID = Uuid::random();
    MutableDictionary info;
    info.set("BDBundleIdentifier", Value::string(bundleIdentifier));
    if (version) info.set("BDBundleVersion", Value::string(*version));
    fields.infoVrec = info.take();
    return std::make_shared<LXBexilProxy>(std::move(fields));
}

class TerminationTest : public ::testing::Test {
  protected:
    void SetUp() override {
        server_ =
            BXDServer::initForServiceDatabase("com.example.termination", (root_ / "annotations.vrec").c_str(), loop_);
        ASSERT_NE(server_, nullptr);
        server_->setServiceManager(ServiceManager(instances()));
    }
    void TearDown() override { server_.reset(); }

    InstanceRecords instances() const { return InstanceRecords(InstanceRecords::Kind::Running, root_ / "runtime"); }

    // Runs terminatePlugInsReply and waits for its reply.
    void terminate(const std::vector<std::shared_ptr<const LXBexilProxy>>& plugIns) {
        std::promise<void> done;
        int calls = 0;
        server_->terminatePlugInsReply(plugIns, [&] {
            ++calls;
            done.set_value();
        });
        ASSERT_EQ(done.get_future().wait_for(std::chrono::seconds(20)), std::future_status::ready);
        EXPECT_EQ(calls, 1);
    }

    test::DaemonDirs root_{"bx-termination"};
    EventLoop loop_{1};
    std::unique_ptr<BXDServer> server_;
};

// Guards termination on uninstall: the reply comes once every instance ended (also with none to end), an instance
// that ignores SIGTERM is killed after the grace period, and a record without a version is ended as version 1.
TEST_F(TerminationTest, RecordedInstancesAreTerminatedAndEveryReplyIsAwaitedEvenNone) {
    log::CaptureSink capture;
    terminate({});

    pid_t a = startSleeper();
    pid_t b = startSleeper(/*ignoreTerm=*/true);  // needs the SIGKILL after the grace period
    SleeperGuard guard{a, b};
    ASSERT_TRUE(instances().record("com.example.greeter.hello", a));
    ASSERT_TRUE(instances().record("com.example.greeter.bonjour", b));

    terminate({proxy("com.example.greeter.hello", "3"), proxy("com.example.greeter.bonjour", std::nullopt),
               proxy("com.example.idle", "1")});

    EXPECT_TRUE(reapWithin(a, std::chrono::seconds(2)));
    EXPECT_TRUE(reapWithin(b, std::chrono::seconds(2)));
    EXPECT_EQ(capture.count("one or more plug-ins have been terminated for uuid="), 2u);
    EXPECT_EQ(capture.count("jobard reported no plug-ins on record for uuid="), 1u);
    // A record without "BDBundleVersion" is terminated as version 1.
    EXPECT_TRUE(capture.contains("(1.0) jobard:1 ")) << "version fallback";
    // The records of the ended instances are gone.
    EXPECT_TRUE(instances().live("com.example.greeter.hello").empty());
}

// Guards against signalling the wrong process: a record of a dead instance, or of a pid now used by a process that
// started later, ends nothing and is removed.
TEST_F(TerminationTest, StaleRecordsNeverSignalAnotherProcess) {
    log::CaptureSink capture;
    pid_t gone = startSleeper();
    SleeperGuard guard{gone};
    ASSERT_TRUE(instances().record("com.example.greeter.hello", gone));
    kill(gone, SIGKILL);
    waitpid(gone, nullptr, 0);
    // The same pid recorded with a start time that no live process has: a reused pid must not be taken for it.
    fs::path stale = root_ / "runtime" / "instances" / "com.example.greeter.bonjour" / std::to_string(getpid());
    fs::create_directories(stale.parent_path());
    std::ofstream(stale) << "1\n";

    terminate({proxy("com.example.greeter.hello", "1"), proxy("com.example.greeter.bonjour", "1")});
    EXPECT_EQ(capture.count("jobard reported no plug-ins on record"), 2u);
    EXPECT_FALSE(fs::exists(stale));
}

// Guards the sweep of sandboxes that a daemon leaves: a recorded sandbox and its outer process are ended, a record
// whose pids now name other processes (here this test's own) signals nothing, and a record that another runtime
// keeps without a sandbox line is not bxd's to end.
TEST_F(TerminationTest, LeftSandboxesAreEndedAndNothingElseIs) {
    log::CaptureSink capture;
    pid_t outer = startSleeper(), first = startSleeper(), foreign = startSleeper();
    SleeperGuard guard{outer, first, foreign};
    ASSERT_TRUE(instances().record("com.example.greeter.hello", outer, first));
    ASSERT_TRUE(instances().record("com.example.greeter.bonjour", foreign));
    fs::path stale = root_ / "runtime" / "instances" / "com.example.greeter.stale" / std::to_string(getpid());
    fs::create_directories(stale.parent_path());
    std::ofstream(stale) << "1\nsandbox " << getpid() << " 1\n";

    EXPECT_EQ(ServiceManager(instances()).endSandboxedInstances("in a test"), 1u);
    EXPECT_TRUE(reapWithin(outer, std::chrono::seconds(2)));
    EXPECT_TRUE(reapWithin(first, std::chrono::seconds(2)));
    EXPECT_TRUE(
        capture.contains("ending plug-in com.example.greeter.hello instance " + std::to_string(outer) + " in a test"));
    EXPECT_FALSE(fs::exists(stale));
    EXPECT_EQ(instances().live("com.example.greeter.bonjour").size(), 1u);
    EXPECT_EQ(waitpid(foreign, nullptr, WNOHANG), 0) << "a record without a sandbox line was ended";
}

// The busy check's platform service: only live asserted instances count, and a name cannot reach outside the
// records' directory.
TEST(ProcessAssertions, OnlyLiveAssertedInstancesAreBusy) {
    test::TempDir runtime("bx-assertions");
    InstanceRecords assertions(InstanceRecords::Kind::Assertion, runtime.path());
    ProcessAssertions wardend(assertions);
    pid_t busy = startSleeper();
    pid_t finished = startSleeper();
    SleeperGuard guard{busy, finished};
    ASSERT_TRUE(assertions.record("com.example.greeter.hello", busy));
    ASSERT_TRUE(assertions.record("com.example.greeter.bonjour", finished));
    kill(finished, SIGKILL);
    waitpid(finished, nullptr, 0);

    std::vector<Value> found =
        wardend.busyExtensionInstances({"com.example.greeter.hello", "com.example.greeter.bonjour", "../escape"});
    ASSERT_EQ(found.size(), 1u);
    EXPECT_EQ(found[0].get("pid"), Value::int64(busy));

    // The daemon's record asks by its bundle identifier and describes the busy instance by that alone.
    auto plugIn = test::plugInRecord("com.example.greeter.hello", Uuid::random());
    ASSERT_NE(plugIn, nullptr);
    EXPECT_EQ(
        plugIn->checkBusy(wardend),
        Value::dictionary({{ProcessAssertions::kBundleIdentifierKey, Value::string("com.example.greeter.hello")}}));
    kill(busy, SIGKILL);
    waitpid(busy, nullptr, 0);
    EXPECT_FALSE(plugIn->checkBusy(wardend));
}

// A plug-in instance that takes a while to end, as one that saves its state does: on SIGTERM it writes its pid to
// `report`, lingers, then exits.
pid_t startLingeringInstance(int report) {
    sigset_t term, previous;
    sigemptyset(&term);
    sigaddset(&term, SIGTERM);
    // Blocked before the fork, so no SIGTERM can reach the child before it waits for one.
    sigprocmask(SIG_BLOCK, &term, &previous);
    pid_t parent = getpid();
    pid_t child = fork();
    if (child == 0) {
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        if (getppid() != parent) _exit(0);
        int received = 0;
        sigwait(&term, &received);
        pid_t self = getpid();
        if (write(report, &self, sizeof self) != sizeof self) _exit(1);
        usleep(500 * 1000);
        _exit(0);
    }
    sigprocmask(SIG_SETMASK, &previous, nullptr);
    return child;
}

constexpr const char* kInPidNamespace = "BX_TEST_IN_PID_NAMESPACE";

// While the service manager waits for one instance to end, another instance of the same plug-in may end by itself
// and its pid go to an unrelated process. The record still names the old process (by its start time), so the new
// one must be left alone. Choosing the next pid needs a pid namespace of one's own, so the test runs itself again
// as the first process of new user and pid namespaces.
TEST(ServiceManagerTermination, APidReusedWhileAnotherInstanceEndsIsLeftAlone) {
    const std::string name = std::string(::testing::UnitTest::GetInstance()->current_test_suite()->name()) + "." +
                             ::testing::UnitTest::GetInstance()->current_test_info()->name();
    if (!getenv(kInPidNamespace)) {
        fs::path output = fs::temp_directory_path() / ("bx-pid-reuse-" + std::to_string(getpid()) + ".txt");
        const std::string namespaces = "unshare --user --map-root-user --pid --fork --mount-proc ";
        if (std::system((namespaces + "true >/dev/null 2>&1").c_str()) != 0)
            GTEST_SKIP() << "cannot make user and pid namespaces here";
        int status = std::system((std::string(kInPidNamespace) + "=" + std::to_string(getpid()) + " " + namespaces +
                                  "'" + fs::canonical("/proc/self/exe").string() + "' --gtest_filter=" + name + " >'" +
                                  output.string() + "' 2>&1")
                                     .c_str());
        std::ifstream in(output);
        std::stringstream text;
        text << in.rdbuf();
        fs::remove(output);
        fs::remove_all(fs::temp_directory_path() / ("bx-pid-reuse-" + std::to_string(getpid())));
        EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << text.str();
        return;
    }

    // Named after the process outside, since every run is pid 1 in here.
    fs::path runtime = fs::temp_directory_path() / ("bx-pid-reuse-" + std::string(getenv(kInPidNamespace)));
    InstanceRecords instances(InstanceRecords::Kind::Running, runtime);
    int report[2];
    ASSERT_EQ(pipe2(report, O_CLOEXEC), 0);
    pid_t first = startLingeringInstance(report[1]), second = startLingeringInstance(report[1]);
    SleeperGuard guard{first, second};
    ASSERT_TRUE(instances.record("com.example.greeter.hello", first));
    ASSERT_TRUE(instances.record("com.example.greeter.hello", second));
    // Start times count clock ticks: the process that takes over a pid below must start in a later one.
    std::this_thread::sleep_for(std::chrono::milliseconds(100));

    EventLoop loop(1);
    SerialQueue queue("pid-reuse", loop);
    std::promise<void> done;
    ServiceManager(instances).removeExternalService("com.example.greeter.hello", "1", queue,
                                                    [&done](int) { done.set_value(); });

    // The instance signalled first lingers; meanwhile the other one ends and a new process gets its pid.
    pollfd readable{report[0], POLLIN, 0};
    ASSERT_EQ(poll(&readable, 1, 10000), 1) << "no instance was signalled";
    pid_t signalled = 0;
    ASSERT_EQ(read(report[0], &signalled, sizeof signalled), static_cast<ssize_t>(sizeof signalled));
    pid_t ended = signalled == first ? second : first;
    kill(ended, SIGKILL);
    waitpid(ended, nullptr, 0);
    {
        std::ofstream next("/proc/sys/kernel/ns_last_pid");
        next << ended - 1;
    }
    pid_t successor = startSleeper();
    SleeperGuard successorGuard{successor};
    ASSERT_EQ(successor, ended) << "the pid was not reused";

    ASSERT_EQ(done.get_future().wait_for(std::chrono::seconds(20)), std::future_status::ready);
    int status = 0;
    EXPECT_EQ(waitpid(successor, &status, WNOHANG), 0) << "the process that took over the pid was signalled";
    close(report[0]);
    close(report[1]);
    fs::remove_all(runtime);
}

}  // namespace
}  // namespace bexil
