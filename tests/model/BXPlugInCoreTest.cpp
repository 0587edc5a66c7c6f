#include <gtest/gtest.h>

#include <atomic>
#include <map>
#include <thread>
#include <unordered_set>
#include <vector>

#include "PlugInRecords.h"

namespace bexil {
namespace {

using namespace test;

// ---- Derived properties ----

// An application extension (exactly a ".wexa" path, case-sensitive) defaults protocol and principal to RZObject, so
// that it passes the checks without either key; any other plug-in has no defaults.
TEST(BXPlugInCoreDerived, ApplicationExtensionsDefaultToRZObject) {
    auto ext = recordWithPlugIn(kSharePath, {{"RZExtensionAttributes", Value::emptyDictionary()}});
    EXPECT_TRUE(ext->isAppExtension());
    EXPECT_EQ(ext->protocolSpec(), str("RZObject"));
    EXPECT_EQ(ext->principalSpec(), str("RZObject"));
    EXPECT_FALSE(ext->diagnose());
    for (const char* path : {"/Apps/X.app/PlugIns/Share.WEXA", "/Apps/X.app/PlugIns/Share.wexa/", kToolPath}) {
        auto other = recordWithPlugIn(path, {});
        EXPECT_FALSE(other->isAppExtension()) << path;
        EXPECT_FALSE(other->protocolSpec()) << path;
        EXPECT_FALSE(other->principalSpec()) << path;
    }
}

// "Dedicated" decides who may see a plug-in: it is a truth value (booleans, numbers other than zero; nothing else).
// "#Data" is matched exactly (case included); any "EmbeddedCode" at all, even false, makes a (refused) hybrid.
TEST(BXPlugInCoreDerived, DedicatedFollowsTheTruthValueDataAndHybridTheirKeys) {
    const std::pair<std::optional<Value>, bool> dedicated[] = {
        {std::nullopt, false},    {Value::boolean(true), true}, {Value::boolean(false), false},
        {Value::int64(0), false}, {Value::real(0.5), true},     {str("YES"), false}};
    for (const auto& [value, expected] : dedicated) {
        Entries plugIn;
        if (value) plugIn.push_back({"Dedicated", *value});
        EXPECT_EQ(recordWithPlugIn(kToolPath, plugIn)->isDedicated(), expected)
            << (value ? value->description() : "absent");
    }
    EXPECT_FALSE(recordWithPlugIn(kToolPath, {{"RZExtensionProtocol", str("#data")}})->isData());
    EXPECT_TRUE(recordWithPlugIn(kToolPath, {{"EmbeddedCode", Value::boolean(false)}})->isHybrid());
    EXPECT_FALSE(recordWithPlugIn(kToolPath, {})->isHybrid());
}

// ---- Diagnosis ----

void expectDiagnosis(const BXPlugInCore& record, const char* message) {
    std::optional<Error> error = record.diagnose();
    ASSERT_TRUE(error) << "expected: " << message;
    EXPECT_EQ(error->domain(), "Bexil");
    EXPECT_EQ(error->code(), 12);
    EXPECT_EQ(error->localizedDescription(), message);
}

// Each message alone is checked against the mis-configured example bundles (ExampleBundlesTest); here the order of
// the checks, which decides what an author is told first, and the edges of the presence checks.
TEST(BXPlugInCoreDiagnose, TheFirstFailureWins) {
    BXPlugInCore nameless;
    nameless.setPlugInDictionary(dict({{"PassProxy", Value::boolean(true)}}));
    expectDiagnosis(nameless, "missing identifier (no RZExtensionIdentifier, nor even BDBundleIdentifier)");
    // A principal class that is not even a string is still one.
    expectDiagnosis(*makeRecord(kSharePath, shareInfo({{"PrincipalClass", Value::int64(1)}})),
                    "Application Extensions may not use the \"PrincipalClass\" key");
    // "PassProxy" counts by its presence, whatever its value, and is checked before the embedded code.
    expectDiagnosis(
        *makeRecord(kSharePath, shareInfo({{"PassProxy", Value::boolean(false)}, {"EmbeddedCode", str("x")}})),
        "the \"PassProxy\" key is not supported on this platform");
}

// ---- Identity ----

// Records are equal and hash alike exactly when their UUIDs are (the given one, else a fresh one each); a record
// without a UUID cannot be compared or hashed at all, which is an internal inconsistency.
TEST(BXPlugInCoreIdentity, EqualityAndHashFollowTheUuidAloneAndNeedOne) {
    Uuid shared = Uuid::random();
    auto a = recordWithPlugIn("/a.wexa", {});
    a->setUuid(shared);
    auto b = makeRecord(kToolPath, shareInfo(), shared);
    auto c = makeRecord(kToolPath, shareInfo());
    EXPECT_FALSE(*c == *makeRecord(kToolPath, shareInfo())) << "each missing UUID is replaced by a fresh one";
    std::unordered_set<std::shared_ptr<BXPlugInCore>, BXPlugInCoreHash, BXPlugInCoreEqual> set{a, b, c};
    EXPECT_EQ(set.size(), 2u);

    BXPlugInCore empty;
    EXPECT_THROW((void)empty.hash(), InternalInconsistency);
    EXPECT_THROW((void)(empty == *a), InternalInconsistency);
    // The receiver has a uuid; the argument without one is simply a different record.
    EXPECT_FALSE(*a == empty);
}

// ---- Annotations ----

// Setting a value gives a new dictionary (readers may hold the old one); removing the last change restores it; a
// record without annotations does not get a dictionary from a single value.
TEST(BXPlugInCoreAnnotations, SetReplacesRemovesNeverEditsInPlaceAndAbsentStaysAbsent) {
    auto record = makeRecord(kSharePath, shareInfo());
    Value start = dict({{"com.example.mail.share", dict({{"election", Value::int64(1)}})}});
    record->setAnnotations(start);
    record->setAnnotationValue("extra", Value::int64(5));
    EXPECT_EQ(record->annotations()->get("extra"), Value::int64(5));
    EXPECT_EQ(start.count(), 1u) << "the old dictionary is never edited";
    record->setAnnotationValue("extra", std::nullopt);
    record->setAnnotationValue("absent", std::nullopt);
    EXPECT_EQ(*record->annotations(), start);

    record = makeRecord(kSharePath, shareInfo());
    record->setAnnotationValue("com.example.mail.share", dict({{"election", Value::int64(1)}}));
    EXPECT_FALSE(record->annotations());
}

// ---- Redirected look-ups ----

// Answers the plug-in dictionary's keys from its own table, as the daemon's record answers them from the registry.
class RedirectingRecord : public BXPlugInCore {
  public:
    std::map<std::string, Value, std::less<>> table;
    std::optional<Value> pluginKey(std::string_view key) const override {
        auto it = table.find(key);
        return it == table.end() ? std::nullopt : std::optional<Value>(it->second);
    }
};

// Every derived property and the checks must go through the look-ups, never the stored dictionaries (it has none).
TEST(BXPlugInCoreRedirect, DerivedPropertiesFollowRedirectedLookUps) {
    RedirectingRecord record;
    ASSERT_TRUE(record.setupWithNameUrlBundleInfoInfoUuid("com.example.redirect", std::string(kToolPath), std::nullopt,
                                                          std::nullopt, std::nullopt));
    record.table = {{"RZExtensionProtocol", str("#Data")},
                    {"Dedicated", Value::boolean(true)},
                    {"RZExtensionAttributes", dict({{"RZExtensionVersion", str("9")}})}};
    EXPECT_TRUE(record.isData());
    EXPECT_TRUE(record.isDedicated());
    EXPECT_EQ(record.version(), str("9"));
    EXPECT_FALSE(record.diagnose());
    record.table["EmbeddedCode"] = str("x");
    EXPECT_EQ(record.diagnose()->localizedDescription(), "hybrid plug-ins are not supported on this platform");
}

// ---- Concurrency ----

// Readers must see whole values while writers replace them, and concurrent changes of different annotation keys
// must all survive: a lost update would silently drop a user's election.
TEST(BXPlugInCoreConcurrency, ReadersSeeWholeValuesWhileWritersReplaceThem) {
    auto record = makeRecord(kSharePath, shareInfo());
    record->setAnnotations(Value::emptyDictionary());
    constexpr int kWriters = 2;
    constexpr int kKeysPerWriter = 200;
    std::atomic<bool> done{false};
    std::atomic<long> reads{0};

    std::vector<std::thread> readers;
    for (int r = 0; r < 2; ++r) {
        readers.emplace_back([&] {
            do {
                std::optional<Value> notes = record->annotations();
                ASSERT_TRUE(notes && notes->isDictionary());
                std::optional<std::string> name = record->localizedName();
                ASSERT_TRUE(!name || *name == "Share" || *name == "Share to Mail");
                ASSERT_TRUE(record->exportForm().ok());
                EXPECT_EQ(record->protocolSpec(), str("ShareProtocol"));
                reads.fetch_add(1);
            } while (!done.load());
        });
    }
    std::vector<std::thread> writers;
    for (int w = 0; w < kWriters; ++w) {
        writers.emplace_back([&, w] {
            for (int i = 0; i < kKeysPerWriter; ++i) {
                record->setAnnotationValue("w" + std::to_string(w) + "-" + std::to_string(i), Value::int64(i));
                record->setLocalizedName(std::string(i % 2 ? "Share" : "Share to Mail"));
            }
        });
    }
    for (auto& t : writers) t.join();
    done.store(true);
    for (auto& t : readers) t.join();
    EXPECT_EQ(record->annotations()->count(), static_cast<size_t>(kWriters * kKeysPerWriter));
    EXPECT_GT(reads.load(), 0);
}

}  // namespace
}  // namespace bexil
