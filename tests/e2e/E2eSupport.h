#pragma once

// What the end-to-end tests share: a client connection, request builders, the error fields of a reply, and a
// fixture with a private daemon, copies of the example bundles and the usual requests.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <future>
#include <iterator>
#include <memory>
#include <optional>
#include <string>
#include <variant>
#include <vector>

#include "BxdProcess.h"
#include "base/Document.h"
#include "base/EventLoop.h"
#include "base/SerialQueue.h"
#include "base/UniqueFd.h"
#include "bexil/Value.h"
#include "platform/ledgerix/LXBexilProxy.h"
#include "platform/ledgerix/LedgerixWorkspace.h"
#include "platform/zem/ZemConnection.h"

namespace bexil::test {

// A raw stream socket to the daemon, for bytes that no well-behaved client would send.
class RawSocket {
  public:
    explicit RawSocket(const std::string& path) : fd_(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
        sockaddr_un addr{AF_UNIX, {}};
        strncpy(addr.sun_path, path.c_str(), sizeof addr.sun_path - 1);
        EXPECT_EQ(connect(fd_, reinterpret_cast<sockaddr*>(&addr), sizeof addr), 0) << strerror(errno);
    }
    ~RawSocket() { closeNow(); }
    void write(const std::vector<uint8_t>& bytes) { (void)!::send(fd_, bytes.data(), bytes.size(), MSG_NOSIGNAL); }
    void closeNow() {
        if (fd_ >= 0) ::close(std::exchange(fd_, -1));
    }
    // Exactly `count` bytes, or fewer when the peer closes or 5 s pass without any.
    std::vector<uint8_t> read(size_t count) {
        timeval tv{5, 0};
        setsockopt(fd_, SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof tv);
        std::vector<uint8_t> bytes(count);
        size_t got = 0;
        while (got < count) {
            ssize_t n = ::recv(fd_, bytes.data() + got, count - got, 0);
            if (n <= 0) break;
            got += static_cast<size_t>(n);
        }
        bytes.resize(got);
        return bytes;
    }
    // True when the daemon closed the connection (a read gives 0 or an error other than the time limit) in 5 s.
    bool closedByPeer() {
        timeval tv{5, 0};
        setsockopt(fd_, SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof tv);
        char buf[4096];
        ssize_t n = 0;
        do {
            n = ::recv(fd_, buf, sizeof buf, 0);
        } while (n > 0);
        return n == 0 || (errno != EAGAIN && errno != EWOULDBLOCK);
    }

  private:
    int fd_;
};

// A client connection with its own loop and queue, and a blocking round trip with a time limit.
class TestClient {
  public:
    using Reply = std::variant<Value, ZemError>;

    explicit TestClient(const std::string& service = "com.quorvel.bexil.bxd")
        : loop_(1), queue_("test-client", loop_), connection_(ZemConnection::createClient(service, queue_)) {
        connection_->setEventHandler([](const ZemConnection::Event&) {});
        connection_->resume();
    }
    ~TestClient() { connection_->cancel(); }

    // The reply, or the connection error in its place (ConnectionInvalid when none came within `timeout`).
    Reply roundTrip(const Value& message, std::chrono::seconds timeout = std::chrono::seconds(10)) {
        auto promise = std::make_shared<std::promise<Reply>>();
        auto future = promise->get_future();
        connection_->sendWithReply(message, queue_, [promise](const Reply& reply) { promise->set_value(reply); });
        if (future.wait_for(timeout) != std::future_status::ready) return ZemError(ZemError::Kind::ConnectionInvalid);
        return future.get();
    }
    // The reply dictionary; a connection error fails the test and gives a null Value.
    Value replyTo(const Value& message) {
        Reply reply = roundTrip(message);
        EXPECT_TRUE(std::holds_alternative<Value>(reply)) << "connection error instead of a reply";
        return std::holds_alternative<Value>(reply) ? std::get<Value>(reply) : Value();
    }

    // The reply and the first descriptor it passed (invalid when none); a null reply on a connection error.
    std::pair<Value, UniqueFd> replyWithDescriptor(const Value& message) {
        using MessageReply = std::variant<ZemMessage, ZemError>;
        auto promise = std::make_shared<std::promise<MessageReply>>();
        auto future = promise->get_future();
        connection_->sendWithMessageReply(message, queue_,
                                          [promise](const MessageReply& reply) { promise->set_value(reply); });
        if (future.wait_for(std::chrono::seconds(20)) != std::future_status::ready) return {};
        MessageReply reply = future.get();
        const auto* received = std::get_if<ZemMessage>(&reply);
        if (received == nullptr) return {};
        UniqueFd descriptor(received->descriptorCount() > 0 ? fcntl(received->descriptor(0), F_DUPFD_CLOEXEC, 0) : -1);
        return {received->body(), std::move(descriptor)};
    }

    // Sends every message before waiting for any reply; the replies (or errors) in the order sent.
    std::vector<Reply> pipeline(const std::vector<Value>& messages) {
        std::vector<std::future<Reply>> futures;
        for (const Value& message : messages) {
            auto promise = std::make_shared<std::promise<Reply>>();
            futures.push_back(promise->get_future());
            connection_->sendWithReply(message, queue_, [promise](const Reply& reply) { promise->set_value(reply); });
        }
        std::vector<Reply> replies;
        for (std::future<Reply>& future : futures) {
            if (future.wait_for(std::chrono::seconds(10)) != std::future_status::ready)
                replies.emplace_back(ZemError(ZemError::Kind::ConnectionInvalid));
            else
                replies.push_back(future.get());
        }
        return replies;
    }

    // Sends `messages` as requests whose replies nobody waits for, then closes the connection.
    void sendAndHangUp(const std::vector<Value>& messages) {
        for (const Value& message : messages) connection_->sendWithReply(message, queue_, [](const Reply&) {});
        connection_->cancel();
    }

  private:
    EventLoop loop_;
    SerialQueue queue_;
    std::shared_ptr<ZemConnection> connection_;
};

inline const std::filesystem::path kExamples = std::filesystem::path(BEXIL_SOURCE_DIR) / "examples" / "bundles";
inline constexpr const char* kManagerEntitlement = "com.quorvel.private.bexil.manager";
inline constexpr uint64_t kAllVersions = 0x1, kAllInstances = 0x4, kSystemOnly = 0x8, kDiscoverAll = 0x200;
inline const std::filesystem::path kMatchClient = std::filesystem::path(BEXIL_BINARY_DIR) / "tests/bx_match_client";

// A reply's error code, 0 when it has none.
inline int64_t errorCode(const Value& reply) { return reply.get("errorcode").numberAsInt64().value_or(0); }
inline std::string errorText(const Value& reply) { return std::string(reply.get("error").stringView()); }

// A request of the current protocol version named `name`, with `fields` beside the envelope.
inline Value request(std::string_view name, std::vector<std::pair<std::string, Value>> fields = {}) {
    fields.emplace_back("request", Value::string(name));
    fields.emplace_back("version", Value::uint64(3));
    return Value::dictionary(std::move(fields));
}
inline Value pathsRequest(std::string_view name, const std::vector<std::string>& paths) {
    std::vector<Value> values;
    for (const std::string& path : paths) values.push_back(Value::string(path));
    return request(name, {{"paths", Value::array(std::move(values))}});
}

// A "match" request with the given rules (none: the key is absent) and flag word (0: the key is absent).
inline Value matchRequest(std::optional<Value> rules = std::nullopt, uint64_t flags = 0) {
    std::vector<std::pair<std::string, Value>> fields;
    if (rules) fields.emplace_back("rules", *rules);
    if (flags) fields.emplace_back("flags", Value::uint64(flags));
    return request("match", std::move(fields));
}
inline Value identifierRule(const std::string& identifier) {
    return Value::dictionary({{"RZExtensionIdentifier", Value::string(identifier)}});
}

using Ids = std::vector<std::string>;

// The identifiers of a discovery reply's forms, sorted.
inline Ids identifiers(const Value& reply) {
    Ids ids;
    for (const Value& form : reply.get("matches").items()) ids.emplace_back(form.get("identifier").stringView());
    std::sort(ids.begin(), ids.end());
    return ids;
}
// The forms of a discovery reply whose identifier is `identifier`.
inline std::vector<Value> formsOf(const Value& reply, const std::string& identifier) {
    std::vector<Value> forms;
    for (const Value& form : reply.get("matches").items())
        if (form.get("identifier").stringView() == identifier) forms.push_back(form);
    return forms;
}

// Sleeps past the next whole second, so what is registered next has a later (whole-second) registration time.
inline void sleepToNextSecond() {
    auto now = std::chrono::system_clock::now().time_since_epoch();
    std::this_thread::sleep_for(std::chrono::ceil<std::chrono::seconds>(now) + std::chrono::milliseconds(5) - now);
}

inline std::string slurp(const std::filesystem::path& path) {
    std::ifstream in(path);
    return std::string(std::istreambuf_iterator<char>(in), {});
}

struct Outcome {
    int status = -1;
    std::string out, err;
};

// A bubblewrap command line that runs a program in a private root made of the system's programs and libraries,
// `root` (read-write) and the build tree, all at their own paths, followed by the `more` arguments (further mounts);
// the process ids stay shared with the test, so clients outside talk to a daemon started this way as to any.
inline std::vector<std::string> privateRootLauncher(const std::filesystem::path& root,
                                                    const std::vector<std::string>& more) {
    std::vector<std::string> launcher = {"/usr/bin/bwrap", "--die-with-parent", "--proc", "/proc", "--dev", "/dev"};
    const std::string mounts[][3] = {{"--ro-bind", "/usr", "/usr"},
                                     {"--ro-bind", "/etc", "/etc"},
                                     {"--bind", root.string(), root.string()},
                                     {"--ro-bind", BEXIL_BINARY_DIR, BEXIL_BINARY_DIR},
                                     {"--symlink", "usr/lib", "/lib"},
                                     {"--symlink", "usr/lib64", "/lib64"},
                                     {"--symlink", "usr/bin", "/bin"},
                                     {"--symlink", "usr/sbin", "/sbin"}};
    for (const auto& mount : mounts) launcher.insert(launcher.end(), std::begin(mount), std::end(mount));
    launcher.insert(launcher.end(), more.begin(), more.end());
    return launcher;
}

// A private daemon (not started yet) with its own preferences directory exported to this process, so the tool
// and the daemon agree on it, plus the bundles, entitlements and requests most end-to-end tests need.
class DaemonTest : public ::testing::Test {
  protected:
    DaemonTest() {
        std::filesystem::create_directories(preferences());
        setenv("BX_PREFERENCES_DIR", preferences().c_str(), 1);
        bxd_.exportEnvironment();
    }

    std::filesystem::path preferences() const { return bxd_.root() / "preferences"; }
    std::filesystem::path document() const { return bxd_.root() / "annotations.vrec"; }

    // Copies the named example bundles into bundles/ under the daemon's root (made canonical).
    void copyExamples(std::initializer_list<const char*> names) {
        std::filesystem::create_directories(bxd_.root() / "bundles");
        bundles_ = std::filesystem::canonical(bxd_.root() / "bundles");
        for (const char* name : names)
            std::filesystem::copy(kExamples / name, bundles_ / name, std::filesystem::copy_options::recursive);
    }
    std::string plugIn(const std::string& relative) const { return (bundles_ / relative).string(); }

    bool start(std::vector<std::string> arguments = {}) {
        arguments.insert(arguments.begin(), {"-d", document().string()});
        return bxd_.start(arguments);
    }

    // Expects the daemon to log `text` within five seconds.
    void expectLog(const std::string& text) const {
        EXPECT_TRUE(bxd_.waitForLog(text)) << "no log line with: " << text << "\n" << bxd_.log();
    }

    // Sends `message` on a new connection, expects a reply without error and returns it.
    Value succeed(const Value& message) const {
        Value reply = TestClient().replyTo(message);
        EXPECT_EQ(errorCode(reply), 0) << errorText(reply) << "\n" << bxd_.log();
        EXPECT_FALSE(reply.contains("error")) << reply.description();
        return reply;
    }
    void add(const std::vector<std::string>& paths) const { succeed(pathsRequest("add", paths)); }

    // Sends `message` on a new connection and expects the failure `code` with `text`, and no other key.
    void expectFailure(const Value& message, int64_t code, const std::string& text) {
        Value reply = TestClient().replyTo(message);
        EXPECT_EQ(errorCode(reply), code) << text;
        EXPECT_EQ(errorText(reply), text);
        EXPECT_EQ(reply.count(), 2u) << reply.description();
    }

    // The UUID under which the daemon's registry holds the bundle at `path`, read from its store.
    std::optional<Uuid> registeredUuid(const std::string& path) const {
        LedgerixWorkspace::Options options;
        options.stateDirectory = bxd_.root() / "state";
        auto registry = LedgerixWorkspace::open(options);
        if (!registry) {
            ADD_FAILURE() << registry.error().description();
            return std::nullopt;
        }
        auto proxy = (*registry)->plugInProxyForURL(path);
        return proxy ? proxy->pluginUUID() : std::nullopt;
    }

    // Gives `executable` entitlements through the daemon's trusted entitlements directory; they are read when a
    // client connects.
    void grant(const std::filesystem::path& executable, const Value& entitlements, const std::string& name = "self") {
        std::filesystem::path file = bxd_.entitlementsDir() / (name + ".vrec");
        ASSERT_FALSE(Document::writeFileAtomically(
            file,
            Value::dictionary({{"Executable", Value::string(executable.string())}, {"Entitlements", entitlements}})));
        ASSERT_EQ(chmod(file.c_str(), 0644), 0);
    }
    void grantSelf(const Value& entitlements) { grant(std::filesystem::canonical("/proc/self/exe"), entitlements); }
    void grantSelfManager() { grantSelf(Value::dictionary({{kManagerEntitlement, Value::boolean(true)}})); }

    // Runs a shell command line with this process's environment; standard output and error are kept apart.
    Outcome shell(const std::string& command) const {
        std::filesystem::path out = bxd_.root() / "out.txt", err = bxd_.root() / "err.txt";
        int raw = std::system((command + " >'" + out.string() + "' 2>'" + err.string() + "'").c_str());
        return {WIFEXITED(raw) ? WEXITSTATUS(raw) : -1, slurp(out), slurp(err)};
    }
    Outcome bexil(const std::string& arguments) const {
        return shell("timeout 60 '" BEXIL_BINARY_DIR "/tools/bexil/bexil' " + arguments);
    }

    BxdProcess bxd_;
    std::filesystem::path bundles_;
};

}  // namespace bexil::test
