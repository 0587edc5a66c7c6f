// Standing queries through the real daemon: a watcher's view (the result it started with and every message applied
// since) must equal what a fresh "match" of the same rules by the same client answers, after any change; the limits
// on watches refuse with their code, a watcher that stops reading gets one resync and costs the daemon nothing more,
// and a watch ends with its unwatch or its connection. The watchers use the client library's routing
// (BXDaemonWatches, the machinery behind DaemonClient::watch).

#include <gtest/gtest.h>
#include <signal.h>
#include <spawn.h>

#include <cstdlib>
#include <fstream>
#include <map>
#include <mutex>
#include <random>
#include <set>

#include "E2eSupport.h"
#include "client/BXDaemonClient.h"
#include "client/BXDaemonClientSync.h"
#include "client/BXDaemonWatches.h"

extern char** environ;

namespace bexil {
namespace {

namespace fs = std::filesystem;
using namespace test;

Value str(std::string_view s) { return Value::string(s); }

constexpr std::string_view kPointA = "com.example.watch.a";
constexpr std::string_view kPointB = "com.example.watch.b";

// One watcher: its own connection, the watch's callbacks and the view they keep.
class Watcher {
  public:
    Watcher(const Value& rules, uint64_t flags) : rules_(rules), flags_(flags), client_(nullptr), watches_(client_) {}

    // Starts the watch and waits for its first result; false when it did not come.
    bool start() {
        DaemonClient::WatchCallbacks callbacks;
        callbacks.result = [this](const std::vector<Value>& forms, uint64_t generation) {
            std::lock_guard lock(mutex_);
            view_.clear();
            for (const Value& form : forms) view_[std::string(form.get("uuid").stringView())] = form;
            generation_ = generation;
            ++results_;
        };
        callbacks.change = [this](const DaemonClient::WatchChange& change) {
            std::lock_guard lock(mutex_);
            for (const std::string& uuid : change.removed) {
                if (view_.erase(uuid) == 0) problems_.push_back("removed but not held: " + uuid);
            }
            for (const Value& form : change.added) {
                std::string uuid(form.get("uuid").stringView());
                if (!view_.emplace(uuid, form).second) problems_.push_back("added but held already: " + uuid);
            }
            for (const Value& form : change.changed) {
                std::string uuid(form.get("uuid").stringView());
                auto held = view_.find(uuid);
                if (held == view_.end())
                    problems_.push_back("changed but not held: " + uuid);
                else if (held->second == form)
                    problems_.push_back("changed into the same form: " + uuid);
                view_[uuid] = form;
            }
            if (change.generation < generation_) problems_.push_back("generation went back");
            generation_ = change.generation;
            ++changes_;
        };
        callbacks.resync = [this](uint64_t) {
            std::lock_guard lock(mutex_);
            ++resyncs_;
        };
        callbacks.ended = [this](const Error& error) {
            std::lock_guard lock(mutex_);
            ended_ = error.localizedDescription().value_or(error.description());
        };
        handle_ = watches_.watch(rules_, flags_, std::move(callbacks));
        return handle_ && waitFor([this] { return results() > 0 || !ended().empty(); }) && ended().empty();
    }

    // A round trip on the watcher's connection: every message bxd sent it before has been handled when it returns.
    void sync() {
        auto reply = sendAndWait([&](BXDaemonClient::ReplyHandler done) { client_.statusReply(std::move(done)); },
                                 std::chrono::seconds(10));
        EXPECT_TRUE(reply && std::holds_alternative<Value>(*reply));
    }

    // What a "match" of the same rules and flags by the same client answers now, by UUID.
    std::map<std::string, Value> fresh() {
        std::map<std::string, Value> forms;
        auto reply = sendAndWait(
            [&](BXDaemonClient::ReplyHandler done) {
                client_.matchAllPagesReply(rules_, flags_, protocol::page::kDefaultForms, nullptr, std::move(done));
            },
            std::chrono::seconds(10));
        const Value* message = reply ? std::get_if<Value>(&*reply) : nullptr;
        EXPECT_TRUE(message != nullptr && errorCode(*message) == 0);
        if (message == nullptr) return forms;
        for (const Value& form : message->get("matches").items())
            forms[std::string(form.get("uuid").stringView())] = form;
        return forms;
    }

    std::map<std::string, Value> view() {
        std::lock_guard lock(mutex_);
        return view_;
    }
    std::vector<std::string> problems() {
        std::lock_guard lock(mutex_);
        return problems_;
    }
    size_t changes() {
        std::lock_guard lock(mutex_);
        return changes_;
    }
    size_t resyncs() {
        std::lock_guard lock(mutex_);
        return resyncs_;
    }
    size_t results() {
        std::lock_guard lock(mutex_);
        return results_;
    }
    std::string ended() {
        std::lock_guard lock(mutex_);
        return ended_;
    }
    BXDaemonClient& client() { return client_; }
    BXDaemonWatches& watches() { return watches_; }
    std::optional<uint64_t> handle() const { return handle_; }

    // Waits until `condition` holds; it is asked without the watcher's lock (it may call the getters above).
    static bool waitFor(const std::function<bool()>& condition, std::chrono::seconds limit = std::chrono::seconds(10)) {
        auto deadline = std::chrono::steady_clock::now() + limit;
        while (std::chrono::steady_clock::now() < deadline) {
            if (condition()) return true;
            std::this_thread::sleep_for(std::chrono::milliseconds(5));
        }
        return condition();
    }

  private:
    Value rules_;
    uint64_t flags_;
    BXDaemonClient client_;
    BXDaemonWatches watches_;
    std::optional<uint64_t> handle_;
    std::mutex mutex_;
    std::map<std::string, Value> view_;
    uint64_t generation_ = 0;
    size_t results_ = 0, changes_ = 0, resyncs_ = 0;
    std::vector<std::string> problems_;
    std::string ended_;
};

// How two views differ, in a line per UUID; empty when they are equal.
std::string difference(const std::map<std::string, Value>& view, const std::map<std::string, Value>& fresh) {
    std::string text;
    for (const auto& [uuid, form] : fresh) {
        auto held = view.find(uuid);
        if (held == view.end())
            text += "missing " + uuid + "\n";
        else if (!(held->second == form))
            text += "differs " + uuid + ": " + held->second.description() + " vs " + form.description() + "\n";
    }
    for (const auto& [uuid, form] : view)
        if (fresh.count(uuid) == 0) text += "extra " + uuid + "\n";
    return text;
}

class WatchTest : public DaemonTest {
  protected:
    void SetUp() override {
        fs::create_directories(bxd_.root() / "bundles");
        bundles_ = fs::canonical(bxd_.root() / "bundles");
        fs::path app = bundles_ / "Watch.app";
        fs::create_directories(app / "PlugIns");
        std::ofstream(app / "Info.vrec") << Document::write(Value::dictionary({
                                                                {"BDBundleIdentifier", str("com.example.watch")},
                                                                {"BDBundleVersion", str("1")},
                                                            }))
                                                .value();
    }

    // Writes a plug-in bundle inside Watch.app and returns its path.
    std::string writePlugIn(const std::string& name, const std::string& identifier, const std::string& version,
                            std::string_view point) {
        fs::path bundle = bundles_ / "Watch.app" / "PlugIns" / (name + ".bxplugin");
        fs::create_directories(bundle);
        std::ofstream(bundle / "Info.vrec")
            << Document::write(Value::dictionary({
                                   {"BDBundleIdentifier", str(identifier)},
                                   {"BDBundleVersion", str(version)},
                                   {"RZExtension", Value::dictionary({
                                                       {"RZExtensionPointIdentifier", str(point)},
                                                       {"RZExtensionProtocol", str("#Data")},
                                                       {"PrincipalClass", str("WatchPrincipal")},
                                                       {"RZExtensionAttributes",
                                                        Value::dictionary({{"RZExtensionVersion", str(version)}})},
                                                   })},
                               }))
                   .value();
        return bundle.string();
    }

    Value status() { return succeed(request("status")); }
    uint64_t watchCount() { return status().get("watchCount").getUInt64().value_or(999999); }

    Value watchRequest(const Value& rules, uint64_t flags = 0) {
        return request("watch", {{"rules", rules}, {"flags", Value::uint64(flags)}});
    }
};

// Guards the central promise: after every one of 200 random changes (registrations, unregistrations, annotations,
// holds placed and released, exclusions) each of three watchers with different rules and flags holds exactly what
// a fresh match of its rules answers it, form for form, having heard only messages that make sense (nothing removed
// that it did not hold, nothing added twice, generations that never go back).
TEST_F(WatchTest, EveryWatcherViewEqualsAFreshMatchAfterEachOf200RandomChanges) {
    const char* seedText = std::getenv("BX_WATCH_SEED");
    const unsigned seed = seedText != nullptr ? static_cast<unsigned>(std::strtoul(seedText, nullptr, 10))
                                              : static_cast<unsigned>(std::random_device{}());
    SCOPED_TRACE("seed " + std::to_string(seed) + " (set BX_WATCH_SEED to replay)");
    std::mt19937 random(seed);

    grantSelfManager();  // "remove" needs it
    ASSERT_TRUE(start()) << bxd_.log();
    // Six identifiers over two extension points; three of them with two versions, which compete.
    struct PlugIn {
        std::string path, identifier;
        bool registered = false;
    };
    std::vector<PlugIn> plugIns;
    for (int i = 0; i < 6; ++i) {
        std::string identifier = "com.example.watch.p" + std::to_string(i);
        std::string_view point = i % 2 == 0 ? kPointA : kPointB;
        plugIns.push_back({writePlugIn("p" + std::to_string(i), identifier, "1", point), identifier});
        if (i < 3) plugIns.push_back({writePlugIn("p" + std::to_string(i) + "v2", identifier, "2", point), identifier});
    }
    std::vector<std::string> initial;
    for (size_t i = 0; i < plugIns.size(); i += 2) {
        initial.push_back(plugIns[i].path);
        plugIns[i].registered = true;
    }
    add(initial);

    Watcher pointA(Value::dictionary({{"RZExtensionPointIdentifier", str(kPointA)}}), 0);
    Watcher allVersions(Value::emptyDictionary(), kAllVersions);
    Watcher oneIdentifier(identifierRule("com.example.watch.p1"), 0);
    std::vector<Watcher*> watchers{&pointA, &allVersions, &oneIdentifier};
    for (Watcher* watcher : watchers) ASSERT_TRUE(watcher->start()) << watcher->ended() << bxd_.log();

    TestClient holder;  // holds live as long as this connection
    std::vector<Value> holds;
    std::vector<std::string> exclusions;
    auto registered = [&] {
        std::vector<size_t> found;
        for (size_t i = 0; i < plugIns.size(); ++i)
            if (plugIns[i].registered) found.push_back(i);
        return found;
    };
    auto uuidOf = [&](const PlugIn& plugIn) { return registeredUuid(plugIn.path); };
    auto writeExclusions = [&] {
        fs::path file = bxd_.root() / "exclusions.json";
        std::string rules;
        for (const std::string& identifier : exclusions)
            rules += (rules.empty() ? "" : ", ") + std::string("{\"RZExtensionIdentifier\": \"") + identifier + "\"}";
        std::ofstream(file) << "{\"exclusions\": [" << rules << "]}";
        Outcome written = bexil("exclusions --set " + file.string());
        ASSERT_EQ(written.status, 0) << written.err;
    };

    for (int step = 0; step < 200; ++step) {
        std::string what;
        std::vector<size_t> present = registered();
        switch (random() % 6) {
            case 0: {  // register one that is not
                std::vector<size_t> absent;
                for (size_t i = 0; i < plugIns.size(); ++i)
                    if (!plugIns[i].registered) absent.push_back(i);
                if (absent.empty()) continue;
                PlugIn& chosen = plugIns[absent[random() % absent.size()]];
                add({chosen.path});
                chosen.registered = true;
                what = "add " + chosen.path;
                break;
            }
            case 1: {  // unregister one
                if (present.size() < 2) continue;
                PlugIn& chosen = plugIns[present[random() % present.size()]];
                succeed(pathsRequest("remove", {chosen.path}));
                chosen.registered = false;
                what = "remove " + chosen.path;
                break;
            }
            case 2:
            case 3: {  // annotate one: its election and an extension that shows in its form
                if (present.empty()) continue;
                PlugIn& chosen = plugIns[present[random() % present.size()]];
                std::optional<Uuid> uuid = uuidOf(chosen);
                ASSERT_TRUE(uuid);
                Value annotation =
                    Value::dictionary({{"election", Value::int64(static_cast<int64_t>(random() % 2))},
                                       {"extension", Value::dictionary({{"step", Value::int64(step)}})}});
                succeed(
                    request("annotate", {{"uuids", Value::array({Value::uuid(*uuid)})}, {"annotations", annotation}}));
                what = "annotate " + chosen.path;
                break;
            }
            case 4: {  // place a hold, or release one
                if (!holds.empty() && random() % 2 == 0) {
                    size_t at = random() % holds.size();
                    Value reply = holder.replyTo(request("lock", {{"uuids", Value::array({holds[at]})}}));
                    ASSERT_EQ(errorCode(reply), 0) << errorText(reply);
                    holds.erase(holds.begin() + static_cast<std::ptrdiff_t>(at));
                    what = "release a hold";
                } else {
                    if (present.empty()) continue;
                    PlugIn& chosen = plugIns[present[random() % present.size()]];
                    MutableDictionary lock(pathsRequest("lock", {chosen.path}));
                    lock.set("flags", Value::uint64(0x1));
                    Value reply = holder.replyTo(lock.take());
                    ASSERT_EQ(errorCode(reply), 0) << errorText(reply);
                    holds.push_back(reply.get("uuids"));
                    what = "hold " + chosen.path;
                }
                break;
            }
            case 5: {  // exclude an identifier, or lift an exclusion
                if (!exclusions.empty() && random() % 2 == 0) {
                    exclusions.erase(exclusions.begin() + static_cast<std::ptrdiff_t>(random() % exclusions.size()));
                    what = "lift an exclusion";
                } else {
                    exclusions.push_back(plugIns[random() % plugIns.size()].identifier);
                    what = "exclude " + exclusions.back();
                }
                writeExclusions();
                break;
            }
        }
        SCOPED_TRACE("step " + std::to_string(step) + ": " + what);
        for (Watcher* watcher : watchers) {
            watcher->sync();
            std::map<std::string, Value> fresh = watcher->fresh();
            std::string differs = difference(watcher->view(), fresh);
            ASSERT_TRUE(differs.empty()) << differs;
            ASSERT_TRUE(watcher->problems().empty()) << watcher->problems().front();
        }
    }
    for (Watcher* watcher : watchers) {
        EXPECT_GT(watcher->changes(), 0u) << "every watcher heard of some change";
        EXPECT_EQ(watcher->resyncs(), 0u);
        EXPECT_EQ(watcher->ended(), "");
    }
}

// Guards the limits on the number of watches: the 65th watch of one connection is refused with code 21 and its
// text, other connections still watch, "unwatch" frees a slot, and "status" counts the watches in force; a watch's
// request is checked as a match's is.
TEST_F(WatchTest, TheWatchesOfOneConnectionAreLimitedAndUnwatchFreesOne) {
    ASSERT_TRUE(start()) << bxd_.log();
    add({writePlugIn("p0", "com.example.watch.p0", "1", kPointA)});
    TestClient client;
    std::vector<Value> requests(protocol::watch::kMaxPerClient, watchRequest(Value::emptyDictionary()));
    std::vector<TestClient::Reply> replies = client.pipeline(requests);
    std::set<uint64_t> ids;
    for (const TestClient::Reply& reply : replies) {
        ASSERT_TRUE(std::holds_alternative<Value>(reply));
        const Value& message = std::get<Value>(reply);
        ASSERT_EQ(errorCode(message), 0) << errorText(message);
        ids.insert(message.get("watch").getUInt64().value_or(0));
        EXPECT_EQ(message.get("matches").count(), 1u);
        EXPECT_TRUE(message.get("generation").getUInt64().has_value());
    }
    EXPECT_EQ(ids.size(), protocol::watch::kMaxPerClient) << "every watch has its own id";
    EXPECT_EQ(watchCount(), protocol::watch::kMaxPerClient);

    Value refused = client.replyTo(watchRequest(Value::emptyDictionary()));
    EXPECT_EQ(errorCode(refused), 21);
    EXPECT_EQ(errorText(refused), "too many watches on this connection (at most 64)");
    expectLog("(watch::kMaxPerClient): watch refused");
    EXPECT_EQ(errorCode(TestClient().replyTo(watchRequest(Value::emptyDictionary()))), 0) << "another connection";

    // An id of this connection ends once; another connection's id is not this one's to end.
    Value unwatch = request("unwatch", {{"watch", Value::uint64(*ids.begin())}});
    EXPECT_EQ(errorCode(TestClient().replyTo(unwatch)), 4);
    EXPECT_EQ(errorCode(client.replyTo(unwatch)), 0);
    Value again = client.replyTo(unwatch);
    EXPECT_EQ(errorCode(again), 4);
    EXPECT_EQ(errorText(again), "no such watch on this connection");
    EXPECT_EQ(errorCode(client.replyTo(watchRequest(Value::emptyDictionary()))), 0) << "the slot is free again";

    expectFailure(request("unwatch", {{"watch", str("1")}}), 4, "invalid request format (watch id)");
    expectFailure(request("watch", {{"rules", str("not a dictionary")}}), 4,
                  "invalid request format (bad rules dictionary)");
    expectFailure(watchRequest(Value::emptyDictionary(), kDiscoverAll), 11,
                  "unauthorized discovery flag (BXDiscoverAll)");
}

// Guards the limit over all connections: past watch::kMaxTotal, any connection's watch is refused with code 21.
TEST_F(WatchTest, TheWatchesOfAllConnectionsTogetherAreLimited) {
    ASSERT_TRUE(start()) << bxd_.log();
    std::vector<std::unique_ptr<TestClient>> clients;
    const uint64_t perClient = protocol::watch::kMaxPerClient;
    for (uint64_t placed = 0; placed < protocol::watch::kMaxTotal; placed += perClient) {
        clients.push_back(std::make_unique<TestClient>());
        std::vector<Value> requests(std::min(perClient, protocol::watch::kMaxTotal - placed),
                                    watchRequest(identifierRule("com.example.none")));
        for (const TestClient::Reply& reply : clients.back()->pipeline(requests)) {
            ASSERT_TRUE(std::holds_alternative<Value>(reply));
            ASSERT_EQ(errorCode(std::get<Value>(reply)), 0) << errorText(std::get<Value>(reply));
        }
    }
    EXPECT_EQ(watchCount(), protocol::watch::kMaxTotal);
    Value refused = TestClient().replyTo(watchRequest(Value::emptyDictionary()));
    EXPECT_EQ(errorCode(refused), 21);
    EXPECT_EQ(errorText(refused), "too many watches in bxd (at most 4096)");
    expectLog("(watch::kMaxTotal)");
    // A connection that ends takes its watches with it.
    clients.pop_back();
    EXPECT_TRUE(bxd_.waitForLog("released 64 watches of client")) << bxd_.log();
    for (int i = 0; i < 100 && watchCount() != protocol::watch::kMaxTotal - perClient; ++i)
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    EXPECT_EQ(watchCount(), protocol::watch::kMaxTotal - perClient);
    EXPECT_EQ(errorCode(TestClient().replyTo(watchRequest(Value::emptyDictionary()))), 0);
}

// Guards what a watcher that stops reading costs: once more than watch::kMaxQueuedBytes wait unwritten towards it,
// its watch ends with one resync instead of the backlog; other watchers and clients are served meanwhile; when it
// reads again the library starts the watch afresh and its view is right again. An unwatched watch hears nothing
// more, and a connection that ends releases its watches.
TEST_F(WatchTest, ASlowWatcherGetsOneResyncAndOthersAreServed) {
    ASSERT_TRUE(start()) << bxd_.log();
    std::vector<std::string> paths;
    for (int i = 0; i < 4; ++i)
        paths.push_back(writePlugIn("p" + std::to_string(i), "com.example.watch.p" + std::to_string(i), "1", kPointA));
    add(paths);
    std::vector<Value> uuids;
    for (const std::string& path : paths) uuids.push_back(Value::uuid(*registeredUuid(path)));
    const Value rules = Value::dictionary({{"RZExtensionPointIdentifier", str(kPointA)}});

    Watcher slow(rules, 0), brisk(rules, 0), unwatched(rules, 0);
    ASSERT_TRUE(slow.start() && brisk.start() && unwatched.start()) << bxd_.log();
    std::atomic<bool> stopped{false};
    unwatched.watches().unwatch(*unwatched.handle(), [&](const BXDaemonClient::Reply&) { stopped = true; });
    ASSERT_TRUE(Watcher::waitFor([&] { return stopped.load(); }));
    slow.client().bxd()->suspend();

    // Each annotation puts about 4 x 96 KiB of forms into one message: a few of them pass the bound.
    std::string filler(96 * 1024, 'x');
    int annotations = 0;
    while (!bxd_.waitForLog("ends with a resync", std::chrono::milliseconds(1)) && annotations < 40) {
        Value annotation = Value::dictionary(
            {{"extension", Value::dictionary({{"filler", str(filler + std::to_string(annotations))}})}});
        succeed(request("annotate", {{"uuids", Value::array(std::vector<Value>(uuids))}, {"annotations", annotation}}));
        ++annotations;
    }
    expectLog("(watch::kMaxQueuedBytes): watch");
    EXPECT_LT(annotations, 40);
    // Served while the slow one lags: the brisk watcher is up to date, and other requests are answered.
    brisk.sync();
    EXPECT_EQ(difference(brisk.view(), brisk.fresh()), "");
    EXPECT_EQ(brisk.resyncs(), 0u);
    EXPECT_EQ(errorCode(status()), 0);
    EXPECT_EQ(watchCount(), 1u) << "the brisk watch only: the slow one ended, the other was unwatched";

    // Reading again, it gets the backlog queued before the bound, then the resync, then a fresh result.
    slow.client().bxd()->resume();
    EXPECT_TRUE(Watcher::waitFor([&] { return slow.resyncs() == 1 && slow.results() == 2; }, std::chrono::seconds(20)))
        << "the library watched again after the resync";
    EXPECT_EQ(slow.resyncs(), 1u);
    slow.sync();
    EXPECT_EQ(difference(slow.view(), slow.fresh()), "");
    EXPECT_EQ(unwatched.changes(), 0u) << "an unwatched watch hears nothing";
    EXPECT_EQ(watchCount(), 2u);
}

// Guards the tool's output when it is not a terminal: a whole result first ("G = N" and its "+" lines), then one
// line per change with its generation ("-" for a plug-in held out of the result, "+" when the hold is released,
// "~" for an annotated one); SIGINT ends it with status 0, and a daemon that goes away ends it with 69.
TEST_F(WatchTest, TheToolPrintsOneLinePerChangeWhenNotOnATerminal) {
    ASSERT_TRUE(start()) << bxd_.log();
    std::string hello = writePlugIn("hello", "com.example.watch.hello", "1", kPointA);
    std::string other = writePlugIn("other", "com.example.watch.other", "1", kPointB);
    add({hello, other});
    std::string uuid = registeredUuid(hello)->string();

    fs::path out = bxd_.root() / "watch.out", err = bxd_.root() / "watch.err";
    std::string command =
        "exec '" BEXIL_BINARY_DIR "/tools/bexil/bexil' watch RZExtensionPointIdentifier=" + std::string(kPointA) +
        " >'" + out.string() + "' 2>'" + err.string() + "'";
    auto run = [&]() -> pid_t {
        // Emptied here, not only by the shell's redirection: a wait that began before the new shell started would
        // otherwise count the previous run's lines.
        std::ofstream(out, std::ios::trunc);
        std::ofstream(err, std::ios::trunc);
        pid_t pid = 0;
        const char* argv[] = {"/bin/sh", "-c", command.c_str(), nullptr};
        EXPECT_EQ(posix_spawn(&pid, "/bin/sh", nullptr, nullptr, const_cast<char**>(argv), environ), 0);
        return pid;
    };
    // Waits until `text` is in the output `times` times.
    auto waitForText = [&](const std::string& text, size_t times = 1) {
        auto count = [&] {
            std::string all = slurp(out);
            size_t found = 0;
            for (size_t at = all.find(text); at != std::string::npos; at = all.find(text, at + 1)) ++found;
            return found;
        };
        for (int i = 0; i < 500 && count() < times; ++i) std::this_thread::sleep_for(std::chrono::milliseconds(10));
        if (count() >= times) return true;
        ADD_FAILURE() << "not " << times << " times \"" << text << "\" in:\n" << slurp(out) << slurp(err);
        return false;
    };
    pid_t tool = run();
    ASSERT_TRUE(waitForText(" + com.example.watch.hello 1 " + uuid + " " + hello + "\n"));
    EXPECT_NE(slurp(out).find(" = 1\n"), std::string::npos) << slurp(out);
    EXPECT_EQ(slurp(out).find("com.example.watch.other"), std::string::npos) << "another extension point";

    TestClient holder;
    MutableDictionary lock(pathsRequest("lock", {hello}));
    lock.set("flags", Value::uint64(0x1));
    Value held = holder.replyTo(lock.take());
    ASSERT_TRUE(waitForText(" - " + uuid + "\n"));
    holder.replyTo(request("lock", {{"uuids", Value::array({held.get("uuids")})}}));
    ASSERT_TRUE(waitForText(" + com.example.watch.hello 1 " + uuid + " " + hello + "\n", 2));
    succeed(request("annotate", {{"uuids", Value::array({Value::uuid(*Uuid::parse(uuid))})},
                                 {"annotations", Value::dictionary({{"election", Value::int64(1)}})}}));
    ASSERT_TRUE(waitForText(" ~ com.example.watch.hello 1 " + uuid));
    // Every line after the first result starts with a generation that never goes back.
    std::istringstream lines(slurp(out));
    std::string line;
    uint64_t last = 0;
    while (std::getline(lines, line)) {
        uint64_t generation = std::stoull(line.substr(0, line.find(' ')));
        EXPECT_GE(generation, last) << line;
        last = generation;
    }

    kill(tool, SIGINT);
    int status = 0;
    ASSERT_EQ(waitpid(tool, &status, 0), tool);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status << slurp(err);

    tool = run();
    ASSERT_TRUE(waitForText(" = 1\n"));
    bxd_.stop();
    ASSERT_EQ(waitpid(tool, &status, 0), tool);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 69) << status;
    EXPECT_NE(slurp(err).find("bexil: watch: the connection to bxd was lost"), std::string::npos) << slurp(err);
}

}  // namespace
}  // namespace bexil
