// The serialised form of a plug-in record: what is written, what reading tolerates, and that a read form gives the
// same record back.

#include <gtest/gtest.h>

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

// Guards the text properties' storage, where absence is not an optional of its own: an empty text is present (and
// written), a text set to nothing is absent (and left out), in the record and through a form read back.
TEST(BXPlugInFormExport, EmptyTextsArePresentAndClearedTextsAbsent) {
    auto record = fullRecord();
    record->setLocalizedName(std::string());
    record->setRequirement(std::string());
    record->setOriginalIdentifier(std::nullopt);
    record->setLocalizedShortName(std::nullopt);
    EXPECT_EQ(record->localizedName(), std::optional<std::string>(""));
    EXPECT_EQ(record->requirement(), std::optional<std::string>(""));
    EXPECT_FALSE(record->originalIdentifier());
    EXPECT_FALSE(record->localizedShortName());
    Value form = exported(*record);
    EXPECT_EQ(form.get("localizedDisplayName"), str(""));
    EXPECT_FALSE(form.contains("original-identifier"));
    EXPECT_FALSE(form.contains("localizedShortName"));
    auto back = read(form);
    ASSERT_TRUE(back);
    EXPECT_EQ(back->localizedName(), std::optional<std::string>(""));
    EXPECT_FALSE(back->originalIdentifier());
    EXPECT_FALSE(back->localizedShortName());
    EXPECT_EQ(back->localizedContainingName(), std::optional<std::string>("Mail"));
}

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

// Unset optional entries are left out rather than invented; a plug-in off the system volume says so; annotations are
// always written, empty when absent.
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

// Clients and the registry document read what the daemon writes: a read form must give the same record back.
TEST(BXPlugInFormRoundTrip, ReadingAnExportedFormKeepsTheRecord) {
    auto original = fullRecord();
    auto copy = read(exported(*original));
    ASSERT_TRUE(copy);
    EXPECT_TRUE(*copy == *original);
    EXPECT_EQ(exported(*copy), exported(*original));
}

// ---- Reading ----

// Only a missing or wrong-kind path or identifier, and a malformed present "bundleInfo", fail a read: a registry
// document with one bad record must still give the others.
TEST(BXPlugInFormRead, OnlyIdentityPathAndBundleInfoFailARead) {
    Value good = exported(*fullRecord());
    const std::pair<const char*, std::optional<Value>> failing[] = {
        {"path", std::nullopt},
        {"path", str("")},
        {"identifier", Value::array({})},
        {"bundleInfo", changed(good.get("bundleInfo"), "RZExtension", str("flat"))}};
    for (const auto& [key, value] : failing)
        EXPECT_FALSE(read(changed(good, key, value))) << key << " = " << (value ? value->description() : "absent");
    EXPECT_FALSE(read(str("not a form")));
}

// A UUID that is not UUID text gives a fresh identity instead of failing; a UUID-kind value from the wire is taken.
TEST(BXPlugInFormRead, UuidThatIsNotUuidTextGivesAFreshIdentity) {
    auto original = fullRecord();
    Value form = exported(*original);
    auto copy = read(changed(form, "uuid", str("not-a-uuid")));
    ASSERT_TRUE(copy && copy->uuid());
    EXPECT_FALSE(*copy == *original);
    EXPECT_TRUE(*read(changed(form, "uuid", Value::uuid(*original->uuid()))) == *original);
}

// An entry of an unexpected kind or out of range takes its default rather than failing the read or wrapping: the
// limits of the two numbers, a number of another kind that still counts, and one wrong-kind row per outcome.
TEST(BXPlugInFormRead, EntriesOfUnexpectedKindsTakeTheirDefaults) {
    Value form = exported(*fullRecord());
    EXPECT_EQ(read(changed(form, "hubProtocolVersion", std::nullopt))->hubProtocolVersion(), 1u)
        << "a form without a generation is of the first";
    EXPECT_EQ(read(changed(form, "hubProtocolVersion", Value::int64(-2)))->hubProtocolVersion(), 1u);
    EXPECT_EQ(read(changed(form, "hubProtocolVersion", Value::uint64(1ull << 40)))->hubProtocolVersion(), 1u);
    EXPECT_EQ(read(changed(form, "hubProtocolVersion", Value::int64(3)))->hubProtocolVersion(), 3u);
    EXPECT_EQ(read(changed(form, "lastmodified", Value::int64(1ll << 40)))->lastModified(), 0);
    EXPECT_EQ(read(changed(form, "lastmodified", Value::uint64(1000)))->lastModified(), 1000);
    EXPECT_TRUE(read(changed(form, "systemResident", Value::int64(1)))->onSystemVolume());
    EXPECT_FALSE(read(changed(form, "systemResident", str("YES")))->onSystemVolume());
    auto record = read(changed(form, "annotations", str("none")));
    ASSERT_TRUE(record);
    EXPECT_FALSE(record->annotations());
    EXPECT_EQ(record->version(), str("2.4")) << "the dictionaries came through all the same";
}

}  // namespace
}  // namespace bexil
