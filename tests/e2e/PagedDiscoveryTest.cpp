// Paged discovery through the real daemon: a "match" with a page size walks the plug-ins by identifier and hands
// out a continuation per page. The pages put together must be the unpaged answer, whatever the page size and
// whatever changes between pages, and a continuation works only on the connection, rules and run it came from. An
// unpaged "match" is made in steps too, and must still answer one state, as if made in one go.

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <fstream>
#include <optional>
#include <set>
#include <sstream>
#include <string_view>
#include <thread>

#include "E2eSupport.h"
#include "client/BXDaemonClient.h"
#include "client/BXDaemonClientSync.h"
#include "platform/zem/ZemFrame.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;
using namespace test;

// The nice value of the thread of process `pid` named `name`, from /proc; none when there is no such thread.
std::optional<int> niceOfThread(pid_t pid, std::string_view name) {
    const fs::path tasks = fs::path("/proc") / std::to_string(pid) / "task";
    std::error_code ignored;
    for (const fs::directory_entry& task : fs::directory_iterator(tasks, ignored)) {
        std::ifstream comm(task.path() / "comm");
        std::string threadName;
        if (!std::getline(comm, threadName) || threadName != name) continue;
        std::ifstream stat(task.path() / "stat");
        std::string line;
        std::getline(stat, line);
        // The fields after the parenthesised name start with the state (the third); the nice value is the 19th.
        std::istringstream fields(line.substr(line.rfind(')') + 2));
        std::string field;
        for (int i = 3; i < 19; ++i) fields >> field;
        int nice;
        if (fields >> nice) return nice;
    }
    return std::nullopt;
}

Value str(std::string_view s) { return Value::string(s); }

class PagedDiscoveryTest : public DaemonTest {
  protected:
    void SetUp() override {
        fs::create_directories(bxd_.root() / "bundles");
        bundles_ = fs::canonical(bxd_.root() / "bundles");
    }

    // Writes a plug-in bundle inside Paged.app and returns its path.
    std::string writePlugIn(const std::string& name, const std::string& identifier, const std::string& version) {
        fs::path app = bundles_ / "Paged.app";
        if (!fs::exists(app / "Info.vrec")) {
            fs::create_directories(app / "PlugIns");
            std::ofstream(app / "Info.vrec") << Document::write(Value::dictionary({
                                                                    {"BDBundleIdentifier", str("com.example.paged")},
                                                                    {"BDBundleVersion", str("1")},
                                                                }))
                                                    .value();
        }
        fs::path bundle = app / "PlugIns" / (name + ".bxplugin");
        fs::create_directories(bundle);
        Value attributes = Value::dictionary({{"RZExtensionVersion", str(version)}});
        std::ofstream(bundle / "Info.vrec")
            << Document::write(Value::dictionary({
                                   {"BDBundleIdentifier", str(identifier)},
                                   {"BDBundleVersion", str(version)},
                                   {"RZExtension", Value::dictionary({
                                                       {"RZExtensionPointIdentifier", str(kPoint)},
                                                       {"RZExtensionProtocol", str("#Data")},
                                                       {"PrincipalClass", str("PagedPrincipal")},
                                                       {"RZExtensionAttributes", attributes},
                                                   })},
                               }))
                   .value();
        return bundle.string();
    }

    // Starts bxd with 20 plug-ins: p00..p16 once each, and three versions of p09 (one identifier group of 3).
    void startWithPlugIns() {
        ASSERT_TRUE(start()) << bxd_.log();
        std::vector<std::string> paths;
        for (int i = 0; i < 17; ++i) paths.push_back(writePlugIn(name(i), identifier(i), "1"));
        paths.push_back(writePlugIn("p09v2", identifier(9), "2"));
        paths.push_back(writePlugIn("p09v3", identifier(9), "3"));
        add(paths);
    }
    // Registers `count` plug-ins of one version each, PREFIX000, PREFIX001... in identifier order, and returns the
    // UUIDs that an unpaged match then finds.
    std::multiset<std::string> registerNumbered(const std::string& prefix, int count) {
        std::vector<std::string> paths;
        for (int i = 0; i < count; ++i) {
            std::string number = std::to_string(1000 + i).substr(1);
            paths.push_back(writePlugIn(prefix + number, "com.example.paged." + prefix + number, "1"));
        }
        add(paths);
        return unpaged();
    }
    // Starts bxd with discovery steps of 1 us (about one candidate each) and makes this process a manager.
    void startInStepsOfOneMicrosecond() { startInSteps("1"); }
    void startInSteps(const char* microseconds) {
        setenv("BX_PAGE_STEP_MICROSECONDS", microseconds, 1);
        const bool started = start();
        unsetenv("BX_PAGE_STEP_MICROSECONDS");
        ASSERT_TRUE(started) << bxd_.log();
        grantSelfManager();
    }
    static std::string name(int i) { return (i < 10 ? "p0" : "p") + std::to_string(i); }
    static std::string identifier(int i) { return "com.example.paged." + name(i); }

    static Value pageRequest(Value pageSize, std::optional<Value> continuation = std::nullopt, uint64_t flags = 0,
                             std::string_view point = kPoint) {
        std::vector<std::pair<std::string, Value>> fields{
            {"rules", Value::dictionary({{"RZExtensionPointIdentifier", str(point)}})}, {"pagesize", pageSize}};
        if (flags) fields.emplace_back("flags", Value::uint64(flags));
        if (continuation) fields.emplace_back("continuation", *continuation);
        return request("match", std::move(fields));
    }

    // Walks every page of `size` on one connection; `between` runs after each page but the last.
    std::vector<Value> walk(uint64_t size, uint64_t flags = 0, const std::function<void()>& between = nullptr) {
        TestClient client;
        std::vector<Value> pages;
        std::optional<Value> continuation;
        do {
            Value reply = client.replyTo(pageRequest(Value::uint64(size), continuation, flags));
            EXPECT_EQ(errorCode(reply), 0) << errorText(reply);
            pages.push_back(reply);
            continuation = reply.contains("continuation") ? std::optional(reply.get("continuation")) : std::nullopt;
            if (continuation && between) between();
        } while (continuation && pages.size() < 100);
        return pages;
    }

    static std::vector<std::string> uuidsOf(const std::vector<Value>& replies) {
        std::vector<std::string> uuids;
        for (const Value& reply : replies)
            for (const Value& form : reply.get("matches").items()) uuids.emplace_back(form.get("uuid").stringView());
        return uuids;
    }
    std::multiset<std::string> unpaged(uint64_t flags = 0) {
        std::vector<std::pair<std::string, Value>> fields{
            {"rules", Value::dictionary({{"RZExtensionPointIdentifier", str(kPoint)}})}};
        if (flags) fields.emplace_back("flags", Value::uint64(flags));
        std::vector<std::string> uuids = uuidsOf({succeed(request("match", std::move(fields)))});
        return {uuids.begin(), uuids.end()};
    }

    static constexpr std::string_view kPoint = "com.example.paged.point";
};

// Guards the paging contract: whatever the page size, the pages put together are the unpaged answer (the best
// version of p09 once; with all versions, its three forms in one page even when pages hold one form), no page
// holds more than asked unless one identifier alone has more, only the last page lacks a continuation, and the
// client library's match() puts the pages together into the same answer.
TEST_F(PagedDiscoveryTest, PagesOfAnySizeMakeUpTheUnpagedAnswerWithoutSplittingAnIdentifier) {
    startWithPlugIns();
    for (uint64_t flags : {uint64_t{0}, kAllVersions}) {
        std::multiset<std::string> whole = unpaged(flags);
        ASSERT_EQ(whole.size(), flags ? 19u : 17u);
        for (uint64_t size : {1u, 7u, 1000u}) {
            std::vector<Value> pages = walk(size, flags);
            std::vector<std::string> uuids = uuidsOf(pages);
            EXPECT_EQ(std::multiset<std::string>(uuids.begin(), uuids.end()), whole) << "pages of " << size;
            // Pages end by count alone here (plus possibly an empty last one): one ended early costs a round trip.
            const size_t full = size == 1 ? 17u : size == 7 ? 3u : 1u;
            EXPECT_GE(pages.size(), full) << "pages of " << size;
            EXPECT_LE(pages.size(), full + 1) << "pages of " << size;
            std::set<std::string> seenIdentifiers;
            for (const Value& page : pages) {
                std::set<std::string> identifiers;
                for (const Value& form : page.get("matches").items())
                    identifiers.emplace(form.get("identifier").stringView());
                EXPECT_TRUE(page.get("matches").count() <= size || identifiers.size() == 1) << page.description();
                EXPECT_TRUE(page.get("matches").count() > 0 || !page.contains("continuation"));
                for (const std::string& id : identifiers) EXPECT_TRUE(seenIdentifiers.insert(id).second) << id;
            }
        }
    }
    // What DaemonClient::match runs, with pages of 2 and progress after each page but the last.
    BXDaemonClient client;
    std::vector<size_t> progress;
    std::optional<BXDaemonClient::Reply> reply = sendAndWait([&](auto done) {
        client.matchAllPagesReply(
            Value::dictionary({{"RZExtensionPointIdentifier", str(kPoint)}}), kAllVersions, 2,
            [&](size_t forms) { progress.push_back(forms); }, done);
    });
    ASSERT_TRUE(reply && std::holds_alternative<Value>(*reply));
    const Value& whole = std::get<Value>(*reply);
    std::vector<std::string> uuids = uuidsOf({whole});
    EXPECT_EQ(std::multiset<std::string>(uuids.begin(), uuids.end()), unpaged(kAllVersions));
    EXPECT_FALSE(whole.contains("continuation"));
    EXPECT_GE(progress.size(), 8u) << "pages of 2 over 17 identifiers, one of them of 3 forms";
}

// Guards the position being an identifier, not an offset: after the first page, a registration before the position
// is not served, one after it is, a plug-in removed before its turn is not, and an annotation change repeats
// nothing. Every plug-in visible both before and after the walk is served exactly once.
TEST_F(PagedDiscoveryTest, ChangesBetweenPagesNeitherSkipNorRepeatPlugInsThatStayed) {
    startWithPlugIns();
    grantSelfManager();
    std::multiset<std::string> before = unpaged();
    bool changed = false;
    std::vector<Value> pages = walk(5, 0, [&] {
        if (std::exchange(changed, true)) return;
        add({writePlugIn("early", "com.example.paged.a-early", "1"), writePlugIn("late", "com.example.paged.z", "1")});
        succeed(pathsRequest("remove", {plugIn("Paged.app/PlugIns/p15.bxplugin")}));
        std::optional<Uuid> p02 = registeredUuid(plugIn("Paged.app/PlugIns/p02.bxplugin"));
        std::optional<Uuid> p12 = registeredUuid(plugIn("Paged.app/PlugIns/p12.bxplugin"));
        ASSERT_TRUE(p02 && p12);
        succeed(request("annotate", {{"uuids", Value::array({Value::uuid(*p02), Value::uuid(*p12)})},
                                     {"annotations", Value::dictionary({{"election", Value::int64(1)}})}}));
    });
    std::multiset<std::string> after = unpaged();
    std::vector<std::string> served = uuidsOf(pages);
    std::multiset<std::string> servedSet(served.begin(), served.end());
    for (const std::string& uuid : before)
        if (after.count(uuid)) {
            EXPECT_EQ(servedSet.count(uuid), 1u) << uuid;
        }
    auto servedPath = [&](const std::string& path) {
        std::optional<Uuid> uuid = registeredUuid(path);
        return uuid && servedSet.count(uuid->string()) > 0;
    };
    EXPECT_FALSE(servedPath(plugIn("Paged.app/PlugIns/early.bxplugin"))) << "registered behind the position";
    EXPECT_TRUE(servedPath(plugIn("Paged.app/PlugIns/late.bxplugin"))) << "registered ahead of the position";
    EXPECT_EQ(served.size(), before.size()) << "one removed ahead, one added ahead";
}

// Guards a page made in steps with other clients' requests served in between: with steps of 1 us (about one
// candidate each), while another client annotates plug-ins and registers and removes others, every walk serves each
// plug-in that stays registered exactly once, serves nothing twice, and the stretch a step was in when a change
// came is read again rather than offered as it was.
TEST_F(PagedDiscoveryTest, ChangesBetweenStepsOfAPageNeitherSkipNorRepeatPlugInsThatStayed) {
    ASSERT_NO_FATAL_FAILURE(startInStepsOfOneMicrosecond());
    std::multiset<std::string> stable = registerNumbered("s", 120);
    ASSERT_EQ(stable.size(), 120u);
    // Registered and removed in turn; their identifiers sort among the stable ones.
    std::vector<std::string> churn;
    for (int i = 0; i < 4; ++i)
        churn.push_back(writePlugIn("c" + std::to_string(i),
                                    "com.example.paged.s" + std::to_string(1005 + 30 * i).substr(1) + "c", "1"));
    std::vector<Value> stableUuids;
    for (const std::string& uuid : stable) stableUuids.push_back(Value::uuid(*Uuid::parse(uuid)));

    std::atomic<unsigned> changes{0};
    // A jthread, so that a failed assertion below still stops and joins it.
    std::jthread changer([&](std::stop_token stopping) {
        for (unsigned round = 0; !stopping.stop_requested(); ++round) {
            const std::string& path = churn[round % churn.size()];
            succeed(pathsRequest("add", {path}));
            succeed(request("annotate", {{"uuids", Value::array({stableUuids[round % stableUuids.size()]})},
                                         {"annotations", Value::dictionary({{"election", Value::int64(round % 2)}})}}));
            succeed(pathsRequest("remove", {path}));
            changes.fetch_add(3);
        }
    });
    unsigned walks = 0;
    const auto giveUp = std::chrono::steady_clock::now() + std::chrono::seconds(30);
    for (; (walks < 5 || changes.load() < 60) && std::chrono::steady_clock::now() < giveUp; ++walks) {
        std::vector<Value> pages = walk(1000);
        ASSERT_FALSE(pages.empty());
        std::vector<std::string> served = uuidsOf(pages);
        std::multiset<std::string> servedSet(served.begin(), served.end());
        for (const std::string& uuid : servedSet) ASSERT_EQ(servedSet.count(uuid), 1u) << "served twice: " << uuid;
        for (const std::string& uuid : stable) ASSERT_EQ(servedSet.count(uuid), 1u) << "skipped: " << uuid;
    }
    changer.request_stop();
    changer.join();
    EXPECT_GE(changes.load(), 60u) << "the changes did not come while pages were made (" << walks << " walks)";

    // Clients that hang up right after asking for a page (before or while it is made) leave the daemon serving.
    std::vector<uint8_t> frame;
    ASSERT_FALSE(ZemFrame::encode(ZemFrameKind::Request, 1, 0, pageRequest(Value::uint64(1000)), frame));
    for (int i = 0; i < 3; ++i) RawSocket(bxd_.socketPath()).write(frame);
    std::vector<std::string> served = uuidsOf(walk(1000));
    EXPECT_EQ(std::multiset<std::string>(served.begin(), served.end()), stable);
}

// Guards the cut by size: with annotations of 70 KB on 130 plug-ins, a page asked for 200 forms ends before the
// identifier that would take it past 8 MiB (so the array's count shrinks below 128 and takes a byte less), the
// client decodes it, and the pages together still serve every plug-in once.
TEST_F(PagedDiscoveryTest, APageEndsBeforeTheFormThatWouldTakeItPastItsByteLimit) {
    ASSERT_TRUE(start()) << bxd_.log();
    grantSelfManager();
    std::multiset<std::string> all = registerNumbered("b", 130);
    ASSERT_EQ(all.size(), 130u);
    const Value large = Value::dictionary({{"notes", str(std::string(70 * 1024, 'n'))}});
    std::vector<std::pair<std::string, Value>> annotations;
    for (const std::string& uuid : all) annotations.emplace_back(uuid, large);
    succeed(request("bulk-annotate", {{"annotations", Value::dictionary(std::move(annotations))}}));

    std::vector<Value> pages = walk(200);
    ASSERT_GE(pages.size(), 2u);
    const size_t first = pages[0].get("matches").count();
    EXPECT_GT(first, 100u);
    EXPECT_LT(first, 128u) << "8 MiB holds about 118 forms of 70 KB";
    std::vector<std::string> served = uuidsOf(pages);
    EXPECT_EQ(std::multiset<std::string>(served.begin(), served.end()), all);
    expectLog("more would exceed 8388608 bytes (page::kMaxBytes)");
}

// Guards the continuation's binding: another connection, other rules, an altered or truncated one and one from
// before a restart are refused with code 19 and their own message, and the daemon goes on serving.
TEST_F(PagedDiscoveryTest, ContinuationsWorkOnlyOnTheirConnectionRulesAndRun) {
    startWithPlugIns();
    TestClient owner;
    Value first = owner.replyTo(pageRequest(Value::uint64(4)));
    ASSERT_TRUE(first.get("continuation").isData()) << first.description();
    Value continuation = first.get("continuation");
    std::span<const uint8_t> bytes = continuation.dataBytes();

    const std::string foreign = "continuation not issued to this connection for these rules and flags";
    auto refused = [](TestClient& client, const Value& message, const std::string& text) {
        Value reply = client.replyTo(message);
        EXPECT_EQ(errorCode(reply), 19) << reply.description();
        EXPECT_EQ(errorText(reply), text);
        EXPECT_FALSE(reply.contains("matches"));
    };
    TestClient other;
    refused(other, pageRequest(Value::uint64(4), continuation), foreign);
    refused(owner, pageRequest(Value::uint64(4), continuation, kAllVersions), foreign);
    refused(owner, pageRequest(Value::uint64(4), continuation, 0, "com.example.other"), foreign);
    std::vector<uint8_t> altered(bytes.begin(), bytes.end());
    altered[12] ^= 1;  // a byte of the position
    refused(owner, pageRequest(Value::uint64(4), Value::data(altered)), foreign);
    std::vector<uint8_t> truncated(bytes.begin(), bytes.end() - 1);
    refused(owner, pageRequest(Value::uint64(4), Value::data(std::move(truncated))), "malformed continuation");
    refused(owner, pageRequest(Value::uint64(4), Value::data(std::vector<uint8_t>{})), "malformed continuation");
    // The page size may change from page to page; the continuation still works where it belongs.
    Value next = owner.replyTo(pageRequest(Value::uint64(100), continuation));
    EXPECT_EQ(errorCode(next), 0) << errorText(next);
    EXPECT_GT(next.get("matches").count(), 0u);

    bxd_.stop();
    ASSERT_TRUE(start()) << bxd_.log();
    TestClient afterRestart;
    refused(afterRestart, pageRequest(Value::uint64(4), continuation),
            "continuation expired: bxd restarted since it was issued; start again");
}

// Guards the page size's bounds: zero, negative, of another kind, a continuation without a page size or of the
// wrong kind are invalid requests; a huge page size is served as the largest, logged.
TEST_F(PagedDiscoveryTest, BadPageSizesAreRefusedAndHugeOnesServedAsTheLargest) {
    startWithPlugIns();
    const std::string badSize = "invalid request format (page size must be a positive integer)";
    for (const Value& size : {Value::uint64(0), Value::int64(0), Value::int64(-3), str("7"), Value::real(7.0),
                              Value::boolean(true), Value::array({Value::uint64(7)})})
        expectFailure(pageRequest(size), 4, badSize);
    expectFailure(request("match", {{"continuation", Value::data(std::vector<uint8_t>{1})}}), 4,
                  "invalid request format (continuation without page size)");
    expectFailure(pageRequest(Value::uint64(3), str("abc")), 4, "invalid request format (continuation must be data)");

    EXPECT_EQ(uuidsOf(walk(UINT64_MAX)).size(), 17u);
    expectLog("serving 10000 (page::kMaxForms)");
    size_t five = succeed(pageRequest(Value::int64(5))).get("matches").count();
    EXPECT_TRUE(five > 0 && five <= 5) << "a positive int64 is a size";
}

// Guards an unpaged "match" made in steps: with steps of 1 us, a match of everything (read a stretch at a time,
// offered a candidate per step) answers what a match of the one extension point (read at once and offered in one
// step) does: the same forms in the same order, three versions of one identifier registered stretches apart
// competing as they would in one go, with and without all versions.
TEST_F(PagedDiscoveryTest, AnUnpagedMatchMadeInStepsAnswersWhatOneGoDoes) {
    ASSERT_NO_FATAL_FAILURE(startInStepsOfOneMicrosecond());
    add({writePlugIn("d1", "com.example.paged.dup", "1")});
    registerNumbered("a", 50);
    add({writePlugIn("d3", "com.example.paged.dup", "3")});
    registerNumbered("b", 50);
    add({writePlugIn("d2", "com.example.paged.dup", "2")});
    for (uint64_t flags : {uint64_t{0}, kAllVersions}) {
        auto match = [&](const Value& rules) {
            return succeed(request("match", {{"rules", rules}, {"flags", Value::uint64(flags)}})).get("matches");
        };
        const Value everything = match(Value::emptyDictionary());
        const Value onThePoint = match(Value::dictionary({{"RZExtensionPointIdentifier", str(kPoint)}}));
        ASSERT_EQ(everything.count(), flags ? 103u : 101u);
        EXPECT_TRUE(everything == onThePoint) << "flags " << flags;
        std::vector<std::string> versions;
        for (const Value& form : everything.items())
            if (form.get("identifier").stringView() == "com.example.paged.dup")
                versions.emplace_back(form.get("version").stringView());
        const std::vector<std::string> expected =
            flags ? std::vector<std::string>{"1", "3", "2"} : std::vector<std::string>{"3"};
        EXPECT_EQ(versions, expected);
    }
    // The steps have a thread of their own, ten steps of nice value below the one that reads requests.
    const std::optional<int> requestNice = niceOfThread(bxd_.pid(), "bxd");
    ASSERT_TRUE(requestNice);
    EXPECT_EQ(niceOfThread(bxd_.pid(), "bulk"), std::min(*requestNice + 10, 19));
}

// Guards the one state of an unpaged "match" made in steps: while another client sets the same annotation on every
// plug-in in one bulk change after another and registers and removes one more, every reply serves each plug-in
// once, all with the annotation of one bulk change, and the daemon says that it started matches again.
TEST_F(PagedDiscoveryTest, AnUnpagedMatchMadeInStepsAnswersOneStateWhileThePlugInsChange) {
    ASSERT_NO_FATAL_FAILURE(startInStepsOfOneMicrosecond());
    std::multiset<std::string> stable = registerNumbered("s", 100);
    ASSERT_EQ(stable.size(), 100u);
    const std::string churn = writePlugIn("c", "com.example.paged.c", "1");

    // Steps of one candidate, then steps that read several stretches each, the changes landing while one is read.
    for (const char* step : {"1", "300"}) {
        SCOPED_TRACE(std::string("steps of ") + step + " us");
        if (std::string_view(step) != "1") {
            bxd_.stop();
            ASSERT_NO_FATAL_FAILURE(startInSteps(step));
        }
        std::atomic<unsigned> changes{0};
        std::jthread changer([&](std::stop_token stopping) {
            for (int64_t round = 1; !stopping.stop_requested(); ++round) {
                std::vector<std::pair<std::string, Value>> annotations;
                for (const std::string& uuid : stable)
                    annotations.emplace_back(uuid, Value::dictionary({{"round", Value::int64(round)}}));
                succeed(request("bulk-annotate", {{"annotations", Value::dictionary(std::move(annotations))}}));
                succeed(pathsRequest(round % 2 ? "add" : "remove", {churn}));
                changes.fetch_add(2);
            }
        });
        unsigned matches = 0;
        const auto giveUp = std::chrono::steady_clock::now() + std::chrono::seconds(30);
        for (; (matches < 5 || changes.load() < 40) && std::chrono::steady_clock::now() < giveUp; ++matches) {
            Value reply = succeed(request("match", {{"rules", Value::emptyDictionary()}}));
            std::multiset<std::string> served;
            std::set<int64_t> rounds;
            for (const Value& form : reply.get("matches").items()) {
                std::string uuid(form.get("uuid").stringView());
                if (stable.count(uuid) == 0) continue;
                served.insert(uuid);
                rounds.insert(form.get("annotations").get("extension").get("round").getInt64().value_or(0));
            }
            ASSERT_EQ(served, stable);
            ASSERT_EQ(rounds.size(), 1u) << "forms of " << rounds.size() << " bulk changes in one reply";
        }
        changer.request_stop();
        changer.join();
        EXPECT_GE(changes.load(), 40u) << "the changes did not come while matches were made (" << matches << ")";
        expectLog("started again");
    }
}

// Guards the tool on more plug-ins than one default page: `bexil add` registers them in batches and `bexil match`
// pages through all of them, both silent on standard error when it is not a terminal.
TEST_F(PagedDiscoveryTest, TheToolRegistersAndDiscoversMoreThanAPage) {
    ASSERT_TRUE(start()) << bxd_.log();
    std::string paths;
    const int count = static_cast<int>(protocol::page::kDefaultForms) + 44;
    for (int i = 0; i < count; ++i)
        paths += " '" + writePlugIn("t" + std::to_string(i), "com.example.t" + std::to_string(i), "1") + "'";
    Outcome added = bexil("add" + paths);
    EXPECT_EQ(added.status, 0) << added.err;
    EXPECT_EQ(added.err, "");
    Outcome matched = bexil("--json match RZExtensionPointIdentifier=" + std::string(kPoint));
    EXPECT_EQ(matched.status, 0) << matched.err;
    EXPECT_EQ(matched.err, "");
    size_t forms = 0;
    for (size_t at = matched.out.find("\"uuid\""); at != std::string::npos; at = matched.out.find("\"uuid\"", at + 1))
        ++forms;
    EXPECT_EQ(forms, static_cast<size_t>(count));
    EXPECT_GE(bxd_.countInLog("match returned"), 2u) << "more than one page";
}

}  // namespace
}  // namespace bexil
