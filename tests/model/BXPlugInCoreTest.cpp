#include <gtest/gtest.h>

#include <atomic>
#include <map>
#include <thread>
#include <unordered_map>
#include <unordered_set>
#include <vector>

#include "CapturedLog.h"
#include "TestSupport.h"
#include "model/BXPlugInCore.h"
#include "platform/log/CaptureSink.h"

namespace bexil {
namespace {

using test::capturedLog;
using test::dict;
using test::Entries;
using test::str;

const char* const kSharePath = "/Applications/Mail.app/PlugIns/Share.wexa";
const char* const kToolPath = "/System/Library/Bexil/Indexer.bundle";

// The information dictionary of an ordinary current-style plug-in as a bundle would carry it.
Value shareInfo(Entries extraPlugIn = {}) {
    Entries plugIn = {
        {"RZExtensionPointIdentifier", str("com.quorvel.share-services")},
        {"RZExtensionProtocol", str("ShareProtocol")},
        {"PrincipalClass", str("RZObject")},
        {"RZExtensionAttributes",
         dict({{"RZExtensionVersion", str("2.4")}, {"RZExtensionActivationRule", str("TRUEPREDICATE")}})},
    };
    for (auto& e : extraPlugIn) plugIn.push_back(std::move(e));
    return dict({
        {"BDBundleIdentifier", str("com.example.mail.share")},
        {"BDBundleShortVersionString", str("2.4.1")},
        {"BDBundleInfoVrecURL", str("file:///Applications/Mail.app/PlugIns/Share.wexa/Info.vrec")},
        {"RZExtension", dict(std::move(plugIn))},
    });
}

std::shared_ptr<BXPlugInCore> makeRecord(const char* path, Value info, std::optional<Uuid> uuid = std::nullopt) {
    return BXPlugInCore::initWithNameUrlBundleInfoInfoUuid("com.example.mail.share", std::string(path), info,
                                                           std::nullopt, uuid);
}

// A record whose plug-in dictionary is a dictionary of the given entries (no information dictionary).
std::shared_ptr<BXPlugInCore> recordWithPlugIn(const char* path, Entries plugIn) {
    return BXPlugInCore::initWithNameUrlBundleInfoInfoUuid("com.example.tool", std::string(path), std::nullopt,
                                                           dict(std::move(plugIn)), std::nullopt);
}

// ---- Set-up ----

TEST(BXPlugInCoreSetup, MissingUrlFailsSilentlyAndMissingIdentifierFailsLoggingThePath) {
    log::CaptureSink capture;
    EXPECT_EQ(BXPlugInCore::initWithNameUrlBundleInfoInfoUuid("com.example.x", std::nullopt, shareInfo(), std::nullopt,
                                                              std::nullopt),
              nullptr);
    EXPECT_EQ(capturedLog(capture), "");
    auto record = BXPlugInCore::initWithNameUrlBundleInfoInfoUuid(std::nullopt, std::string(kSharePath), shareInfo(),
                                                                  std::nullopt, std::nullopt);
    std::string log = capturedLog(capture);
    EXPECT_EQ(record, nullptr);
    EXPECT_NE(log.find(std::string("missing identifier in plug-in at ") + kSharePath), std::string::npos) << log;
    EXPECT_NE(log.find("error"), std::string::npos) << log;
}

TEST(BXPlugInCoreSetup, MalformedDictionariesFailButANonDictionaryRZExtensionKeepsTheInformationDictionary) {
    Value info = dict({{"BDBundleIdentifier", str("com.example.broken")}, {"RZExtension", str("oops")}});
    BXPlugInCore record;
    log::CaptureSink capture;
    EXPECT_FALSE(record.setupWithNameUrlBundleInfoInfoUuid("com.example.broken", std::string(kToolPath), info,
                                                           std::nullopt, std::nullopt));
    std::string log = capturedLog(capture);
    EXPECT_NE(log.find("malformed plug-in dictionary in plug-in com.example.broken at /System/Library/Bexil/"
                       "Indexer.bundle: "),
              std::string::npos)
        << log;
    ASSERT_TRUE(record.bundleInfoDictionary());
    EXPECT_TRUE(record.bundleInfoDictionary()->identical(info));
    EXPECT_FALSE(record.plugInDictionary());
    // A failed set-up stores neither the names nor an identity.
    EXPECT_FALSE(record.identifier());
    EXPECT_FALSE(record.uuid());

    // An information dictionary of the wrong kind is refused and not stored.
    BXPlugInCore wrongKind;
    capture.clear();
    EXPECT_FALSE(wrongKind.setupWithNameUrlBundleInfoInfoUuid("com.example.x", std::string(kToolPath),
                                                              Value::array({str("a")}), std::nullopt, std::nullopt));
    EXPECT_NE(capturedLog(capture).find("malformed plug-in dictionary"), std::string::npos);
    EXPECT_FALSE(wrongKind.bundleInfoDictionary());
    EXPECT_FALSE(wrongKind.setDictionaries(str("not a dictionary")));
    EXPECT_FALSE(wrongKind.bundleInfoDictionary());
}

TEST(BXPlugInCoreSetup, InfoArgumentIsUsedOnlyByTheFactoryAndOnlyWithoutRZExtension) {
    Value info = dict({{"RZExtensionProtocol", str("P")}});
    auto built = BXPlugInCore::initWithNameUrlBundleInfoInfoUuid("com.example.x", std::string(kToolPath), std::nullopt,
                                                                 info, std::nullopt);
    ASSERT_TRUE(built);
    ASSERT_TRUE(built->plugInDictionary());
    EXPECT_TRUE(built->plugInDictionary()->identical(info));
    EXPECT_FALSE(built->bundleInfoDictionary());

    BXPlugInCore setUp;
    ASSERT_TRUE(setUp.setupWithNameUrlBundleInfoInfoUuid("com.example.x", std::string(kToolPath), std::nullopt, info,
                                                         std::nullopt));
    EXPECT_FALSE(setUp.plugInDictionary());

    auto notADictionary = BXPlugInCore::initWithNameUrlBundleInfoInfoUuid("com.example.x", std::string(kToolPath),
                                                                          std::nullopt, str("flat"), std::nullopt);
    ASSERT_TRUE(notADictionary);
    EXPECT_FALSE(notADictionary->plugInDictionary());

    Value bundle = shareInfo();
    auto both = BXPlugInCore::initWithNameUrlBundleInfoInfoUuid("com.example.x", std::string(kSharePath), bundle, info,
                                                                std::nullopt);
    ASSERT_TRUE(both);
    EXPECT_TRUE(both->plugInDictionary()->identical(*bundle.find("RZExtension")));
}

TEST(BXPlugInCoreSetup, StoresNamesAndGivenOrFreshUuid) {
    Uuid given = Uuid::random();
    auto record = makeRecord(kSharePath, shareInfo(), given);
    ASSERT_TRUE(record);
    EXPECT_EQ(record->identifier(), "com.example.mail.share");
    EXPECT_EQ(record->url(), kSharePath);
    EXPECT_EQ(record->uuid(), given);

    auto a = makeRecord(kSharePath, shareInfo());
    auto b = makeRecord(kSharePath, shareInfo());
    ASSERT_TRUE(a && b && a->uuid() && b->uuid());
    EXPECT_FALSE(a->uuid()->isNil());
    EXPECT_FALSE(*a == *b);
}

TEST(BXPlugInCoreSetup, ObsoleteMultipleKeyIsLoggedAndIgnored) {
    log::CaptureSink capture;
    auto record = makeRecord(kSharePath, shareInfo({{"Multiple", Value::boolean(true)}}));
    std::string log = capturedLog(capture);
    ASSERT_TRUE(record);
    EXPECT_NE(log.find("multiplexed plug-ins (Multiple key) obsolete and ignored"), std::string::npos) << log;
    EXPECT_FALSE(record->isMultiplexed());
}

// A subclass that rewrites the information dictionary before it is stored, as a builder with its own conventions
// would.
class NormalizingRecord : public BXPlugInCore {
  public:
    Value normalizeInfoDictionary(const Value& info) override {
        MutableDictionary copy(info);
        copy.set("RZExtension", dict({{"RZExtensionProtocol", str("Normalized")}}));
        return copy.take();
    }
};

TEST(BXPlugInCoreSetup, NormalizeHookRunsBeforeTheDictionariesAreStored) {
    NormalizingRecord record;
    Value info = dict({{"RZExtension", str("would be malformed")}});
    log::CaptureSink capture;
    ASSERT_TRUE(record.setupWithNameUrlBundleInfoInfoUuid("com.example.x", std::string(kToolPath), info, std::nullopt,
                                                          std::nullopt));
    capturedLog(capture);
    EXPECT_EQ(record.protocolSpec(), str("Normalized"));
}

// ---- Derived properties ----

TEST(BXPlugInCoreDerived, CurrentStylePlugInDerivesItsConfiguration) {
    auto record = makeRecord(kSharePath, shareInfo());
    ASSERT_TRUE(record);
    EXPECT_EQ(record->path(), kSharePath);
    EXPECT_TRUE(record->isAppExtension());
    EXPECT_EQ(record->protocolSpec(), str("ShareProtocol"));
    EXPECT_EQ(record->embeddedProtocolSpec(), str("ShareProtocol"));
    EXPECT_EQ(record->principalSpec(), str("RZObject"));
    EXPECT_EQ(record->sdkSpec(), str("com.quorvel.share-services"));
    EXPECT_EQ(record->version(), str("2.4"));
    ASSERT_TRUE(record->attributes());
    EXPECT_EQ(record->attributes()->get("RZExtensionActivationRule"), str("TRUEPREDICATE"));
    EXPECT_EQ(record->infoKey("BDBundleShortVersionString"), str("2.4.1"));
    EXPECT_FALSE(record->infoKey("Nope"));
    EXPECT_FALSE(record->isHybrid());
    EXPECT_FALSE(record->isDedicated());
    EXPECT_FALSE(record->isData());
    EXPECT_FALSE(record->isMultiplexed());
    EXPECT_FALSE(record->embeddedCodePath());
    EXPECT_FALSE(record->containingPath());
    EXPECT_FALSE(record->oldStyle());
}

TEST(BXPlugInCoreDerived, ApplicationExtensionDefaultsProtocolAndPrincipalToRZObject) {
    auto ext = recordWithPlugIn(kSharePath, {{"RZExtensionAttributes", Value::emptyDictionary()}});
    ASSERT_TRUE(ext);
    EXPECT_EQ(ext->protocolSpec(), str("RZObject"));
    EXPECT_EQ(ext->principalSpec(), str("RZObject"));
    EXPECT_EQ(ext->embeddedProtocolSpec(), str("RZObject"));
    EXPECT_FALSE(ext->diagnose());

    // The suffix test is exact and case-sensitive.
    for (const char* path : {"/Apps/X.app/PlugIns/Share.WEXA", "/Apps/X.app/PlugIns/Share.wexa/", kToolPath}) {
        auto other = recordWithPlugIn(path, {});
        ASSERT_TRUE(other);
        EXPECT_FALSE(other->isAppExtension()) << path;
        EXPECT_FALSE(other->protocolSpec()) << path;
        EXPECT_FALSE(other->principalSpec()) << path;
    }
}

TEST(BXPlugInCoreDerived, ProtocolSpecKeepsArraysAndEmbeddedProtocolOverrides) {
    Value compound = Value::array({str("A"), str("B")});
    auto record = recordWithPlugIn(kToolPath, {{"RZExtensionProtocol", compound}, {"EmbeddedProtocol", str("E")}});
    ASSERT_TRUE(record);
    EXPECT_EQ(record->protocolSpec(), compound);
    EXPECT_EQ(record->embeddedProtocolSpec(), str("E"));
}

TEST(BXPlugInCoreDerived, DedicatedFollowsTheTruthValueDataAndHybridTheirKeys) {
    struct Case {
        std::optional<Value> value;
        bool expected;
    };
    std::vector<Case> cases = {
        {std::nullopt, false},          {Value::int64(1), true},  {Value::boolean(true), true},
        {Value::boolean(false), false}, {Value::int64(0), false}, {Value::real(0.5), true},
        {Value::uint64(7), true},       {str("YES"), false},      {Value::emptyDictionary(), false}};
    for (const Case& c : cases) {
        Entries plugIn;
        if (c.value) plugIn.push_back({"Dedicated", *c.value});
        auto record = recordWithPlugIn(kToolPath, plugIn);
        ASSERT_TRUE(record);
        EXPECT_EQ(record->isDedicated(), c.expected) << (c.value ? c.value->description() : "absent");
    }
    // Data only for exactly "#Data"; any EmbeddedCode value at all makes a hybrid.
    auto isData = [](Value protocol) {
        return recordWithPlugIn(kToolPath, {{"RZExtensionProtocol", protocol}})->isData();
    };
    EXPECT_TRUE(isData(str("#Data")));
    EXPECT_FALSE(isData(str("#data")));
    EXPECT_FALSE(isData(str("#Data ")));
    EXPECT_FALSE(isData(Value::array({str("#Data")})));
    EXPECT_TRUE(recordWithPlugIn(kToolPath, {{"EmbeddedCode", Value::boolean(false)}})->isHybrid());
    EXPECT_TRUE(recordWithPlugIn(kToolPath, {{"EmbeddedCode", str("Contents/Code")}})->isHybrid());
    EXPECT_FALSE(recordWithPlugIn(kToolPath, {})->isHybrid());
}

TEST(BXPlugInCoreDerived, OldStyleComesFromTheStyleKeysAndNeitherIsAFault) {
    auto current = makeRecord(kSharePath, shareInfo());
    EXPECT_FALSE(current->oldStyle());

    auto old =
        makeRecord(kToolPath, dict({{"Bexil", Value::emptyDictionary()}, {"RZExtension", Value::emptyDictionary()}}));
    EXPECT_FALSE(old->oldStyle()) << "RZExtension decides first";

    BXPlugInCore legacy;
    legacy.setBundleInfoDictionary(dict({{"Bexil", dict({{"Protocol", str("P")}})}}));
    log::CaptureSink capture;
    EXPECT_TRUE(legacy.oldStyle());
    EXPECT_EQ(capturedLog(capture), "");

    // Neither style is a fault, and answers old style.
    auto record = recordWithPlugIn(kToolPath, {});
    EXPECT_TRUE(record->oldStyle());
    std::string log = capturedLog(capture);
    EXPECT_NE(log.find("fault"), std::string::npos) << log;
    EXPECT_NE(log.find("unknown plug-in configuration style"), std::string::npos) << log;
    EXPECT_NE(log.find("oldStyle"), std::string::npos) << log;
    EXPECT_NE(log.find(record->uuid()->string()), std::string::npos) << log;
}

// ---- Canonical shape ----

TEST(BXPlugInCoreCanonicalize, AddsAttributesWithVersionFromTheBundleOrOneAndKeepsAnExistingVersion) {
    Value info =
        dict({{"BDBundleShortVersionString", str("3.1")}, {"RZExtension", dict({{"RZExtensionProtocol", str("P")}})}});
    auto record = makeRecord(kToolPath, info);
    ASSERT_TRUE(record);
    EXPECT_FALSE(record->attributes());
    record->canonicalize();
    EXPECT_EQ(record->attributes(), dict({{"RZExtensionVersion", str("3.1")}}));
    EXPECT_EQ(record->protocolSpec(), str("P"));
    // The information dictionary is left as it was: only the plug-in dictionary is rewritten.
    EXPECT_TRUE(record->bundleInfoDictionary()->identical(info));
    EXPECT_FALSE(record->infoKey("RZExtension")->contains("RZExtensionAttributes"));

    // Without a bundle version it falls back to "1"; an existing version is kept.
    auto bare = recordWithPlugIn(kToolPath, {{"RZExtensionAttributes", dict({{"Other", Value::int64(4)}})}});
    bare->canonicalize();
    EXPECT_EQ(bare->attributes(), dict({{"Other", Value::int64(4)}, {"RZExtensionVersion", str("1")}}));

    auto versioned = makeRecord(kSharePath, shareInfo());
    Value before = *versioned->attributes();
    versioned->canonicalize();
    EXPECT_EQ(versioned->version(), str("2.4"));
    EXPECT_EQ(versioned->attributes(), before);

    BXPlugInCore empty;
    empty.canonicalize();
    EXPECT_EQ(empty.attributes(), dict({{"RZExtensionVersion", str("1")}}));
}

// ---- Diagnosis ----

void expectDiagnosis(const BXPlugInCore& record, const char* message) {
    std::optional<Error> error = record.diagnose();
    ASSERT_TRUE(error) << "expected: " << message;
    EXPECT_EQ(error->domain(), "Bexil");
    EXPECT_EQ(error->code(), 12);
    EXPECT_EQ(error->localizedDescription(), message);
}

TEST(BXPlugInCoreDiagnose, EachCheckHasItsMessageTheFirstFailureWinsAndUsableRecordsPass) {
    BXPlugInCore nameless;
    nameless.setPlugInDictionary(dict({{"PassProxy", Value::boolean(true)}}));
    expectDiagnosis(nameless, "missing identifier (no RZExtensionIdentifier, nor even BDBundleIdentifier)");

    expectDiagnosis(*recordWithPlugIn(kToolPath, {{"EmbeddedCode", str("x")}}),
                    "missing \"RZExtensionProtocol\" key in Info.vrec or SDK");
    expectDiagnosis(*recordWithPlugIn(kToolPath, {{"RZExtensionProtocol", str("P")}}),
                    "missing \"RZExtensionAttributes\" key in Info.vrec or SDK");
    expectDiagnosis(*makeRecord(kSharePath, shareInfo({{"PrincipalClass", str("ShareController")}})),
                    "Application Extensions may not use the \"PrincipalClass\" key");
    expectDiagnosis(*makeRecord(kSharePath, shareInfo({{"PrincipalClass", Value::int64(1)}})),
                    "Application Extensions may not use the \"PrincipalClass\" key");
    expectDiagnosis(
        *makeRecord(kSharePath, shareInfo({{"PassProxy", Value::boolean(false)}, {"EmbeddedCode", str("x")}})),
        "the \"PassProxy\" key is not supported on this platform");
    expectDiagnosis(*makeRecord(kSharePath, shareInfo({{"EmbeddedCode", str("Contents/Code")}})),
                    "hybrid plug-ins are not supported on this platform");

    EXPECT_FALSE(makeRecord(kSharePath, shareInfo())->diagnose());
    // Outside an application extension any principal class is fine.
    EXPECT_FALSE(recordWithPlugIn(kToolPath, {{"RZExtensionProtocol", str("P")},
                                              {"PrincipalClass", str("Indexer")},
                                              {"RZExtensionAttributes", Value::emptyDictionary()}})
                     ->diagnose());
}

// ---- Identity ----

TEST(BXPlugInCoreIdentity, EqualityAndHashFollowTheUuidAlone) {
    Uuid shared = Uuid::random();
    auto a = BXPlugInCore::initWithNameUrlBundleInfoInfoUuid("com.example.a", std::string("/a.wexa"), std::nullopt,
                                                             std::nullopt, shared);
    auto b = BXPlugInCore::initWithNameUrlBundleInfoInfoUuid("com.example.b", std::string("/b.bundle"), shareInfo(),
                                                             std::nullopt, shared);
    auto c = BXPlugInCore::initWithNameUrlBundleInfoInfoUuid("com.example.a", std::string("/a.wexa"), std::nullopt,
                                                             std::nullopt, Uuid::random());
    EXPECT_TRUE(*a == *b);
    EXPECT_EQ(a->hash(), b->hash());
    EXPECT_EQ(std::hash<BXPlugInCore>()(*a), a->hash());
    EXPECT_FALSE(*a == *c);

    std::unordered_set<std::shared_ptr<BXPlugInCore>, BXPlugInCoreHash, BXPlugInCoreEqual> set{a, b, c};
    EXPECT_EQ(set.size(), 2u);
    EXPECT_TRUE(set.contains(b));

    std::unordered_map<std::shared_ptr<const BXPlugInCore>, int, BXPlugInCoreHash, BXPlugInCoreEqual> counts;
    ++counts[a];
    ++counts[b];
    ++counts[c];
    EXPECT_EQ(counts[a], 2);
    EXPECT_EQ(counts[c], 1);
}

TEST(BXPlugInCoreIdentity, ARecordWithoutUuidIsAnInternalInconsistency) {
    BXPlugInCore empty;
    auto other = makeRecord(kSharePath, shareInfo());
    try {
        (void)empty.hash();
        FAIL() << "hash without a uuid must throw";
    } catch (const InternalInconsistency& e) {
        EXPECT_STREQ(e.what(), "self.uuid");
    }
    EXPECT_THROW((void)(empty == *other), InternalInconsistency);
    // The receiver has a uuid; the argument without one is simply a different record.
    EXPECT_FALSE(*other == empty);

    std::unordered_set<std::shared_ptr<BXPlugInCore>, BXPlugInCoreHash, BXPlugInCoreEqual> set;
    EXPECT_THROW(set.insert(std::make_shared<BXPlugInCore>()), InternalInconsistency);
    EXPECT_TRUE(set.empty());
}

// ---- Annotations ----

TEST(BXPlugInCoreAnnotations, SetReplacesRemovesNeverEditsInPlaceAndAbsentStaysAbsent) {
    auto record = makeRecord(kSharePath, shareInfo());
    Value start = dict({{"com.example.mail.share", dict({{"election", Value::int64(1)}})}});
    record->setAnnotations(start);

    record->setAnnotationValue("extra", Value::int64(5));
    EXPECT_EQ(record->annotations()->get("extra"), Value::int64(5));
    EXPECT_EQ(start.count(), 1u) << "the old dictionary is never edited";

    record->setAnnotationValue("extra", str("six"));
    EXPECT_EQ(record->annotations()->get("extra"), str("six"));

    record->setAnnotationValue("extra", std::nullopt);
    EXPECT_EQ(*record->annotations(), start);

    record->setAnnotationValue("absent", std::nullopt);
    EXPECT_EQ(*record->annotations(), start);

    // Absent annotations stay absent.
    record = makeRecord(kSharePath, shareInfo());
    record->setAnnotationValue("com.example.mail.share", dict({{"election", Value::int64(1)}}));
    EXPECT_FALSE(record->annotations());
    record->setAnnotationValue("com.example.mail.share", std::nullopt);
    EXPECT_FALSE(record->annotations());
}

// ---- Redirected look-ups ----

// Answers the plug-in dictionary's keys from its own table, as the daemon's record answers them from the registry.
class RedirectingRecord : public BXPlugInCore {
  public:
    std::map<std::string, Value, std::less<>> table;
    std::optional<Value> pluginKey(std::string_view key) const override {
        auto it = table.find(key);
        if (it == table.end()) return std::nullopt;
        return it->second;
    }
    std::optional<Value> infoKey(std::string_view key) const override {
        if (key == "RZExtension") return Value::emptyDictionary();
        return std::nullopt;
    }
};

TEST(BXPlugInCoreRedirect, DerivedPropertiesFollowRedirectedLookUps) {
    RedirectingRecord record;
    ASSERT_TRUE(record.setupWithNameUrlBundleInfoInfoUuid("com.example.redirect", std::string(kToolPath), std::nullopt,
                                                          std::nullopt, std::nullopt));
    EXPECT_FALSE(record.plugInDictionary());
    record.table = {{"RZExtensionProtocol", str("#Data")},
                    {"RZExtensionPointIdentifier", str("com.quorvel.widgets")},
                    {"Dedicated", Value::boolean(true)},
                    {"RZExtensionAttributes", dict({{"RZExtensionVersion", str("9")}})}};
    EXPECT_EQ(record.protocolSpec(), str("#Data"));
    EXPECT_TRUE(record.isData());
    EXPECT_TRUE(record.isDedicated());
    EXPECT_EQ(record.sdkSpec(), str("com.quorvel.widgets"));
    EXPECT_EQ(record.version(), str("9"));
    EXPECT_FALSE(record.oldStyle());
    EXPECT_FALSE(record.diagnose());

    record.table["EmbeddedCode"] = str("x");
    EXPECT_TRUE(record.isHybrid());
    EXPECT_EQ(record.diagnose()->localizedDescription(), "hybrid plug-ins are not supported on this platform");
}

// ---- Concurrency ----

TEST(BXPlugInCoreConcurrency, ReadersSeeWholeValuesWhileWritersReplaceThem) {
    auto record = makeRecord(kSharePath, shareInfo());
    record->setAnnotations(Value::emptyDictionary());
    constexpr int kWriters = 2;
    constexpr int kKeysPerWriter = 200;
    std::atomic<bool> done{false};
    std::atomic<long> reads{0};

    std::vector<std::thread> threads;
    for (int r = 0; r < 2; ++r) {
        threads.emplace_back([&] {
            do {
                std::optional<Value> notes = record->annotations();
                ASSERT_TRUE(notes && notes->isDictionary());
                std::optional<std::string> name = record->localizedName();
                if (name) {
                    ASSERT_TRUE(*name == "Share" || *name == "Share to Mail");
                }
                auto form = record->exportForm();
                ASSERT_TRUE(form.ok());
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
    for (auto& t : threads) t.join();
    // Every change of a different key survived: no update was lost to a concurrent one.
    EXPECT_EQ(record->annotations()->count(), static_cast<size_t>(kWriters * kKeysPerWriter));
    EXPECT_GT(reads.load(), 0);
}

}  // namespace
}  // namespace bexil
