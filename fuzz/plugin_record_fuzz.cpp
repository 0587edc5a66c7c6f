// Feeds forms and information dictionaries built from random bytes to the plug-in record: reading a form, setting a
// record up from names and dictionaries, then every derived property, the checks, canonical shape and the export,
// and resolving a record against an SDK made from the same bytes.
// The bytes are decoded by a small generator that picks value kinds and draws dictionary keys mostly from the
// record's own vocabulary, so that the inputs reach the code that reads those keys instead of missing every look-up.

#include <array>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "FuzzByteReader.h"
#include "model/BXPlugInCore.h"
#include "platform/sdks/ExtensionSDKRegistry.h"

namespace {

using bexil::BXPlugInCore;
using bexil::MutableArray;
using bexil::MutableDictionary;
using bexil::Uuid;
using bexil::Value;

constexpr const char* kVocabulary[] = {
    // Information, plug-in and attributes dictionaries.
    "RZExtension", "Bexil", "BDBundleShortVersionString", "BDBundleInfoVrecURL", "BDBundleIdentifier", "Multiple",
    "RZExtensionAttributes", "RZExtensionProtocol", "PrincipalClass", "EmbeddedCode", "EmbeddedProtocol", "Dedicated",
    "PassProxy", "RZExtensionPointIdentifier", "HubProtocolVersion", "Shared", "CleanTimeout",
    "RZExtensionHostEntitlement", "RZExtensionVersion",
    // The form.
    "hubProtocolVersion", "path", "systemResident", "identifier", "original-identifier", "version", "bundleInfo",
    "info", "uuid", "lastmodified", "annotations", "entitlements", "containingPath", "localizedContainingDisplayName",
    "localizedDisplayName", "localizedShortName", "hash", "requirement", "extensions"};
constexpr size_t kVocabularySize = sizeof(kVocabulary) / sizeof(kVocabulary[0]);

constexpr const char* kStrings[] = {"RZObject",
                                    "#Data",
                                    "com.example.fuzz",
                                    "/Apps/A.app/PlugIns/P.wexa",
                                    "/System/Library/Bexil/P.bundle",
                                    "1.2",
                                    "",
                                    "00000000-0000-0000-0000-000000000000",
                                    "6F1C2A7E-3B4D-4E5F-8A9B-0C1D2E3F4A5B"};
constexpr size_t kStringCount = sizeof(kStrings) / sizeof(kStrings[0]);

constexpr int kMaxDepth = 5;
constexpr size_t kMaxEntries = 12;

using bexil::fuzz::ByteReader;

std::string key(ByteReader& in) {
    uint8_t pick = in.byte();
    if (pick < 224) return kVocabulary[pick % kVocabularySize];
    return in.text();
}

Value value(ByteReader& in, int depth) {
    uint8_t kind = in.byte();
    if (depth >= kMaxDepth) kind %= 9;  // scalars only
    switch (kind % 12) {
        case 0:
            return Value();
        case 1:
            return Value::boolean(in.byte() & 1);
        case 2:
            return Value::int64(static_cast<int64_t>(in.u64()));
        case 3:
            return Value::uint64(in.u64() >> (in.byte() % 64));
        case 4:
            return Value::real(static_cast<double>(static_cast<int64_t>(in.u64())) / ((in.byte() % 7) + 1));
        case 5:
            return Value::string(kStrings[in.byte() % kStringCount]);
        case 6:
            return Value::string(in.text());
        case 7:
            return Value::data(in.bytes());
        case 8: {
            std::array<uint8_t, 16> b{};
            for (auto& x : b) x = in.byte();
            return Value::uuid(Uuid(b));
        }
        case 9: {
            MutableArray array;
            size_t n = in.byte() % kMaxEntries;
            for (size_t i = 0; i < n && !in.empty(); ++i) array.append(value(in, depth + 1));
            return array.take();
        }
        default: {
            MutableDictionary dictionary;
            size_t n = in.byte() % kMaxEntries;
            for (size_t i = 0; i < n && !in.empty(); ++i) {
                std::string k = key(in);
                dictionary.set(k, value(in, depth + 1));
            }
            return dictionary.take();
        }
    }
}

// Touches everything a user of the record may ask; the answers only have to exist without a fault.
void exercise(BXPlugInCore& record) {
    (void)record.path();
    (void)record.containingPath();
    (void)record.attributes();
    (void)record.version();
    (void)record.protocolSpec();
    (void)record.principalSpec();
    (void)record.sdkSpec();
    (void)record.embeddedCodePath();
    (void)record.embeddedProtocolSpec();
    (void)record.isAppExtension();
    (void)record.isMultiplexed();
    (void)record.isHybrid();
    (void)record.isDedicated();
    (void)record.isData();
    (void)record.oldStyle();
    (void)record.timestamp();
    (void)record.diagnose();
    (void)record.hash();
    (void)record.description();
    auto form = record.exportForm();
    if (!form.ok()) __builtin_trap();
    // What the record writes it must read back as the same record.
    auto again = BXPlugInCore::initWithForm(form->value());
    if (!again || !(*again == record)) __builtin_trap();
    record.setAnnotationValue("fuzz", Value::int64(1));
    record.canonicalize();
    if (!record.version()) __builtin_trap();
    (void)record.exportForm();
}

// Serves one SDK, drawn from the same bytes, for whatever name a record asks for.
class OneSDK : public bexil::ExtensionSDKRegistry {
  public:
    explicit OneSDK(Value sdk) : sdk_(std::move(sdk)) {}
    std::optional<Value> copySDKEntry(std::string_view) const override {
        if (!sdk_.isDictionary()) return std::nullopt;
        return sdk_;
    }

  private:
    Value sdk_;
};

// Resolution against any SDK: a record whose SDK name is a string ends canonical, and a merge loses no key of
// either side.
void resolveAgainst(const Value& sdk, const Value& info) {
    auto previous = bexil::ExtensionSDKRegistry::setShared(std::make_shared<OneSDK>(sdk));
    if (auto record = BXPlugInCore::initWithNameUrlBundleInfoInfoUuid("com.example.fuzz", "/Apps/A.app/PlugIns/P.wexa",
                                                                      info, std::nullopt, std::nullopt)) {
        std::optional<Value> spec = record->sdkSpec();
        record->resolveSDK();
        if ((!spec || spec->isString()) && !record->version()) __builtin_trap();
        exercise(*record);
    }
    if (sdk.isDictionary() && info.isDictionary()) {
        BXPlugInCore merger;
        Value merged = merger.mergeDictionaryInto(sdk, info);
        for (const Value* side : {&sdk, &info})
            for (const auto& entry : side->entries())
                if (!merged.contains(entry.key)) __builtin_trap();
    }
    bexil::ExtensionSDKRegistry::setShared(previous);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    ByteReader in(data, size);
    uint8_t mode = in.byte();
    Value input = value(in, 0);

    if (auto record = BXPlugInCore::initWithForm(input)) {
        exercise(*record);
        record->updateFromForm(input);
    }

    // The same value as an information dictionary, with the rest of the bytes for the other arguments.
    std::optional<std::string> identifier;
    if (mode & 1) identifier = "com.example.fuzz";
    std::optional<std::string> url;
    if (mode & 2) url = (mode & 4) ? "/Apps/A.app/PlugIns/P.wexa" : "/System/Library/Bexil/P.bundle";
    std::optional<Value> info;
    if (mode & 8) info = value(in, 0);
    std::optional<Uuid> uuid;
    if (mode & 16) uuid = Uuid::random();
    std::optional<Value> bundleInfo;
    if (!(mode & 32)) bundleInfo = input;
    if (auto record = BXPlugInCore::initWithNameUrlBundleInfoInfoUuid(identifier, url, bundleInfo, info, uuid))
        exercise(*record);

    if (mode & 64) resolveAgainst(value(in, 0), input);
    return 0;
}
