#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <future>
#include <mutex>

#include "TestSupport.h"
#include "base/Document.h"
#include "database/BXDAnnotationStore.h"
#include "database/BXDatabase.h"
#include "platform/ledgerix/LXBexilProxy.h"
#include "platform/ledgerix/LedgerixWorkspace.h"
#include "platform/log/CaptureSink.h"
#include "policy/BXDPlugIn.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;

const fs::path kExamples = fs::path(BEXIL_SOURCE_DIR) / "examples" / "bundles";

class RecordingDelegate : public BXDatabaseDelegate {
  public:
    explicit RecordingDelegate(BXDatabase& database) : database_(database) {}
    void removedPlugIns(const std::vector<std::shared_ptr<const LXBexilProxy>>& plugIns) override {
        std::lock_guard lock(mutex_);
        calledInsideSync_ = calledInsideSync_ || database_.sync().isCurrent();
        for (const auto& proxy : plugIns) removed_.push_back(proxy->bundleURL().value_or(""));
    }
    std::vector<std::string> removed() {
        std::lock_guard lock(mutex_);
        return removed_;
    }
    bool calledInsideSync() const { return calledInsideSync_; }

  private:
    BXDatabase& database_;
    std::mutex mutex_;
    std::vector<std::string> removed_;
    bool calledInsideSync_ = false;
};

// A database over a registry in private daemon directories (the annotation store looks for a legacy document under
// the state directory), with copies of the example bundles to register.
class BXDatabaseTest : public ::testing::Test {
  protected:
    void SetUp() override {
        root_ = dir_.path();
        fs::create_directories(root_ / "bundles");
        for (const char* bundle : {"Greeter.app", "Notes.app", "Misconfigured.app"})
            fs::copy(kExamples / bundle, root_ / "bundles" / bundle, fs::copy_options::recursive);
        open();
    }
    void TearDown() override {
        database_.reset();
        workspace_.reset();
    }

    void open() {
        database_.reset();
        LedgerixWorkspace::Options options;
        options.stateDirectory = root_ / "state";
        Result<std::shared_ptr<LedgerixWorkspace>> opened = LedgerixWorkspace::open(options);
        ASSERT_TRUE(opened.ok()) << opened.error().description();
        workspace_ = *opened;
        database_ = BXDatabase::create(annotationsPath().string(), workspace_,
                                       [this](std::string_view name) { posted_.emplace_back(name); });
        ASSERT_NE(database_, nullptr);
        delegate_ = std::make_unique<RecordingDelegate>(*database_);
        database_->setDelegate(delegate_.get());
    }

    fs::path annotationsPath() const { return root_ / "annotations.vrec"; }
    std::string bundle(const std::string& relative) const { return (root_ / "bundles" / relative).string(); }
    std::string hello() const { return bundle("Greeter.app/PlugIns/Hello.bxplugin"); }
    std::string bonjour() const { return bundle("Greeter.app/PlugIns/Bonjour.bxplugin"); }
    std::string nightTheme() const { return bundle("Greeter.app/PlugIns/NightTheme.bxplugin"); }

    std::shared_ptr<BXDPlugIn> addAndFind(const std::string& path) {
        std::optional<Error> error = database_->addPlugIn(path);
        EXPECT_FALSE(error) << error->description();
        return database_->findPlugInAtPath(path);
    }

    void grantAutoElection(const std::string& path) {
        ASSERT_FALSE(Document::writeFileAtomically(
            fs::path(path) / "Entitlements.vrec",
            Value::dictionary({{std::string(BXDPlugIn::kAutoElectEntitlement), Value::boolean(true)}})));
    }

    // The annotation map as the document on disk has it.
    Value annotationsOnDisk() const {
        Result<Value> root = Document::readFile(annotationsPath());
        return root ? root->get("data") : Value();
    }

    test::DaemonDirs dir_{"bxdatabase-test"};
    fs::path root_;
    std::shared_ptr<LedgerixWorkspace> workspace_;
    std::unique_ptr<BXDatabase> database_;
    std::unique_ptr<RecordingDelegate> delegate_;
    std::vector<std::string> posted_;
};

// ---- look-ups and the cache ----

// Guards the cache: look-ups ask the registry every time something is not cached (so unknown plug-ins are logged
// each time, not remembered as absent), adding builds no record, and an installed plug-in is one cached record
// however it is looked up.
TEST_F(BXDatabaseTest, LookUpsFindAnInstalledPlugInAsOneCachedRecordAndUnknownOnesAsNothing) {
    log::CaptureSink capture;
    Uuid unknown = Uuid::random();
    EXPECT_EQ(database_->findPlugIn(unknown), nullptr);
    EXPECT_EQ(database_->findPlugIn(unknown), nullptr);
    EXPECT_EQ(capture.count("Ledgerix cannot find plug-in with UUID:" + unknown.string()), 2u);
    EXPECT_EQ(database_->findPlugInAtPath(hello()), nullptr);

    ASSERT_FALSE(database_->addPlugIn(hello()));
    EXPECT_EQ(database_->cachedCount(), 0u);

    std::shared_ptr<BXDPlugIn> byPath = database_->findPlugInAtPath(hello());
    ASSERT_NE(byPath, nullptr);
    EXPECT_EQ(database_->findPlugIn(*byPath->uuid()).get(), byPath.get());
    EXPECT_EQ(database_->plugInForProxy(workspace_->plugInProxyForURL(hello())).get(), byPath.get());
    EXPECT_EQ(database_->cachedCount(), 1u);

    // A misconfigured plug-in registers but is never built, nor cached, so a later look-up tries again.
    std::string missingProtocol = bundle("Misconfigured.app/PlugIns/MissingProtocol.bxplugin");
    ASSERT_FALSE(database_->addPlugIn(missingProtocol));
    EXPECT_EQ(database_->findPlugInAtPath(missingProtocol), nullptr);
    EXPECT_EQ(database_->cachedCount(), 1u);
}

// Guards discovery with a warm cache over the real registry, which then leaves the cached records out of what it
// reads: the records handed out are the cached ones, and a plug-in re-registered since (a changed bundle, under
// the same UUID) gets a new record built from what its bundle says now.
TEST_F(BXDatabaseTest, DiscoveryHandsOutTheCachedRecordsAndBuildsAReRegisteredOneAfresh) {
    ASSERT_FALSE(database_->addPlugIn(hello()));
    ASSERT_FALSE(database_->addPlugIn(bonjour()));
    std::shared_ptr<BXDPlugIn> cached = database_->findPlugInAtPath(hello());
    ASSERT_TRUE(cached);
    std::optional<BXDatabase::PlugInSet> first = database_->findPlugIns(Value());
    ASSERT_TRUE(first);
    ASSERT_EQ(first->size(), 2u);
    EXPECT_EQ((*first)[0].get(), cached.get());
    std::optional<BXDatabase::PlugInSet> second = database_->findPlugIns(Value());
    ASSERT_TRUE(second);
    ASSERT_EQ(second->size(), 2u);
    for (size_t i = 0; i < 2; ++i) EXPECT_EQ((*second)[i].get(), (*first)[i].get());

    grantAutoElection(hello());
    ASSERT_FALSE(database_->addPlugIn(hello()));
    std::optional<BXDatabase::PlugInSlice> walked = database_->findPlugInsAfterIdentifier(Value(), std::nullopt, 10);
    ASSERT_TRUE(walked);
    ASSERT_EQ(walked->plugIns.size(), 2u);
    for (const std::shared_ptr<BXDPlugIn>& record : walked->plugIns) {
        if (record->uuid() == cached->uuid()) {
            EXPECT_NE(record.get(), cached.get());
            EXPECT_TRUE(record->hasEntitlement(BXDPlugIn::kAutoElectEntitlement));
        } else {
            EXPECT_EQ(record.get(), (*first)[1].get());
        }
    }
}

// Guards the lock discipline: what must run under the database's lock refuses to run outside it.
TEST_F(BXDatabaseTest, CreatingOutsideTheLockIsAnInternalInconsistency) {
    ASSERT_FALSE(database_->addPlugIn(hello()));
    EXPECT_THROW(database_->createPlugInForProxy(workspace_->plugInProxyForURL(hello())), InternalInconsistency);
    EXPECT_THROW(database_->purgeCachesToLimit(0), InternalInconsistency);
}

// ---- the purge ----

// Guards the cache limit at its boundary: a count equal to the limit does not purge, one more empties the cache but
// for the record just built; with limit 0 at most that one record stays, and a purged one is rebuilt equal.
TEST_F(BXDatabaseTest, PurgeIsAllOrNothingAboveTheLimit) {
    std::vector<std::string> all = {hello(), bonjour(), nightTheme(), bundle("Notes.app/PlugIns/Stationery.bxplugin")};
    for (const std::string& path : all) ASSERT_FALSE(database_->addPlugIn(path));

    database_->setCacheLimit(2);
    std::shared_ptr<BXDPlugIn> first = database_->findPlugInAtPath(all[0]);
    for (int i = 1; i < 3; ++i) ASSERT_TRUE(database_->findPlugInAtPath(all[i]));
    EXPECT_EQ(database_->cachedCount(), 3u) << "a count equal to the limit does not purge";
    std::shared_ptr<BXDPlugIn> fourth = database_->findPlugInAtPath(all[3]);
    ASSERT_TRUE(fourth);
    EXPECT_EQ(database_->cachedCount(), 1u);
    EXPECT_EQ(database_->findPlugIn(*fourth->uuid()).get(), fourth.get());

    database_->setCacheLimit(0);
    std::shared_ptr<BXDPlugIn> again = database_->findPlugIn(*first->uuid());
    ASSERT_TRUE(again);
    EXPECT_EQ(database_->cachedCount(), 1u);
    EXPECT_NE(again.get(), first.get());
    EXPECT_TRUE(*again == *first);
}

// Guards the release of a purged cache on the writer: the cache is empty at once, and while the purged records wait
// there to be freed every look-up builds the right record again (none of the purged ones comes back, a caller's
// copy lives on and equals the new one); after the release the new records are still the cached ones.
TEST_F(BXDatabaseTest, LookUpsWhileAPurgedCacheIsReleasedBuildTheRightRecords) {
    std::vector<std::string> all = {hello(), bonjour(), nightTheme(), bundle("Notes.app/PlugIns/Stationery.bxplugin")};
    std::vector<std::shared_ptr<BXDPlugIn>> purged;
    for (const std::string& path : all) purged.push_back(addAndFind(path));
    for (const auto& plugIn : purged) ASSERT_TRUE(plugIn);

    std::promise<void> gate;
    database_->writer().async([released = gate.get_future().share()] { released.wait(); });
    database_->sync().sync([&] { database_->purgeCachesToLimit(0); });
    EXPECT_EQ(database_->cachedCount(), 0u);

    std::vector<std::shared_ptr<BXDPlugIn>> rebuilt;
    for (const auto& old : purged) {
        std::shared_ptr<BXDPlugIn> plugIn = database_->findPlugIn(*old->uuid());
        ASSERT_TRUE(plugIn);
        EXPECT_NE(plugIn.get(), old.get());
        EXPECT_TRUE(*plugIn == *old) << old->identifier().value_or("");
        rebuilt.push_back(plugIn);
    }
    gate.set_value();
    database_->waitForWriter();
    EXPECT_EQ(database_->cachedCount(), all.size());
    for (const auto& plugIn : rebuilt) EXPECT_EQ(database_->findPlugIn(*plugIn->uuid()).get(), plugIn.get());
}

// ---- uninstall ----

// Guards uninstall: the record goes, and the delegate (which ends running instances) is told outside the lock,
// also for a plug-in never cached.
TEST_F(BXDatabaseTest, UninstallDropsTheRecordAndTellsTheDelegateOutsideTheLockCachedOrNot) {
    std::shared_ptr<BXDPlugIn> plugIn = addAndFind(hello());
    ASSERT_TRUE(plugIn);
    ASSERT_FALSE(database_->removePlugIn(hello()));
    EXPECT_FALSE(delegate_->calledInsideSync());
    EXPECT_EQ(database_->cachedCount(), 0u);

    // A plug-in never cached is announced all the same.
    ASSERT_FALSE(database_->addPlugIn(bonjour()));
    ASSERT_FALSE(database_->removePlugIn(bonjour()));
    EXPECT_EQ(delegate_->removed(), (std::vector<std::string>{hello(), bonjour()}));
}

// ---- annotations ----

// Guards annotations across the plug-in's life: how they merge is the store's business; here they reach the store
// under the plug-in's identifier and outlive an uninstall into the reinstalled plug-in's form. (Posting once per
// request and surviving a restart: AnnotationTest's end-to-end tests.)
TEST_F(BXDatabaseTest, AnnotationsSurviveUninstallAndReachTheForm) {
    std::shared_ptr<BXDPlugIn> plugIn = addAndFind(hello());
    ASSERT_TRUE(plugIn);
    Value expected = Value::dictionary({{"election", Value::int64(2)}});
    database_->setAnnotationForPlugIn(expected, *plugIn);
    EXPECT_EQ(annotationsOnDisk().get("com.example.greeter.hello"), expected);

    ASSERT_FALSE(database_->removePlugIn(hello()));
    std::shared_ptr<BXDPlugIn> reinstalled = addAndFind(hello());
    ASSERT_TRUE(reinstalled);
    MutableDictionary form;
    database_->addAnnotationForPlugInIn(*reinstalled, form);
    EXPECT_EQ(form.value().get("annotations"), expected);
}

// Guards the writer's saves: a change is seen by every reader at once and reaches the disk with the next save, and
// changes made while the writer was busy share one write (the save after it finds nothing left to write);
// setAnnotationForPlugIn returns with its change on disk.
TEST_F(BXDatabaseTest, ChangesAreSeenAtOnceAndThoseMadeMeanwhileShareOneSave) {
    std::shared_ptr<BXDPlugIn> hello = addAndFind(this->hello()), theme = addAndFind(nightTheme());
    ASSERT_TRUE(hello && theme);
    database_->setAnnotationForPlugIn(Value::dictionary({{"election", Value::int64(1)}}), *hello);
    EXPECT_EQ(annotationsOnDisk().get("com.example.greeter.hello").get("election"), Value::int64(1));

    std::promise<void> gate;
    database_->writer().async([released = gate.get_future().share()] { released.wait(); });
    const Value elected = Value::dictionary({{"election", Value::int64(2)}});
    database_->changeAnnotationForPlugIn(elected, *hello);
    database_->changeAnnotationForPlugIn(elected, *theme);
    EXPECT_EQ(database_->annotationForPlugIn(*theme), elected);
    EXPECT_EQ(annotationsOnDisk().get("com.example.greeter.hello").get("election"), Value::int64(1));

    auto inode = [this] {
        struct stat status {};
        return ::stat(annotationsPath().c_str(), &status) == 0 ? status.st_ino : 0;
    };
    ino_t afterFirst = 0;
    database_->writer().async([this] { database_->saveAnnotations(); });
    database_->writer().async([&] { afterFirst = inode(); });
    database_->writer().async([this] { database_->saveAnnotations(); });
    gate.set_value();
    database_->waitForWriter();
    EXPECT_EQ(inode(), afterFirst) << "the second save wrote again";
    EXPECT_EQ(annotationsOnDisk().get("com.example.greeter.hello"), elected);
    EXPECT_EQ(annotationsOnDisk().get("com.example.greeter.night-theme"), elected);
}

// Guards automatic election: building the record of an entitled plug-in elects it (1, persisted, without a
// notification) unless an election other than 0 is stored: a stored 2 survives however often the record is
// rebuilt, a stored 0 is replaced with the rest of the annotation kept, and a plug-in without the entitlement is
// left alone. (That an entitled plug-in gets 1 at all: SystemPlugInTest.OnlyPlugInsReallyBelowSystemAre...)
TEST_F(BXDatabaseTest, AutomaticElectionStoresOneButNeverOverridesAnElectionMade) {
    for (const std::string& path : {bonjour(), nightTheme()}) grantAutoElection(path);
    for (const std::string& path : {bonjour(), nightTheme(), hello()}) ASSERT_FALSE(database_->addPlugIn(path));
    // Elect before the first record exists, through the store's key (the identifier).
    database_->sync().sync([&] {
        database_->annotations().setAnnotationForIdentifier(
            Value::dictionary({{"election", Value::int64(2)}, {"extension", Value::string("kept")}}),
            "com.example.greeter.bonjour");
        database_->annotations().setAnnotationForIdentifier(
            Value::dictionary({{"election", Value::int64(0)}, {"extension", Value::string("kept")}}),
            "com.example.greeter.night-theme");
    });
    database_->setCacheLimit(0);  // each look-up purges the others, so every round builds the records again
    for (int round = 0; round < 2; ++round) {
        for (auto [path, election] : {std::pair{bonjour(), 2}, {nightTheme(), 1}}) {
            std::shared_ptr<BXDPlugIn> plugIn = database_->findPlugInAtPath(path);
            ASSERT_TRUE(plugIn) << path;
            EXPECT_EQ(database_->annotationForPlugIn(*plugIn).get("election"), Value::int64(election)) << path;
        }
    }
    // Nobody waits for an automatic election's save; it is queued on the writer like every other.
    database_->waitForWriter();
    EXPECT_EQ(annotationsOnDisk().get("com.example.greeter.night-theme"),
              Value::dictionary({{"election", Value::int64(1)}, {"extension", Value::string("kept")}}));
    EXPECT_TRUE(posted_.empty()) << "automatic election posts no notification";
    std::shared_ptr<BXDPlugIn> other = database_->findPlugInAtPath(hello());
    ASSERT_TRUE(other);
    EXPECT_TRUE(database_->annotationForPlugIn(*other).isNull());
}

}  // namespace
}  // namespace bexil
