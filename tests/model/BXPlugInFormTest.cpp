#include <gtest/gtest.h>

#include <functional>
#include <set>

#include "CapturedLog.h"
#include "TestSupport.h"
#include "model/BXPlugInCore.h"
#include "platform/log/CaptureSink.h"

namespace bexil {
namespace {

using test::capturedLog;
using test::dict;
using test::str;

const char* const kPath = "/Applications/Notes.app/PlugIns/Widget.wexa";

Value widgetInfo() {
    return dict({
        {"BDBundleIdentifier", str("com.example.notes.widget")},
        {"BDBundleShortVersionString", str("5.0")},
        {"BDBundleInfoVrecURL", str("file:///Applications/Notes.app/PlugIns/Widget.wexa/Info.vrec")},
        {"RZExtension", dict({{"RZExtensionPointIdentifier", str("com.quorvel.widgets")},
                              {"RZExtensionProtocol", str("WidgetProtocol")},
                              {"RZExtensionAttributes", dict({{"RZExtensionVersion", str("5.0.2")}})}})},
    });
}

// A record as a builder fills it in: every stored property that the form carries has a value.
std::shared_ptr<BXPlugInCore> fullRecord() {
    auto record = BXPlugInCore::initWithNameUrlBundleInfoInfoUuid("com.example.notes.widget", std::string(kPath),
                                                                  widgetInfo(), std::nullopt, std::nullopt);
    record->setOriginalIdentifier("com.example.notes.widget.original");
    record->setHubProtocolVersion(2);
    record->setOnSystemVolume(true);
    record->setLastModified(1'763'892'000);
    record->setEntitlements(dict({{"com.quorvel.developer.auto-elect-plugin", Value::boolean(true)}}));
    record->setAnnotations(dict({{"com.example.notes.widget", dict({{"election", Value::int64(1)}})}}));
    record->setContainingUrl("/Applications/Notes.app");
    record->setLocalizedName("Notes Widget");
    record->setLocalizedShortName("Widget");
    record->setLocalizedContainingName("Notes");
    record->setCdhash(Value::data(std::vector<uint8_t>(20, 0xab)));
    record->setRequirement("identifier \"com.example.notes.widget\"");
    return record;
}

Value exported(const BXPlugInCore& record) {
    Result<MutableDictionary> form = record.exportForm();
    EXPECT_TRUE(form.ok());
    return form->value();
}

std::set<std::string> keysOf(const Value& dictionary) {
    std::set<std::string> keys;
    for (const DictionaryEntry& e : dictionary.entries()) keys.insert(e.key);
    return keys;
}

const std::set<std::string> kAlwaysWritten = {
    "hubProtocolVersion", "path", "systemResident", "identifier",   "original-identifier", "version",
    "bundleInfo",         "info", "uuid",           "lastmodified", "annotations"};

// Reads a form, swallowing the log lines a failing read writes.
std::shared_ptr<BXPlugInCore> read(const Value& form, std::string* log = nullptr) {
    log::CaptureSink capture;
    auto record = BXPlugInCore::initWithForm(form);
    std::string text = capturedLog(capture);
    if (log) *log = text;
    return record;
}

Value changed(const Value& form, std::string_view key, std::optional<Value> value) {
    MutableDictionary copy(form);
    if (value)
        copy.set(key, *value);
    else
        copy.remove(key);
    return copy.take();
}

// ---- Writing ----

TEST(BXPlugInFormExport, WritesTheAlwaysPresentEntriesAndTheOptionalOnesThatAreSet) {
    auto record = fullRecord();
    Value form = exported(*record);
    std::set<std::string> expected = kAlwaysWritten;
    expected.insert({"entitlements", "containingPath", "localizedContainingDisplayName", "localizedDisplayName",
                     "localizedShortName"});
    EXPECT_EQ(keysOf(form), expected);
    EXPECT_EQ(form.get("hubProtocolVersion"), Value::uint64(2));
    EXPECT_EQ(form.get("path"), str(kPath));
    EXPECT_EQ(form.get("systemResident"), Value::boolean(true));
    EXPECT_EQ(form.get("version"), str("5.0.2"));
    EXPECT_EQ(form.get("uuid"), Value::string(record->uuid()->string()));
    EXPECT_EQ(form.get("uuid").stringView().size(), 36u);
    EXPECT_EQ(form.get("lastmodified"), Value::int64(1'763'892'000));
    EXPECT_TRUE(form.get("info").identical(*record->plugInDictionary()));
    EXPECT_EQ(form.get("containingPath"), str("/Applications/Notes.app"));
    EXPECT_EQ(form.get("localizedContainingDisplayName"), str("Notes"));
}

TEST(BXPlugInFormExport, BundleInfoNeverCarriesItsOwnLocationAndTheRecordKeepsIt) {
    auto record = fullRecord();
    Value bundleInfo = exported(*record).get("bundleInfo");
    EXPECT_FALSE(bundleInfo.contains("BDBundleInfoVrecURL"));
    EXPECT_EQ(bundleInfo.get("BDBundleShortVersionString"), str("5.0"));
    EXPECT_TRUE(record->bundleInfoDictionary()->contains("BDBundleInfoVrecURL"));
    EXPECT_EQ(changed(*record->bundleInfoDictionary(), "BDBundleInfoVrecURL", std::nullopt), bundleInfo);
}

TEST(BXPlugInFormExport, MinimalRecordWritesOnlyTheAlwaysPresentEntriesNeverHashOrRequirement) {
    auto record = BXPlugInCore::initWithNameUrlBundleInfoInfoUuid("com.example.min", std::string("/x.bundle"),
                                                                  widgetInfo(), std::nullopt, std::nullopt);
    record->setOriginalIdentifier("com.example.min");
    Value form = exported(*record);
    EXPECT_EQ(keysOf(form), kAlwaysWritten);
    EXPECT_EQ(form.get("annotations"), Value::emptyDictionary());
    EXPECT_EQ(form.get("systemResident"), Value::boolean(false));
    EXPECT_FALSE(form.contains("hash"));
    EXPECT_FALSE(form.contains("requirement"));

    // Hash and requirement are read but never written.
    Value signedForm = dict({{"identifier", str("com.example.signed")},
                             {"path", str("/signed.bundle")},
                             {"hash", Value::data(std::vector<uint8_t>(20, 7))},
                             {"requirement", str("anchor trusted")}});
    auto signedRecord = read(signedForm);
    ASSERT_TRUE(signedRecord);
    EXPECT_EQ(signedRecord->cdhash(), Value::data(std::vector<uint8_t>(20, 7)));
    EXPECT_EQ(signedRecord->requirement(), "anchor trusted");
    Value again = exported(*signedRecord);
    EXPECT_FALSE(again.contains("hash"));
    EXPECT_FALSE(again.contains("requirement"));
}

// ---- Round trip ----

TEST(BXPlugInFormRoundTrip, ReadingAnExportedFormKeepsTheRecord) {
    auto original = fullRecord();
    auto copy = read(exported(*original));
    ASSERT_TRUE(copy);
    EXPECT_TRUE(*copy == *original);
    EXPECT_EQ(copy->onSystemVolume(), true);
    EXPECT_EQ(copy->hubProtocolVersion(), 2u);
    EXPECT_EQ(copy->annotations(), original->annotations());
    // The dictionaries come back through the information dictionary, less its location entry.
    EXPECT_EQ(copy->plugInDictionary(), original->plugInDictionary());
    EXPECT_EQ(copy->version(), str("5.0.2"));
    EXPECT_FALSE(copy->infoKey("BDBundleInfoVrecURL"));
    // Never written, so never read back.
    EXPECT_FALSE(copy->cdhash());
    EXPECT_FALSE(copy->requirement());
    // And a second trip writes the same form, every entry included.
    EXPECT_EQ(exported(*copy), exported(*original));
}

TEST(BXPlugInFormRoundTrip, UpdateFromFormReplacesOnlyTheAnnotations) {
    auto record = fullRecord();
    Value newer = changed(exported(*record), "annotations", dict({{"k", Value::int64(2)}}));
    newer = changed(newer, "identifier", str("com.example.other"));
    record->updateFromForm(newer);
    EXPECT_EQ(record->annotations(), dict({{"k", Value::int64(2)}}));
    EXPECT_EQ(record->identifier(), "com.example.notes.widget");

    record->updateFromForm(changed(newer, "annotations", std::nullopt));
    EXPECT_FALSE(record->annotations());
    record->setAnnotations(Value::emptyDictionary());
    record->updateFromForm(changed(newer, "annotations", str("not a dictionary")));
    EXPECT_FALSE(record->annotations());
}

// ---- Reading ----

TEST(BXPlugInFormRead, AbsentEntriesTakeTheirDefaultsAndNumbersOfOtherKindsCount) {
    Value form = dict({{"identifier", str("com.example.bare")}, {"path", str("/bare.bundle")}});
    auto record = read(form);
    ASSERT_TRUE(record);
    EXPECT_EQ(record->hubProtocolVersion(), 1u);
    EXPECT_EQ(record->lastModified(), 0);
    EXPECT_FALSE(record->onSystemVolume());
    EXPECT_TRUE(record->uuid().has_value());
    EXPECT_FALSE(record->annotations());
    EXPECT_FALSE(record->containingUrl());
    // Without "bundleInfo" there is nothing to derive from; "info" alone is not used.
    EXPECT_FALSE(record->bundleInfoDictionary());
    EXPECT_FALSE(record->plugInDictionary());
    EXPECT_FALSE(read(changed(form, "info", dict({{"RZExtensionProtocol", str("P")}})))->protocolSpec());
    EXPECT_FALSE(record->attributes());
    EXPECT_FALSE(record->version());

    // Numbers of other kinds than the writer's still count.
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

TEST(BXPlugInFormRead, FailuresAreTheSetUpFailures) {
    Value good = exported(*fullRecord());
    std::string log;

    EXPECT_FALSE(read(changed(good, "path", std::nullopt), &log));
    EXPECT_EQ(log, "");

    EXPECT_FALSE(read(changed(good, "identifier", std::nullopt), &log));
    EXPECT_NE(log.find(std::string("missing identifier in plug-in at ") + kPath), std::string::npos) << log;

    Value broken = changed(good.get("bundleInfo"), "RZExtension", str("flat"));
    EXPECT_FALSE(read(changed(good, "bundleInfo", broken), &log));
    EXPECT_NE(log.find("malformed plug-in dictionary in plug-in com.example.notes.widget at"), std::string::npos)
        << log;

    EXPECT_FALSE(read(str("not a form"), &log));
    EXPECT_FALSE(read(Value(), &log));

    // Identity and path of the wrong kind fail the read too.
    EXPECT_FALSE(read(changed(good, "path", Value::int64(7)), &log));
    EXPECT_EQ(log, "");
    EXPECT_FALSE(read(changed(good, "path", str("")), &log));
    EXPECT_FALSE(read(changed(good, "identifier", Value::array({})), &log));
    EXPECT_NE(log.find("missing identifier"), std::string::npos) << log;
    EXPECT_FALSE(read(changed(good, "bundleInfo", str("flat")), &log));
    EXPECT_NE(log.find("malformed plug-in dictionary"), std::string::npos) << log;
}

TEST(BXPlugInFormRead, UuidThatIsNotUuidTextGivesAFreshIdentity) {
    auto original = fullRecord();
    Value form = exported(*original);
    for (Value bad : {str("not-a-uuid"), str(""), Value::int64(42), Value::emptyDictionary()}) {
        auto copy = read(changed(form, "uuid", bad));
        ASSERT_TRUE(copy) << bad.description();
        ASSERT_TRUE(copy->uuid());
        EXPECT_FALSE(*copy == *original) << bad.description();
    }
    // Lower-case text is still the same UUID, and a UUID-kind value from the wire is taken as is.
    std::string lower = original->uuid()->string();
    for (char& c : lower) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    EXPECT_TRUE(*read(changed(form, "uuid", Value::string(lower))) == *original);
    EXPECT_TRUE(*read(changed(form, "uuid", Value::uuid(*original->uuid()))) == *original);
}

TEST(BXPlugInFormRead, EntriesOfUnexpectedKindsTakeTheirDefaults) {
    Value form = exported(*fullRecord());
    using Check = std::function<bool(const BXPlugInCore&)>;
    Check generationOne = [](const BXPlugInCore& r) { return r.hubProtocolVersion() == 1; };
    Check neverModified = [](const BXPlugInCore& r) { return r.lastModified() == 0; };
    struct Case {
        const char* key;
        Value value;
        Check tookDefault;
    };
    std::vector<Case> cases = {
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
        {"info", str("not used anyway"), [](const BXPlugInCore& r) { return r.plugInDictionary().has_value(); }},
    };
    for (const Case& c : cases) {
        std::string what = std::string(c.key) + " = " + c.value.description();
        auto record = read(changed(form, c.key, c.value));
        ASSERT_TRUE(record) << what;
        EXPECT_TRUE(c.tookDefault(*record)) << what;
        // Whatever went wrong elsewhere, the identity and the dictionaries came through.
        EXPECT_EQ(record->identifier(), "com.example.notes.widget") << what;
        EXPECT_EQ(record->version(), str("5.0.2")) << what;
    }
}

}  // namespace
}  // namespace bexil
