// The daemon as a client sees it: options and exit statuses, owning and being activated on its service socket, the
// request envelope, and peers that misbehave.

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <array>
#include <cstring>

#include "E2eSupport.h"
#include "ProtocolDocument.h"
#include "platform/zem/ZemCodec.h"
#include "platform/zem/ZemFrame.h"

namespace bexil {
namespace {

using namespace test;

// A request named `name` whose version field is `version` (none: the key is absent).
Value versioned(std::string_view name, std::optional<Value> version) {
    MutableDictionary d;
    d.set("request", Value::string(name));
    if (version) d.set("version", *version);
    return d.take();
}
const Value kBogus = request("bogus");

// `count` well-formed "bogus" request frames back to back.
std::vector<uint8_t> burst(uint64_t count) {
    std::vector<uint8_t> out, one;
    for (uint64_t serial = 1; serial <= count; ++serial) {
        one.clear();
        EXPECT_FALSE(ZemFrame::encode(ZemFrameKind::Request, serial, 0, kBogus, one).has_value());
        out.insert(out.end(), one.begin(), one.end());
    }
    return out;
}

// ---- options and exit statuses ----

// Guards the usage path: an unknown option, a missing argument and a stray word each end the daemon with status 2
// and the usage line, before it takes a service name.
TEST(BxdOptions, UsageErrorsExitWithStatus2BeforeBuildingAnything) {
    for (const char* arguments : {"-x", "-c", "extra"}) {
        BxdProcess bxd;
        bxd.exportEnvironment();
        std::string line =
            "'" + BxdProcess::binary().string() + "' " + arguments + " 2>'" + bxd.root().string() + "/bxd.log'";
        int status = std::system(line.c_str());
        EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 2) << arguments << ": " << status;
        EXPECT_NE(bxd.log().find("Usage: bxd [-S servicename] [-v]\n"), std::string::npos) << bxd.log();
        EXPECT_TRUE(std::filesystem::is_empty(bxd.serviceDir()));
    }
}

// Guards option handling that reaches the server (each -v is reported, the last -c wins and is taken unvalidated so
// a negative number wraps, -S names the socket) and the end of the real process: SIGTERM tells the clients and the
// daemon exits instead of dying by the signal.
TEST(BxdOptions, OptionsReachTheServerAndSigtermEndsIt) {
    BxdProcess bxd;
    ASSERT_TRUE(bxd.start({"-v", "-v", "-c", "5", "-c", "-1", "-S", "com.example.private"})) << bxd.log();
    EXPECT_EQ(bxd.countInLog("verbose option -v is ineffective; use log config --subsystem com.quorvel.bexil"), 2u);
    EXPECT_NE(bxd.log().find("bxd is launching"), std::string::npos);
    EXPECT_TRUE(bxd.waitForLog("service com.example.private, cache limit 4294967295,")) << bxd.log();

    bxd.exportEnvironment();
    TestClient client("com.example.private");
    EXPECT_EQ(errorCode(client.replyTo(kBogus)), 4);
    int status = bxd.stop(SIGTERM);
    EXPECT_TRUE(WIFEXITED(status)) << status;
    EXPECT_TRUE(bxd.waitForLog("termination imminent")) << bxd.log();
}

// ---- service ownership ----

// Guards the service socket: a live daemon keeps it against a second one (which exits 1), and a socket file left
// by a killed daemon is replaced by the next.
TEST(BxdService, ASecondDaemonOnTheSameNameFailsAndAStaleSocketIsReplaced) {
    BxdProcess first;
    ASSERT_TRUE(first.start()) << first.log();
    first.exportEnvironment();
    const std::string bxd = "'" + BxdProcess::binary().string() + "' 2>/dev/null";
    int status = std::system(bxd.c_str());
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 1) << status;
    EXPECT_EQ(errorCode(TestClient().replyTo(kBogus)), 4) << "the first daemon still serves";

    first.stop(SIGKILL);
    ASSERT_TRUE(std::filesystem::exists(first.socketPath()));
    const std::string execBxd = "exec " + bxd;
    pid_t third = fork();
    if (third == 0) {
        execl("/bin/sh", "sh", "-c", execBxd.c_str(), nullptr);
        _exit(127);
    }
    bool served = false;
    for (int i = 0; i < 500 && !served; ++i) {
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
        served = std::holds_alternative<Value>(TestClient().roundTrip(kBogus, std::chrono::seconds(1)));
    }
    EXPECT_TRUE(served);
    kill(third, SIGKILL);
    waitpid(third, nullptr, 0);
}

// Guards socket activation: the socket exists before the daemon, and the first connection starts bxd on the socket
// it is passed.
TEST(BxdService, FirstConnectionStartsBxdOnTheActivatedSocket) {
    if (access("/usr/bin/systemd-socket-activate", X_OK) != 0) GTEST_SKIP() << "systemd-socket-activate not installed";
    // Private directories only, passed on by the activator: the machine's own state is never touched.
    BxdProcess environment;
    environment.exportEnvironment();
    std::string socketPath = environment.socketPath(), log = (environment.root() / "activated.log").string();
    pid_t activator = fork();
    if (activator == 0) {
        dup2(open(log.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0644), STDERR_FILENO);
        std::string listen = "--listen=" + socketPath;
        execl("/usr/bin/systemd-socket-activate", "systemd-socket-activate", listen.c_str(),
              "--fdname=com.quorvel.bexil.bxd", "-E", "BX_LOG_SINK", "-E", "BX_SERVICE_DIR", "-E", "BXD_LOG_LEVEL",
              "-E", "BX_STATE_DIR", "-E", "BX_RUNTIME_DIR", "-E", "BX_ENTITLEMENTS_DIR", BxdProcess::binary().c_str(),
              nullptr);
        _exit(127);
    }
    for (int i = 0; i < 500 && !std::filesystem::exists(socketPath); ++i)
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    ASSERT_TRUE(std::filesystem::exists(socketPath));
    int status = std::system(BEXIL_BINARY_DIR "/tests/bx_zem_ping bogus >/dev/null");
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
    kill(activator, SIGTERM);
    waitpid(activator, nullptr, 0);
    EXPECT_NE(slurp(log).find("listening on service com.quorvel.bexil.bxd (socket passed by systemd)"),
              std::string::npos)
        << slurp(log);
}

// ---- the request envelope ----

class BxdEnvelope : public DaemonTest {
  protected:
    void SetUp() override { ASSERT_TRUE(start()) << bxd_.log(); }
};

// Guards the envelope checks before dispatch: versions 2 and 3 reach the handler table, anything else (below,
// above, absent, high bits set, another kind) is code 7 naming the low 32 bits; then the request name, which must
// match exactly, and a known request that reaches its handler (a "ready" without its list).
TEST_F(BxdEnvelope, VersionThenRequestNameAreChecked) {
    for (uint64_t accepted : {2u, 3u})
        expectFailure(versioned("bogus", Value::uint64(accepted)), 4, "unrecognized request");
    const std::pair<std::optional<Value>, const char*> refused[] = {
        {Value::uint64(1), "1"},   {Value::uint64(4), "4"},
        {std::nullopt, "0"},       {Value::uint64((uint64_t{1} << 32) | 3), "3"},
        {Value::string("3"), "0"},
    };
    for (const auto& [version, named] : refused)
        expectFailure(versioned("add", version), 7,
                      std::string("unsupported protocol version ") + named + " (current 3)");

    expectFailure(Value::dictionary({{"version", Value::uint64(3)}}), 4, "invalid request format (missing type)");
    for (const char* name : {"Add", ""}) expectFailure(request(name), 4, "unrecognized request");
    expectFailure(request("ready"), 4, "invalid request format (uuid)");
}

// Guards the worked example of docs/protocol.md as a client written from it would meet it: its request frame, sent
// with version 4 on a fresh connection, gets exactly the documented reply frame, whose serial is the daemon's first.
TEST_F(BxdEnvelope, TheDocumentedExampleIsWhatBxdAnswers) {
    std::vector<uint8_t> request = test::documentedBytes("request-frame");
    std::vector<uint8_t> expected = test::documentedBytes("reply-frame");
    ASSERT_GT(expected.size(), ZemFrame::kHeaderBytes);
    ASSERT_EQ(request.back(), 3) << "the example's last byte is its version";
    request.back() = 4;
    RawSocket socket(bxd_.socketPath());
    socket.write(request);
    EXPECT_EQ(socket.read(expected.size()), expected);

    // The daemon numbers its frames on each connection: the second reply carries serial 2.
    constexpr size_t kSerial = 8, kInReplyTo = 16;  // header offsets; the numbers are little-endian
    request[kSerial] = 2;
    socket.write(request);
    std::vector<uint8_t> second = socket.read(expected.size());
    ASSERT_EQ(second.size(), expected.size());
    EXPECT_EQ(second[kSerial], 2) << "serial";
    EXPECT_EQ(second[kInReplyTo], 2) << "in-reply-to";
}

// Guards a client that hangs up while its requests wait behind another client's: none of them runs. bxd is held
// (SIGSTOP) while one client asks for a discovery and another sends two registrations and hangs up, so that all
// three are waiting together when bxd goes on; the discovery is answered and nothing is registered.
TEST_F(BxdEnvelope, RequestsOfAClientThatHungUpWhileTheyWaitedDoNotRun) {
    copyExamples({"Greeter.app"});
    const std::string hello = plugIn("Greeter.app/PlugIns/Hello.bxplugin");
    TestClient other, vanishing;
    ASSERT_EQ(errorText(other.replyTo(kBogus)), "unrecognized request");
    ASSERT_EQ(errorText(vanishing.replyTo(kBogus)), "unrecognized request");

    bxd_.signal(SIGSTOP);
    auto discovery = std::async(std::launch::async, [&] { return other.roundTrip(matchRequest()); });
    std::this_thread::sleep_for(std::chrono::milliseconds(50));
    vanishing.sendAndHangUp({pathsRequest("add", {hello}), pathsRequest("add", {hello})});
    std::this_thread::sleep_for(std::chrono::milliseconds(50));
    bxd_.signal(SIGCONT);

    TestClient::Reply answered = discovery.get();
    ASSERT_TRUE(std::holds_alternative<Value>(answered));
    EXPECT_EQ(errorCode(std::get<Value>(answered)), 0);
    expectLog("client " + std::to_string(getpid()) + " is dead");
    EXPECT_EQ(identifiers(succeed(matchRequest())), Ids{});
    EXPECT_FALSE(registeredUuid(hello)) << bxd_.log();
}

// Guards the per-client request counter: the line comes at the 1000th request, not before.
TEST_F(BxdEnvelope, EveryThousandthRequestOfAClientIsCounted) {
    TestClient client;
    for (int i = 1; i <= 999; ++i) client.roundTrip(kBogus);
    std::string line = "client " + std::to_string(getpid()) + " used 1000 requests so far";
    EXPECT_EQ(bxd_.countInLog(line), 0u);
    client.roundTrip(kBogus);
    expectLog(line);
}

// Guards the daemon against peers that break the protocol or vanish: garbage gets the connection closed, a valid
// payload that is not a dictionary is logged and dropped while the connection serves on, half a frame followed by a
// hang-up is logged, a client that dies with 2000 requests queued is noticed as dead, one that never reads its 20000
// replies does not hold up another client. (An announced frame over the size limit is refused by the frame reader:
// ZemFrameReader unit tests.)
TEST_F(BxdEnvelope, MisbehavingAndVanishingPeersAreDroppedAndOthersServed) {
    const std::string path = bxd_.socketPath();
    {
        RawSocket garbage(path);
        garbage.write(std::vector<uint8_t>(100, 0x41));
        EXPECT_TRUE(garbage.closedByPeer());
    }
    {
        RawSocket half(path);
        std::vector<uint8_t> bytes = burst(1);
        bytes.resize(bytes.size() / 2);
        half.write(bytes);
    }
    {
        RawSocket notDictionary(path);
        std::vector<uint8_t> payload;
        ASSERT_FALSE(ZemCodec::encode(Value::array({Value::string("request")}), payload).has_value());
        std::array<uint8_t, ZemFrame::kHeaderBytes> header{};
        ZemFrame::encodeHeader({ZemFrameKind::Request, 1, 0, static_cast<uint32_t>(payload.size())}, header);
        std::vector<uint8_t> bytes(header.begin(), header.end());
        bytes.insert(bytes.end(), payload.begin(), payload.end());
        notDictionary.write(bytes);
        // Logged and dropped without an answer; the connection stays and the next request is answered.
        expectLog("unexpected message: [\"request\"] from: " + std::to_string(getpid()));
        std::vector<uint8_t> next;
        ASSERT_FALSE(ZemFrame::encode(ZemFrameKind::Request, 2, 0, kBogus, next).has_value());
        notDictionary.write(next);
        std::vector<uint8_t> replyHeader = notDictionary.read(ZemFrame::kHeaderBytes);
        ASSERT_EQ(replyHeader.size(), ZemFrame::kHeaderBytes) << "no reply after the ignored message";
        Result<ZemFrameHeader> decoded = ZemFrame::decodeHeader(
            std::span<const uint8_t, ZemFrame::kHeaderBytes>(replyHeader.data(), ZemFrame::kHeaderBytes));
        ASSERT_TRUE(decoded);
        EXPECT_EQ(decoded->inReplyTo, 2u) << "the answer is to the second request; the first gets none";
    }
    expectLog("closed its connection in the middle of a frame");
    pid_t child = fork();
    if (child == 0) {
        RawSocket(path).write(burst(2000));
        _exit(0);  // dies without reading a single reply
    }
    waitpid(child, nullptr, 0);
    expectLog("client " + std::to_string(child) + " is dead");

    RawSocket lazy(path);
    std::vector<uint8_t> many = burst(20000);
    std::thread writer([&] { lazy.write(many); });
    TestClient client;
    for (int i = 0; i < 50; ++i) EXPECT_EQ(errorText(client.replyTo(kBogus)), "unrecognized request");
    lazy.closeNow();
    writer.join();
    EXPECT_TRUE(bxd_.running());
}

// Guards stalled connections: with a stall time of 1 s, a connection that never sends a frame and one that sends
// half a frame are dropped and logged; one that sent a whole request and then stays silent longer is kept and
// answered when it speaks again.
TEST_F(BxdEnvelope, StalledConnectionsAreDroppedButQuietOnesKept) {
    setenv("BX_STALLED_CONNECTION_SECONDS", "1", 1);
    bxd_.stop(SIGKILL);
    ASSERT_TRUE(start()) << bxd_.log();
    unsetenv("BX_STALLED_CONNECTION_SECONDS");
    const std::string path = bxd_.socketPath();
    RawSocket silent(path);
    RawSocket half(path);
    std::vector<uint8_t> partial = burst(1);
    partial.resize(partial.size() / 2);
    half.write(partial);
    RawSocket quiet(path);
    quiet.write(burst(1));
    ASSERT_EQ(quiet.read(ZemFrame::kHeaderBytes).size(), ZemFrame::kHeaderBytes);

    EXPECT_TRUE(silent.closedByPeer());
    EXPECT_TRUE(half.closedByPeer());
    expectLog("sent no complete frame for 1 s (kStalledConnectionTimeout): disconnecting");
    expectLog("sent part of a frame and no more for 1 s");
    std::this_thread::sleep_for(std::chrono::milliseconds(1500));
    std::vector<uint8_t> second;
    ASSERT_FALSE(ZemFrame::encode(ZemFrameKind::Request, 2, 0, kBogus, second).has_value());
    quiet.write(second);
    EXPECT_EQ(quiet.read(ZemFrame::kHeaderBytes).size(), ZemFrame::kHeaderBytes) << "a quiet client was dropped";
}

// Guards pipelining: a client that writes 10,000 requests before reading any reply gets every one answered, in
// the order it sent them (replies queue up for it until it reads, within the pause mark).
TEST_F(BxdEnvelope, TenThousandPipelinedRequestsAreAllAnsweredInOrder) {
    constexpr uint64_t kRequests = 10000;
    RawSocket client(bxd_.socketPath());
    std::vector<uint8_t> many = burst(kRequests);
    std::thread writer([&] { client.write(many); });
    uint64_t answered = 0;
    for (uint64_t expected = 1; expected <= kRequests; ++expected) {
        std::vector<uint8_t> bytes = client.read(ZemFrame::kHeaderBytes);
        if (bytes.size() != ZemFrame::kHeaderBytes) break;
        Result<ZemFrameHeader> header =
            ZemFrame::decodeHeader(std::span<const uint8_t, ZemFrame::kHeaderBytes>(bytes.data(), bytes.size()));
        ASSERT_TRUE(header.ok()) << header.error().description();
        ASSERT_EQ(header->inReplyTo, expected);
        ASSERT_EQ(client.read(header->payloadLength).size(), header->payloadLength);
        answered = expected;
    }
    writer.join();
    EXPECT_EQ(answered, kRequests) << bxd_.log().substr(0, 2000);
}

// Guards a client that pipelines without reading: once its unread replies pass the pause mark (4 KiB here, where
// the default of 1 MiB would let some 17,000 of these replies wait) its further requests wait, with a log line,
// other clients are served meanwhile, and after the stall time (1 s here) it is dropped with a log line.
TEST_F(BxdEnvelope, AClientThatNeverReadsIsPausedThenDropped) {
    setenv("BX_STALLED_CONNECTION_SECONDS", "1", 1);
    setenv("BX_QUEUED_REPLY_BYTES", "4096", 1);
    bxd_.stop(SIGKILL);
    ASSERT_TRUE(start()) << bxd_.log();
    unsetenv("BX_STALLED_CONNECTION_SECONDS");
    unsetenv("BX_QUEUED_REPLY_BYTES");
    RawSocket lazy(bxd_.socketPath());
    std::vector<uint8_t> many = burst(40000);
    std::thread writer([&] { lazy.write(many); });
    TestClient client;
    for (int i = 0; i < 20; ++i) EXPECT_EQ(errorText(client.replyTo(kBogus)), "unrecognized request");
    expectLog("bytes of replies unread, over the limit (kQueuedReplyBytes): its requests wait until it reads");
    expectLog("has not read its replies for 1 s (");
    EXPECT_LT(bxd_.countInLog("requested bogus"), 5000u) << "the lazy client's requests ran past the pause mark";
    writer.join();
    EXPECT_EQ(errorText(client.replyTo(kBogus)), "unrecognized request");
}

}  // namespace
}  // namespace bexil
