// The generation must never go back: these cases restart the store over what a crash, a lost or damaged file, a
// restored backup or a failing disk leaves behind, with a clock the test controls. The change feed's folding is
// what "changes" answers, so its cases are the sequences a client could be caught in the middle of.

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <fstream>

#include "TestSupport.h"
#include "daemon/ChangeFeed.h"
#include "daemon/GenerationStore.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;

class GenerationStoreTest : public ::testing::Test {
  protected:
    GenerationStore store(FileSystem& fileSystem = posixFileSystem(), uint64_t block = 16) {
        return GenerationStore(
            file_, [this] { return clock_; }, fileSystem, block);
    }
    void writeFile(const std::string& text) { std::ofstream(file_, std::ios::binary) << text; }
    std::string readFile() {
        std::ifstream in(file_, std::ios::binary);
        return std::string(std::istreambuf_iterator<char>(in), {});
    }

    test::TempDir dir_{"bexil-generation"};
    fs::path file_ = dir_ / "generation";
    uint64_t clock_ = 1000;
};

TEST_F(GenerationStoreTest, RestartsAboveEverythingHandedOutEvenAfterACrashMidBlock) {
    uint64_t last = 0;
    {
        GenerationStore first = store();
        last = first.start();
        EXPECT_EQ(last, 1001u) << "one past the clock floor on a first start";
        // A crash at any point leaves the mark ahead of whatever was handed out.
        for (int i = 0; i < 40; ++i) {
            first.reserveThrough(++last);
            EXPECT_GE(GenerationStore::parse(readFile()).value_or(0), last);
        }
    }
    // The clock stood still (or went back): the mark alone must carry the next run above.
    clock_ = 500;
    GenerationStore second = store();
    EXPECT_GT(second.start(), last);
}

TEST_F(GenerationStoreTest, ReservesInBlocksNotPerGeneration) {
    test::FailingFileSystem counting("none", 0);
    GenerationStore reserving = store(counting, 100);
    uint64_t first = reserving.start();
    EXPECT_EQ(reserving.mark(), first + 99);
    std::string before = readFile();
    for (uint64_t g = first + 1; g <= first + 99; ++g) reserving.reserveThrough(g);
    EXPECT_EQ(readFile(), before) << "within the block nothing is written";
    reserving.reserveThrough(first + 100);
    EXPECT_EQ(reserving.mark(), first + 199);
}

TEST_F(GenerationStoreTest, ACorruptOrForeignFileFallsBackToTheClockAndIsRewritten) {
    for (std::string text : {std::string("garbage"), std::string("bexil generation mark 1\n12x\n"),
                             std::string("bexil generation mark 1\n99999999999999999999999\n"),
                             std::string("bexil generation mark 1\n0042\n"), std::string("bexil generation mark 1\n5"),
                             std::string("bexil generation mark 2\n5\n"), std::string(4096, '7'), std::string()}) {
        writeFile(text);
        clock_ += 10;
        GenerationStore damaged = store();
        EXPECT_EQ(damaged.start(), clock_ + 1) << text;
        EXPECT_TRUE(GenerationStore::parse(readFile())) << "rewritten after: " << text;
    }
}

TEST_F(GenerationStoreTest, ARestoredOlderFileNeverTakesGenerationsBack) {
    uint64_t handedOut = 0;
    std::string backup;
    {
        GenerationStore early = store();
        early.start();
        backup = readFile();
    }
    clock_ = 5000;
    {
        GenerationStore later = store();
        handedOut = later.start();
        for (int i = 0; i < 100; ++i) later.reserveThrough(++handedOut);
    }
    // The state directory comes back from the early backup; time has moved on meanwhile.
    writeFile(backup);
    clock_ = 6000;
    GenerationStore restored = store();
    EXPECT_GT(restored.start(), handedOut);
}

TEST_F(GenerationStoreTest, AnUnwritableFolderLogsAndCarriesOnAndTriesAgain) {
    test::FailingFileSystem full("open", ENOSPC);
    GenerationStore failing = store(full, 4);
    uint64_t first = failing.start();
    EXPECT_EQ(first, 1001u);
    EXPECT_TRUE(failing.failing());
    EXPECT_FALSE(fs::exists(file_));
    failing.reserveThrough(first + 1);
    failing.reserveThrough(first + 2);
    full.heal();
    failing.reserveThrough(first + 3);
    EXPECT_FALSE(failing.failing());
    EXPECT_EQ(GenerationStore::parse(readFile()), first + 6);
}

TEST_F(GenerationStoreTest, AFolderThatDoesNotExistStillStartsFromTheClock) {
    GenerationStore nowhere(dir_ / "missing" / "generation", [this] { return clock_; });
    EXPECT_EQ(nowhere.start(), 1001u);
    EXPECT_TRUE(nowhere.failing());
    GenerationStore none(std::nullopt, [this] { return clock_; });
    EXPECT_EQ(none.start(), 1001u);
    EXPECT_FALSE(none.failing());
}

TEST_F(GenerationStoreTest, TheTopOfTheRangeSaturatesInsteadOfWrapping) {
    writeFile(GenerationStore::format(UINT64_MAX));
    GenerationStore top = store();
    EXPECT_EQ(top.start(), UINT64_MAX);
    top.reserveThrough(UINT64_MAX);
    EXPECT_EQ(GenerationStore::parse(readFile()), UINT64_MAX);
}

// ---- The feed ----

Uuid uuidOf(uint8_t n) {
    std::array<uint8_t, 16> bytes{};
    bytes[15] = n;
    return Uuid(bytes);
}

using Kind = Change::Kind;
using Effect = ChangeFeed::PlugInChange::Effect;

TEST(ChangeFeedTest, EachChangeIsOneGenerationSeenByObserversInOrder) {
    ChangeFeed feed;
    std::vector<uint64_t> seen;
    uint64_t token = feed.subscribe([&](const Change& change) { seen.push_back(change.generation); });
    // An observer that unsubscribes itself while running is not called again, nor are the others disturbed.
    uint64_t once = 0;
    once = feed.subscribe([&](const Change&) { feed.unsubscribe(once); });
    EXPECT_EQ(feed.publish(Kind::Registered, {uuidOf(1)}, {"a"}), 1u);
    EXPECT_EQ(feed.publish(Kind::Annotated, {uuidOf(1)}, {"a"}), 2u);
    feed.note(Kind::HoldPlaced, {uuidOf(1)}, {"a"});
    feed.note(Kind::HoldReleased, {uuidOf(1)}, {"a"});
    EXPECT_EQ(feed.current(), 2u) << "noted changes wait for publishPending";
    feed.publishPending();
    EXPECT_EQ(feed.current(), 4u);
    feed.unsubscribe(token);
    feed.publish(Kind::ExclusionsChanged, {}, {});
    EXPECT_EQ(seen, (std::vector<uint64_t>{1, 2, 3, 4}));
}

TEST(ChangeFeedTest, FoldsEachPlugInsChangesByWhetherItWasThereBeforeAndAfter) {
    ChangeFeed feed;
    feed.publish(Kind::Registered, {uuidOf(1)}, {"stays"});
    const uint64_t since = feed.current();
    feed.publish(Kind::Registered, {uuidOf(2)}, {"new"});
    feed.publish(Kind::Annotated, {uuidOf(1), uuidOf(2)}, {"stays", "new"});
    feed.publish(Kind::Registered, {uuidOf(3)}, {"brief"});
    feed.publish(Kind::HoldPlaced, {uuidOf(1)}, {"stays"});
    feed.publish(Kind::Unregistered, {uuidOf(3)}, {"brief"});
    feed.publish(Kind::Unregistered, {uuidOf(1)}, {"stays"});
    feed.publish(Kind::Registered, {uuidOf(1)}, {"stays"});  // the same build registered again
    feed.publish(Kind::HoldReleased, {uuidOf(4)}, {"old"});

    ChangeFeed::Since answer = feed.changesSince(since);
    ASSERT_EQ(answer.outcome, ChangeFeed::Since::Outcome::Answered);
    ASSERT_EQ(answer.plugIns.size(), 3u) << "one that came and went is not listed";
    EXPECT_EQ(answer.plugIns[0].uuid, uuidOf(2));
    EXPECT_EQ(answer.plugIns[0].effect, Effect::Added);
    EXPECT_EQ(answer.plugIns[1].uuid, uuidOf(1));
    EXPECT_EQ(answer.plugIns[1].effect, Effect::Changed);
    EXPECT_EQ(answer.plugIns[1].kinds,
              (std::vector<Kind>{Kind::Annotated, Kind::HoldPlaced, Kind::Unregistered, Kind::Registered}));
    EXPECT_EQ(answer.plugIns[1].generation, since + 7);
    EXPECT_EQ(answer.plugIns[2].uuid, uuidOf(4));
    EXPECT_EQ(answer.plugIns[2].effect, Effect::Changed);
    EXPECT_FALSE(answer.exclusions);

    feed.publish(Kind::Unregistered, {uuidOf(2)}, {"new"});
    feed.publish(Kind::ExclusionsChanged, {}, {});
    answer = feed.changesSince(since + 1);
    EXPECT_EQ(answer.exclusions, feed.current());
    for (const ChangeFeed::PlugInChange& change : answer.plugIns)
        if (change.uuid == uuidOf(2)) {
            EXPECT_EQ(change.effect, Effect::Removed);
        }

    EXPECT_TRUE(feed.changesSince(feed.current()).plugIns.empty());
    EXPECT_EQ(feed.changesSince(feed.current() + 1).outcome, ChangeFeed::Since::Outcome::Ahead);
}

TEST(ChangeFeedTest, TheWindowDropsTheOldestAndAnswersTooOldBeforeIt) {
    ChangeFeed feed(nullptr, std::nullopt, 4);
    for (uint8_t n = 1; n <= 10; ++n) feed.publish(Kind::Annotated, {uuidOf(n)}, {"x"});
    EXPECT_EQ(feed.oldestAnswerable(), 6u);
    EXPECT_EQ(feed.changesSince(5).outcome, ChangeFeed::Since::Outcome::TooOld);
    ChangeFeed::Since edge = feed.changesSince(6);
    ASSERT_EQ(edge.outcome, ChangeFeed::Since::Outcome::Answered);
    ASSERT_EQ(edge.plugIns.size(), 4u);
    EXPECT_EQ(edge.plugIns.front().uuid, uuidOf(7));
}

TEST(ChangeFeedTest, AStoredFeedStartsAboveTheLastRunAndAnswersItsGenerationsTooOld) {
    test::TempDir dir("bexil-feed");
    uint64_t clock = 50;
    uint64_t lastRun = 0;
    {
        ChangeFeed feed(std::make_unique<GenerationStore>(dir / "generation", [&] { return clock; }));
        for (int i = 0; i < 5; ++i) lastRun = feed.publish(Kind::HoldPlaced, {uuidOf(1)}, {"x"});
    }
    ChangeFeed next(std::make_unique<GenerationStore>(dir / "generation", [&] { return clock; }));
    EXPECT_GT(next.current(), lastRun);
    EXPECT_EQ(next.changesSince(lastRun).outcome, ChangeFeed::Since::Outcome::TooOld);
    EXPECT_EQ(next.changesSince(next.current()).outcome, ChangeFeed::Since::Outcome::Answered);
}

}  // namespace
}  // namespace bexil
