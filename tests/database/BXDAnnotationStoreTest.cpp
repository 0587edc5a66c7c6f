#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <filesystem>
#include <optional>
#include <random>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "CapturedLog.h"
#include "TestSupport.h"
#include "base/Document.h"
#include "database/BXDAnnotationStore.h"
#include "platform/log/CaptureSink.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;

using test::capturedLine;
using test::dict;
using test::FailingFileSystem;
Value integer(int64_t i) { return Value::int64(i); }
Value elected(int64_t election) { return dict({{"election", integer(election)}}); }

// A record that reads and writes annotations under a key of its own, as the daemon's plug-in records do.
struct KeyedRecord {
    std::string key;
    std::string annotationKey() const { return key; }
};

// A store at a private path, with a state directory of its own where the legacy document lives.
class AnnotationStoreTest : public ::testing::Test {
  protected:
    static Value document(Value data, int64_t version = 16) {
        return dict({{"version", integer(version)}, {"data", std::move(data)}});
    }
    static void put(const fs::path& path, const Value& root) { test::writeText(path, Document::write(root).value()); }
    static std::string text(const fs::path& path) { return test::readText(path); }
    // The document on disk, which must load.
    Value onDisk() const {
        Result<Value> root = Document::readFile(path_);
        EXPECT_TRUE(root.ok()) << root.error().description();
        return root.ok() ? *root : Value();
    }
    std::string store() const { return path_.string(); }

    test::TempDir tmp_{"bexil-annotation-store"};
    fs::path directory_ = tmp_.path();
    fs::path path_ = directory_ / "Bexil-Annotations";
    fs::path legacyPath_ = directory_ / "state" / "containers" / "com.quorvel.bxd" / "Bexil-Annotations";
    test::ScopedEnv stateDir_{"BX_STATE_DIR", (directory_ / "state").string()};
    log::CaptureSink capture_;
};

// ---- loading at start ----

// Guards the first start: no document is no error, nothing is written until a change, and what is saved loads back.
TEST_F(AnnotationStoreTest, MissingDocumentStartsEmptySilentlyWritesOnlyAtTheFirstChangeAndLoadsBack) {
    Value saved = dict({{"com.example.a", elected(1)}});
    {
        BXDAnnotationStore annotations(store());
        EXPECT_EQ(annotations.annotations(), Value::emptyDictionary());
        EXPECT_TRUE(capture_.entries().empty());
        EXPECT_FALSE(fs::exists(path_));
        annotations.setAnnotationForIdentifier(elected(1), "com.example.a");
    }
    EXPECT_EQ(onDisk(), document(saved));
    EXPECT_EQ(BXDAnnotationStore(store()).annotations(), saved);
}

// Guards an unusable document (another version, torn, of the wrong shape): it is logged as an error operators grep
// for, the map starts empty, the document is kept for inspection until something is written, and the store then
// serves and saves as usual.
TEST_F(AnnotationStoreTest, OtherVersionIsLoggedResetAndOverwrittenAtTheFirstChange) {
    const std::string good = Document::write(document(dict({{"a", elected(1)}}))).value();
    const std::string version = "Error Domain=Bexil Code=7 \"found database version ";
    const std::vector<std::pair<std::string, std::string>> cases = {
        {Document::write(document(dict({}), 15)).value(), version + "15 needed version 16\""},
        {good.substr(0, good.size() / 2), "Error Domain=BexilDocument"},
        {Document::write(dict({{"version", integer(16)}, {"data", Value::string("x")}})).value(),
         "root[\"data\"] is of type string, not a dictionary"},
    };
    for (const auto& [contents, expected] : cases) {
        SCOPED_TRACE(contents);
        test::writeText(path_, contents);
        capture_.clear();
        BXDAnnotationStore annotations(store());
        EXPECT_EQ(annotations.annotations(), Value::emptyDictionary());
        std::string line = capturedLine(capture_, "unable to load annotation database:");
        EXPECT_TRUE(line.starts_with("error ops: unable to load annotation database:" + store() + " error:")) << line;
        EXPECT_TRUE(line.ends_with(" (resetting)") && line.find(expected) != std::string::npos) << line;
        EXPECT_EQ(text(path_), contents);

        annotations.setAnnotationForIdentifier(elected(1), "b");
        EXPECT_EQ(onDisk(), document(dict({{"b", elected(1)}})));
    }
    // A version-16 document without "data" is an empty map, not a failure.
    put(path_, dict({{"version", integer(16)}}));
    capture_.clear();
    EXPECT_EQ(BXDAnnotationStore(store()).annotations(), Value::emptyDictionary());
    EXPECT_TRUE(capture_.entries().empty());
}

// ---- the legacy document (in the daemon's container under the state directory) ----

// Guards the upgrade from the old location: the legacy document is copied (never changed) only when the document is
// missing or bad and the legacy one has the current version; a good document always wins.
TEST_F(AnnotationStoreTest, LegacyDocumentIsMigratedOnlyWhenTheDocumentIsMissingOrBadAndItHasTheCurrentVersion) {
    put(legacyPath_, document(dict({{"legacy", Value::emptyDictionary()}}), 15));
    EXPECT_EQ(BXDAnnotationStore(store()).annotations(), Value::emptyDictionary());

    Value legacy = dict({{"com.example.old", dict({{"election", integer(1)}, {"keep", Value::string("me")}})}});
    put(legacyPath_, document(legacy));
    const std::string legacyText = text(legacyPath_);
    for (bool badDocument : {false, true}) {
        SCOPED_TRACE(badDocument ? "bad document" : "no document");
        if (badDocument) test::writeText(path_, "<vrec><dict>");
        if (!badDocument) fs::remove(path_);
        EXPECT_EQ(BXDAnnotationStore(store()).annotations(), legacy);
        EXPECT_EQ(onDisk(), document(legacy));
        EXPECT_EQ(text(legacyPath_), legacyText) << "the legacy document is only ever read";
    }

    Value current = dict({{"current", elected(1)}});
    put(path_, document(current));
    EXPECT_EQ(BXDAnnotationStore(store()).annotations(), current);
}

// ---- setting annotations ----

// Guards the merge clients rely on: setting merges one level deep into what is stored (a given "extension" replaces
// the stored one whole, unknown keys stay), an empty annotation changes nothing, null removes the whole entry, and
// records share the entry of their annotation key.
TEST_F(AnnotationStoreTest, SettingMergesOneLevelDeepAndNullRemovesTheWholeEntry) {
    put(path_, document(dict({{"p", dict({{"election", integer(1)},
                                          {"extension", dict({{"a", integer(1)}, {"b", integer(2)}})},
                                          {"unknown", Value::string("kept")}})},
                              {"odd", Value::string("not a dictionary")}})));
    BXDAnnotationStore annotations(store());
    KeyedRecord plugIn{"p"}, sameKey{"p"};

    annotations.setAnnotationForPlugIn(elected(2), plugIn);
    annotations.setAnnotationForPlugIn(dict({{"extension", dict({{"c", integer(3)}})}}), sameKey);
    annotations.setAnnotationForPlugIn(Value::emptyDictionary(), plugIn);
    Value expected =
        dict({{"election", integer(2)}, {"extension", dict({{"c", integer(3)}})}, {"unknown", Value::string("kept")}});
    EXPECT_EQ(annotations.annotationForPlugIn(plugIn), expected);
    EXPECT_EQ(onDisk().get("data").get("p"), expected);

    // An entry that is not a dictionary reads as none and survives other saves.
    EXPECT_TRUE(annotations.annotationForIdentifier("odd").isNull());
    EXPECT_EQ(onDisk().get("data").get("odd"), Value::string("not a dictionary"));

    // Null removes the whole entry, so setting after removal starts from nothing.
    annotations.setAnnotationForPlugIn(Value(), plugIn);
    annotations.setAnnotationForPlugIn(elected(3), sameKey);
    EXPECT_EQ(onDisk().get("data"), dict({{"odd", Value::string("not a dictionary")}, {"p", elected(3)}}));
}

// ---- failed writes ----

// Guards durability of a failed save: which step of the atomic replace fails is the document layer's concern (its
// tests fail each one); here any failure, also a value a document cannot hold, must keep the old document on disk
// and the change in memory until a later save succeeds.
TEST_F(AnnotationStoreTest, FailedSaveKeepsTheOldDocumentAndTheChangeInMemory) {
    put(path_, document(dict({{"a", elected(1)}})));
    const std::string before = text(path_);
    FailingFileSystem failing("write", EIO);
    BXDAnnotationStore annotations(store(), failing);

    annotations.setAnnotationForIdentifier(elected(2), "a");
    EXPECT_EQ(annotations.annotationForIdentifier("a"), elected(2));
    EXPECT_TRUE(annotations.diskBehind());
    EXPECT_EQ(text(path_), before);
    EXPECT_TRUE(capturedLine(capture_, "unable to save annotations:")
                    .starts_with("error ops: unable to save annotations:" + store() +
                                 " error:Error Domain=POSIX Code=" + std::to_string(EIO)))
        << capturedLine(capture_, "unable to save annotations:");

    failing.heal();
    // A value a document cannot hold fails every save until it is removed.
    Value withUuid = dict({{"extension", dict({{"id", Value::uuid(Uuid::random())}})}});
    annotations.setAnnotationForIdentifier(withUuid, "bad");
    annotations.setAnnotationForIdentifier(elected(1), "b");
    EXPECT_TRUE(annotations.diskBehind());
    EXPECT_EQ(text(path_), before);
    annotations.setAnnotationForIdentifier(Value(), "bad");
    EXPECT_FALSE(annotations.diskBehind());
    EXPECT_EQ(onDisk(), document(dict({{"a", elected(2)}, {"b", elected(1)}})));
}

// ---- crashes ----

// Guards the directory against leftovers: temporaries of dead writers go at start, a live writer's and other
// files' stay.
TEST_F(AnnotationStoreTest, LeftoversOfInterruptedWritesAreRemovedAtStart) {
    pid_t dead = fork();
    ASSERT_GE(dead, 0);
    if (dead == 0) _exit(0);
    ASSERT_EQ(waitpid(dead, nullptr, 0), dead);

    fs::path stale = directory_ / ("Bexil-Annotations.tmp-" + std::to_string(dead) + "-00aa");
    fs::path live = directory_ / ("Bexil-Annotations.tmp-" + std::to_string(getppid()) + "-00bb");
    fs::path foreign = directory_ / ("Other.tmp-" + std::to_string(dead) + "-00cc");
    for (const fs::path& p : {stale, live, foreign}) test::writeText(p, "partial");

    BXDAnnotationStore annotations(store());
    EXPECT_FALSE(fs::exists(stale));
    EXPECT_TRUE(fs::exists(live));
    EXPECT_TRUE(fs::exists(foreign));
}

// The bytes of the large value written at `step`, so that a torn write cannot pass for a whole one.
std::vector<uint8_t> blobFor(int64_t step) {
    std::vector<uint8_t> bytes(96 * 1024);
    for (size_t i = 0; i < bytes.size(); ++i) bytes[i] = static_cast<uint8_t>((step * 131 + i * 7) >> (i % 3));
    return bytes;
}

// Guards crash safety: a writer killed at any moment leaves a whole document (the other entries intact, the
// changing one from a single save), never an older one than before; the next start removes its temporaries.
TEST_F(AnnotationStoreTest, KilledWriterAlwaysLeavesAWholeDocument) {
    constexpr int kKills = 50;
    // On a loaded machine many kills can land between two writes: the rounds go on until one has hit a write in the
    // middle, up to this many.
    constexpr int kMostKills = 250;
    MutableDictionary initial;
    for (int i = 0; i < 100; ++i) initial.set("com.example.p" + std::to_string(i), elected(i % 3));
    initial.set("state", dict({{"step", integer(0)}, {"blob", Value::data(blobFor(0))}}));
    Value initialMap = initial.take();
    put(path_, document(initialMap));

    std::mt19937 random(20240611);
    int64_t lastStep = 0;
    int interruptedWrites = 0;
    for (int round = 0; round < kKills || (interruptedWrites == 0 && round < kMostKills); ++round) {
        int progress[2];
        ASSERT_EQ(pipe(progress), 0);
        pid_t child = fork();
        ASSERT_GE(child, 0);
        if (child == 0) {
            close(progress[0]);
            // Continues from whatever the last run left, as a restarted daemon would.
            BXDAnnotationStore annotations(store());
            int64_t step = annotations.annotationForIdentifier("state").get("step").numberAsInt64().value_or(-1000);
            if (step < 0) _exit(3);
            for (;;) {
                ++step;
                annotations.setAnnotationForIdentifier(
                    dict({{"step", integer(step)}, {"blob", Value::data(blobFor(step))}}), "state");
                if (annotations.diskBehind()) _exit(4);
                // One byte per finished save, so that the kill can be timed against the writer's real pace.
                if (::write(progress[1], "s", 1) != 1) _exit(5);
            }
        }
        close(progress[1]);
        // Two finished saves give the length of one; the kill then lands anywhere inside the next one, however
        // fast or loaded the machine is.
        auto awaitSave = [&] {
            pollfd ready{progress[0], POLLIN, 0};
            char byte;
            return poll(&ready, 1, 30000) == 1 && ::read(progress[0], &byte, 1) == 1;
        };
        bool saving = awaitSave();
        auto first = std::chrono::steady_clock::now();
        saving = saving && awaitSave();
        auto period = std::chrono::duration_cast<std::chrono::microseconds>(std::chrono::steady_clock::now() - first);
        if (saving)
            std::this_thread::sleep_for(
                std::chrono::microseconds(std::uniform_int_distribution<int64_t>(0, period.count())(random)));
        ASSERT_EQ(kill(child, SIGKILL), 0);
        close(progress[0]);
        int status = 0;
        ASSERT_EQ(waitpid(child, &status, 0), child);
        ASSERT_TRUE(WIFSIGNALED(status)) << "the writer stopped by itself with status " << WEXITSTATUS(status);
        ASSERT_TRUE(saving) << "the writer did not save within 30 s";
        for (const auto& entry : fs::directory_iterator(directory_))
            if (entry.path().filename().string().find(".tmp-") != std::string::npos) ++interruptedWrites;

        Result<Value> root = Document::readFile(path_);
        ASSERT_TRUE(root.ok()) << "round " << round << ": " << root.error().description();
        ASSERT_EQ(root->get("version"), integer(16));
        Value data = root->get("data");
        MutableDictionary fixed(data);
        fixed.set("state", initialMap.get("state"));
        ASSERT_EQ(fixed.take(), initialMap) << "round " << round;
        Value state = data.get("state");
        std::optional<int64_t> step = state.get("step").numberAsInt64();
        ASSERT_TRUE(step.has_value());
        ASSERT_GE(*step, lastStep) << "a later document went back to an earlier map";
        ASSERT_EQ(state, dict({{"step", integer(*step)}, {"blob", Value::data(blobFor(*step))}}))
            << "round " << round << " step " << *step;
        lastStep = *step;
    }
    // Some kills must have hit a write in the middle, or this proved nothing.
    EXPECT_GE(interruptedWrites, 1);
    // The next start removes what the killed writers left, whatever they named it.
    BXDAnnotationStore survivor(store());
    for (const auto& entry : fs::directory_iterator(directory_))
        EXPECT_EQ(entry.path().filename().string().find(".tmp-"), std::string::npos) << entry.path();
}

}  // namespace
}  // namespace bexil
