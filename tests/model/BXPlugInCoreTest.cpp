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

// ---- Set-up ----

// A missing URL is refused quietly; a missing identifier or a malformed information dictionary is refused with a log
// line naming the plug-in, and a refused record stores neither its names nor an identity.
TEST(BXPlugInCoreSetup, MissingNamesAndMalformedDictionariesAreRefused) {
    log::CaptureSink capture;
    EXPECT_EQ(BXPlugInCore::initWithNameUrlBundleInfoInfoUuid("com.example.x", std::nullopt, shareInfo(), std::nullopt,
                                                              std::nullopt),
              nullptr);
    EXPECT_EQ(capturedLog(capture), "");
    EXPECT_EQ(BXPlugInCore::initWithNameUrlBundleInfoInfoUuid(std::nullopt, std::string(kSharePath), shareInfo(),
                                                              std::nullopt, std::nullopt),
              nullptr);
    EXPECT_EQ(capturedLog(capture), std::string("error: missing identifier in plug-in at ") + kSharePath + "\n");

    // A non-dictionary "RZExtension" keeps the information dictionary but no plug-in dictionary.
    Value info = dict({{"BDBundleIdentifier", str("com.example.broken")}, {"RZExtension", str("oops")}});
    BXPlugInCore broken;
    capture.clear();
    EXPECT_FALSE(broken.setupWithNameUrlBundleInfoInfoUuid("com.example.broken", std::string(kToolPath), info,
                                                           std::nullopt, std::nullopt));
    EXPECT_NE(capturedLog(capture).find("malformed plug-in dictionary in plug-in com.example.broken at "
                                        "/System/Library/Bexil/Indexer.bundle: "),
              std::string::npos)
        << capturedLog(capture);
    EXPECT_EQ(broken.bundleInfoDictionary(), info);
    EXPECT_FALSE(broken.plugInDictionary());
    EXPECT_FALSE(broken.identifier());
    EXPECT_FALSE(broken.uuid());

    // An information dictionary of the wrong kind is refused and not stored.
    BXPlugInCore wrongKind;
    EXPECT_FALSE(wrongKind.setupWithNameUrlBundleInfoInfoUuid("com.example.x", std::string(kToolPath),
                                                              Value::array({str("a")}), std::nullopt, std::nullopt));
    EXPECT_FALSE(wrongKind.bundleInfoDictionary());
}

// `info` stands in for the plug-in dictionary only in the factory, only when it is a dictionary, and only when the
// information dictionary gave none.
TEST(BXPlugInCoreSetup, InfoArgumentIsUsedOnlyByTheFactoryAndOnlyWithoutRZExtension) {
    Value info = dict({{"RZExtensionProtocol", str("P")}});
    auto plugInFrom = [](std::optional<Value> bundleInfo, Value given) {
        return BXPlugInCore::initWithNameUrlBundleInfoInfoUuid("com.example.x", std::string(kToolPath), bundleInfo,
                                                               given, std::nullopt)
            ->plugInDictionary();
    };
    EXPECT_EQ(plugInFrom(std::nullopt, info), info);
    EXPECT_FALSE(plugInFrom(std::nullopt, str("flat")));
    EXPECT_EQ(plugInFrom(shareInfo(), info), shareInfo().get("RZExtension"));

    BXPlugInCore setUp;
    ASSERT_TRUE(setUp.setupWithNameUrlBundleInfoInfoUuid("com.example.x", std::string(kToolPath), std::nullopt, info,
                                                         std::nullopt));
    EXPECT_FALSE(setUp.plugInDictionary());
}

TEST(BXPlugInCoreSetup, ObsoleteMultipleKeyIsLoggedAndIgnored) {
    log::CaptureSink capture;
    ASSERT_TRUE(makeRecord(kSharePath, shareInfo({{"Multiple", Value::boolean(true)}})));
    EXPECT_TRUE(capture.contains("multiplexed plug-ins (Multiple key) obsolete and ignored")) << capturedLog(capture);
}

// A subclass that rewrites the information dictionary before it is stored, as a builder with its own conventions
// would: the hook must run before the dictionary is judged malformed.
class NormalizingRecord : public BXPlugInCore {
  public:
    Value normalizeInfoDictionary(const Value& info) override {
        return changed(info, "RZExtension", dict({{"RZExtensionProtocol", str("Normalized")}}));
    }
};

TEST(BXPlugInCoreSetup, NormalizeHookRunsBeforeTheDictionariesAreStored) {
    NormalizingRecord record;
    ASSERT_TRUE(record.setupWithNameUrlBundleInfoInfoUuid("com.example.x", std::string(kToolPath),
                                                          dict({{"RZExtension", str("would be malformed")}}),
                                                          std::nullopt, std::nullopt));
    EXPECT_EQ(record.protocolSpec(), str("Normalized"));
}

// ---- Derived properties ----

// Protocol and principal come from the plug-in dictionary, a compound protocol as it is, an embedded protocol
// overriding it for the embedded code; an application extension (exactly a ".wexa" path) defaults both to RZObject.
TEST(BXPlugInCoreDerived, SpecsComeFromThePlugInDictionaryWithRZObjectDefaultsForApplicationExtensions) {
    Value compound = Value::array({str("A"), str("B")});
    auto embedded = recordWithPlugIn(kToolPath, {{"RZExtensionProtocol", compound}, {"EmbeddedProtocol", str("E")}});
    EXPECT_EQ(embedded->protocolSpec(), compound);
    EXPECT_EQ(embedded->embeddedProtocolSpec(), str("E"));

    auto ext = recordWithPlugIn(kSharePath, {{"RZExtensionAttributes", Value::emptyDictionary()}});
    EXPECT_TRUE(ext->isAppExtension());
    EXPECT_EQ(ext->protocolSpec(), str("RZObject"));
    EXPECT_EQ(ext->principalSpec(), str("RZObject"));
    EXPECT_EQ(ext->embeddedProtocolSpec(), str("RZObject"));
    EXPECT_FALSE(ext->diagnose());
    for (const char* path : {"/Apps/X.app/PlugIns/Share.WEXA", "/Apps/X.app/PlugIns/Share.wexa/", kToolPath}) {
        auto other = recordWithPlugIn(path, {});
        EXPECT_FALSE(other->isAppExtension()) << path;
        EXPECT_FALSE(other->protocolSpec()) << path;
        EXPECT_FALSE(other->principalSpec()) << path;
    }
}

// "Dedicated" is a truth value (booleans, numbers other than zero; nothing else); "#Data" is matched exactly; any
// "EmbeddedCode" at all, even false, makes a hybrid.
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
    auto isData = [](Value protocol) {
        return recordWithPlugIn(kToolPath, {{"RZExtensionProtocol", protocol}})->isData();
    };
    EXPECT_TRUE(isData(str("#Data")));
    EXPECT_FALSE(isData(str("#data")));
    EXPECT_FALSE(isData(Value::array({str("#Data")})));
    EXPECT_TRUE(recordWithPlugIn(kToolPath, {{"EmbeddedCode", Value::boolean(false)}})->isHybrid());
    EXPECT_FALSE(recordWithPlugIn(kToolPath, {})->isHybrid());
}

// "RZExtension" decides first, then "Bexil"; a record with neither is a fault on the ops channel and answers old
// style.
TEST(BXPlugInCoreDerived, OldStyleComesFromTheStyleKeysAndNeitherIsAFault) {
    auto both =
        makeRecord(kToolPath, dict({{"Bexil", Value::emptyDictionary()}, {"RZExtension", Value::emptyDictionary()}}));
    EXPECT_FALSE(both->oldStyle());

    BXPlugInCore legacy;
    legacy.setBundleInfoDictionary(dict({{"Bexil", dict({{"Protocol", str("P")}})}}));
    log::CaptureSink capture;
    EXPECT_TRUE(legacy.oldStyle());
    EXPECT_EQ(capturedLog(capture), "");

    auto neither = recordWithPlugIn(kToolPath, {});
    EXPECT_TRUE(neither->oldStyle());
    EXPECT_EQ(capturedLog(capture),
              "fault: unknown plug-in configuration style (oldStyle of <BXPlugInCore "
              "com.example.tool " +
                  neither->uuid()->string() + " " + kToolPath + ">)\n");
}

// ---- Canonical shape ----

TEST(BXPlugInCoreCanonicalize, AddsAttributesWithVersionFromTheBundleOrOneAndKeepsAnExistingVersion) {
    Value info =
        dict({{"BDBundleShortVersionString", str("3.1")}, {"RZExtension", dict({{"RZExtensionProtocol", str("P")}})}});
    auto record = makeRecord(kToolPath, info);
    record->canonicalize();
    EXPECT_EQ(record->attributes(), dict({{"RZExtensionVersion", str("3.1")}}));
    EXPECT_EQ(record->protocolSpec(), str("P"));
    // Only the plug-in dictionary is rewritten, never the information dictionary it came from.
    EXPECT_EQ(record->bundleInfoDictionary(), info);

    // Without a bundle version it falls back to "1", keeping the other attributes.
    auto bare = recordWithPlugIn(kToolPath, {{"RZExtensionAttributes", dict({{"Other", Value::int64(4)}})}});
    bare->canonicalize();
    EXPECT_EQ(bare->attributes(), dict({{"Other", Value::int64(4)}, {"RZExtensionVersion", str("1")}}));
    BXPlugInCore empty;
    empty.canonicalize();
    EXPECT_EQ(empty.attributes(), dict({{"RZExtensionVersion", str("1")}}));

    auto versioned = makeRecord(kSharePath, shareInfo());
    Value before = *versioned->attributes();
    versioned->canonicalize();
    EXPECT_EQ(versioned->attributes(), before);
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
// the checks and the edges of each.
TEST(BXPlugInCoreDiagnose, TheFirstFailureWinsAndUsableRecordsPass) {
    BXPlugInCore nameless;
    nameless.setPlugInDictionary(dict({{"PassProxy", Value::boolean(true)}}));
    expectDiagnosis(nameless, "missing identifier (no RZExtensionIdentifier, nor even BDBundleIdentifier)");
    expectDiagnosis(*recordWithPlugIn(kToolPath, {{"EmbeddedCode", str("x")}}),
                    "missing \"RZExtensionProtocol\" key in Info.vrec or SDK");
    // A principal class that is not even a string is still one.
    expectDiagnosis(*makeRecord(kSharePath, shareInfo({{"PrincipalClass", Value::int64(1)}})),
                    "Application Extensions may not use the \"PrincipalClass\" key");
    // "PassProxy" counts by its presence, whatever its value, and is checked before the embedded code.
    expectDiagnosis(
        *makeRecord(kSharePath, shareInfo({{"PassProxy", Value::boolean(false)}, {"EmbeddedCode", str("x")}})),
        "the \"PassProxy\" key is not supported on this platform");

    EXPECT_FALSE(makeRecord(kSharePath, shareInfo())->diagnose());
    // Outside an application extension any principal class is fine.
    EXPECT_FALSE(recordWithPlugIn(kToolPath, {{"RZExtensionProtocol", str("P")},
                                              {"PrincipalClass", str("Indexer")},
                                              {"RZExtensionAttributes", Value::emptyDictionary()}})
                     ->diagnose());
}

// ---- Identity ----

// Records are equal and hash alike exactly when their UUIDs are (the given one, else a fresh one each); a record
// without a UUID cannot be compared or hashed at all, which is an internal inconsistency.
TEST(BXPlugInCoreIdentity, EqualityAndHashFollowTheUuidAloneAndNeedOne) {
    Uuid shared = Uuid::random();
    auto a = BXPlugInCore::initWithNameUrlBundleInfoInfoUuid("com.example.a", std::string("/a.wexa"), std::nullopt,
                                                             std::nullopt, shared);
    auto b = makeRecord(kToolPath, shareInfo(), shared);
    auto c = makeRecord(kToolPath, shareInfo());
    auto d = makeRecord(kToolPath, shareInfo());
    EXPECT_TRUE(*a == *b);
    EXPECT_EQ(std::hash<BXPlugInCore>()(*a), b->hash());
    EXPECT_FALSE(c->uuid()->isNil());
    EXPECT_FALSE(*c == *d) << "each missing UUID is replaced by a fresh one";
    std::unordered_set<std::shared_ptr<BXPlugInCore>, BXPlugInCoreHash, BXPlugInCoreEqual> set{a, b, c};
    EXPECT_EQ(set.size(), 2u);

    BXPlugInCore empty;
    try {
        (void)empty.hash();
        FAIL() << "hash without a uuid must throw";
    } catch (const InternalInconsistency& e) {
        EXPECT_STREQ(e.what(), "self.uuid");
    }
    EXPECT_THROW((void)(empty == *a), InternalInconsistency);
    // The receiver has a uuid; the argument without one is simply a different record.
    EXPECT_FALSE(*a == empty);
}

// ---- Annotations ----

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
                    {"RZExtensionPointIdentifier", str("com.quorvel.widgets")},
                    {"Dedicated", Value::boolean(true)},
                    {"RZExtensionAttributes", dict({{"RZExtensionVersion", str("9")}})}};
    EXPECT_TRUE(record.isData());
    EXPECT_TRUE(record.isDedicated());
    EXPECT_EQ(record.sdkSpec(), str("com.quorvel.widgets"));
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
