// The "launch" request through the real daemon and a real sandbox: a host starts a plug-in it made ready and talks
// to it over the socket bxd hands over; the instance is recorded while it runs and reaped when it ends; nothing
// starts without a grant of this very process, without a known profile, or without bubblewrap; and the started
// plug-in sees only its bundle, its container and a private /tmp, and the network only under profiles that allow it.

#include <grp.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <poll.h>
#include <spawn.h>
#include <sys/ptrace.h>
#include <sys/socket.h>

#include <sstream>

#include "../../examples/plugins/GreetingProtocol.h"
#include "E2eSupport.h"
#include "base/Pidfd.h"
#include "bexil/TypedConnection.h"
#include "platform/zem/ZemFrame.h"
#include "platform/zem/ZemFrameReader.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;
using namespace test;

const fs::path kHelloPlugIn = fs::path(BEXIL_BINARY_DIR) / "examples/plugins/hello-plugin";
const fs::path kProbePlugIn = fs::path(BEXIL_BINARY_DIR) / "tests/bx_probe_plugin";
const fs::path kHostClient = fs::path(BEXIL_BINARY_DIR) / "tests/bx_host_client";
constexpr const char* kInPidNamespace = "BX_TEST_IN_PID_NAMESPACE";

// Writes `line` and a newline to `fd` and reads one line back; "(closed)" or "(timeout)" when none comes.
std::string exchange(int fd, const std::string& line) {
    std::string out = line + "\n";
    if (write(fd, out.data(), out.size()) != static_cast<ssize_t>(out.size())) return "(closed)";
    std::string answer;
    char c;
    for (;;) {
        pollfd p{fd, POLLIN, 0};
        if (poll(&p, 1, 10000) != 1) return "(timeout)";
        if (read(fd, &c, 1) != 1) return "(closed)";
        if (c == '\n') return answer;
        answer += c;
    }
}

class LaunchTest : public DaemonTest {
  protected:
    void SetUp() override {
        // bubblewrap needs namespaces the machine may not grant (some containers); then nothing can be launched.
        if (std::system("bwrap --unshare-all --ro-bind / / true >/dev/null 2>&1") != 0)
            GTEST_SKIP() << "bubblewrap cannot run here";
        copyExamples({"Greeter.app"});
        fs::copy_file(kHelloPlugIn, hello() + "/hello", fs::copy_options::overwrite_existing);
    }
    void startAndAdd(std::vector<std::string> more = {}) {
        ASSERT_TRUE(start()) << bxd_.log();
        more.insert(more.begin(), {hello(), bonjour()});
        add(more);
    }
    std::string hello() const { return plugIn("Greeter.app/PlugIns/Hello.bxplugin"); }
    std::string bonjour() const { return plugIn("Greeter.app/PlugIns/Bonjour.bxplugin"); }
    Value uuidsOf(const std::vector<std::string>& paths) const {
        std::vector<Value> uuids;
        for (const std::string& path : paths) uuids.push_back(Value::uuid(registeredUuid(path).value_or(Uuid())));
        return Value::array(std::move(uuids));
    }
    Value ready(TestClient& client, const std::vector<std::string>& paths) const {
        return client.replyTo(request("ready", {{"uuids", uuidsOf(paths)}}));
    }
    std::pair<Value, UniqueFd> launch(TestClient& client, const std::string& path) const {
        return client.replyWithDescriptor(request("launch", {{"uuids", uuidsOf({path})}}));
    }
    fs::path instanceRecord(const std::string& identifier, uint64_t pid) const {
        return bxd_.root() / "runtime/instances" / identifier / std::to_string(pid);
    }
    fs::path container(const std::string& identifier) const { return bxd_.root() / "state/containers" / identifier; }

    // Starts bxd with the shell script `script` (written as root/`name`) in bubblewrap's place and registers the
    // greeters. The script reports its first process on descriptor 4 as bubblewrap does; the plug-in's socket is its
    // descriptor 3.
    void startAndAddWithStandIn(const std::string& name, const std::string& script) {
        const fs::path standIn = bxd_.root() / name;
        std::ofstream(standIn) << "#!/bin/sh\n" << script;
        fs::permissions(standIn, fs::perms(0755));
        setenv("BX_BWRAP", standIn.c_str(), 1);
        startAndAdd();
        unsetenv("BX_BWRAP");
    }

    // A bundle for the probe plug-in inside Probe.app, of extension point `point`.
    std::string makeProbe(const std::string& name, const std::string& point) {
        fs::path app = bundles_ / "Probe.app";
        fs::create_directories(app / "PlugIns");
        fs::path bundle = app / "PlugIns" / (name + ".bxplugin");
        fs::create_directories(bundle);
        fs::copy_file(kProbePlugIn, bundle / "probe", fs::copy_options::overwrite_existing);
        Value info = Value::dictionary(
            {{"BDBundleIdentifier", Value::string("com.example.probe." + name)},
             {"BDBundleExecutable", Value::string("probe")},
             {"BDBundleVersion", Value::string("1")},
             {"DTBuildTool", Value::string("made by hand")},
             {"RZExtension", Value::dictionary({{"PrincipalClass", Value::string("Probe")},
                                                {"RZExtensionPointIdentifier", Value::string(point)},
                                                {"RZExtensionProtocol", Value::string("Probing")},
                                                {"RZExtensionAttributes",
                                                 Value::dictionary({{"RZExtensionVersion", Value::string("1")}})}})}});
        EXPECT_FALSE(Document::writeFileAtomically(bundle / "Info.vrec", info));
        EXPECT_FALSE(Document::writeFileAtomically(
            app / "Info.vrec", Value::dictionary({{"BDBundleIdentifier", Value::string("com.example.probe")}})));
        return bundle.string();
    }
};

// Guards the whole path: ready, launch, a line each way through the sandboxed example plug-in, whose HOME is its
// data container; the instance is on record while it runs, and when the host closes its end the plug-in ends, is
// reaped and its record removed.
TEST_F(LaunchTest, AHostTalksToTheLaunchedPlugInWhichIsRecordedUntilItEnds) {
    startAndAdd();
    TestClient host;
    ASSERT_EQ(errorCode(ready(host, {hello()})), 0) << bxd_.log();
    auto [reply, channel] = launch(host, hello());
    ASSERT_EQ(errorCode(reply), 0) << errorText(reply) << "\n" << bxd_.log();
    ASSERT_TRUE(channel) << "no socket came with the reply";
    uint64_t pid = reply.get("pid").numberAsUInt64().value_or(0);
    ASSERT_GT(pid, 0u);
    EXPECT_TRUE(fs::exists(instanceRecord("com.example.greeter.hello", pid)));

    std::string answer = exchange(channel.get(), "world");
    EXPECT_EQ(answer.rfind("Hello, world! (plug-in pid ", 0), 0u) << answer;
    EXPECT_NE(answer.find("home " + container("com.example.greeter.hello").string() + ")"), std::string::npos)
        << answer;
    EXPECT_EQ(exchange(channel.get(), "again").rfind("Hello, again!", 0), 0u);

    channel.reset();
    expectLog("plug-in com.example.greeter.hello instance " + std::to_string(pid) + " ended (exit status 0)");
    EXPECT_FALSE(fs::exists(instanceRecord("com.example.greeter.hello", pid)));
}

// The typed path: the host binds the socket to the protocol that Hello's bundle names and greets with typed calls.
// An ill-typed call stays on the host's side; one written by hand reaches Hello, which refuses it and keeps serving.
TEST_F(LaunchTest, AHostAndTheLaunchedPlugInExchangeTypedMessages) {
    startAndAdd();
    TestClient host;
    ASSERT_EQ(errorCode(ready(host, {hello()})), 0) << bxd_.log();
    auto [reply, channel] = launch(host, hello());
    ASSERT_EQ(errorCode(reply), 0) << errorText(reply) << "\n" << bxd_.log();
    ASSERT_TRUE(channel);
    const uint64_t pid = reply.get("pid").numberAsUInt64().value_or(0);
    Value spec = reply.get("bundleInfo").get("RZExtension").get("RZExtensionProtocol");
    ASSERT_EQ(spec, Value::string("GreetingProvider"));
    ASSERT_TRUE(greeting::declareProtocol());
    UniqueFd byHand(dup(channel.get()));
    auto connection = TypedConnection::bind(channel.release(), spec);
    ASSERT_TRUE(connection.ok()) << connection.error().description();

    auto greeted = (*connection)->call("greet", Value::array({Value::string("typed world")}));
    ASSERT_TRUE(greeted.ok()) << greeted.error().description() << "\n" << bxd_.log();
    EXPECT_EQ(greeted->items()[0].stringView().rfind("Hello, typed world! (plug-in pid ", 0), 0u);
    EXPECT_GT(greeted->items()[1].numberAsInt64().value_or(0), 0);
    EXPECT_FALSE((*connection)->call("greet", Value::array({Value::int64(1)})).ok());

    std::vector<uint8_t> frame;
    ASSERT_FALSE(ZemFrame::encode(
        ZemFrameKind::Request, 99, 0,
        Value::dictionary({{"selector", Value::string("greet")}, {"arguments", Value::array({Value::int64(1)})}}),
        frame));
    ASSERT_EQ(write(byHand.get(), frame.data(), frame.size()), static_cast<ssize_t>(frame.size()));
    ZemFrameReader reader;
    std::optional<ZemFrame> refusal;
    uint8_t buffer[4096];
    for (pollfd ready{byHand.get(), POLLIN, 0}; !refusal && poll(&ready, 1, 10000) == 1;) {
        ssize_t n = read(byHand.get(), buffer, sizeof buffer);
        if (n <= 0) break;
        reader.feed(std::span<const uint8_t>(buffer, static_cast<size_t>(n)));
        refusal = reader.next();
    }
    ASSERT_TRUE(refusal) << bxd_.log();
    EXPECT_EQ(refusal->inReplyTo(), 99u);
    EXPECT_EQ(refusal->decodePayload()->get("errorcode"), Value::uint64(4));
    EXPECT_TRUE((*connection)->call("greet", Value::array({Value::string("again")})).ok());

    byHand.reset();
    connection->reset();
    expectLog("plug-in com.example.greeter.hello instance " + std::to_string(pid) + " ended (exit status 0)");
}

// Guards the refusals, none of which starts a process: a plug-in this host never made ready, a held plug-in, an
// unknown UUID, more than one UUID, and a plug-in whose profile is fine but whose sandbox tool is missing.
TEST_F(LaunchTest, NothingStartsWithoutAGrantAHoldFreePlugInAndBubblewrap) {
    setenv("BX_BWRAP", (bxd_.root() / "no-bwrap").c_str(), 1);
    startAndAdd();
    unsetenv("BX_BWRAP");
    TestClient host;
    EXPECT_EQ(errorText(launch(host, hello()).first),
              "plug-in com.example.greeter.hello was not made ready for this host");
    EXPECT_EQ(errorText(host.replyTo(request("launch", {{"uuids", Value::array({Value::uuid(Uuid::random())})}}))),
              "no such plugin (uuid not found)");
    EXPECT_EQ(errorText(host.replyTo(request("launch", {{"uuids", uuidsOf({hello(), bonjour()})}}))),
              "invalid request format (launch takes one uuid)");

    ASSERT_EQ(errorCode(ready(host, {hello()})), 0);
    auto [missing, none] = launch(host, hello());
    EXPECT_EQ(errorCode(missing), 4);
    EXPECT_EQ(errorText(missing), "cannot launch com.example.greeter.hello: bubblewrap is not available (" +
                                      (bxd_.root() / "no-bwrap").string() + ": No such file or directory)");
    EXPECT_FALSE(none);

    TestClient holder;
    ASSERT_EQ(errorCode(holder.replyTo(
                  request("lock", {{"paths", Value::array({Value::string(hello())})}, {"flags", Value::uint64(1)}}))),
              0);
    auto [held, nothing] = launch(host, hello());
    EXPECT_EQ(errorCode(held), 11);
    EXPECT_EQ(errorText(held), "access to plugin com.example.greeter.hello denied: the plug-in is on hold");
    EXPECT_TRUE(fs::is_empty(bxd_.root() / "runtime") ||
                !fs::exists(bxd_.root() / "runtime/instances/com.example.greeter.hello") ||
                fs::is_empty(bxd_.root() / "runtime/instances/com.example.greeter.hello"));
}

// Guards a host that leaves while its launch is on the way: whatever the moment, no instance of the plug-in is
// left running or on record once bxd has seen the host go.
TEST_F(LaunchTest, AHostThatLeavesDuringALaunchLeavesNoInstance) {
    startAndAdd();
    TestClient host;
    ASSERT_EQ(errorCode(ready(host, {hello()})), 0);
    for (int round = 0; round < 20; ++round) {
        TestClient leaving;
        leaving.sendAndHangUp({request("launch", {{"uuids", uuidsOf({hello()})}})});
    }
    const fs::path instances = bxd_.root() / "runtime/instances/com.example.greeter.hello";
    auto gone = [&] { return !fs::exists(instances) || fs::is_empty(instances); };
    for (int i = 0; i < 500 && !gone(); ++i) std::this_thread::sleep_for(std::chrono::milliseconds(10));
    EXPECT_TRUE(gone()) << "instances left: " << bxd_.log();
    EXPECT_EQ(bxd_.countInLog("launched plug-in com.example.greeter.hello"),
              bxd_.countInLog("plug-in com.example.greeter.hello instance "))
        << "every instance started was reaped";
}

// Guards the end of an instance: ending it (here by a hold with termination) ends its whole sandbox, even when its
// outer process dies before it has let the sandbox's first process go on. bubblewrap names that process before it
// releases it, and a sandbox that nobody releases waits forever, on no record, holding the plug-in's socket. A
// stand-in for bubblewrap reports its first process and never releases it.
TEST_F(LaunchTest, EndingAnInstanceEndsItsWholeSandbox) {
    startAndAddWithStandIn("stalling-bwrap",
                           "sleep 600 &\n"
                           "echo $! > \"$0.first\"\n"
                           "echo \"{ \\\"child-pid\\\": $! }\" >&4\n"
                           "wait\n");
    TestClient host;
    ASSERT_EQ(errorCode(ready(host, {hello()})), 0);
    auto [reply, channel] = launch(host, hello());
    ASSERT_EQ(errorCode(reply), 0) << errorText(reply) << "\n" << bxd_.log();
    const pid_t first = std::stoi(slurp((bxd_.root() / "stalling-bwrap.first").string()));
    auto running = [first] {
        std::string stat = slurp("/proc/" + std::to_string(first) + "/stat");
        size_t name = stat.rfind(')');
        return name != std::string::npos && name + 2 < stat.size() && stat[name + 2] != 'Z';
    };
    ASSERT_TRUE(running());

    Value held = TestClient().replyTo(
        request("lock", {{"paths", Value::array({Value::string(hello())})}, {"flags", Value::uint64(0x1 | 0x4)}}));
    EXPECT_EQ(errorCode(held), 0) << errorText(held);
    for (int i = 0; i < 500 && running(); ++i) std::this_thread::sleep_for(std::chrono::milliseconds(10));
    EXPECT_FALSE(running()) << "the sandbox's first process outlived its instance\n" << bxd_.log();
    if (running()) kill(first, SIGKILL);
}

// Guards what outlives a daemon: bxd ends the sandboxes it started when it stops, and when it is killed instead, the
// next bxd of the same runtime directory ends what it left (a sandbox that was named but never released waits
// forever otherwise). The stand-in for bubblewrap, like one whose daemon has gone, never releases its first process
// and does not die with bxd.
TEST_F(LaunchTest, SandboxesDoNotOutliveTheDaemonThatStartedThem) {
    startAndAddWithStandIn("stalling-bwrap",
                           "sleep 600 &\n"
                           "echo $! > \"$0.first\"\n"
                           "echo \"{ \\\"child-pid\\\": $! }\" >&4\n"
                           "wait\n");
    // Pinned before the daemon goes, so that their pids cannot be reused while they are looked at.
    auto launchPinned = [&] {
        TestClient host;
        EXPECT_EQ(errorCode(ready(host, {hello()})), 0);
        auto [reply, channel] = launch(host, hello());
        EXPECT_EQ(errorCode(reply), 0) << errorText(reply) << "\n" << bxd_.log();
        const pid_t outer = static_cast<pid_t>(reply.get("pid").numberAsUInt64().value_or(0));
        const pid_t first = std::stoi(slurp((bxd_.root() / "stalling-bwrap.first").string()));
        return std::pair(UniqueFd(pidfdOpen(outer)), UniqueFd(pidfdOpen(first)));
    };
    auto endsSoon = [](const UniqueFd& process) { return process && pidfdExited(process.get(), 5000); };

    auto [killedOuter, killedFirst] = launchPinned();
    ASSERT_TRUE(killedOuter && killedFirst);
    bxd_.stop(SIGKILL);
    EXPECT_FALSE(pidfdExited(killedFirst.get(), 200)) << "the stand-in's sandbox must outlive a killed daemon";
    setenv("BX_BWRAP", (bxd_.root() / "stalling-bwrap").c_str(), 1);
    const bool restarted = start();
    unsetenv("BX_BWRAP");
    ASSERT_TRUE(restarted) << bxd_.log();
    EXPECT_TRUE(endsSoon(killedFirst)) << "the next daemon left the sandbox running\n" << bxd_.log();
    EXPECT_TRUE(endsSoon(killedOuter));
    // The sandbox ends as bxd signals it, just before bxd logs that it did: wait for the line, then count it.
    expectLog("left running by an earlier bxd");
    EXPECT_EQ(bxd_.countInLog("left running by an earlier bxd"), 1u) << bxd_.log();

    auto [stoppedOuter, stoppedFirst] = launchPinned();
    ASSERT_TRUE(stoppedOuter && stoppedFirst);
    EXPECT_EQ(WEXITSTATUS(bxd_.stop(SIGTERM)), 0);
    EXPECT_TRUE(endsSoon(stoppedFirst)) << "a stopped daemon left its sandbox running\n" << bxd_.log();
    EXPECT_TRUE(endsSoon(stoppedOuter));
    EXPECT_TRUE(fs::is_empty(bxd_.root() / "runtime/instances/com.example.greeter.hello")) << "records stay behind";
    for (const UniqueFd* process : {&killedOuter, &killedFirst, &stoppedOuter, &stoppedFirst})
        if (*process) pidfdSendSignal(process->get(), SIGKILL);
}

// Guards the daemon's one thread against the end of an instance: bxd learns of it from the instance's pidfd, which
// can report an end that waitpid cannot collect yet (here: a process that another process traces is reaped by its
// parent only after its tracer has seen it end; the event loop can also report a pidfd early). bxd must answer other
// requests meanwhile and reap the instance once it can. A stand-in for bubblewrap ends when its host hangs up.
TEST_F(LaunchTest, AnInstanceThatCannotBeReapedYetDoesNotStopTheDaemon) {
    startAndAddWithStandIn("plain-bwrap",
                           "echo \"{ \\\"child-pid\\\": $$ }\" >&4\n"
                           "exec cat <&3 >/dev/null\n");
    TestClient host;
    ASSERT_EQ(errorCode(ready(host, {hello()})), 0);
    auto [reply, channel] = launch(host, hello());
    ASSERT_EQ(errorCode(reply), 0) << errorText(reply) << "\n" << bxd_.log();
    const pid_t instance = static_cast<pid_t>(reply.get("pid").numberAsUInt64().value_or(0));
    if (ptrace(PTRACE_SEIZE, instance, nullptr, nullptr) != 0)
        GTEST_SKIP() << "this process may not trace another: " << strerror(errno);

    UniqueFd ended(pidfdOpen(instance));
    channel.reset();  // the instance ends; until its tracer has seen that, its parent cannot reap it
    ASSERT_TRUE(pidfdExited(ended.get(), 5000));
    const auto asked = std::chrono::steady_clock::now();
    TestClient::Reply answer = TestClient().roundTrip(request("bulk"), std::chrono::seconds(3));
    EXPECT_TRUE(std::holds_alternative<Value>(answer)) << "bxd stopped answering while an instance ended";
    EXPECT_LT(std::chrono::steady_clock::now() - asked, std::chrono::seconds(2));

    int status = 0;
    ASSERT_EQ(waitpid(instance, &status, __WALL), instance);  // the tracer has seen the end: bxd may reap it now
    EXPECT_TRUE(WIFEXITED(status)) << status;
    expectLog("plug-in com.example.greeter.hello instance " + std::to_string(instance) + " ended (exit status 0)");
    EXPECT_FALSE(fs::exists(instanceRecord("com.example.greeter.hello", static_cast<uint64_t>(instance))));
}

// Guards the user a plug-in runs as: a host that is not root gets a plug-in running as its own user, never as
// root, even though bxd runs as root; the plug-in's container becomes that user's.
TEST_F(LaunchTest, APlugInRunsAsItsHostsUserNeverAsRoot) {
    if (geteuid() != 0) GTEST_SKIP() << "needs root to run a host as another user";
    std::string probe = makeProbe("user", "com.example.probe");
    // The host is another user: it must reach the socket and the plug-in its bundle.
    fs::permissions(bxd_.root(), fs::perms(0755));
    startAndAdd({probe});
    const std::string uuid = registeredUuid(probe)->string();
    fs::path output = bxd_.root() / "host-nobody.txt";
    pid_t host = fork();
    if (host == 0) {
        int out = open(output.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
        if (out < 0 || dup2(out, 1) < 0 || dup2(out, 2) < 0 || setgroups(0, nullptr) != 0 ||
            setresgid(65534, 65534, 65534) != 0 || setresuid(65534, 65534, 65534) != 0)
            _exit(125);
        execl(kHostClient.c_str(), kHostClient.c_str(), ("ready:" + uuid).c_str(), ("launch:" + uuid).c_str(),
              "say:uid", nullptr);
        _exit(127);
    }
    int status = 0;
    ASSERT_EQ(waitpid(host, &status, 0), host);
    std::string text = slurp(output);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << text;
    EXPECT_NE(text.find("\n0 \n0 \nok 65534\n"), std::string::npos) << text << bxd_.log();
    struct stat owner {};
    ASSERT_EQ(stat(container("com.example.probe.user").c_str(), &owner), 0);
    EXPECT_EQ(owner.st_uid, 65534u);
}

// Guards confinement: the plug-in writes its container and /tmp and nothing else (not its bundle, not the
// daemon's state, not the file system root), cannot see another plug-in's container, and reaches a port on this
// machine's loopback only under a profile with network access ("plugin"), not under "typepad".
TEST_F(LaunchTest, APlugInSeesOnlyItsBundleContainerAndTmpAndTheNetworkItsProfileAllows) {
    std::string open = makeProbe("open", "com.example.probe");
    std::string closed = makeProbe("closed", "com.quorvel.typepad-service");
    startAndAdd({open, closed});
    fs::create_directories(container("com.example.greeter.hello"));
    { std::ofstream(container("com.example.greeter.hello") / "secret.txt") << "hello's secret\n"; }

    int listener = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    ASSERT_EQ(bind(listener, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
    ASSERT_EQ(listen(listener, 4), 0);
    socklen_t length = sizeof address;
    getsockname(listener, reinterpret_cast<sockaddr*>(&address), &length);
    const std::string port = std::to_string(ntohs(address.sin_port));
    UniqueFd listenerOwner(listener);

    TestClient host;
    ASSERT_EQ(errorCode(ready(host, {open, closed})), 0) << bxd_.log();
    auto [openReply, openChannel] = launch(host, open);
    auto [closedReply, closedChannel] = launch(host, closed);
    ASSERT_TRUE(openChannel && closedChannel) << errorText(openReply) << errorText(closedReply) << bxd_.log();
    const Value& started = openReply.get("bundleInfo");
    EXPECT_EQ(started.get("BDBundleIdentifier"), Value::string("com.example.probe.open")) << "the reply says what ran";
    EXPECT_EQ(started.find("DTBuildTool"), nullptr) << "without what only says how it was built";

    const std::string own = container("com.example.probe.open").string();
    EXPECT_EQ(exchange(openChannel.get(), "write " + own + "/note.txt"), "ok");
    EXPECT_EQ(slurp(own + "/note.txt"), "probe\n") << "the container is the real one, kept after the plug-in";
    EXPECT_EQ(exchange(openChannel.get(), "write /tmp/scratch"), "ok");
    EXPECT_FALSE(fs::exists("/tmp/scratch") && slurp("/tmp/scratch") == "probe\n") << "/tmp is private";
    EXPECT_EQ(exchange(openChannel.get(), "env TMPDIR"), "ok " + own + "/tmp");
    EXPECT_EQ(exchange(openChannel.get(), "write " + open + "/Info.vrec"), "error Read-only file system");
    EXPECT_EQ(exchange(openChannel.get(), "write /escaped"), "error Read-only file system");
    // The daemon's state directory is not there: a write to its path lands in the private /tmp, if anywhere.
    exchange(openChannel.get(), "write " + (bxd_.root() / "state/evil").string());
    EXPECT_FALSE(fs::exists(bxd_.root() / "state/evil"));
    EXPECT_EQ(exchange(openChannel.get(), "read " + container("com.example.greeter.hello").string() + "/secret.txt"),
              "error No such file or directory");
    EXPECT_EQ(exchange(openChannel.get(), "read " + open + "/Info.vrec").rfind("ok <?xml", 0), 0u);
    EXPECT_EQ(exchange(openChannel.get(), "connect " + port), "ok") << "the plugin profile reaches the network";
    EXPECT_EQ(exchange(closedChannel.get(), "connect " + port).rfind("error ", 0), 0u)
        << "the typepad profile has no network";
    EXPECT_EQ(exchange(openChannel.get(), "uid"), "ok " + std::to_string(getuid()));
}

// Guards the tool: "bexil launch" makes the plug-in ready for itself and launches it in one process (a grant
// would not outlive a separate "bexil ready"), says each --say line and prints the plug-in's answers.
TEST_F(LaunchTest, TheToolLaunchesAndTalksToThePlugIn) {
    startAndAdd();
    Outcome run = bexil("launch " + registeredUuid(hello())->string() + " --say world --say again");
    EXPECT_EQ(run.status, 0) << run.err << bxd_.log();
    EXPECT_EQ(run.out.rfind("Hello, world! (plug-in pid ", 0), 0u) << run.out;
    EXPECT_NE(run.out.find("\nHello, again! "), std::string::npos) << run.out;
    EXPECT_EQ(run.err.rfind("bexil: plug-in instance ", 0), 0u) << run.err;
    EXPECT_NE(run.err.find(" started (com.example.greeter.hello 1.2)\n"), std::string::npos) << run.err;
}

// Runs the host client with `arguments` as the next process (no shell in between, which would take a pid
// first); its lines of output (its pid first).
std::vector<std::string> runHost(const std::vector<std::string>& arguments, const fs::path& output) {
    std::vector<std::string> all{kHostClient.string()};
    all.insert(all.end(), arguments.begin(), arguments.end());
    std::vector<char*> argv;
    for (std::string& argument : all) argv.push_back(argument.data());
    argv.push_back(nullptr);
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, 1, output.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    posix_spawn_file_actions_adddup2(&actions, 1, 2);
    pid_t pid = -1;
    EXPECT_EQ(posix_spawn(&pid, argv[0], &actions, nullptr, argv.data(), environ), 0);
    posix_spawn_file_actions_destroy(&actions);
    int status = -1;
    waitpid(pid, &status, 0);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << slurp(output);
    std::vector<std::string> lines;
    std::istringstream in(slurp(output));
    for (std::string line; std::getline(in, line);) lines.push_back(line);
    return lines;
}

// A host that made a plug-in ready and ended leaves nothing a later process with its pid could use. Choosing the
// next pid needs a pid namespace of one's own, so the test runs itself again as the first process of new user and
// pid namespaces, with the daemon inside. bubblewrap is pointed at nothing, so a launch that the grant lets
// through answers "bubblewrap is not available" instead of starting anything.
class LaunchGrantTest : public DaemonTest {};

TEST_F(LaunchGrantTest, AGrantDiesWithItsHostAndIsNotInheritedByThePid) {
    const std::string name = std::string(::testing::UnitTest::GetInstance()->current_test_suite()->name()) + "." +
                             ::testing::UnitTest::GetInstance()->current_test_info()->name();
    if (!getenv(kInPidNamespace)) {
        const std::string namespaces = "unshare --user --map-root-user --pid --fork --mount-proc ";
        if (std::system((namespaces + "true >/dev/null 2>&1").c_str()) != 0)
            GTEST_SKIP() << "cannot make user and pid namespaces here";
        fs::path output = bxd_.root() / "namespace-run.txt";
        int status = std::system((std::string(kInPidNamespace) + "=1 " + namespaces + "'" +
                                  fs::canonical("/proc/self/exe").string() + "' --gtest_filter=" + name + " >'" +
                                  output.string() + "' 2>&1")
                                     .c_str());
        EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << slurp(output);
        EXPECT_NE(slurp(output).find("[  PASSED  ] 1 test"), std::string::npos) << slurp(output);
        return;
    }

    copyExamples({"Greeter.app"});
    setenv("BX_BWRAP", (bxd_.root() / "no-bwrap").c_str(), 1);
    ASSERT_TRUE(start()) << bxd_.log();
    std::string hello = plugIn("Greeter.app/PlugIns/Hello.bxplugin");
    add({hello});
    const std::string uuid = registeredUuid(hello)->string();
    const std::string granted = "4 cannot launch com.example.greeter.hello: bubblewrap is not available";
    const std::string refused = "11 plug-in com.example.greeter.hello was not made ready for this host";
    fs::path output = bxd_.root() / "host.txt";

    std::vector<std::string> first = runHost({"launch:" + uuid, "ready:" + uuid, "launch:" + uuid}, output);
    ASSERT_EQ(first.size(), 4u);
    EXPECT_EQ(first[1], refused) << "no grant before ready";
    EXPECT_EQ(first[2], "0 ");
    EXPECT_EQ(first[3].rfind(granted, 0), 0u) << "the grant lets its own host through: " << first[3];

    const pid_t endedHost = std::stoi(first[0]);
    {
        std::ofstream next("/proc/sys/kernel/ns_last_pid");
        next << endedHost - 1;
    }
    std::vector<std::string> successor = runHost({"launch:" + uuid}, output);
    ASSERT_EQ(successor.size(), 2u);
    ASSERT_EQ(std::stoi(successor[0]), endedHost) << "the pid was not reused";
    EXPECT_EQ(successor[1], refused);
}

}  // namespace
}  // namespace bexil
