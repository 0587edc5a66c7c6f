// The serialised form of a plug-in record: what is written, what reading tolerates, and that a read form gives the
// same record back.

#include <gtest/gtest.h>

#include <functional>

#include "PlugInRecords.h"

namespace bexil {
namespace {

using namespace test;

const char* const kUuidText = "6F1C2A7E-3B4D-4E5F-8A9B-0C1D2E3F4A5B";

// A record as a builder fills it in: every stored property that the form carries has a value.
std::shared_ptr<BXPlugInCore> fullRecord() {
    auto record = makeRecord(kSharePath, shareInfo(), Uuid::parse(kUuidText));
    record->setOriginalIdentifier("com.example.mail.share.original");
    record->setHubProtocolVersion(2);
    record->setOnSystemVolume(true);
    record->setLastModified(1'763'892'000);
    record->setEntitlements(dict({{"com.quorvel.developer.auto-elect-plugin", Value::boolean(true)}}));
    record->setAnnotations(dict({{"com.example.mail.share", dict({{"election", Value::int64(1)}})}}));
    record->setContainingUrl("/Applications/Mail.app");
    record->setLocalizedName("Share to Mail");
    record->setLocalizedShortName("Share");
    record->setLocalizedContainingName("Mail");
    record->setCdhash(Value::data(std::vector<uint8_t>(20, 0xab)));
    record->setRequirement("identifier \"com.example.mail.share\"");
    return record;
}

Value exported(const BXPlugInCore& record) {
    Result<MutableDictionary> form = record.exportForm();
    EXPECT_TRUE(form.ok());
    return form->value();
}

// Reads a form, swallowing the log lines a failing read writes (the set-up tests check those).
std::shared_ptr<BXPlugInCore> read(const Value& form) {
    log::CaptureSink capture;
    return BXPlugInCore::initWithForm(form);
}

// ---- Writing ----

// Every entry under its own key; the information dictionary never carries its own location, though the record keeps
// it; hash and requirement are never written.
TEST(BXPlugInFormExport, FullRecordWritesEveryEntryUnderItsKey) {
    auto record = fullRecord();
    Value expected = dict({
        {"hubProtocolVersion", Value::uint64(2)},
        {"path", str(kSharePath)},
        {"systemResident", Value::boolean(true)},
        {"identifier", str("com.example.mail.share")},
        {"original-identifier", str("com.example.mail.share.original")},
        {"version", str("2.4")},
        {"bundleInfo", changed(shareInfo(), "BDBundleInfoVrecURL", std::nullopt)},
        {"info", shareInfo().get("RZExtension")},
        {"uuid", str(kUuidText)},
        {"lastmodified", Value::int64(1'763'892'000)},
        {"annotations", *record->annotations()},
        {"entitlements", *record->entitlements()},
        {"containingPath", str("/Applications/Mail.app")},
        {"localizedContainingDisplayName", str("Mail")},
        {"localizedDisplayName", str("Share to Mail")},
        {"localizedShortName", str("Share")},
    });
    EXPECT_EQ(exported(*record), expected);
    EXPECT_TRUE(record->bundleInfoDictionary()->contains("BDBundleInfoVrecURL"));
}

// Unset optional entries are left out rather than invented; annotations are always written, empty when absent.
TEST(BXPlugInFormExport, MinimalRecordWritesOnlyTheAlwaysPresentEntries) {
    auto record = makeRecord(kToolPath, shareInfo(), Uuid::parse(kUuidText));
    Value form = exported(*record);
    EXPECT_EQ(form, dict({{"hubProtocolVersion", Value::uint64(0)},
                          {"path", str(kToolPath)},
                          {"systemResident", Value::boolean(false)},
                          {"identifier", str("com.example.mail.share")},
                          {"version", str("2.4")},
                          {"bundleInfo", changed(shareInfo(), "BDBundleInfoVrecURL", std::nullopt)},
                          {"info", shareInfo().get("RZExtension")},
                          {"uuid", str(kUuidText)},
                          {"lastmodified", Value::int64(0)},
                          {"annotations", Value::emptyDictionary()}}));
}

// ---- Round trip ----

TEST(BXPlugInFormRoundTrip, ReadingAnExportedFormKeepsTheRecordAndHashAndRequirementAreRead) {
    auto original = fullRecord();
    auto copy = read(exported(*original));
    ASSERT_TRUE(copy);
    EXPECT_TRUE(*copy == *original);
    EXPECT_EQ(exported(*copy), exported(*original));
    // Hash and requirement are never written (see the export tests) but are read from a form that has them.
    auto signedRecord = read(dict({{"identifier", str("com.example.signed")},
                                   {"path", str("/signed.bundle")},
                                   {"hash", Value::data(std::vector<uint8_t>(20, 7))},
                                   {"requirement", str("anchor trusted")}}));
    ASSERT_TRUE(signedRecord);
    EXPECT_EQ(signedRecord->cdhash(), Value::data(std::vector<uint8_t>(20, 7)));
    EXPECT_EQ(signedRecord->requirement(), "anchor trusted");
}

TEST(BXPlugInFormRoundTrip, UpdateFromFormReplacesOnlyTheAnnotations) {
    auto record = fullRecord();
    Value newer = changed(exported(*record), "annotations", dict({{"k", Value::int64(2)}}));
    newer = changed(newer, "identifier", str("com.example.other"));
    record->updateFromForm(newer);
    EXPECT_EQ(record->annotations(), dict({{"k", Value::int64(2)}}));
    EXPECT_EQ(record->identifier(), "com.example.mail.share");

    record->updateFromForm(changed(newer, "annotations", str("not a dictionary")));
    EXPECT_FALSE(record->annotations());
}

// ---- Reading ----

TEST(BXPlugInFormRead, AbsentEntriesTakeTheirDefaultsAndNumbersOfOtherKindsCount) {
    Value form = dict({{"identifier", str("com.example.bare")}, {"path", str("/bare.bundle")}});
    auto record = read(form);
    ASSERT_TRUE(record);
    EXPECT_EQ(record->hubProtocolVersion(), 1u) << "a form without a generation is of the first";
    // Without "bundleInfo" there is nothing to derive from; "info" alone is not used.
    EXPECT_FALSE(record->plugInDictionary());
    EXPECT_FALSE(read(changed(form, "info", dict({{"RZExtensionProtocol", str("P")}})))->protocolSpec());

    auto numbers = read(dict({{"identifier", str("com.example.n")},
                              {"path", str("/n.bundle")},
                              {"hubProtocolVersion", Value::int64(2)},
                              {"lastmodified", Value::uint64(1000)},
                              {"systemResident", Value::int64(1)}}));
    ASSERT_TRUE(numbers);
    EXPECT_EQ(numbers->hubProtocolVersion(), 2u);
    EXPECT_EQ(numbers->lastModified(), 1000);
    EXPECT_TRUE(numbers->onSystemVolume());
}

// Only a missing or wrong-kind path or identifier, and a malformed present "bundleInfo", fail a read.
TEST(BXPlugInFormRead, OnlyIdentityPathAndBundleInfoFailARead) {
    Value good = exported(*fullRecord());
    Value flat = changed(good.get("bundleInfo"), "RZExtension", str("flat"));
    const std::pair<const char*, std::optional<Value>> failing[] = {
        {"path", std::nullopt},       {"path", Value::int64(7)},        {"path", str("")},
        {"identifier", std::nullopt}, {"identifier", Value::array({})}, {"bundleInfo", flat},
        {"bundleInfo", str("flat")}};
    for (const auto& [key, value] : failing)
        EXPECT_FALSE(read(changed(good, key, value))) << key << " = " << (value ? value->description() : "absent");
    EXPECT_FALSE(read(str("not a form")));
    EXPECT_FALSE(read(Value()));
}

TEST(BXPlugInFormRead, UuidThatIsNotUuidTextGivesAFreshIdentity) {
    auto original = fullRecord();
    Value form = exported(*original);
    for (Value bad : {str("not-a-uuid"), Value::int64(42)}) {
        auto copy = read(changed(form, "uuid", bad));
        ASSERT_TRUE(copy && copy->uuid()) << bad.description();
        EXPECT_FALSE(*copy == *original) << bad.description();
    }
    // Lower-case text is still the same UUID, and a UUID-kind value from the wire is taken as is.
    std::string lower = original->uuid()->string();
    for (char& c : lower) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    EXPECT_TRUE(*read(changed(form, "uuid", Value::string(lower))) == *original);
    EXPECT_TRUE(*read(changed(form, "uuid", Value::uuid(*original->uuid()))) == *original);
}

// One row per entry read through a kind check, plus the range limits of the two numbers.
TEST(BXPlugInFormRead, EntriesOfUnexpectedKindsTakeTheirDefaults) {
    Value form = exported(*fullRecord());
    using Check = std::function<bool(const BXPlugInCore&)>;
    Check generationOne = [](const BXPlugInCore& r) { return r.hubProtocolVersion() == 1; };
    Check neverModified = [](const BXPlugInCore& r) { return r.lastModified() == 0; };
    const std::tuple<const char*, Value, Check> cases[] = {
        {"hubProtocolVersion", str("2"), generationOne},
        {"hubProtocolVersion", Value::int64(-2), generationOne},
        {"hubProtocolVersion", Value::uint64(1ull << 40), generationOne},
        {"hubProtocolVersion", Value::boolean(true), generationOne},
        {"lastmodified", str("yesterday"), neverModified},
        {"lastmodified", Value::int64(1ll << 40), neverModified},
        {"systemResident", str("YES"), [](const BXPlugInCore& r) { return !r.onSystemVolume(); }},
        {"annotations", str("none"), [](const BXPlugInCore& r) { return !r.annotations(); }},
        {"entitlements", Value::array({str("x")}), [](const BXPlugInCore& r) { return !r.entitlements(); }},
        {"original-identifier", Value::int64(3), [](const BXPlugInCore& r) { return !r.originalIdentifier(); }},
        {"containingPath", Value::emptyDictionary(), [](const BXPlugInCore& r) { return !r.containingUrl(); }},
        {"localizedDisplayName", Value::int64(3), [](const BXPlugInCore& r) { return !r.localizedName(); }},
        {"hash", str("abcd"), [](const BXPlugInCore& r) { return !r.cdhash(); }},
        {"requirement", Value::data(std::vector<uint8_t>{1, 2}),
         [](const BXPlugInCore& r) { return !r.requirement(); }},
    };
    for (const auto& [key, value, tookDefault] : cases) {
        std::string what = std::string(key) + " = " + value.description();
        auto record = read(changed(form, key, value));
        ASSERT_TRUE(record) << what;
        EXPECT_TRUE(tookDefault(*record)) << what;
        // Whatever went wrong elsewhere, the identity and the dictionaries came through.
        EXPECT_EQ(record->version(), str("2.4")) << what;
    }
}

}  // namespace
}  // namespace bexil
