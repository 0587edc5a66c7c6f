#include <gtest/gtest.h>

#include <map>

#include "CapturedLog.h"
#include "PlugInRecords.h"
#include "platform/sdks/ExtensionSDKRegistry.h"

namespace bexil {
namespace {

using namespace test;

// SDKs held in memory, installed as the process's registry for the life of the fixture.
class MemorySDKs : public ExtensionSDKRegistry {
  public:
    std::optional<Value> copySDKEntry(std::string_view name) const override {
        auto found = sdks.find(std::string(name));
        if (found == sdks.end()) return std::nullopt;
        return found->second;
    }
    std::map<std::string, Value> sdks;
};

class BXPlugInSDK : public ::testing::Test {
  protected:
    BXPlugInSDK() { previous_ = ExtensionSDKRegistry::setShared(registry_); }
    ~BXPlugInSDK() override { ExtensionSDKRegistry::setShared(previous_); }

    std::shared_ptr<MemorySDKs> registry_ = std::make_shared<MemorySDKs>();
    std::shared_ptr<const ExtensionSDKRegistry> previous_;
    BXPlugInCore merger_;
};

Value array(std::vector<Value> items) { return Value::array(std::move(items)); }

// Which side wins for each kind of value, at the top level and nested: the plug-in for strings and arrays, the SDK
// for "CleanTimeout" at any depth, the union for "Shared", key by key for two dictionaries, and the plug-in's value
// where the SDK's dictionary meets something else.
TEST_F(BXPlugInSDK, MergeRulesDecideTheWinnerByKindOfValue) {
    Value sdk = dict({{"CleanTimeout", Value::int64(30)},
                      {"Name", str("sdk")},
                      {"Types", array({str("a")})},
                      {"OnlySDK", Value::int64(1)},
                      {"Reshape", dict({{"x", Value::int64(1)}})},
                      {"RZExtension", dict({{"CleanTimeout", Value::int64(5)},
                                            {"Shared", array({str("x"), str("y")})},
                                            {"RZExtensionAttributes", dict({{"A", Value::int64(1)}})}})}});
    Value plugIn = dict({{"CleanTimeout", Value::int64(99)},
                         {"Name", str("mine")},
                         {"Types", array({str("b"), str("c")})},
                         {"Reshape", str("flat")},
                         {"RZExtension", dict({{"CleanTimeout", Value::int64(7)},
                                               {"Shared", array({str("y"), str("z")})},
                                               {"RZExtensionAttributes", dict({{"B", Value::int64(2)}})}})}});
    Value merged = merger_.mergeDictionaryInto(sdk, plugIn);
    EXPECT_EQ(merged.get("CleanTimeout"), Value::int64(30));
    EXPECT_EQ(merged.get("Name"), str("mine"));
    EXPECT_EQ(merged.get("Types"), array({str("b"), str("c")}));
    EXPECT_EQ(merged.get("OnlySDK"), Value::int64(1));
    EXPECT_EQ(merged.get("Reshape"), str("flat"));
    Value ext = merged.get("RZExtension");
    EXPECT_EQ(ext.get("CleanTimeout"), Value::int64(5));
    EXPECT_EQ(ext.get("Shared"), array({str("y"), str("z"), str("x")}));
    EXPECT_EQ(ext.get("RZExtensionAttributes"), dict({{"A", Value::int64(1)}, {"B", Value::int64(2)}}));
}

// "Shared" may be one path or a list; a union never repeats a path, and anything else keeps the plug-in's value.
TEST_F(BXPlugInSDK, SharedResourcesUniteWithoutDuplicates) {
    EXPECT_EQ(merger_.mergeSharedResourcesInto(str("a"), array({str("a"), str("b"), str("b")})),
              array({str("a"), str("b")}));
    EXPECT_EQ(merger_.mergeSharedResourcesInto(array({str("c")}), str("a")), array({str("a"), str("c")}));
    EXPECT_EQ(merger_.mergeSharedResourcesInto(array({str("c")}), Value::int64(3)), Value::int64(3));
}

// An unregistered SDK is logged by name and the record keeps its dictionaries but is still canonicalized; a name
// that is not a string is logged and changes nothing at all.
TEST_F(BXPlugInSDK, UnregisteredOrInvalidSDKNamesKeepTheRecordsOwnDictionaries) {
    log::CaptureSink capture;
    Value info = shareInfo({{"RZExtensionPointIdentifier", str("com.example.nowhere")}});
    MutableDictionary withoutVersion(info.get("RZExtension"));
    withoutVersion.set("RZExtensionAttributes", Value::emptyDictionary());
    auto record = makeRecord(kSharePath, changed(info, "RZExtension", withoutVersion.take()));
    record->resolveSDK();
    EXPECT_EQ(capturedLine(capture, "not registered"),
              "default ops: plug-in sdk \"com.example.nowhere\" not registered");
    EXPECT_EQ(record->version(), str("2.4.1"));

    auto invalid = recordWithPlugIn(kToolPath, {{"RZExtensionPointIdentifier", Value::int64(4)}});
    Value before = *invalid->plugInDictionary();
    invalid->resolveSDK();
    EXPECT_EQ(capturedLine(capture, "invalid SDK key"), "error ops: invalid SDK key:4");
    EXPECT_TRUE(invalid->plugInDictionary()->identical(before));
}

// A record built without an information dictionary is an internal fault: nothing merges, canonicalization runs.
TEST_F(BXPlugInSDK, RecordWithoutInformationDictionaryIsAFaultAndOnlyCanonicalized) {
    log::CaptureSink capture;
    registry_->sdks["com.example.point"] = dict({{"RZExtension", dict({{"Added", Value::int64(1)}})}});
    auto record = recordWithPlugIn(kToolPath, {{"RZExtensionPointIdentifier", str("com.example.point")}});
    record->resolveSDK();
    EXPECT_EQ(capture.find("cannot resolve SDK without materialized Info.vrec")->level, log::Level::Fault);
    EXPECT_FALSE(record->pluginKey("Added"));
    EXPECT_FALSE(record->bundleInfoDictionary());
    EXPECT_EQ(record->version(), str("1"));
}

}  // namespace
}  // namespace bexil
