// The daemon as a client sees it: options and exit statuses, the request envelope, and peers that misbehave.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cstring>
#include <future>
#include <thread>

#include "BxdProcess.h"
#include "TestClient.h"
#include "base/EventLoop.h"
#include "base/SerialQueue.h"
#include "platform/zem/ZemCodec.h"
#include "platform/zem/ZemConnection.h"
#include "platform/zem/ZemFrame.h"
#include "platform/zem/ZemFrameReader.h"

namespace bexil {
namespace {

using test::BxdProcess;
using Reply = std::variant<Value, ZemError>;

Value request(std::string_view name, std::optional<Value> version = Value::uint64(3)) {
    MutableDictionary d;
    d.set("request", Value::string(name));
    if (version) d.set("version", *version);
    return d.take();
}

using test::TestClient;

// A raw stream socket to the daemon, for bytes that no well-behaved client would send.
class RawSocket {
  public:
    explicit RawSocket(const std::string& path) : fd_(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
        sockaddr_un addr{};
        addr.sun_family = AF_UNIX;
        strncpy(addr.sun_path, path.c_str(), sizeof addr.sun_path - 1);
        connected_ = connect(fd_, reinterpret_cast<sockaddr*>(&addr), sizeof addr) == 0;
    }
    ~RawSocket() { closeNow(); }
    bool connected() const { return connected_; }
    void write(const std::vector<uint8_t>& bytes) { (void)!::send(fd_, bytes.data(), bytes.size(), MSG_NOSIGNAL); }
    void closeNow() {
        if (fd_ >= 0) ::close(fd_);
        fd_ = -1;
    }
    // True when the daemon closed the connection (read returns 0 or an error) within the timeout.
    bool closedByPeer(std::chrono::milliseconds timeout = std::chrono::seconds(5)) {
        timeval tv{static_cast<time_t>(timeout.count() / 1000),
                   static_cast<suseconds_t>(timeout.count() % 1000 * 1000)};
        setsockopt(fd_, SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof tv);
        char buf[4096];
        for (;;) {
            ssize_t n = ::recv(fd_, buf, sizeof buf, 0);
            if (n == 0) return true;
            if (n < 0) return errno != EAGAIN && errno != EWOULDBLOCK;
        }
    }
    int fd() const { return fd_; }

  private:
    int fd_;
    bool connected_ = false;
};

std::vector<uint8_t> frame(ZemFrameKind kind, uint64_t serial, const Value& payload) {
    std::vector<uint8_t> out;
    EXPECT_FALSE(ZemFrame::encode(kind, serial, 0, payload, out).has_value());
    return out;
}

int64_t errorCode(const Value& reply) {
    const Value* code = reply.find("errorcode");
    return code && code->numberAsUInt64() ? static_cast<int32_t>(*code->numberAsUInt64()) : 0;
}
std::string errorText(const Value& reply) { return std::string(reply.get("error").stringView()); }

// ---- options and exit statuses ----

TEST(BxdOptions, UsageErrorsExitWithStatus2BeforeBuildingAnything) {
    for (const std::vector<std::string>& args :
         std::vector<std::vector<std::string>>{{"extra"}, {"-x"}, {"-c"}, {"-S"}, {"-d"}, {"-v", "positional"}}) {
        BxdProcess bxd;
        EXPECT_EQ(bxd.runToExit(args), 2) << args[0];
        EXPECT_NE(bxd.log().find("Usage: bxd [-S servicename] [-v]\n"), std::string::npos) << bxd.log();
        EXPECT_EQ(bxd.log().find("listening on service"), std::string::npos);
        EXPECT_TRUE(std::filesystem::is_empty(bxd.serviceDir()));
    }
}

TEST(BxdOptions, EachVerboseOptionWritesTheIneffectiveLine) {
    BxdProcess bxd;
    ASSERT_TRUE(bxd.start({"-v", "-v"})) << bxd.log();
    EXPECT_EQ(bxd.countInLog("verbose option -v is ineffective; use log config --subsystem com.quorvel.bexil"), 2u);
    EXPECT_NE(bxd.log().find("bxd is launching"), std::string::npos);
}

TEST(BxdOptions, LastCacheLimitWinsAndNegativeWraps) {
    {
        BxdProcess bxd;
        ASSERT_TRUE(bxd.start({"-c", "5", "-c", "7"})) << bxd.log();
        EXPECT_TRUE(bxd.waitForLog("cache limit 7,")) << bxd.log();
    }
    {
        BxdProcess bxd;
        ASSERT_TRUE(bxd.start({"-c", "-1"})) << bxd.log();
        EXPECT_TRUE(bxd.waitForLog("cache limit 4294967295,")) << bxd.log();
    }
    {
        BxdProcess bxd;
        ASSERT_TRUE(bxd.start({"-c", "lots"})) << bxd.log();
        EXPECT_TRUE(bxd.waitForLog("cache limit 0,")) << bxd.log();
    }
}

TEST(BxdOptions, DefaultsAndServiceName) {
    BxdProcess bxd;
    ASSERT_TRUE(bxd.start()) << bxd.log();
    EXPECT_TRUE(bxd.waitForLog("service com.quorvel.bexil.bxd, cache limit 1000000,")) << bxd.log();
    BxdProcess other;
    ASSERT_TRUE(other.start({"-S", "com.example.private"})) << other.log();
    EXPECT_TRUE(std::filesystem::exists(other.socketPath("com.example.private")));
}

// ---- service ownership ----

TEST(BxdService, ASecondDaemonOnTheSameNameFailsAndAStaleSocketIsReplaced) {
    BxdProcess first;
    ASSERT_TRUE(first.start()) << first.log();
    // Same private directories, same name: the live daemon keeps its socket.
    first.exportEnvironment();
    std::string serviceDir = first.serviceDir().string();
    pid_t second = fork();
    if (second == 0) {
        setenv("BX_SERVICE_DIR", serviceDir.c_str(), 1);
        setenv("BX_LOG_SINK", "stderr", 1);
        int devnull = open("/dev/null", O_WRONLY);
        dup2(devnull, STDERR_FILENO);
        execl(BxdProcess::binary().c_str(), "bxd", nullptr);
        _exit(127);
    }
    int status = 0;
    waitpid(second, &status, 0);
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(WEXITSTATUS(status), 1);
    {
        TestClient client;
        EXPECT_EQ(errorCode(client.replyTo(request("bogus"))), 4);
    }

    // A daemon killed outright leaves its socket file behind; the next one replaces it.
    first.stop(SIGKILL);
    ASSERT_TRUE(std::filesystem::exists(first.socketPath()));
    pid_t third = fork();
    if (third == 0) {
        setenv("BX_SERVICE_DIR", serviceDir.c_str(), 1);
        int devnull = open("/dev/null", O_WRONLY);
        dup2(devnull, STDERR_FILENO);
        execl(BxdProcess::binary().c_str(), "bxd", nullptr);
        _exit(127);
    }
    bool served = false;
    for (int i = 0; i < 500 && !served; ++i) {
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
        TestClient client;
        Reply reply = client.roundTrip(request("bogus"), std::chrono::seconds(1));
        served = std::holds_alternative<Value>(reply);
    }
    EXPECT_TRUE(served);
    kill(third, SIGKILL);
    waitpid(third, nullptr, 0);
}

// ---- the request envelope ----

class BxdEnvelope : public ::testing::Test {
  protected:
    static void SetUpTestSuite() {
        bxd_ = new BxdProcess();
        ASSERT_TRUE(bxd_->start()) << bxd_->log();
        bxd_->exportEnvironment();
    }
    static void TearDownTestSuite() {
        delete bxd_;
        bxd_ = nullptr;
    }
    static BxdProcess* bxd_;
};
BxdProcess* BxdEnvelope::bxd_ = nullptr;

TEST_F(BxdEnvelope, VersionIsCheckedFirst) {
    TestClient client;
    // 2 passes the envelope like 3 does: both reach the handler table.
    for (uint64_t accepted : {2u, 3u}) {
        Value reply = client.replyTo(request("bogus", Value::uint64(accepted)));
        EXPECT_EQ(errorCode(reply), 4);
        EXPECT_EQ(errorText(reply), "unrecognized request");
    }
    for (uint64_t refused : {1u, 4u}) {
        Value reply = client.replyTo(request("add", Value::uint64(refused)));
        EXPECT_EQ(errorCode(reply), 7);
        EXPECT_EQ(errorText(reply), "unsupported protocol version " + std::to_string(refused) + " (current 3)");
    }
    Value missing = client.replyTo(request("add", std::nullopt));
    EXPECT_EQ(errorCode(missing), 7);
    EXPECT_EQ(errorText(missing), "unsupported protocol version 0 (current 3)");
    // Only the low 32 bits are named, but the whole value is compared.
    Value high = client.replyTo(request("add", Value::uint64((uint64_t{1} << 32) | 3)));
    EXPECT_EQ(errorCode(high), 7);
    EXPECT_EQ(errorText(high), "unsupported protocol version 3 (current 3)");
    // A version of another kind is no version at all.
    Value text = client.replyTo(request("add", Value::string("3")));
    EXPECT_EQ(errorCode(text), 7);
}

TEST_F(BxdEnvelope, RequestNamesAreExactAndKnownOnesAreNotYetAvailable) {
    TestClient client;
    Value noType = client.replyTo(Value::dictionary({{"version", Value::uint64(3)}}));
    EXPECT_EQ(errorCode(noType), 4);
    EXPECT_EQ(errorText(noType), "invalid request format (missing type)");
    // A failure reply holds exactly the two failure keys.
    EXPECT_EQ(noType.count(), 2u);

    for (const char* name : {"Add", "ADD", "add ", "", "matches"}) {
        Value reply = client.replyTo(request(name));
        EXPECT_EQ(errorCode(reply), 4) << name;
        EXPECT_EQ(errorText(reply), "unrecognized request") << name;
    }
    for (const char* name : {"ready", "access", "lock"}) {
        Value reply = client.replyTo(request(name));
        EXPECT_EQ(errorCode(reply), 4) << name;
        EXPECT_EQ(errorText(reply), std::string("the \"") + name + "\" operation is not available yet") << name;
    }
}

TEST_F(BxdEnvelope, EveryThousandthRequestOfAClientIsCounted) {
    TestClient client;
    for (int i = 1; i <= 999; ++i) client.roundTrip(request("bogus"));
    std::string pidText = "client " + std::to_string(getpid()) + " used ";
    EXPECT_EQ(bxd_->countInLog(pidText + "1000 requests so far"), 0u);
    client.roundTrip(request("bogus"));
    EXPECT_TRUE(bxd_->waitForLog(pidText + "1000 requests so far")) << "missing 1000th request line";
    EXPECT_EQ(bxd_->countInLog(pidText + "999 requests"), 0u);
}

TEST_F(BxdEnvelope, MisbehavingPeersAreDroppedAndOthersServed) {
    const std::string path = bxd_->socketPath();
    {
        RawSocket garbage(path);
        ASSERT_TRUE(garbage.connected());
        garbage.write(std::vector<uint8_t>(100, 0x41));
        EXPECT_TRUE(garbage.closedByPeer());
    }
    {
        // A header announcing a frame over the limit is refused before any payload arrives.
        RawSocket oversized(path);
        std::vector<uint8_t> bytes = frame(ZemFrameKind::Request, 1, request("bogus"));
        uint32_t huge = static_cast<uint32_t>(ZemFrame::kMaxFrameBytes);
        std::memcpy(bytes.data() + ZemFrame::kHeaderBytes - 4, &huge, 4);
        bytes.resize(ZemFrame::kHeaderBytes);
        oversized.write(bytes);
        EXPECT_TRUE(oversized.closedByPeer());
    }
    {
        RawSocket half(path);
        std::vector<uint8_t> bytes = frame(ZemFrameKind::Request, 1, request("bogus"));
        bytes.resize(bytes.size() / 2);
        half.write(bytes);
        half.closeNow();
    }
    {
        // A payload that is valid but not a dictionary is a protocol violation too.
        RawSocket notDictionary(path);
        std::vector<uint8_t> payload;
        ASSERT_FALSE(ZemCodec::encode(Value::array({Value::string("request")}), payload).has_value());
        std::array<uint8_t, ZemFrame::kHeaderBytes> header{};
        ZemFrame::encodeHeader({ZemFrameKind::Request, 1, 0, static_cast<uint32_t>(payload.size())}, header);
        std::vector<uint8_t> bytes(header.begin(), header.end());
        bytes.insert(bytes.end(), payload.begin(), payload.end());
        notDictionary.write(bytes);
        EXPECT_TRUE(notDictionary.closedByPeer());
    }
    EXPECT_TRUE(bxd_->waitForLog("closed its connection in the middle of a frame"));
    EXPECT_TRUE(bxd_->running());
    TestClient client;
    EXPECT_EQ(errorText(client.replyTo(request("bogus"))), "unrecognized request");
}

TEST_F(BxdEnvelope, ClientThatDiesWithRequestsQueuedLeavesOthersServed) {
    const std::string path = bxd_->socketPath();
    pid_t child = fork();
    if (child == 0) {
        RawSocket socket(path);
        std::vector<uint8_t> burst;
        for (uint64_t serial = 1; serial <= 2000; ++serial) {
            std::vector<uint8_t> one = frame(ZemFrameKind::Request, serial, request("bogus"));
            burst.insert(burst.end(), one.begin(), one.end());
        }
        socket.write(burst);
        _exit(0);  // dies without reading a single reply
    }
    waitpid(child, nullptr, 0);
    EXPECT_TRUE(bxd_->waitForLog("client " + std::to_string(child) + " is dead"));
    TestClient client;
    EXPECT_EQ(errorText(client.replyTo(request("bogus"))), "unrecognized request");
}

TEST_F(BxdEnvelope, ClientThatNeverReadsDoesNotHoldUpOthers) {
    RawSocket lazy(bxd_->socketPath());
    std::vector<uint8_t> burst;
    for (uint64_t serial = 1; serial <= 20000; ++serial) {
        std::vector<uint8_t> one = frame(ZemFrameKind::Request, serial, request("bogus"));
        burst.insert(burst.end(), one.begin(), one.end());
    }
    std::thread writer([&] { lazy.write(burst); });
    TestClient client;
    for (int i = 0; i < 50; ++i) EXPECT_EQ(errorText(client.replyTo(request("bogus"))), "unrecognized request");
    lazy.closeNow();
    writer.join();
    EXPECT_TRUE(bxd_->running());
}

TEST(BxdTermination, SigtermTellsClientsAndEndsTheDaemon) {
    BxdProcess bxd;
    ASSERT_TRUE(bxd.start()) << bxd.log();
    bxd.exportEnvironment();
    TestClient client;
    client.replyTo(request("bogus"));
    int status = bxd.stop(SIGTERM);
    EXPECT_TRUE(WIFEXITED(status)) << status;
    EXPECT_TRUE(bxd.waitForLog("termination imminent")) << bxd.log();
}

}  // namespace
}  // namespace bexil
