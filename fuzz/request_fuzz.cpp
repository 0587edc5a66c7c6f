// Whole requests through the daemon: a server over private directories, with the example bundles registered, gets
// each input as the messages of one fresh client connection and handles them exactly as it handles a real
// client's, from the connection's event handler through the request queue to the reply. Only the connection is
// made up: it records what the daemon sends instead of writing it to a socket.
//
// An input is one mode byte and one Zem-encoded value: an array of up to kMaxMessages messages, or a single one.
// Mode bit 0 makes the client one whose identity cannot be established (no entitlements); otherwise it is this
// very process, which the entitlements directory makes a manager. Mode bit 1 sends the messages one-way, which the
// daemon answers all the same (the connection drops those replies). What exists only at run time is named by
// placeholders: a string or key "@N" (decimal) is the UUID text of the N-th registered plug-in, any other "@rest"
// is the path <examples copy>/rest, and a UUID whose first twelve bytes are zero is the UUID of the registered
// plug-in its last byte counts to.
//
// With BEXIL_FUZZ_PRINT set in the environment every request is printed with its reply, to see what an input does.
//
// Whatever the messages: every dictionary is answered exactly once (the client stays connected throughout), with
// a dictionary the connection can encode; nothing else is answered; the daemon logs no fault and lets no
// exception escape; the only one-way messages are well-formed ones of its watches; and once the connection has
// ended, no hold or watch of the client is left.

#include <openssl/crypto.h>
#include <stdlib.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <map>
#include <memory>
#include <mutex>
#include <set>
#include <span>
#include <string>
#include <vector>

#include "FuzzLog.h"
#include "base/Document.h"
#include "base/EventLoop.h"
#include "base/Pidfd.h"
#include "base/SerialQueue.h"
#include "bexil/Protocol.h"
#include "daemon/BXDPlugInHold.h"
#include "daemon/BXDServer.h"
#include "daemon/BXDZemClient.h"
#include "platform/ledgerix/LXApplicationWorkspace.h"
#include "platform/ledgerix/LXBexilProxy.h"
#include "platform/zem/ZemCodec.h"
#include "platform/zem/ZemConnection.h"
#include "platform/zem/ZemFrame.h"

namespace {

using namespace bexil;
namespace fs = std::filesystem;

constexpr size_t kMaxMessages = 8;
// Long enough for a loaded machine under the sanitizers; every request here completes in milliseconds.
constexpr auto kReplyTimeout = std::chrono::seconds(20);

[[noreturn]] void fail(const std::string& what) {
    std::fprintf(stderr, "request_fuzz: %s\n", what.c_str());
    std::abort();
}

// A connection whose peer is the fuzzer: events are handed to the client's handler on a queue of the server's loop,
// as a socket connection does, and what the daemon sends is checked and kept.
class FuzzConnection final : public ZemConnection {
  public:
    FuzzConnection(const SerialQueue& sibling, ZemPeerCredentials credentials)
        : queue_("fuzz-connection", sibling), credentials_(std::move(credentials)) {}

    void setEventHandler(EventHandler handler) override { handler_ = std::move(handler); }
    void setContext(std::shared_ptr<void> context) override { context_ = std::move(context); }
    std::shared_ptr<void> context() const override { return context_; }
    void setFinalizer(Finalizer finalizer) override { finalizer_ = std::move(finalizer); }
    void resume() override {}
    void suspend() override {}
    void cancel() override { fail("the daemon cancelled a client's connection"); }

    // The only one-way messages bxd sends a client are its watches': each names its watch and what it is.
    void send(const Value& message) override {
        const std::string* event = message.get(protocol::key::kEvent).getString();
        if (!message.get(protocol::key::kWatch).getUInt64() || !message.get(protocol::key::kGeneration).getUInt64() ||
            event == nullptr || (*event != protocol::watch::kUpdate && *event != protocol::watch::kResync))
            fail("the daemon sent a one-way message that is no watch's: " + message.description());
        if (Result<size_t> size = ZemCodec::encodedSize(message); !size || *size > ZemFrame::kMaxPayloadBytes)
            fail("a watch message cannot be sent in a frame");
    }
    void sendReply(const ZemMessage& request, const Value& reply) override { record(request, reply, 0); }
    void sendReplyWithDescriptors(const ZemMessage& request, const Value& reply,
                                  std::vector<UniqueFd> descriptors) override {
        record(request, reply, descriptors.size());
    }
    void sendWithReply(const Value&, SerialQueue&, ReplyHandler) override {
        fail("the daemon sent a request to a client");
    }
    void sendWithMessageReply(const Value&, SerialQueue&, MessageReplyHandler) override {
        fail("the daemon sent a request to a client");
    }

    pid_t peerPid() const override { return credentials_.pid; }
    uid_t peerUid() const override { return credentials_.uid; }
    gid_t peerGid() const override { return credentials_.gid; }
    bool peerHasHungUp() const override { return false; }
    // What the daemon sends is recorded at once: nothing ever waits to be written.
    size_t queuedBytes() const override { return 0; }
    const ZemPeerCredentials& peerCredentials() const override { return credentials_; }
    const std::string& serviceName() const override { return serviceName_; }
    std::string description() const override { return "<fuzz connection>"; }

    // Hands an event to the client on the connection's queue, after the events before it.
    void deliver(ZemConnection::Event event) {
        queue_.async([this, event = std::move(event)] { handler_(event); });
    }
    // Waits until every block queued on the connection's queue so far has run.
    void drain() {
        queue_.sync([] {});
    }
    // The end of the connection as the client sees it: the connection-invalid event, then the finalizer lets go
    // of the client.
    void close() {
        deliver(ZemError(ZemError::Kind::ConnectionInvalid));
        queue_.sync([this] {
            if (finalizer_) finalizer_(std::move(context_));
            context_.reset();
            handler_ = nullptr;
        });
    }

    // Waits until `count` replies have come, or the timeout has passed; returns the replies per serial.
    std::map<uint64_t, int> awaitReplies(size_t count) {
        std::unique_lock lock(mutex_);
        replied_.wait_for(lock, kReplyTimeout, [&] { return replies_ >= count; });
        return perSerial_;
    }

  private:
    void record(const ZemMessage& request, const Value& reply, size_t descriptors) {
        if (!reply.isDictionary()) fail("a reply is not a dictionary: " + reply.description());
        // The socket connection encodes the reply into a frame; one that cannot be encoded would never arrive.
        if (Result<size_t> size = ZemCodec::encodedSize(reply); !size)
            fail("a reply cannot be encoded (" + size.error().description() + "): " + reply.description());
        else if (*size > ZemFrame::kMaxPayloadBytes)
            fail("a reply exceeds the frame limit");
        if (descriptors > ZemFrame::kMaxDescriptorsPerFrame) fail("a reply carries too many descriptors");
        if (const Value* code = reply.find(protocol::key::kErrorCode); code && !code->getUInt64())
            fail("an error code is not an unsigned number: " + reply.description());
        if (const Value* error = reply.find(protocol::key::kError); error && !error->isString())
            fail("an error message is not a string: " + reply.description());
        if (std::getenv("BEXIL_FUZZ_PRINT"))
            std::fprintf(stderr, "#%llu %s\n  -> %s\n", static_cast<unsigned long long>(request.serial()),
                         request.description().c_str(), reply.description().c_str());
        std::lock_guard lock(mutex_);
        ++perSerial_[request.serial()];
        ++replies_;
        replied_.notify_all();
    }

    SerialQueue queue_;
    ZemPeerCredentials credentials_;
    const std::string serviceName_ = std::string(protocol::kServiceName);
    EventHandler handler_;
    std::shared_ptr<void> context_;
    Finalizer finalizer_;
    std::mutex mutex_;
    std::condition_variable replied_;
    std::map<uint64_t, int> perSerial_;
    size_t replies_ = 0;
};

void uncaughtException(std::string_view queueLabel, std::exception_ptr exception) {
    fail("a block on queue " + std::string(queueLabel) + " threw: " + exceptionMessage(exception));
}

// The server, its directories and the bundles every input starts from. Built on first use; torn down at exit in
// order (server, then loop, then files).
struct World {
    fs::path root;
    fs::path bundles;
    std::string executable;
    std::unique_ptr<EventLoop> loop;
    std::unique_ptr<BXDServer> server;
    std::unique_ptr<fuzz::LogCheck> logCheck;
    // The bundles registered at the start of every input, by real path.
    std::set<std::string> baseline;
    // The registered plug-ins' UUIDs, in the order of their paths: what the placeholders count through.
    std::vector<Uuid> plugIns;

    World() {
        std::string dir = (fs::temp_directory_path() / "bexil-request-fuzz-XXXXXX").string();
        if (::mkdtemp(dir.data()) == nullptr) fail("cannot make a temporary directory");
        root = fs::canonical(dir);
        for (const char* sub : {"service", "state", "runtime", "entitlements", "preferences"})
            fs::create_directories(root / sub);
        setenv("BX_SERVICE_DIR", (root / "service").c_str(), 1);
        setenv("BX_STATE_DIR", (root / "state").c_str(), 1);
        setenv("BX_RUNTIME_DIR", (root / "runtime").c_str(), 1);
        setenv("BX_ENTITLEMENTS_DIR", (root / "entitlements").c_str(), 1);
        setenv("BX_PREFERENCES_DIR", (root / "preferences").c_str(), 1);
        // "launch" gets as far as starting the sandbox and no further: nothing is ever started.
        setenv("BX_BWRAP", (root / "no-bubblewrap").c_str(), 1);

        logCheck = std::make_unique<fuzz::LogCheck>();
        EventLoop::setUncaughtExceptionHandler(uncaughtException);

        // This process is the entitled client: the trusted directory makes its executable a manager.
        executable = fs::canonical("/proc/self/exe").string();
        Result<std::string> entitlements = Document::write(Value::dictionary(
            {{"Executable", Value::string(executable)},
             {"Entitlements",
              Value::dictionary({{std::string(protocol::kManagerEntitlement), Value::boolean(true)}})}}));
        if (!entitlements) fail("cannot write the entitlements document");
        std::ofstream(root / "entitlements" / "request-fuzz.vrec") << *entitlements;
        fs::permissions(root / "entitlements" / "request-fuzz.vrec", fs::perms(0644));

        bundles = root / "bundles";
        fs::copy(fs::path(BEXIL_SOURCE_DIR) / "examples" / "bundles", bundles, fs::copy_options::recursive);

        // In bxd the loop runs on the main thread, so the crypto library (token signing) first loads its
        // configuration there. Here the loop has a thread of its own; loaded on that thread, the configuration
        // leaves state behind that is still allocated at exit and reported as a leak.
        OPENSSL_init_crypto(OPENSSL_INIT_LOAD_CONFIG, nullptr);
        loop = std::make_unique<EventLoop>(1);
        server =
            BXDServer::initForServiceDatabase("com.example.request-fuzz", (root / "annotations.vrec").c_str(), *loop);
        if (!server) fail("cannot build the server");

        // Every plug-in bundle of the examples that the registry takes is part of the baseline.
        for (const auto& entry : fs::recursive_directory_iterator(bundles)) {
            std::string extension = entry.path().extension().string();
            if (!entry.is_directory() || (extension != ".bxplugin" && extension != ".wexa")) continue;
            if (!server->addPlugIn(entry.path().string())) baseline.insert(entry.path().string());
        }
        if (baseline.empty()) fail("no example bundle could be registered");
    }

    ~World() {
        server.reset();
        loop.reset();
        logCheck.reset();
        std::error_code ignored;
        fs::remove_all(root, ignored);
    }

    LXProxyList installed() const {
        std::optional<LXProxyList> list = server->workspace()->installedPlugins();
        if (!list) fail("the registry cannot list its plug-ins");
        return *list;
    }

    // Undoes what earlier inputs registered or removed, and lists the plug-ins for the placeholders (anew each
    // time: a bundle removed and added again has a new UUID).
    void restoreBaseline() {
        LXProxyList list = installed();
        bool changed = false;
        std::set<std::string> present;
        for (const auto& proxy : list) {
            if (!proxy->bundleURL()) continue;
            present.insert(*proxy->bundleURL());
            if (!baseline.count(*proxy->bundleURL())) {
                server->removePlugIn(*proxy->bundleURL());
                changed = true;
            }
        }
        for (const std::string& path : baseline) {
            if (present.count(path)) continue;
            if (server->addPlugIn(path)) fail("a baseline bundle cannot be registered again");
            changed = true;
        }
        if (changed) list = installed();
        std::vector<std::pair<std::string, Uuid>> byPath;
        for (const auto& proxy : list)
            if (proxy->bundleURL() && proxy->pluginUUID())
                byPath.emplace_back(*proxy->bundleURL(), *proxy->pluginUUID());
        std::sort(byPath.begin(), byPath.end());
        plugIns.clear();
        for (const auto& [path, uuid] : byPath) plugIns.push_back(uuid);
        if (plugIns.empty()) fail("no plug-in is registered");
    }

    std::string resolveText(const std::string& text) const {
        if (text.empty() || text[0] != '@') return text;
        std::string rest = text.substr(1);
        if (!rest.empty() && rest.size() <= 3 &&
            std::all_of(rest.begin(), rest.end(), [](char c) { return c >= '0' && c <= '9'; }))
            return plugIns[std::stoul(rest) % plugIns.size()].string();
        return (bundles / rest).string();
    }

    Value resolve(const Value& value) const {
        if (const std::string* text = value.getString()) return Value::string(resolveText(*text));
        if (const Uuid* uuid = value.getUuid()) {
            const auto& bytes = uuid->bytes();
            if (std::all_of(bytes.begin(), bytes.begin() + 12, [](uint8_t b) { return b == 0; }))
                return Value::uuid(plugIns[bytes[15] % plugIns.size()]);
            return value;
        }
        if (value.isArray()) {
            MutableArray array;
            for (const Value& item : value.items()) array.append(resolve(item));
            return array.take();
        }
        if (value.isDictionary()) {
            MutableDictionary dictionary;
            for (const DictionaryEntry& entry : value.entries())
                dictionary.set(resolveText(entry.key), resolve(entry.value));
            return dictionary.take();
        }
        return value;
    }

    ZemPeerCredentials credentials(bool identified) const {
        ZemPeerCredentials credentials;
        credentials.pid = getpid();
        credentials.uid = getuid();
        credentials.gid = getgid();
        if (identified) {
            int pidfd = pidfdOpen(getpid());
            if (pidfd < 0) fail("cannot open a pidfd of this process");
            credentials.pidfd = std::make_shared<const UniqueFd>(pidfd);
        } else {
            credentials.failure = "the fuzzer made these credentials up";
        }
        return credentials;
    }
};

World& world() {
    static World instance;
    return instance;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    World& w = world();
    if (size == 0) return 0;
    const uint8_t mode = data[0];
    Result<Value> decoded = ZemCodec::decode(std::span<const uint8_t>(data + 1, size - 1));
    if (!decoded) return 0;
    w.restoreBaseline();

    std::vector<Value> messages;
    if (decoded->isArray()) {
        for (const Value& item : decoded->items()) {
            if (messages.size() == kMaxMessages) break;
            messages.push_back(w.resolve(item));
        }
    } else {
        messages.push_back(w.resolve(*decoded));
    }

    auto connection = std::make_shared<FuzzConnection>(w.server->zemQueue(), w.credentials(!(mode & 1)));
    // A new client is set up on the listener's queue, as an accepted connection is.
    w.server->zemQueue().sync([&] { BXDZemClient::initWithConnectionServer(connection, w.server.get()); });

    const bool oneWay = (mode & 2) != 0;
    size_t expected = 0;
    for (size_t i = 0; i < messages.size(); ++i) {
        if (messages[i].isDictionary()) ++expected;
        connection->deliver(ZemMessage(messages[i], i + 1, !oneWay));
    }
    connection->awaitReplies(expected);
    // Anything more the daemon sends would come from work still queued: once both queues are idle, the counts are
    // final.
    connection->drain();
    w.server->mainQueue().sync([] {});
    std::map<uint64_t, int> replies = connection->awaitReplies(expected);
    for (size_t i = 0; i < messages.size(); ++i) {
        int count = replies.count(i + 1) ? replies[i + 1] : 0;
        int wanted = messages[i].isDictionary() ? 1 : 0;
        if (count != wanted)
            fail("message #" + std::to_string(i + 1) + " was answered " + std::to_string(count) +
                 " times: " + messages[i].description());
    }

    connection->close();
    size_t holdsLeft = w.server->syncQueue().sync([&] { return w.server->holds().size(); });
    if (holdsLeft != 0) fail("holds outlive the client that placed them");
    if (BXDPlugInHold::openKeepAliveUnits() != 0) fail("keep-alive units outlive their holds");
    // The client's watches are released on the request queue, after its death was noted.
    size_t watchesLeft = 0;
    w.server->mainQueue().sync([&] {
        if (StandingQueries* queries = w.server->standingQueries()) watchesLeft = queries->count();
    });
    if (watchesLeft != 0) fail("watches outlive the client that made them");

    if (std::optional<std::string> fault = w.logCheck->takeFault()) fail("the daemon logged a fault: " + *fault);
    return 0;
}
